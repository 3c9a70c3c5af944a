// The HTTPS backend posting to real HTTPS servers on loopback: headers on the
// wire, digest, gzip, batching thresholds, flushing, realtime order, server
// refusals and TLS refusals.

#include <algorithm>
#include <atomic>
#include <numeric>
#include <thread>

#include "backends/tests/HTTPSPostBackendTestSupport.h"
#include "backends/tests/WireCaptureServer.h"
#include "zerith/ZerithConstants.h"

namespace zerith::test {
namespace {

using log::Level;

class HTTPSPostTest : public HTTPSBackendTest {
 protected:
  // Enabled, posting every event at once to `url`.
  std::shared_ptr<HTTPSPostBackend> immediate(const std::string& url, Value info = userInfo()) {
    return backend(profileWith({enablingClient(url)}), std::move(info), true, false);
  }
  std::shared_ptr<HTTPSPostBackend> batching(const std::string& url) {
    return backend(profileWith({enablingClient(url)}), userInfo(), true, true);
  }
};

TEST_F(HTTPSPostTest, HeadersGoOutInTheirOrderWithAnIndependentlyCheckedDigest) {
  WireCaptureServer wire;
  auto b = immediate(wire.url("/post"));
  const std::string key = "collector-key";
  b->setDigestKey(Data(key.begin(), key.end()));
  b->setIsInternal(true);
  b->sendMessage(clientEvent(1), at(1001), 3, 4, 1);
  ASSERT_TRUE(wire.waitForConnections(1));
  const auto request = wire.requests().at(0);
  EXPECT_EQ(request.requestLine, "POST /post HTTP/1.1");

  std::vector<std::string> ours;
  for (const auto& [name, value] : request.headers) {
    if (name != "Host" && name != "X-ZTH-Source-Application") {  // the transport's own
      ours.push_back(name);
    }
  }
  const std::vector<std::string> expected = {"X-ZTH-Client-Name", "X-ZTH-Service-Name", "X-ZTH-Internal-Build",
                                             "User-Agent",        "X-ZTH-Client-Version", "X-ZTH-Sender",
                                             "X-ZTH-Event-Map",   "Accept",              "Content-Type",
                                             "Content-Length",    "Content-Encoding",    "X-ZTH-DIGEST"};
  EXPECT_EQ(ours, expected);
  std::map<std::string, std::string> h(request.headers.begin(), request.headers.end());
  EXPECT_EQ(h["X-ZTH-Client-Name"], "demo");
  EXPECT_EQ(h["X-ZTH-Service-Name"], "cli");
  EXPECT_EQ(h["X-ZTH-Internal-Build"], "1");
  EXPECT_EQ(h["User-Agent"], "Zerith/8.1 (Board9,1; 12.4)");
  EXPECT_EQ(h["X-ZTH-Client-Version"], "12");
  EXPECT_EQ(h["X-ZTH-Sender"], "YJ");
  EXPECT_EQ(h["X-ZTH-Event-Map"], "3 4");
  EXPECT_EQ(h["Accept"], "application/json");
  EXPECT_EQ(h["Content-Type"], "application/json");
  EXPECT_EQ(h["Content-Length"], std::to_string(request.body.size()));
  EXPECT_EQ(h["Content-Encoding"], "gzip");
  const std::string json = inflateGzip(request.body);
  ASSERT_FALSE(json.empty());
  EXPECT_LT(request.body.size(), json.size());
  // The digest covers the JSON before compression.
  EXPECT_EQ(h["X-ZTH-DIGEST"], independentDigest(key, json));
  EXPECT_EQ(nlohmann::ordered_json::parse(json)["events"][0]["n"], 1);
}

TEST_F(HTTPSPostTest, UserAgentMinorVersionAndOptionalHeaders) {
  WireCaptureServer wire;
  auto b = immediate(wire.url("/post"));
  b->setSelfVersion("1.2.3");
  b->setHardwareType(std::nullopt);
  b->setDigestKey(Data{1, 2, 3});
  b->setDigestAlgorithm(1);  // no digest for other algorithms
  // A tiny body: gzip would be longer, so it goes as it is.
  b->postJSONMessage("{}", 0, std::nullopt, std::nullopt, nullptr);
  ASSERT_TRUE(wire.waitForConnections(1));
  const auto request = wire.requests().at(0);
  std::map<std::string, std::string> h(request.headers.begin(), request.headers.end());
  EXPECT_EQ(h["User-Agent"], "Zerith/1.2.3 ((null); 12.4)");
  EXPECT_EQ(request.body, "{}");
  EXPECT_FALSE(h.count("Content-Encoding"));
  EXPECT_FALSE(h.count("X-ZTH-DIGEST"));
  EXPECT_FALSE(h.count("X-ZTH-Event-Map"));
  EXPECT_FALSE(h.count("X-ZTH-Internal-Build"));
  EXPECT_EQ(h["Content-Length"], "2");
}

TEST_F(HTTPSPostTest, PlainHttpURLIsUpgradedToHttpsOnCustomerDevices) {
  server.on("/post", Reply{});
  const std::string https = server.url("/post");
  auto b = immediate("HTTP://" + https.substr(std::string("https://").size()));
  b->sendMessage(clientEvent(1), at(1001), 1, 1, 1);
  ASSERT_TRUE(server.waitForRequests(1));
  EXPECT_EQ(server.requests()[0].path, "/post");

  auto other = immediate("ftp-like");
  auto results = ResultLog::make();
  other->postJSONMessage("{\"a\":1}", 0, std::nullopt, std::nullopt, results->handler());
  ASSERT_TRUE(results->waitFor(1));
  ASSERT_TRUE(results->errors()[0]);
  EXPECT_EQ(results->errors()[0]->code, -1);
}

TEST_F(HTTPSPostTest, FiftyRecordsOfAMethodStayBatchedAndTheFiftyFirstFlushesAll) {
  server.on("/post", Reply{});
  auto b = batching(server.url("/post"));
  ASSERT_EQ(b->eventThreshold(), 49);
  b->sendMessage(clientEvent(-1), at(1001), 2, 0, 0);  // another method, flushed with them
  for (int i = 0; i < 50; ++i) {
    EXPECT_FALSE(b->sendMessage(clientEvent(i), at(1001), 1, 0, 0));
  }
  EXPECT_EQ(b->batchedEventCount(), 51u);
  EXPECT_EQ(server.requestCount(), 0u);
  b->sendMessage(clientEvent(50), at(1001), 1, 0, 0);
  ASSERT_TRUE(server.waitForRequests(1));
  const auto events = envelopeOf(server.requests()[0])["events"];
  ASSERT_EQ(events.size(), 51u);
  EXPECT_EQ(events[0]["n"], -1);
  EXPECT_EQ(events[50]["n"], 49);
  EXPECT_EQ(b->batchedEventCount(), 1u);
  // The batch went without method or status: no event map header.
  EXPECT_FALSE(server.requests()[0].header("X-ZTH-Event-Map"));
}

// Senders on several threads share one batch while another thread flushes
// it: the count read and the append share one turn on the state queue, so
// every record lands in exactly one batch, and one sender's records keep
// their order within a batch and from one flush to the next.
TEST_F(HTTPSPostTest, ConcurrentSendersAndFlushesPutEveryRecordInExactlyOneBatchInOrder) {
  server.on("/post", Reply{});
  auto b = batching(server.url("/post"));
  constexpr int kSenders = 4;
  constexpr int kEach = 300;
  std::atomic<bool> sending{true};
  std::thread flusher([&] {
    while (sending.load()) {
      b->flushMessagesWithCompletion(nullptr);
      std::this_thread::yield();
    }
  });
  std::vector<std::thread> senders;
  for (int s = 0; s < kSenders; ++s) {
    senders.emplace_back([&, s] {
      for (int i = 0; i < kEach; ++i) {
        // Two methods, so that both the per-method threshold and the
        // flusher's flushes cut the batch.
        b->sendMessage(Value(Dictionary{{"ClientData", Dictionary{{"s", s}, {"i", i}}}}), at(1001),
                       static_cast<std::uint16_t>(1 + i % 2), 0, 0);
      }
    });
  }
  for (auto& sender : senders) {
    sender.join();
  }
  sending.store(false);
  flusher.join();
  b->flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(b->batchedEventCount(), 0u);

  // Every post holds at least one record: wait for posts until all arrived.
  std::size_t records = 0;
  std::vector<RecordedRequest> posts;
  while (records < kSenders * kEach && server.waitForRequests(posts.size() + 1)) {
    posts = server.requests();
    records = 0;
    for (const auto& post : posts) {
      records += envelopeOf(post)["events"].size();
    }
  }
  ASSERT_EQ(records, static_cast<std::size_t>(kSenders * kEach));
  // Batches are cut in order but may arrive in any order over parallel
  // connections: each batch's first record per sender tells where it goes.
  std::vector<std::vector<int>> seen(kSenders);
  std::vector<std::vector<std::pair<int, int>>> batchesPerSender(kSenders);  // (first i, last i) per batch
  for (const auto& post : posts) {
    std::vector<int> last(kSenders, -1);
    std::vector<int> first(kSenders, -1);
    const auto envelope = envelopeOf(post);
    for (const auto& record : envelope["events"]) {
      const int s = record["s"].get<int>();
      const int i = record["i"].get<int>();
      EXPECT_GT(i, last[s]) << "sender " << s << " out of order within a batch";
      if (first[s] < 0) {
        first[s] = i;
      }
      last[s] = i;
      seen[s].push_back(i);
    }
    for (int s = 0; s < kSenders; ++s) {
      if (first[s] >= 0) {
        batchesPerSender[s].emplace_back(first[s], last[s]);
      }
    }
  }
  for (int s = 0; s < kSenders; ++s) {
    std::sort(seen[s].begin(), seen[s].end());
    std::vector<int> expected(kEach);
    std::iota(expected.begin(), expected.end(), 0);
    EXPECT_EQ(seen[s], expected) << "sender " << s << ": a record lost or in two batches";
    // The batches of one sender do not interleave: each continues where the
    // one before it ended.
    std::sort(batchesPerSender[s].begin(), batchesPerSender[s].end());
    for (std::size_t k = 1; k < batchesPerSender[s].size(); ++k) {
      EXPECT_EQ(batchesPerSender[s][k].first, batchesPerSender[s][k - 1].second + 1) << "sender " << s;
    }
  }
}

TEST_F(HTTPSPostTest, FlushPostsTheBatchAndReportsWhyItCouldNot) {
  server.on("/post", Reply{});
  auto b = batching(server.url("/post"));
  auto results = ResultLog::make();
  EXPECT_FALSE(b->flushMessagesWithCompletion(results->handler()));
  ASSERT_TRUE(results->waitFor(1));
  EXPECT_EQ(results->errors()[0]->description, "Nothing to flush");

  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
  EXPECT_GT(b->batchedEventsSize(), 0u);
  b->flushMessagesWithCompletion(results->handler());
  ASSERT_TRUE(results->waitFor(2));
  EXPECT_FALSE(results->errors()[1]) << results->errors()[1]->description;
  ASSERT_EQ(server.requestCount(), 1u);
  EXPECT_EQ(envelopeOf(server.requests()[0])["events"].size(), 2u);
  EXPECT_EQ(b->batchedEventsSize(), 0u);

  // User info required but gone: the batch stays.
  b->sendMessage(clientEvent(3), at(1001), 1, 0, 0);
  b->setUserInfoDict(Value());
  b->flushMessagesWithCompletion(results->handler());
  ASSERT_TRUE(results->waitFor(3));
  EXPECT_EQ(results->errors()[2]->description, "Can not flush: userInfo is required");
  EXPECT_EQ(b->batchedEventCount(), 1u);

  // Every record filtered out by the event lists.
  b->setUserInfoDict(userInfo());
  auto client = enablingClient(server.url("/post"));
  client.set("event_blacklist", Array{Value(1)});
  auto blocked = backend(profileWith({client}), userInfo(), true, true);
  blocked->sendMessage(clientEvent(4), at(1001), 1, 0, 0);
  blocked->flushMessagesWithCompletion(results->handler());
  ASSERT_TRUE(results->waitFor(4));
  EXPECT_EQ(results->errors()[3]->description, "Nothing to flush: batched events were completely filtered out");
  EXPECT_TRUE(logs.contains("flushMessagesWithCompletion: Dropping event with category 1 as it is blacklisted for backend httpsPost"));

  // A state other than enabled drops the batch.
  b->setState(kBackendStateUndecided);
  b->flushMessagesWithCompletion(results->handler());
  ASSERT_TRUE(results->waitFor(5));
  EXPECT_EQ(b->batchedEventCount(), 0u);
  EXPECT_EQ(server.requestCount(), 1u);
}

TEST_F(HTTPSPostTest, RealtimeEventWhileBatchedFlushesFirstAndFreezesTheState) {
  auto client = enablingClient(server.url("/batch"));
  client.erase("override_dnu");  // consent respected: printable copies
  client.set("realtime_post_url", server.url("/now"));
  server.on("/batch", Reply{});
  server.on("/now", Reply{});
  auto b = backend(profileWith({client}), userInfo(), true, true);
  ASSERT_EQ(b->state(), kBackendStateEnabled);
  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
  const auto text = b->sendMessage(clientEvent(3), at(1002), 7, 8, 1);
  ASSERT_TRUE(text);
  EXPECT_EQ(text->rfind("Flushed events:\n{", 0), 0u) << *text;
  const auto standalone = text->find("\nStandalone event:\n{");
  ASSERT_NE(standalone, std::string::npos);
  EXPECT_NE(text->substr(0, standalone).find("\"n\": 2"), std::string::npos);
  EXPECT_NE(text->substr(standalone).find("\"n\": 3"), std::string::npos);
  ASSERT_TRUE(server.waitForRequestTo("/batch"));
  ASSERT_TRUE(server.waitForRequestTo("/now"));
  EXPECT_TRUE(b->isImmutable());
  // Frozen: a storebag that now refuses does not change the state.
  b->setUserInfoDict(userInfo("nobody", "x"));
  b->updateState();
  EXPECT_EQ(b->state(), kBackendStateEnabled);
}

TEST_F(HTTPSPostTest, SampledOutBackendIsWokenByFlagTwoOrThreeButBatchesThatEvent) {
  server.on("/post", Reply{});
  for (int flag : {2, 3}) {
    auto client = enablingClient(server.url("/post"));
    client.set("sampling_threshold", 0.0);
    client.set("override_sampling", 1.0);
    auto b = backend(profileWith({client}));
    ASSERT_EQ(b->state(), kBackendStateSampledOut);
    const std::size_t before = server.requestCount();
    b->sendMessage(clientEvent(1), at(1001), 1, 0, 1);  // realtime, but sampled out: batched
    EXPECT_EQ(b->state(), kBackendStateSampledOut);
    b->sendMessage(clientEvent(2), at(1001), 1, 0, flag);
    EXPECT_EQ(b->state(), kBackendStateEnabled);
    EXPECT_EQ(b->batchedEventCount(), 2u);
    EXPECT_EQ(server.requestCount(), before);
    b->sendMessage(clientEvent(3), at(1001), 1, 0, 1);
    ASSERT_TRUE(server.waitForRequests(before + 2));
  }
}

TEST_F(HTTPSPostTest, SessionEndMessageCarriesConsentAndSamplingFigures) {
  server.on("/post", Reply{});
  auto b = immediate(server.url("/post"));
  b->sendMessage(Value(Dictionary{}), at(1001), 0, 1, 1);
  ASSERT_TRUE(server.waitForRequests(1));
  const auto record = envelopeOf(server.requests()[0])["events"][0];
  EXPECT_EQ(record["Opt"], 2);
  EXPECT_EQ(record["SamplingThreshold"], 1.0);
  EXPECT_EQ(record["OverrideSampling"], -1);
  EXPECT_EQ(record["Batch"], 0);
}

TEST_F(HTTPSPostTest, ServerErrorDisablesTheBackendAndLaterEventsStopAtOnce) {
  server.on("/post", Reply{.status = 503});
  auto b = immediate(server.url("/post"));
  auto results = ResultLog::make();
  b->sendMessage(clientEvent(1), at(1001), 1, 0, 1);
  ASSERT_TRUE(logs.waitFor("postJSONMessage: backend httpsPost disabled by server 503 return code"));
  EXPECT_EQ(b->state(), kBackendStateDisabled);
  EXPECT_FALSE(b->sendMessage(clientEvent(2), at(1001), 1, 0, 1));
  EXPECT_EQ(server.requestCount(), 1u);

  // The error reaches a flush's completion with the status as its code.
  auto batched = batching(server.url("/post"));
  batched->sendMessage(clientEvent(3), at(1001), 1, 0, 0);
  batched->flushMessagesWithCompletion(results->handler());
  ASSERT_TRUE(results->waitFor(1));
  ASSERT_TRUE(results->errors()[0]);
  EXPECT_EQ(results->errors()[0]->code, 503);
  EXPECT_EQ(results->errors()[0]->description, "backend httpsPost disabled by server 503 return code");
}

TEST_F(HTTPSPostTest, SlowCollectorNeverHoldsUpTheSender) {
  server.on("/post", Reply{});
  server.holdAnswers();
  auto b = immediate(server.url("/post"));
  auto results = ResultLog::make();
  b->postJSONMessage("{\"a\":1}", 0, std::nullopt, std::nullopt, results->handler());
  ASSERT_TRUE(server.waitForRequests(1));
  // The answer is held; sending and batching go on meanwhile.
  b->sendMessage(clientEvent(2), at(1001), 1, 0, 1);
  b->setBatchEvents(true);
  b->sendMessage(clientEvent(3), at(1001), 1, 0, 0);
  EXPECT_EQ(b->batchedEventCount(), 1u);
  EXPECT_TRUE(results->errors().empty());
  server.releaseAnswers();
  ASSERT_TRUE(results->waitFor(1));
  EXPECT_FALSE(results->errors()[0]);
}

// Answers other than a server error, URLs that do not parse, a closed port
// and certificates that are not trusted or name another host: each post
// completes (with an error where nothing was answered) and the backend stays
// enabled; a refused certificate is refused before any request byte.
TEST_F(HTTPSPostTest, ClientErrorsRedirectsBadURLsAndRefusedConnectionsLeaveTheBackendEnabled) {
  server.on("/404", Reply{.status = 404});
  server.on("/302", Reply{.status = 302, .headers = {{"Location", "/gone"}}});
  server.on("/huge", Reply{.body = std::string(2 << 20, 'x')});
  RefusingPort refusing;
  TestCA stranger("stranger CA");
  WireCaptureServer selfSigned(stranger.serverCertificate());
  WireCaptureServer wrongHost(TestCA::shared().issueServerCertificate({"collector.invalid"}, {}));
  struct Row {
    std::string url;
    std::optional<bool> failed;  // nullopt: an answer came, its error is the transport's business
  };
  const Row rows[] = {{server.url("/404"), std::nullopt},
                      {server.url("/302"), std::nullopt},
                      {server.url("/huge"), std::nullopt},
                      {"https://[::1/post", true},
                      {"https://exa mple.invalid/post", true},
                      {"://nothing", true},
                      {"", true},
                      {refusing.url("/post"), true},
                      {selfSigned.url("/post"), true},
                      {wrongHost.url("/post"), true}};
  for (const Row& row : rows) {
    SCOPED_TRACE(row.url);
    auto b = immediate(row.url);
    auto results = ResultLog::make();
    b->postJSONMessage("{\"a\":1}", 0, std::nullopt, std::nullopt, results->handler());
    ASSERT_TRUE(results->waitFor(1));
    if (row.failed) {
      EXPECT_EQ(results->errors()[0].has_value(), *row.failed);
    }
    EXPECT_EQ(b->state(), kBackendStateEnabled);
  }
  EXPECT_TRUE(logs.contains("HTTPSPostBackend(postJsonMessage): post error: "));
  for (const WireCaptureServer* wire : {&selfSigned, &wrongHost}) {
    EXPECT_EQ(wire->requestBytes(), 0u);
    EXPECT_TRUE(wire->requests().empty());
  }
}

TEST_F(HTTPSPostTest, CellularIsForbiddenForHapticsAndForBackendsWithoutUserInfo) {
  // The wire does not show cellular access; the request the transport gets
  // does, so look at it through a transport that only records it.
  struct Recording : ReportingSessionConnectivityInterface {
    std::vector<URLRequest> requests;
    bool postURLRequestWithCompletionHandler(const URLRequest& r, URLCompletion) override {
      requests.push_back(r);
      return true;
    }
    void getURLRequestWithCompletionHandler(const URLRequest&, URLCompletion) override {}
  };
  auto recording = std::make_shared<Recording>();
  const auto cellular = [&](Value info, bool wifiOnly) {
    auto client = enablingClient("https://127.0.0.1:1/");
    client.set("use_wifi_only", wifiOnly ? 1 : 0);
    client.set("client", "demo,com.velmar.lumira");
    client.set("service", "cli,haptics");
    const bool require = !info.isNil();
    auto b = backend(profileWith({client}), std::move(info), require);
    b->setReportingSessionConnectivityDelegate(recording);
    b->postJSONMessage("{}", 0, std::nullopt, std::nullopt, nullptr);
    return recording->requests.back().allowsCellularAccess;
  };
  EXPECT_TRUE(cellular(userInfo(), false));
  EXPECT_FALSE(cellular(userInfo(), true));
  EXPECT_FALSE(cellular(userInfo("COM.velmar.lumira", "Haptics"), false));
  EXPECT_FALSE(cellular(Value(), false));
}

TEST_F(HTTPSPostTest, DefaultsURLBeatsTheStorebagAndAGoneTransportSendsNothing) {
  server.on("/from-defaults", Reply{});
  Defaults(kZerithDefaultsDomain).setObject("httpsPostURL", Value(server.url("/from-defaults")));
  auto b = immediate(server.url("/from-storebag"));
  EXPECT_EQ(b->postURL(), server.url("/from-defaults"));
  EXPECT_TRUE(logs.contains("HTTPSPostBackend(initWithName): Using user default '" + server.url("/from-defaults") +
                            "' for postURL"));
  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  ASSERT_TRUE(server.waitForRequestTo("/from-defaults"));

  // The realtime URL follows the storebag's post URL when neither is set.
  EXPECT_EQ(b->realtimePostURL(), server.url("/from-defaults"));

  // Without a transport the post is dropped and its completion never runs.
  auto orphan = immediate(server.url("/post"));
  orphan->setReportingSessionConnectivityDelegate({});
  auto results = ResultLog::make();
  orphan->postJSONMessage("{}", 0, std::nullopt, std::nullopt, results->handler());
  EXPECT_TRUE(results->errors().empty());
}

TEST_F(HTTPSPostTest, CorrelatedSessionIDRewritesTheBatch) {
  server.on("/post", Reply{});
  auto b = batching(server.url("/post"));
  b->setCompType(3);
  b->setCombinedSessionIDString("OLD");
  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  b->setCorrelatedSessionID("ROOT.CHILD");
  b->flushMessagesWithCompletion(nullptr);
  ASSERT_TRUE(server.waitForRequests(1));
  const auto envelope = envelopeOf(server.requests()[0]);
  EXPECT_EQ(envelope["events"][0]["_sessionID"], "ROOT.CHILD");
  EXPECT_EQ(envelope["events"][0]["_sender"], "YB");
  EXPECT_EQ(server.requests()[0].header("X-ZTH-Sender"), "YB");
}

}  // namespace
}  // namespace zerith::test
