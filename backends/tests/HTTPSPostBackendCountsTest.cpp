// What the HTTPS backend counts for each event: sent, batched, and dropped
// by the reason that decided it, against a real HTTPS server on loopback;
// and its side of the spool: record IDs only when "spoolEnabled" is on, and
// what the answer to a post counts (delivered, or lost when no spool keeps
// the batch). The spool itself: SpoolTest.cpp; the whole road with a failing
// collector: the e2e tests.

#include <chrono>
#include <set>
#include <thread>

#include "backends/tests/HTTPSPostBackendTestSupport.h"

namespace zerith::test {
namespace {

class HTTPSCountsTest : public HTTPSBackendTest {
 protected:

  // Every count but the ones named is 0.
  static void expectOnly(const ZerithBackend& b, std::initializer_list<std::pair<BackendCount, std::uint64_t>> wanted) {
    for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
      const auto kind = static_cast<BackendCount>(i);
      std::uint64_t expected = 0;
      for (const auto& [k, n] : wanted) {
        if (k == kind) {
          expected = n;
        }
      }
      EXPECT_EQ(b.counters().get(kind), expected) << backendCountName(kind);
    }
  }

  // The answer's count is made on the transport's queue once the post is
  // answered: wait for it (bounded) before the exact comparison.
  static bool waitForCount(const ZerithBackend& b, BackendCount kind, std::uint64_t n) {
    for (int i = 0; i < 10000 && b.counters().get(kind) < n; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return b.counters().get(kind) == n;
  }

  void flush(HTTPSPostBackend& b) {
    auto results = ResultLog::make();
    b.flushMessagesWithCompletion(results->handler());
    ASSERT_TRUE(results->waitFor(1));
  }
  std::shared_ptr<HTTPSPostBackend> enabled(const std::string& url) {
    return backend(profileWith({enablingClient(url)}), userInfo(), true, true);
  }
  static std::vector<Dictionary> records(int n) {
    std::vector<Dictionary> out;
    for (int i = 0; i < n; ++i) {
      out.push_back(Dictionary{{"n", i}, {"text", "{\"not\":[a record]}"}});
    }
    return out;
  }
  // Posts an envelope of `n` records and waits for its completion.
  void post(HTTPSPostBackend& b, int n) {
    const auto body = b.createMessageForPostAndLogging(records(n), nullptr);
    ASSERT_TRUE(body);
    auto results = ResultLog::make();
    b.postJSONMessage(*body, 0, std::nullopt, std::nullopt, results->handler());
    ASSERT_TRUE(results->waitFor(1));
  }
};

TEST_F(HTTPSCountsTest, BatchedEventsAreSentOrDroppedByTheEventListsAtTheFlush) {
  server.on("/post", Reply{});
  Dictionary client = enablingClient(server.url("/post"));
  client.set("event_whitelist", Array{Value(1), Value(2)});
  client.set("event_blacklist", Array{Value(2)});
  auto b = backend(profileWith({client}), userInfo(), true, true);
  ASSERT_EQ(b->state(), kBackendStateEnabled);
  for (const std::uint16_t category : {1, 2, 3, 1}) {
    b->sendMessage(clientEvent(category), at(1001), category, 0, 0);
  }
  expectOnly(*b, {{BackendCount::batched, 4}, {BackendCount::inBatch, 4}});
  flush(*b);
  ASSERT_TRUE(server.waitForRequests(1));
  EXPECT_EQ(envelopeOf(server.requests()[0])["events"].size(), 2u);
  // A realtime event passes the batch and goes at once.
  b->sendMessage(clientEvent(9), at(1002), 1, 0, 1);
  ASSERT_TRUE(server.waitForRequests(2));
  ASSERT_TRUE(waitForCount(*b, BackendCount::delivered, 3));
  expectOnly(*b, {{BackendCount::batched, 4},
                  {BackendCount::sent, 3},
                  {BackendCount::delivered, 3},
                  {BackendCount::droppedFiltered, 1},
                  {BackendCount::droppedBlacklisted, 1}});
}

TEST_F(HTTPSCountsTest, EventsThatMayNotGoCountTheReasonThatKeptThem) {
  server.on("/post", Reply{});
  struct Case {
    const char* what;
    Dictionary change;
    bool withUserInfo;
    bool withURL;
    std::int32_t state;
    BackendCount reason;
    bool batchedFirst;
  };
  const Case cases[] = {
      // The draw is never below 0: sampled out, batched, dropped at the flush.
      {"sampled out", {{"sampling_threshold", 0.0}}, true, true, kBackendStateSampledOut, BackendCount::droppedSampledOut, true},
      // At or above the override threshold the draw disables the backend.
      {"disabled by the draw", {{"sampling_threshold", 0.0}, {"override_sampling", 0.0}}, true, true,
       kBackendStateDisabled, BackendCount::droppedSampledOut, false},
      {"disabled by the locale rule", {{"locale_whitelist", Array{Value("FR")}}}, true, true, kBackendStateDisabled,
       BackendCount::droppedDisabled, false},
      {"undecided without user info", {}, false, true, kBackendStateUndecided, BackendCount::droppedDisabled, true},
      {"no post URL", {}, true, false, kBackendStateEnabled, BackendCount::droppedDisabled, false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    Dictionary client = enablingClient(server.url("/post"));
    for (const auto& [key, value] : c.change) {
      client.set(key, value);
    }
    if (!c.withURL) {
      client.erase("post_url");
    }
    auto b = backend(profileWith({client}), c.withUserInfo ? userInfo() : Value(), true, false);
    ASSERT_EQ(b->state(), c.state);
    b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
    b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
    flush(*b);
    if (c.batchedFirst) {
      expectOnly(*b, {{BackendCount::batched, 2}, {c.reason, 2}});
    } else {
      expectOnly(*b, {{c.reason, 2}});
    }
  }
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(HTTPSCountsTest, ServerRefusalAndAGoneTransportCountTheirDrops) {
  server.on("/post", Reply{.status = 503});
  auto b = backend(profileWith({enablingClient(server.url("/post"))}), userInfo(), true, true);
  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  flush(*b);  // answered 503: disabled by the server
  ASSERT_EQ(b->state(), kBackendStateDisabled);
  b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
  // The refused batch is gone (no spool): lost to the answer.
  expectOnly(*b, {{BackendCount::batched, 1},
                  {BackendCount::sent, 1},
                  {BackendCount::droppedTransportError, 1},
                  {BackendCount::droppedDisabled, 1}});

  auto orphan = backend(profileWith({enablingClient(server.url("/post"))}), userInfo(), true, false);
  orphan->setReportingSessionConnectivityDelegate({});
  orphan->sendMessage(clientEvent(3), at(1001), 1, 0, 0);
  expectOnly(*orphan, {{BackendCount::droppedTransportError, 1}});
  EXPECT_EQ(server.requestCount(), 1u);
}

TEST_F(HTTPSCountsTest, BatchStillHeldWhenTheBackendGoesIsCountedAsDropped) {
  auto b = backend(profileWith({enablingClient(server.url("/post"))}), userInfo(), true, true);
  ASSERT_EQ(b->state(), kBackendStateEnabled);
  // User info taken away again: the batch may not be flushed, and stays.
  b->setUserInfoDict(Value());
  b->sendMessage(clientEvent(1), at(1001), 1, 0, 0);
  b->sendMessage(clientEvent(2), at(1001), 1, 0, 0);
  flush(*b);
  EXPECT_EQ(b->batchedEventCount(), 2u);
  const auto counters = b->sharedCounters();
  b.reset();
  EXPECT_EQ(counters->get(BackendCount::batched), 2u);
  EXPECT_EQ(counters->get(BackendCount::droppedDisabled), 2u);
  EXPECT_EQ(counters->get(BackendCount::sent), 0u);
}

TEST_F(HTTPSCountsTest, RecordsCarryADistinctIDOnlyWithTheKey) {
  auto without = enabled(server.url("/post"));
  auto envelope = nlohmann::ordered_json::parse(*without->createMessageForPostAndLogging(records(3), nullptr));
  for (const auto& record : envelope["events"]) {
    EXPECT_FALSE(record.contains("_recordID")) << record;
  }

  Defaults("com.velmar.zerith").setObject("spoolEnabled", Value(true));
  auto with = enabled(server.url("/post"));
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

TEST_F(HTTPSCountsTest, AnswersCountDeliveredOrLostRecordsWithoutTheSpool) {
  server.on("/ok", Reply{.status = 200});
  server.on("/unavailable", Reply{.status = 503});
  server.on("/bad", Reply{.status = 400});

  auto ok = enabled(server.url("/ok"));
  post(*ok, 3);
  EXPECT_EQ(ok->counters().get(BackendCount::delivered), 3u);
  EXPECT_EQ(ok->counters().get(BackendCount::droppedTransportError), 0u);

  RefusingPort refusing;
  auto refused = enabled(refusing.url("/post"));
  post(*refused, 4);
  EXPECT_EQ(refused->counters().get(BackendCount::droppedTransportError), 4u);
  EXPECT_EQ(refused->counters().get(BackendCount::spooled), 0u);

  auto unavailable = enabled(server.url("/unavailable"));
  post(*unavailable, 2);
  EXPECT_EQ(unavailable->counters().get(BackendCount::droppedTransportError), 2u);
  EXPECT_EQ(unavailable->state(), kBackendStateDisabled);

  auto bad = enabled(server.url("/bad"));
  post(*bad, 5);
  EXPECT_EQ(bad->counters().get(BackendCount::droppedTransportError), 5u);
  EXPECT_EQ(bad->counters().get(BackendCount::delivered), 0u);
  EXPECT_EQ(bad->state(), kBackendStateEnabled);
  // No spool was asked for anything.
  EXPECT_FALSE(logs.contains("Spool:"));
}

}  // namespace
}  // namespace zerith::test
