// The HTTPS backend posting to real HTTPS servers on loopback: headers on the
// wire, digest, gzip, batching thresholds, flushing, realtime order, server
// refusals and TLS refusals; and what it counts for each event: sent,
// batched, delivered, and dropped by the reason that decided it.

#include <algorithm>
#include <atomic>
#include <set>
#include <thread>

#include "backends/tests/HTTPSPostBackendTestSupport.h"
#include "backends/tests/WireCaptureServer.h"

namespace zerith::test {
namespace {

using Headers = std::vector<std::pair<std::string, std::string>>;

// The headers the backend set, in wire order (without the transport's own).
Headers ourHeaders(const WireCaptureServer::Request& request) {
  Headers ours;
  std::copy_if(request.headers.begin(), request.headers.end(), std::back_inserter(ours),
               [](const auto& h) { return h.first != "Host" && h.first != "X-ZTH-Source-Application"; });
  return ours;
}

class HTTPSPostTest : public HTTPSBackendTest {};

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
  const std::string json = inflateGzip(request.body);
  ASSERT_FALSE(json.empty());
  // The digest covers the JSON before compression.
  EXPECT_EQ(ourHeaders(request), (Headers{{"X-ZTH-Client-Name", "demo"},
                                          {"X-ZTH-Service-Name", "cli"},
                                          {"X-ZTH-Internal-Build", "1"},
                                          {"User-Agent", "Zerith/8.1 (Board9,1; 12.4)"},
                                          {"X-ZTH-Client-Version", "12"},
                                          {"X-ZTH-Sender", "YJ"},
                                          {"X-ZTH-Event-Map", "3 4"},
                                          {"Accept", "application/json"},
                                          {"Content-Type", "application/json"},
                                          {"Content-Length", std::to_string(request.body.size())},
                                          {"Content-Encoding", "gzip"},
                                          {"X-ZTH-DIGEST", independentDigest(key, json)}}));
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
  EXPECT_EQ(request.body, "{}");
  EXPECT_EQ(ourHeaders(request), (Headers{{"X-ZTH-Client-Name", "demo"},
                                          {"X-ZTH-Service-Name", "cli"},
                                          {"User-Agent", "Zerith/1.2.3 ((null); 12.4)"},
                                          {"X-ZTH-Client-Version", "12"},
                                          {"X-ZTH-Sender", "YJ"},
                                          {"Accept", "application/json"},
                                          {"Content-Type", "application/json"},
                                          {"Content-Length", "2"}}));
}

TEST_F(HTTPSPostTest, PlainHttpURLIsUpgradedToHttpsOnCustomerDevices) {
  const std::string https = server.url("/post");
  auto b = immediate("HTTP://" + https.substr(std::string("https://").size()));
  b->sendMessage(clientEvent(1), at(1001), 1, 1, 1);
  ASSERT_TRUE(server.waitForRequests(1));
  EXPECT_EQ(server.requests()[0].path, "/post");
  const auto error = post(*immediate("ftp-like"), "{\"a\":1}");
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, -1);
}

TEST_F(HTTPSPostTest, FiftyRecordsOfAMethodStayBatchedAndTheFiftyFirstFlushesAll) {
  auto b = batching(server.url("/post"));
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
  // connections. Within a batch one sender's records are consecutive; put in
  // order by their first record, one sender's batches tile 0..kEach-1.
  std::vector<std::vector<std::pair<int, int>>> runs(kSenders);  // (first i, last i) per batch
  for (const auto& post : posts) {
    std::vector<std::pair<int, int>> run(kSenders, {-1, -1});
    const auto envelope = envelopeOf(post);
    for (const auto& record : envelope["events"]) {
      const int s = record["s"].get<int>();
      const int i = record["i"].get<int>();
      EXPECT_TRUE(run[s].second < 0 || i == run[s].second + 1) << "sender " << s << " out of order within a batch";
      run[s] = {run[s].first < 0 ? i : run[s].first, i};
    }
    for (int s = 0; s < kSenders; ++s) {
      if (run[s].first >= 0) {
        runs[s].push_back(run[s]);
      }
    }
  }
  for (int s = 0; s < kSenders; ++s) {
    std::sort(runs[s].begin(), runs[s].end());
    int next = 0;
    for (const auto& [first, last] : runs[s]) {
      EXPECT_EQ(first, next) << "sender " << s << ": a record lost or in two batches";
      next = last + 1;
    }
    EXPECT_EQ(next, kEach) << "sender " << s;
  }
}

TEST_F(HTTPSPostTest, FlushPostsTheBatchAndReportsWhyItCouldNot) {
  auto b = batching(server.url("/post"));
  EXPECT_FALSE(b->flushMessagesWithCompletion(nullptr));
  EXPECT_EQ(flush(*b).value_or(Error{}).description, "Nothing to flush");

  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
  EXPECT_GT(b->batchedEventsSize(), 0u);
  EXPECT_FALSE(flush(*b));
  ASSERT_EQ(server.requestCount(), 1u);
  EXPECT_EQ(envelopeOf(server.requests()[0])["events"].size(), 2u);
  EXPECT_EQ(b->batchedEventsSize(), 0u);

  // Every record filtered out by the event lists.
  auto blocked = batching(server.url("/post"), {{"event_blacklist", Array{Value(1)}}});
  blocked->sendMessage(clientEvent(4), at(1001), 1, 0, 0);
  EXPECT_EQ(flush(*blocked).value_or(Error{}).description,
            "Nothing to flush: batched events were completely filtered out");
  EXPECT_TRUE(logs.contains("flushMessagesWithCompletion: Dropping event with category 1 as it is blacklisted for backend httpsPost"));

  // A state other than enabled drops the batch.
  b->sendMessage(clientEvent(3), at(1001), 1, 0, 0);
  b->setState(kBackendStateUndecided);
  flush(*b);
  EXPECT_EQ(b->batchedEventCount(), 0u);
  EXPECT_EQ(server.requestCount(), 1u);
}

TEST_F(HTTPSPostTest, RealtimeEventWhileBatchedFlushesFirstAndFreezesTheState) {
  server.on("/now", Reply{});
  // Consent respected: printable copies.
  auto b = batching(server.url("/post"), {{"realtime_post_url", server.url("/now")}, {"override_dnu", nullptr}});
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
  ASSERT_TRUE(server.waitForRequestTo("/post"));
  ASSERT_TRUE(server.waitForRequestTo("/now"));
  EXPECT_TRUE(b->isImmutable());
  // Frozen: a storebag that now refuses does not change the state.
  b->setUserInfoDict(userInfo("nobody", "x"));
  b->updateState();
  EXPECT_EQ(b->state(), kBackendStateEnabled);
}

TEST_F(HTTPSPostTest, SampledOutBackendIsWokenByFlagTwoOrThreeButBatchesThatEvent) {
  for (int flag : {2, 3}) {
    auto b = immediate(server.url("/post"), {{"sampling_threshold", 0.0}, {"override_sampling", 1.0}});
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
  auto b = immediate(server.url("/post"));
  b->sendMessage(Value(Dictionary{}), at(1001), 0, 1, 1);
  ASSERT_TRUE(server.waitForRequests(1));
  const auto record = envelopeOf(server.requests()[0])["events"][0];
  EXPECT_EQ((std::tuple(record["Opt"], record["SamplingThreshold"], record["OverrideSampling"], record["Batch"])),
            (std::tuple(2, 1.0, -1, 0)));
}

TEST_F(HTTPSPostTest, SlowCollectorNeverHoldsUpTheSender) {
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
    const auto error = post(*b, "{\"a\":1}");
    if (row.failed) {
      EXPECT_EQ(error.has_value(), *row.failed);
    }
    EXPECT_EQ(b->state(), kBackendStateEnabled);
  }
  EXPECT_TRUE(logs.contains("HTTPSPostBackend(postJsonMessage): post error: "));
  for (const WireCaptureServer* wire : {&selfSigned, &wrongHost}) {
    ASSERT_TRUE(wire->waitForConnections(1));  // the connection the client gave up
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
    const auto client = enablingClient("https://127.0.0.1:1/", {{"use_wifi_only", wifiOnly ? 1 : 0},
                                                                {"client", "demo,com.velmar.lumira"},
                                                                {"service", "cli,haptics"}});
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

TEST_F(HTTPSPostTest, DefaultsURLBeatsTheStorebagAndTheRealtimeURLFollowsIt) {
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
  EXPECT_TRUE(logs.contains("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '" +
                            server.url("/from-defaults") + "'"));
}

TEST_F(HTTPSPostTest, CorrelatedSessionIDRewritesTheBatch) {
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

// --- Counts ----------------------------------------------------------------------------------

TEST_F(HTTPSPostTest, BatchedEventsAreSentOrDroppedByTheEventListsAtTheFlush) {
  auto b = batching(server.url("/post"),
                    {{"event_whitelist", Array{Value(1), Value(2)}}, {"event_blacklist", Array{Value(2)}}});
  ASSERT_EQ(b->state(), kBackendStateEnabled);
  for (const std::uint16_t category : {1, 2, 3, 1}) {
    b->sendMessage(clientEvent(category), at(1001), category, 0, 0);
  }
  expectOnly(b->counters(), {{BackendCount::batched, 4}, {BackendCount::inBatch, 4}});
  ASSERT_FALSE(flush(*b));
  EXPECT_EQ(envelopeOf(server.requests()[0])["events"].size(), 2u);
  // A realtime event passes the batch and goes at once; its answer is
  // counted on the transport's queue (a bounded wait for it).
  b->sendMessage(clientEvent(9), at(1002), 1, 0, 1);
  ASSERT_TRUE(server.waitForRequests(2));
  for (int i = 0; i < 10000 && b->counters().get(BackendCount::delivered) < 3; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  expectOnly(b->counters(), {{BackendCount::batched, 4},
                  {BackendCount::sent, 3},
                  {BackendCount::delivered, 3},
                  {BackendCount::droppedFiltered, 1},
                  {BackendCount::droppedBlacklisted, 1}});
}

TEST_F(HTTPSPostTest, EventsThatMayNotGoCountTheReasonThatKeptThem) {
  struct Case {
    const char* what;
    Dictionary change;
    bool withUserInfo;
    std::int32_t state;
    BackendCount reason;
    bool batchedFirst;
  };
  const Case cases[] = {
      // The draw is never below 0: sampled out, batched, dropped at the flush.
      {"sampled out", {{"sampling_threshold", 0.0}}, true, kBackendStateSampledOut, BackendCount::droppedSampledOut,
       true},
      // At or above the override threshold the draw disables the backend.
      {"disabled by the draw", {{"sampling_threshold", 0.0}, {"override_sampling", 0.0}}, true, kBackendStateDisabled,
       BackendCount::droppedSampledOut, false},
      {"disabled by the locale rule", {{"locale_whitelist", Array{Value("FR")}}}, true, kBackendStateDisabled,
       BackendCount::droppedDisabled, false},
      {"undecided without user info", {}, false, kBackendStateUndecided, BackendCount::droppedDisabled, true},
      {"no post URL", {{"post_url", nullptr}}, true, kBackendStateEnabled, BackendCount::droppedDisabled, false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    const Value info = c.withUserInfo ? userInfo() : Value();
    auto b = backend(profileWith({enablingClient(server.url("/post"), c.change)}), info);
    ASSERT_EQ(b->state(), c.state);
    b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
    b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
    flush(*b);
    expectOnly(b->counters(), {{BackendCount::batched, c.batchedFirst ? 2u : 0u}, {c.reason, 2}});
  }
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(HTTPSPostTest, ServerErrorDisablesTheBackendAndLaterEventsStopAtOnce) {
  server.on("/post", Reply{.status = 503});
  auto now = immediate(server.url("/post"));
  now->sendMessage(clientEvent(1), at(1001), 1, 0, 1);
  ASSERT_TRUE(logs.waitFor("postJSONMessage: backend httpsPost disabled by server 503 return code"));
  EXPECT_EQ(now->state(), kBackendStateDisabled);
  EXPECT_FALSE(now->sendMessage(clientEvent(2), at(1001), 1, 0, 1));

  // The error reaches a flush's completion with the status as its code.
  auto b = batching(server.url("/post"));
  b->sendMessage(clientEvent(3), at(1001), 1, 0, 0);
  const auto error = flush(*b);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, 503);
  EXPECT_EQ(error->description, "backend httpsPost disabled by server 503 return code");
  ASSERT_EQ(b->state(), kBackendStateDisabled);
  b->sendMessage(clientEvent(4), at(1001), 1, 0, 0);
  // The refused batch is gone (no spool): lost to the answer.
  expectOnly(b->counters(), {{BackendCount::batched, 1},
                  {BackendCount::sent, 1},
                  {BackendCount::droppedTransportError, 1},
                  {BackendCount::droppedDisabled, 1}});
  EXPECT_EQ(server.requestCount(), 2u);
}

// Without a transport the post is dropped, counted, and its completion
// never runs.
TEST_F(HTTPSPostTest, AGoneTransportSendsNothingAndCountsTheDrop) {
  auto orphan = immediate(server.url("/post"));
  orphan->setReportingSessionConnectivityDelegate({});
  auto results = ResultLog::make();
  orphan->postJSONMessage("{}", 0, std::nullopt, std::nullopt, results->handler());
  orphan->sendMessage(clientEvent(3), at(1001), 1, 0, 0);
  expectOnly(orphan->counters(), {{BackendCount::droppedTransportError, 1}});
  EXPECT_TRUE(results->errors().empty());
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(HTTPSPostTest, BatchStillHeldWhenTheBackendGoesIsCountedAsDropped) {
  auto b = batching(server.url("/post"));
  ASSERT_EQ(b->state(), kBackendStateEnabled);
  // User info taken away again: the batch may not be flushed, and stays.
  b->setUserInfoDict(Value());
  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
  EXPECT_EQ(flush(*b).value_or(Error{}).description, "Can not flush: userInfo is required");
  EXPECT_EQ(b->batchedEventCount(), 2u);
  const auto counters = b->sharedCounters();
  b.reset();
  expectOnly(*counters, {{BackendCount::batched, 2}, {BackendCount::droppedDisabled, 2}});
}

// Envelopes of `n` records whose text looks like JSON structure.
std::vector<Dictionary> records(int n) {
  std::vector<Dictionary> out;
  for (int i = 0; i < n; ++i) {
    out.push_back(Dictionary{{"n", i}, {"text", "{\"not\":[a record]}"}});
  }
  return out;
}

TEST_F(HTTPSPostTest, RecordsCarryADistinctIDOnlyWithTheKey) {
  auto without = batching(server.url("/post"));
  auto envelope = nlohmann::ordered_json::parse(*without->createMessageForPostAndLogging(records(3), nullptr));
  for (const auto& record : envelope["events"]) {
    EXPECT_FALSE(record.contains("_recordID")) << record;
  }
  Defaults("com.velmar.zerith").setObject("spoolEnabled", Value(true));
  auto with = batching(server.url("/post"));
  std::set<std::string> ids;
  for (int round = 0; round < 2; ++round) {
    envelope = nlohmann::ordered_json::parse(*with->createMessageForPostAndLogging(records(3), nullptr));
    for (const auto& record : envelope["events"]) {
      const std::string id = record.value("_recordID", std::string());
      EXPECT_EQ(id.size(), 32u) << record;
      EXPECT_EQ(id.find_first_not_of("0123456789abcdef"), std::string::npos) << id;
      EXPECT_TRUE(ids.insert(id).second) << id;
    }
  }
  EXPECT_EQ(ids.size(), 6u);
}

}  // namespace
}  // namespace zerith::test
