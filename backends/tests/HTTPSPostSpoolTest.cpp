// The HTTPS backend's side of the spool: record IDs only when "spoolEnabled"
// is on, and what the answer to a post counts (delivered, or lost when no
// spool keeps the batch). The spool itself: SpoolTest.cpp; the whole road
// with a failing collector: the e2e tests.

#include <set>

#include "backends/tests/HTTPSPostBackendTestSupport.h"

namespace zerith::test {
namespace {

class HTTPSPostSpoolTest : public HTTPSBackendTest {
 protected:
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

TEST_F(HTTPSPostSpoolTest, RecordsCarryADistinctIDOnlyWithTheKey) {
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
      EXPECT_TRUE(ids.insert(id).second) << id;
    }
  }
  EXPECT_EQ(ids.size(), 6u);
}

TEST_F(HTTPSPostSpoolTest, AnswersCountDeliveredOrLostRecordsWithoutTheSpool) {
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
