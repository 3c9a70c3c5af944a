// The real daemon against raw sockets: admission by entitlement, hostile and
// broken frames, clients that vanish mid-call, and the stop signal. The
// service manager's watchdog: pings while every pool, queue and thread makes
// progress, none once one of them is wedged. A file size limit under the
// daemon: a write past it fails with EFBIG, handled as any failed write.

#include <signal.h>
#include <sys/resource.h>

#include <cerrno>
#include <cstring>
#include <random>
#include <thread>

#include "tests/e2e/E2eFixture.h"

namespace zerith::test {
namespace {

using log::Level;

constexpr const char* kDisplayURL = "fetchDisplayURL:";

// A session that answers proves the daemon is alive and serving.
void expectServing(RawFrameSocket& client, std::uint64_t number) {
  ASSERT_TRUE(client.call(kDisplayURL, number));
  const auto reply = client.replyTo(number);
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ((*reply)["args"]["url"], Value("URL not available"));
}

// --- Admission ---------------------------------------------------------------

TEST_F(E2eTest, ClientsWithoutATrueEntitlementAreClosedAndNoSessionIsMade) {
  for (const Value& entitlement : {Value(), Value(false), Value("yes")}) {
    grant(entitlement);  // the policy is read afresh for every connection
    if (!daemon) {
      startDaemon();
    }
    auto client = RawFrameSocket::connect();
    ASSERT_TRUE(client.has_value());
    client->call(kDisplayURL, 1);  // may already find the socket closed
    EXPECT_TRUE(client->waitClosed());
  }
  EXPECT_TRUE(daemon->waitFor("it lacks the entitlement com.velmar.private.zerithd", 3));
  EXPECT_EQ(daemon->count("Accepting new Vesk connection"), 0u);
  EXPECT_EQ(daemon->count("createReportingSessionWithDelegate"), 0u);

  grant(Value(true));
  auto client = RawFrameSocket::connect();
  ASSERT_TRUE(client.has_value());
  expectServing(*client, 1);
  EXPECT_TRUE(daemon->waitFor("as it has proper entitlement, 0(0) connections."));
}

// --- Hostile and broken input -------------------------------------------------

TEST_F(E2eTest, BrokenFramesCloseOnlyTheirOwnConnectionAndWrongCallsAreAnswered) {
  grant(Value(true));
  startDaemon();
  auto bystander = RawFrameSocket::connect();
  ASSERT_TRUE(bystander.has_value());
  expectServing(*bystander, 1);

  const std::vector<std::pair<std::string, Data>> attacks = {
      {"garbage body", frameWithBody(Data(64, 0xAB))},
      {"oversized length", Data{0x7F, 0xFF, 0xFF, 0xFF, 1, 2, 3}},
      {"XML instead of binary", frameWithBody([] {
         const std::string xml = plist::encodeXml(Value(Dictionary{{"op", Value(kDisplayURL)}}));
         return Data(xml.begin(), xml.end());
       }())},
      {"array root", frameWithBody(plist::encodeBinary(Value(Array{Value(1)})))},
      {"truncated plist",
       [] {
         Data body = plist::encodeBinary(Value(Dictionary{{"op", Value(kDisplayURL)}, {"call", Value(1)}}));
         body.resize(body.size() / 2);
         return frameWithBody(body);
       }()},
  };
  std::uint64_t n = 2;
  for (const auto& [name, bytes] : attacks) {
    SCOPED_TRACE(name);
    auto attacker = RawFrameSocket::connect();
    ASSERT_TRUE(attacker.has_value());
    ASSERT_TRUE(attacker->write(bytes));
    EXPECT_TRUE(attacker->waitClosed());
    expectServing(*bystander, n++);
  }

  // Wrong calls are answered with errors and the connection goes on.
  ASSERT_TRUE(bystander->call("noSuchOperation:", n));
  auto reply = bystander->replyTo(n++);
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ((*reply)["error"]["code"], Value(-1));
  // A session info that is not a dictionary never reaches the session.
  ASSERT_TRUE(bystander->call("setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock:", n,
                              Dictionary{{"sessionInfo", Value("not a dictionary")}}));
  reply = bystander->replyTo(n++);
  ASSERT_TRUE(reply.has_value());
  EXPECT_FALSE((*reply)["error"].isNil());
  EXPECT_EQ(daemon->count("setSessionInfo: Configuring session"), 0u);
  expectServing(*bystander, n);
  EXPECT_TRUE(daemon->running());
}

TEST_F(E2eTest, ClientVanishingMidCallEndsItsSessionAndTheTransaction) {
  grant(Value(true));
  startDaemon();
  {
    auto client = RawFrameSocket::connect();
    ASSERT_TRUE(client.has_value());
    ASSERT_TRUE(client->call("setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock:", 1,
                             Dictionary{{"sessionInfo", Value(Dictionary{{"sessionID", Value(77)}})}}));
    // Half of the next frame, then gone.
    Data frame = ipc::encodeCall(kDisplayURL, 2, {});
    frame.resize(frame.size() - 3);
    ASSERT_TRUE(client->write(frame));
  }
  ASSERT_TRUE(daemon->waitFor("was invalidated"));
  ASSERT_TRUE(daemon->waitForExact(Level::Default, kTransactionEnded));
  EXPECT_TRUE(daemon->has(Level::Default, "releaseVeskTransaction: Vesk transaction ref count is 0"));

  auto next = RawFrameSocket::connect();
  ASSERT_TRUE(next.has_value());
  expectServing(*next, 1);
}

// --- Stopping ----------------------------------------------------------------

TEST_F(E2eTest, StopSignalWithoutSessionsExitsAtOnce) {
  grant(Value(true));
  startDaemon();
  EXPECT_EQ(daemon->stop(5s), 0) << daemon->output();
  EXPECT_FALSE(daemon->output().empty());
  EXPECT_EQ(daemon->count("Waiting up to"), 0u);
  const auto notes = daemon->notifications();
  EXPECT_NE(std::find(notes.begin(), notes.end(), "READY=1"), notes.end());
  EXPECT_NE(std::find(notes.begin(), notes.end(), "STOPPING=1"), notes.end());
}

TEST_F(E2eTest, StopSignalDrainsOpenSessionsAndRefusesNewOnes) {
  grant(Value(true));
  startDaemon();
  auto client = RawFrameSocket::connect();
  ASSERT_TRUE(client.has_value());
  expectServing(*client, 1);

  daemon->signal(SIGTERM);
  ASSERT_TRUE(daemon->waitFor("main: Waiting up to"));
  EXPECT_TRUE(daemon->running());
  expectServing(*client, 2);  // the open session goes on while draining

  // A newcomer is not served.
  auto late = RawFrameSocket::connect();
  if (late) {
    late->call(kDisplayURL, 1);
  }
  client->close();
  EXPECT_EQ(daemon->waitForExit(10s), 0) << daemon->output();
  EXPECT_TRUE(daemon->has(Level::Default, kTransactionEnded));
  EXPECT_TRUE(daemon->has(Level::Default, "main: Keep-alive transaction ended, exiting"));
  if (late) {
    EXPECT_FALSE(late->replyTo(1, 5s).has_value());
  }
  EXPECT_EQ(daemon->count("Accepting new Vesk connection"), 1u);
}

TEST_F(E2eTest, StopTimeOutEndsTheDrainOfASessionThatStaysOpen) {
  grant(Value(true));
  startDaemon({.arguments = {"--stop-timeout", "0.5"}});
  auto client = RawFrameSocket::connect();
  ASSERT_TRUE(client.has_value());
  expectServing(*client, 1);
  EXPECT_EQ(daemon->stop(10s), 0) << daemon->output();
  EXPECT_TRUE(
      daemon->has(Level::Error, "main: Stop time-out passed with the keep-alive transaction still open, exiting"));
}

TEST_F(E2eTest, SocketThatCannotBeCreatedFailsTheStartWithAClearMessage) {
  // The runtime folder is a file: nothing can listen there.
  root.write("/run/zerithd", "not a folder");
  DaemonProcess failed(root, {.readyTimeout = 5s});
  EXPECT_FALSE(failed.ready());
  EXPECT_EQ(failed.waitForExit(10s), 1);
  EXPECT_TRUE(failed.count("main: Unable to create the runtime folder") > 0 ||
              failed.count("main: Unable to listen on") > 0)
      << failed.output();
}

// --- Watchdog -----------------------------------------------------------------

// The daemon stops pinging once the main operation queue is wedged (through
// its test hook), so that the manager would restart it.
TEST_F(E2eTest, WatchdogPingsWhileServingAndStopsOnceAQueueIsWedged) {
  grant(Value(true));
  // A 900 ms watchdog: a ping every 300 ms while all is well.
  startDaemon({.arguments = {"--stop-timeout", "5"},
               .environment = {{"WATCHDOG_USEC", "900000"}, {"ZERITHD_TEST_WEDGE_MAIN_QUEUE_AFTER_MS", "3000"}}});
  ASSERT_TRUE(daemon->waitFor("Watchdog on, pinging every 300 ms")) << daemon->output();
  const auto pings = [&] {
    const auto all = daemon->notifications();
    return std::count_if(all.begin(), all.end(), [](const std::string& m) { return m.find("WATCHDOG=1") != m.npos; });
  };
  for (int i = 0; i < 50 && pings() < 4; ++i) {
    std::this_thread::sleep_for(100ms);
  }
  ASSERT_GE(pings(), 4) << daemon->output();

  ASSERT_TRUE(daemon->waitFor("watchdog: no progress on the main operation queue", 1, 10s)) << daemon->output();
  const auto atStall = pings();
  std::this_thread::sleep_for(2s);  // six ping periods
  EXPECT_EQ(pings(), atStall) << daemon->output();
  // Only the one queue is wedged: the daemon still answers and stops.
  auto client = connect();
  ASSERT_TRUE(client);
  EXPECT_TRUE(client->setSessionInfo(sessionInfo(9), Value(), Value(), false, 10s));
}

// --- Write limit --------------------------------------------------------------

// The signal the daemon would otherwise die of is ignored; it goes on serving.
struct WriteLimitCase {
  const char* name;
  std::uint64_t limit;    // bytes
  std::size_t eventSize;  // 0: no event is sent
  const char* failedWrite;
};

class WriteLimitTest : public E2eTest, public ::testing::WithParamInterface<WriteLimitCase> {};

TEST_P(WriteLimitTest, AWriteBeyondTheLimitFailsAndTheDaemonServesOn) {
  const WriteLimitCase& c = GetParam();
  grant(Value(true));
  HttpsTestServer server;
  server.on("/post", {.status = 200});
  serveSignedStorebag(server, collectorStorebag(server.url("/post")));
  startDaemon(trusting());
  // The limit holds before the first HTTPS request (which makes the CA
  // bundle) and before any post.
  const rlimit limit{c.limit, c.limit};
  ASSERT_EQ(::prlimit(daemon->pid(), RLIMIT_FSIZE, &limit, nullptr), 0) << std::strerror(errno);

  auto client = startDemoSession(1);
  ASSERT_TRUE(client);
  if (c.eventSize != 0) {
    // Random hex, which compresses poorly.
    std::mt19937_64 random(7);
    std::string blob(c.eventSize, '0');
    for (char& ch : blob) {
      ch = "0123456789abcdef"[random() % 16];
    }
    ASSERT_TRUE(client->sendMessage(event(3, 4, Value(Dictionary{{"blob", blob}})), 10s));
  }
  ASSERT_TRUE(daemon->waitFor(c.failedWrite)) << daemon->output();
  EXPECT_NE(daemon->output().find("File too large"), std::string::npos) << daemon->output();

  // Still alive and answering: another client's session is set up.
  auto other = connect();
  ASSERT_TRUE(other);
  EXPECT_TRUE(other->setSessionInfo(sessionInfo(2), Value(), Value(), false, 10s));
  EXPECT_TRUE(daemon->running());
}

INSTANTIATE_TEST_SUITE_P(
    Writes, WriteLimitTest,
    ::testing::Values(
        // The system's CA bundle alone is larger than the limit.
        WriteLimitCase{"CaBundleMemfd", 64 * 1024, 0, "cannot make the CA bundle with the extra authorities"},
        // The bundle fits; one event's post body does not.
        WriteLimitCase{"PostBodyFile", 1024 * 1024, 3 * 1024 * 1024, "cannot write the body file"}),
    [](const auto& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace zerith::test
