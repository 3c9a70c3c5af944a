#include "backends/DashboardBackend.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <arpa/inet.h>

#include <map>
#include <set>
#include <stdexcept>

#include "backends/DashboardDatagram.h"
#include "backends/tests/BackendTestSupport.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/TempRoot.h"
#include "tests/support/UdpTestServer.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/URLSession.h"
#include "transport/tests/TransportTestSupport.h"
#include "zerith/ZerithConstants.h"

namespace zerith::test {
namespace {

using log::Level;
using namespace std::chrono_literals;

constexpr char kUdid[] = "0123456789abcdef0123456789abcdef01234567";

// Made by the factory, as a session makes it.
std::shared_ptr<DashboardBackend> makeBackend(const Value& profile) {
  auto b = std::dynamic_pointer_cast<DashboardBackend>(
      ZerithBackend::newBackendWithName(kZerithBackendDashboard, profile, std::string("Linux"), 5));
  if (b) {
    b->setSessionID(0x01020304);
    b->setClientVersion(0x0506);
    b->setCompType(5);
    b->setUdid(kUdid);
    b->setSelfVersion("3.1");
  }
  return b;
}

// The datagram send takes the event number as a 16-bit value; an int
// literal would pick the base class's numbering send with a flag instead.
std::optional<std::string> send(DashboardBackend& b, const Value& event, const timeval& time, std::uint16_t method,
                                std::uint16_t respCode, std::uint16_t eventNumber) {
  return b.sendMessage(event, time, method, respCode, eventNumber);
}

timeval at(long seconds, long micros) { return timeval{seconds, micros}; }

std::uint16_t be16(const std::vector<std::uint8_t>& b, std::size_t at) {
  return static_cast<std::uint16_t>((b[at] << 8) | b[at + 1]);
}
std::uint32_t be32(const std::vector<std::uint8_t>& b, std::size_t at) {
  return (static_cast<std::uint32_t>(b[at]) << 24) | (b[at + 1] << 16) | (b[at + 2] << 8) | b[at + 3];
}
std::string textOf(const std::vector<std::uint8_t>& b) { return std::string(b.begin() + 64, b.end()); }

// What the backend's network queue reports: the retransmission queue's size
// and whether the sources are gone; tests wait on it.
class QueueWatch : Recorder<std::pair<std::size_t, bool>> {
 public:
  explicit QueueWatch(DashboardBackend& backend) : backend_(backend) {
    backend.setQueueObserver([this](std::size_t count, bool cancelled) { add({count, cancelled}); });
  }
  // The backend outlives the test while its timer drains the queue: the
  // observer is taken away again before the watch goes.
  ~QueueWatch() { backend_.setQueueObserver(nullptr); }
  // Waits until the last report is (count, cancelled); nullopt: any count.
  bool waitFor(std::optional<std::size_t> count, bool cancelled = false) {
    return waitUntil([&](const auto& reports) {
      const auto last = reports.empty() ? std::pair<std::size_t, bool>{0, false} : reports.back();
      return (!count || last.first == *count) && last.second == cancelled;
    }, 10s);
  }

 private:
  DashboardBackend& backend_;
};

std::vector<std::uint8_t> ackFor(std::uint16_t event, std::size_t size = 64) {
  std::vector<std::uint8_t> ack(size, 0);
  if (size >= 62) {
    ack[60] = static_cast<std::uint8_t>(event >> 8);
    ack[61] = static_cast<std::uint8_t>(event);
  }
  return ack;
}

class DashboardBackendTest : public ::testing::Test {
 protected:
  // A backend sending to the test server, reliable with that period when
  // one is given; a test cannot go on without it.
  std::shared_ptr<DashboardBackend> backend(std::optional<int> reliableMs = std::nullopt, Dictionary profile = {}) {
    profile.set("ip", Value("127.0.0.1"));
    profile.set("port", Value(static_cast<int>(server.port())));
    if (reliableMs) {
      profile.set("reliable", Value(*reliableMs));
    }
    auto b = makeBackend(Value(std::move(profile)));
    if (!b) {
      throw std::runtime_error("the factory made no dashboard backend");
    }
    return b;
  }

  log::LogCapture logs;
  UdpTestServer server;
};

// --- The datagram's bytes ----------------------------------------------------------------------

TEST_F(DashboardBackendTest, EmptyEventIsA64ByteHeaderWithComplementedFieldsAndTimeIn4msSteps) {
  auto b = backend();
  const auto line = send(*b, Value(Dictionary{}), at(12, 345678), 0x0102, 0x0304, 0x0a0b);
  ASSERT_TRUE(server.waitForArrivals(1));
  const auto d = server.arrivals()[0].bytes;
  ASSERT_EQ(d.size(), 64u);
  // Self version major, sender code index, 1, 345678 us / 4000; seconds;
  // ~session, ~client version, ~length; method, status; event; flags (from
  // a profile, not reliable).
  EXPECT_EQ((std::vector<std::uint32_t>{d[0], d[1], d[2], d[3], be32(d, 4), be32(d, 8), be16(d, 12), be16(d, 14),
                                        be16(d, 16), be16(d, 18), be16(d, 60), be16(d, 62)}),
            (std::vector<std::uint32_t>{3, 5, 1, 86, 12, ~0x01020304u, 0xFAF9, 0xFFBF, 0x0102, 0x0304, 0x0a0b, 0}));
  EXPECT_EQ(std::string(d.begin() + 20, d.begin() + 60), kUdid);
  ASSERT_TRUE(line.has_value());
  EXPECT_EQ(*line, std::string("12.344 ") + kUdid + " 127.0.0.1 YF  1286 16909060  2571   258   772 ");
}

TEST_F(DashboardBackendTest, TextIsOrderedByValueLengthWithEscapesAndNullForContainersAndCut) {
  auto b = backend();
  const Value event(Dictionary{{"s", Value("a\nb=c\\d")},
                               {"long", Value("abcdef")},
                               {"nested", Value(Dictionary{{"x", Value(1)}})},
                               {"n", Value(7)},
                               {"e", Value("")},
                               {"r", Value(1.5)},
                               {"t", Value(true)}});
  const auto line = send(*b, event, at(1, 0), 1, 2, 3);
  ASSERT_TRUE(server.waitForArrivals(1));
  const auto d = server.arrivals()[0].bytes;
  // Lengths of the descriptions: "" 0, "7" 1, "1" 1, "1.5" 3, "null" 4,
  // "abcdef" 6, "a\nb=c\d" 7; equal lengths keep the dictionary's order.
  const std::string text = R"( e=empty n=7 t=1 r=1.5 nested=null long=abcdef s=ab\=c\\d)";
  EXPECT_EQ(textOf(d), text);
  EXPECT_EQ(be16(d, 14), static_cast<std::uint16_t>(~(64 + text.size())));
  EXPECT_TRUE(line->ends_with(text));

  // A longer text is cut at 1023 bytes.
  send(*b, Value(Dictionary{{"k", Value(std::string(2000, 'v'))}}), at(1, 0), 1, 2, 3);
  ASSERT_TRUE(server.waitForArrivals(2));
  const auto cut = server.arrivals()[1].bytes;
  ASSERT_EQ(cut.size(), 64u + 1023u);
  EXPECT_EQ(be16(cut, 14), static_cast<std::uint16_t>(~1087u));
  EXPECT_EQ(textOf(cut).substr(0, 4), " k=v");
}

TEST_F(DashboardBackendTest, AddressBackendSetsTheReliableAndNotFromProfileFlags) {
  auto b = DashboardBackend::initWithName("dashboard", std::string("127.0.0.1"), server.port(), std::nullopt);
  ASSERT_NE(b, nullptr);
  EXPECT_NE(b->boundPort(), 0);
  send(*b, Value(Dictionary{}), at(1, 0), 1, 2, 3);
  ASSERT_TRUE(server.waitForArrivals(1));
  EXPECT_EQ(be16(server.arrivals()[0].bytes, 62), 3);
  b->cleanup();
}

// --- Reliable mode ----------------------------------------------------------------------------

TEST_F(DashboardBackendTest, ProfileWithoutReliableSendsOnceAndNeverBinds) {
  server.setPolicy([](const auto&, std::size_t) { return UdpTestServer::Decision{.acknowledge = true}; });
  auto b = backend();
  EXPECT_EQ(b->boundPort(), 0);
  EXPECT_FALSE(b->hasReadSource());
  send(*b, Value(Dictionary{}), at(1, 0), 1, 2, 7);
  ASSERT_TRUE(server.waitForArrivals(1));
  // Sent whole: nothing is kept for another try.
  EXPECT_TRUE(b->messageQueueSnapshot().empty());
  b->cleanup();
  QueueWatch watch(*b);
  EXPECT_EQ(b->socketDescriptor(), -1);
  EXPECT_FALSE(b->hasTimer());
  EXPECT_EQ(server.arrivals().size(), 1u);
}

TEST_F(DashboardBackendTest, LossyNetworkStillGetsEveryDatagramAcknowledgedWithinTheSchedule) {
  // Every third datagram's first copy is lost, and every acknowledgement of
  // an even event number is lost the first time.
  std::set<std::uint16_t> ackLostOnce;
  std::map<std::uint16_t, int> copies;
  server.setPolicy([&](const std::vector<std::uint8_t>& bytes, std::size_t) {
    const std::uint16_t event = be16(bytes, 60);
    const int copy = copies[event]++;
    if (event % 3 == 0 && copy == 0) {
      return UdpTestServer::Decision{.drop = true};
    }
    if (event % 2 == 0 && ackLostOnce.insert(event).second) {
      return UdpTestServer::Decision{.acknowledge = false};
    }
    return UdpTestServer::Decision{.acknowledge = true};
  });
  auto b = backend(5);
  ASSERT_TRUE(b->reliableUDP());
  QueueWatch watch(*b);
  constexpr std::uint16_t kEvents = 30;
  for (std::uint16_t e = 1; e <= kEvents; ++e) {
    send(*b, Value(Dictionary{{"i", Value(static_cast<int>(e))}}), at(1, 0), 1, 2, e);
  }
  // Copies sent and events acknowledged, per event number.
  std::map<std::uint16_t, int> sent;
  std::set<std::uint16_t> acknowledged;
  const auto tally = [&](const std::vector<UdpDatagram>& arrivals) {
    sent.clear();
    acknowledged.clear();
    for (const auto& d : arrivals) {
      ++sent[be16(d.bytes, 60)];
      if (d.acknowledged) {
        acknowledged.insert(be16(d.bytes, 60));
      }
    }
    return acknowledged.size() == kEvents;
  };
  ASSERT_TRUE(server.waitUntil(tally));
  ASSERT_TRUE(watch.waitFor(0));
  tally(server.arrivals());
  std::uint64_t copiesSent = 0;
  for (std::uint16_t e = 1; e <= kEvents; ++e) {
    EXPECT_TRUE(acknowledged.contains(e)) << e;
    EXPECT_LE(sent[e], 5) << e;  // first sending and at most four more
    EXPECT_GE(sent[e], (e % 3 == 0 || e % 2 == 0) ? 2 : 1) << e;
    copiesSent += static_cast<std::uint64_t>(sent[e]);
  }
  // Every event handed over once and acknowledged once; each further copy
  // that went out whole was a retransmission (a first copy the socket did
  // not take whole is not one, but loopback takes them all).
  expectOnly(b->counters(), {{BackendCount::sent, kEvents},
                             {BackendCount::delivered, kEvents},
                             {BackendCount::retried, copiesSent - kEvents}});
  b->cleanup();
  ASSERT_TRUE(watch.waitFor(std::nullopt, true));
}

// Asked to clean up with a datagram still unanswered, the backend sends it
// five times in all, drops it, and only then lets its sources go.
TEST_F(DashboardBackendTest, UnansweredDatagramIsSentFiveTimesThenDroppedBeforeTheCleanupEnds) {
  auto b = backend(3);
  QueueWatch watch(*b);
  send(*b, Value(Dictionary{{"k", Value("v")}}), at(1, 0), 1, 2, 9);
  ASSERT_TRUE(watch.waitFor(1));
  b->cleanup();
  ASSERT_TRUE(watch.waitFor(0, true));
  EXPECT_TRUE(logs.has(Level::Debug, "DashboardBackend(myPeriodicTask): clean up at myPeriodicTask."));
  EXPECT_EQ(b->socketDescriptor(), -1);
  // The last copy leaves the queue as it is sent; the server may read it a
  // moment later.
  ASSERT_TRUE(server.waitForArrivals(5));
  const auto arrivals = server.arrivals();
  ASSERT_EQ(arrivals.size(), 5u);
  for (const auto& d : arrivals) {
    EXPECT_EQ(d.bytes, arrivals[0].bytes);
  }
  expectOnly(b->counters(),
             {{BackendCount::sent, 1}, {BackendCount::retried, 4}, {BackendCount::droppedTransportError, 1}});
}

TEST_F(DashboardBackendTest, FiftyFirstQueuedDatagramPushesOutTheOldest) {
  // A period long enough that no tick runs during the test.
  auto b = backend(600000);
  for (std::uint16_t e = 1; e <= 51; ++e) {
    send(*b, Value(Dictionary{}), at(1, 0), 1, 2, e);
  }
  const auto queue = b->messageQueueSnapshot();
  ASSERT_EQ(queue.size(), 50u);
  EXPECT_EQ(queue.front().eventNumber, 2);
  EXPECT_EQ(queue.back().eventNumber, 51);
  EXPECT_EQ(queue.front().state, UDPPacketToSend::kAwaitingAcknowledgement);
  expectOnly(b->counters(), {{BackendCount::sent, 51}, {BackendCount::droppedQueueFull, 1}});
  b->cleanup();
}

TEST_F(DashboardBackendTest, ShortLongForgedAndUnknownAcknowledgementsAreIgnored) {
  auto b = backend(600000);
  QueueWatch watch(*b);
  for (const std::uint16_t e : {std::uint16_t{4}, std::uint16_t{4}, std::uint16_t{5}}) {
    send(*b, Value(Dictionary{}), at(1, 0), 1, 2, e);
  }
  ASSERT_TRUE(watch.waitFor(3));
  const std::uint16_t port = b->boundPort();

  server.sendTo(port, ackFor(5, 61));    // too short to hold an event number
  server.sendTo(port, ackFor(5, 1200));  // longer than any datagram
  server.sendTo(port, ackFor(77));       // no such datagram
  {
    // From another port of the same host: never the server's answer.
    const int other = ::socket(AF_INET, SOCK_DGRAM, 0);
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    to.sin_port = htons(port);
    const auto forged = ackFor(5);
    ::sendto(other, forged.data(), forged.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to);
    ::close(other);
  }
  // One valid acknowledgement for the duplicated number: only the first
  // record goes; it arrives after the others, so they were all seen.
  server.sendTo(port, ackFor(4));
  ASSERT_TRUE(watch.waitFor(2));
  const auto queue = b->messageQueueSnapshot();
  ASSERT_EQ(queue.size(), 2u);
  EXPECT_EQ(queue[0].eventNumber, 4);
  EXPECT_EQ(queue[1].eventNumber, 5);
  EXPECT_TRUE(logs.contains("DashboardBackend(processSocketRead): ignoring an acknowledgement of 61 bytes"));
  EXPECT_TRUE(logs.contains("DashboardBackend(processSocketRead): ignoring an acknowledgement of 1200 bytes"));
  EXPECT_TRUE(logs.contains("DashboardBackend(processSocketRead): no queued datagram for event 77"));
  b->cleanup();
}

// --- Clean-up --------------------------------------------------------------------------------

TEST_F(DashboardBackendTest, CleanupWithAnEmptyQueueCancelsTheSourcesAtOnce) {
  auto b = backend(600000);
  ASSERT_TRUE(b->hasReadSource());
  b->cleanup();
  b->cleanup();  // finds nothing left to cancel: the socket is not closed twice
  QueueWatch watch(*b);  // queued behind the clean-ups
  EXPECT_FALSE(b->hasReadSource());
  EXPECT_FALSE(b->hasTimer());
  EXPECT_EQ(b->socketDescriptor(), -1);
}

// --- Set-up failures ------------------------------------------------------------------------

TEST_F(DashboardBackendTest, ProfileWithoutAddressOrWithBadAddressMakesNoBackend) {
  EXPECT_EQ(makeBackend(Value(Dictionary{{"port", Value(1)}})), nullptr);
  EXPECT_TRUE(logs.has(Level::Error, "DashboardBackend(initWithName): can't resolve server IP"));
  EXPECT_EQ(makeBackend(Value(Dictionary{{"ip", Value("127.0.0.1")}})), nullptr);
  EXPECT_TRUE(logs.has(Level::Error, "DashboardBackend(initWithName): can't resolve server port"));
  EXPECT_EQ(makeBackend(Value(Dictionary{{"ip", Value("dashboard.example")}, {"port", Value(1)}})), nullptr);
  EXPECT_TRUE(logs.has(Level::Error, "DashboardBackend(initWithName): can't parse server IP dashboard.example"));
  EXPECT_EQ(DashboardBackend::initWithName("dashboard", std::optional<std::string>(), 1, std::nullopt), nullptr);
}

// --- Log data ----------------------------------------------------------------------------

class DashboardLogDataTest : public DashboardBackendTest {
 protected:
  DashboardLogDataTest() { URLSession::setExtraCAFile(TestCA::shared().caFile().string()); }
  TempRoot root;
  HttpsTestServer https;
  std::shared_ptr<ReportingSessionConnectivityHelper> transport =
      ReportingSessionConnectivityHelper::initWithDelegate({}, ReportingSessionConnectivityHelper::POSTRequestMode());
};

TEST_F(DashboardLogDataTest, ArrayIsPostedAsABinaryPropertyListAndTheLocationReported) {
  https.on("/logs", Reply{.body = "https://store.example/logs/42"});
  auto b = backend(std::nullopt, {{"post_url", Value(https.url("/logs"))}, {"display_url", Value("https://dash/")}});
  EXPECT_EQ(b->displayURL(), "https://dash/");
  b->setReportingSessionConnectivityDelegate(transport);
  const Value logData(Array{Value("first line"), Value(42), Value(Dictionary{{"k", Value("v")}})});
  EXPECT_TRUE(b->uploadLogData(logData));
  ASSERT_EQ(https.requestCount(), 1u);
  const auto request = https.requests()[0];
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.header("Content-Type"), "application/octet-stream");
  const auto decoded = plist::decodeBinary(plist::bytesOf(request.body));
  ASSERT_TRUE(decoded.has_value());
  EXPECT_EQ(*decoded, logData);
  EXPECT_TRUE(logs.has(Level::Default, "DashboardBackend(uploadLogData): Log data uploaded to https://store.example/logs/42"));
  b->cleanup();
}

TEST_F(DashboardLogDataTest, NoPostURLNotAnArrayAndTransportErrorsAnswerNo) {
  auto without = backend();
  EXPECT_FALSE(without->uploadLogData(Value(Array{Value("x")})));
  EXPECT_TRUE(logs.has(Level::Error, "DashboardBackend(uploadLogData): Post URL for log data array is nil"));

  RefusingPort refusing;
  auto b = backend(std::nullopt, {{"post_url", Value(refusing.url("/logs"))}});
  b->setReportingSessionConnectivityDelegate(transport);
  EXPECT_FALSE(b->uploadLogData(Value("not an array")));
  EXPECT_TRUE(logs.has(Level::Error, "DashboardBackend(uploadLogData): Failed to serialize log data array for upload"));
  EXPECT_FALSE(b->uploadLogData(Value(Array{Value("x")})));
  EXPECT_TRUE(logs.contains("DashboardBackend(uploadLogData): Error uploading log data array ("));
  without->cleanup();
  b->cleanup();
}

// --- The codec --------------------------------------------------------------------------------

TEST(DashboardDatagramTest, DecodeChecksLengthsAndUndoesTheEscapes) {
  const dashboard::Header h{.seconds = 12, .microseconds = 345678, .sessionID = 7, .udid = kUdid, .eventNumber = 300};
  const auto bytes = dashboard::encode(h, R"( a=x y b=c\=d\\ e=)");
  std::string why;
  const auto d = dashboard::decode(bytes, &why);
  ASSERT_TRUE(d.has_value()) << why;
  EXPECT_EQ(std::tuple(d->sessionID, d->milliseconds, d->eventNumber, d->udid), std::tuple(7u, 344u, 300, std::string(kUdid)));
  EXPECT_EQ(d->items, (std::vector<std::pair<std::string, std::string>>{{"a", "x y"}, {"b", "c=d\\"}, {"e", ""}}));

  auto shortened = bytes;
  shortened.pop_back();
  EXPECT_FALSE(dashboard::decode(shortened, &why).has_value());
  EXPECT_EQ(why, "length field says 82 bytes, 81 arrived");
  EXPECT_FALSE(dashboard::decode(std::vector<std::uint8_t>(63, 0), &why).has_value());
}

}  // namespace
}  // namespace zerith::test
