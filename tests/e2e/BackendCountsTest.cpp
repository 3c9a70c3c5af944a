// What became of a session's events, end to end: a real client sends events
// that one HTTPS backend posts (the collector sees the record with the
// sender code, the session ID and the filtered payload), filters out and
// refuses by its blacklist and that a sampled-out second backend drops; the
// collector reads the counts in the session's final report, and `zerith
// status` reads the totals of the ended session from the daemon (and is
// refused without its entitlement).

#include <filesystem>

#include "backends/ZerithBackend.h"
#include "tests/e2e/E2eFixture.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;

class BackendCountsTest : public E2eTest {
 protected:
  void startAll() {
    const fs::path www = root.path() / "collector/www";
    collector = startCollector({"--serve", www.string(), "--status", "200"});
    ASSERT_GT(collector->port(), 0);
    // No draw is below 0: the second backend is sampled out and batches what it gets.
    Dictionary posting{{"event_whitelist", Array{Value(0), Value(3), Value(6)}}, {"event_blacklist", Array{Value(6)}}};
    Dictionary section = collectorStorebag(collector->url("/post"), posting)["seed"].dictCopy();
    section.set("httpsPost2", collectorStorebag(collector->url("/post"),
                                                Dictionary{{"sampling_threshold", 0.0}})["seed"]["httpsPost"]);
    publishSignedStorebag(storebag(Value(section)), www, collector->url("/zerith"));
    startDaemon(trusting(collectorCA()));
  }

  std::unique_ptr<CollectorProcess> collector;
};

TEST_F(BackendCountsTest, FinalReportAndStatusSayWhatBecameOfEveryEvent) {
  startAll();
  {
    ZerithReply started;
    auto client = startDemoSession(515, &started);
    ASSERT_TRUE(client) << daemon->output();
    ASSERT_TRUE(started) << daemon->output();
    EXPECT_EQ(started["backends"], Value(Array{Value("httpsPost"), Value("httpsPost2")})) << daemon->output();
    for (const int category : {3, 5, 6}) {  // posted, not whitelisted, blacklisted
      ASSERT_TRUE(
          client->sendMessage(event(category, 1, Value(Dictionary{{"n", category}, {"udid", "device-7"}})), 10s));
    }
    client->flushMessages(10s);  // the sampled-out batch goes
    ASSERT_TRUE(client->finishSession(10s));
  }
  // The transaction ends once the ended session has handed over its counts.
  ASSERT_TRUE(daemon->waitFor(kTransactionEnded)) << daemon->output();

  // The event's post and the report's post may reach the collector in
  // either order (each on a connection of its own).
  std::optional<nlohmann::ordered_json> report;
  std::optional<nlohmann::ordered_json> posted;
  while (!report || !posted) {
    const auto line = collector->nextLine("record");
    ASSERT_TRUE(line) << daemon->output();
    if ((*line)["record"]["_method"] == 0 && (*line)["record"]["_status"] == 1) {
      report = (*line)["record"];
    } else if ((*line)["record"]["_method"] == 3) {
      ASSERT_FALSE(posted) << "one event posted twice: " << *line;
      posted = *line;
    }
  }
  // The posted event arrived as a record with the sender code, the session
  // ID, the user info and its device identifier hashed by the filter.
  EXPECT_TRUE(hasMembers(
      *posted, R"({"_sender":"YJ","_sessionID":515,"path":"/post","record":{"clientName":"demo","_status":1,"n":3}})"));
  EXPECT_EQ((*posted)["record"]["udid"], ZerithBackend::convertIntoSHA256("device-7"));
  // As the report was made: the start message and category 3 posted, 5 and
  // 6 refused by the lists; the second backend's four events (start, 3, 5,
  // 6) batched and dropped at the flush.
  EXPECT_TRUE(hasMembers(*report, R"({"BackendCounts_httpsPost_sent":2,"BackendCounts_httpsPost_droppedFiltered":1,
      "BackendCounts_httpsPost_droppedBlacklisted":1,"BackendCounts_httpsPost2_batched":4,
      "BackendCounts_httpsPost2_droppedSampledOut":4,"GracefulTermination":true})"));
  EXPECT_FALSE(report->contains("BackendCounts_httpsPost_batched"));
  EXPECT_TRUE(report->contains("SessionsCount_YJ"));

  // Without its own entitlement the status is refused, the connection kept.
  const CliResult refused = zerith({"status", "--json"});
  EXPECT_EQ(refused.status, cli::kExitRefused) << refused.err;
  EXPECT_NE(refused.err.find(ipc::kDaemonStatusEntitlement), std::string::npos) << refused.err;
  EXPECT_TRUE(daemon->waitFor("refusing the status to")) << daemon->output();

  grant(Value(true), /*status=*/true);
  const auto parsed = statusJson();
  // The asking connection is not listed; the refused one may still be, on
  // its way out, without backends.
  for (const auto& live : parsed["sessions"]) {
    EXPECT_TRUE(live["backends"].empty()) << parsed;
  }
  ASSERT_EQ(parsed["ended"].size(), 2u) << parsed;
  // Now with the final report itself, posted, and its end-of-session flush.
  EXPECT_TRUE(hasMembers(parsed["ended"][0], R"({"clientType":7,"backend":"httpsPost","sessions":1,
      "counts":{"sent":3,"droppedFiltered":1,"droppedBlacklisted":1,"droppedSampledOut":0}})"));
  EXPECT_TRUE(hasMembers(parsed["ended"][1],
                         R"({"backend":"httpsPost2","counts":{"batched":5,"droppedSampledOut":5,"sent":0}})"));

  const CliResult table = zerith({"status"});
  ASSERT_EQ(table.status, 0) << table.err;
  EXPECT_NE(table.out.find("Ended sessions, totals by client type and backend:"), std::string::npos) << table.out;
  EXPECT_NE(table.out.find("sampledOut 5"), std::string::npos) << table.out;
  EXPECT_NE(table.out.find("filtered 1, blacklisted 1"), std::string::npos) << table.out;
}

}  // namespace
}  // namespace zerith::test
