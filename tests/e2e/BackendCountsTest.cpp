// What became of a session's events, end to end: a real client sends events
// that one HTTPS backend posts, filters out and refuses by its blacklist and
// that a sampled-out second backend drops; the collector reads the counts in
// the session's final report, and `zerith status` reads the totals of the
// ended session from the daemon (and is refused without its entitlement).

#include <filesystem>
#include <sstream>

#include "config/StorebagSigner.h"
#include "ipc/DaemonStatus.h"
#include "tests/e2e/E2eFixture.h"
#include "tests/support/CollectorProcess.h"
#include "tools/zerith/ZerithCli.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;

class BackendCountsTest : public E2eTest {
 protected:
  // The session entitlement, and the status one when `status` is set.
  void entitle(bool status) {
    Dictionary entitlements{{"com.velmar.private.zerithd", true}};
    if (status) {
      entitlements.set(ipc::kDaemonStatusEntitlement, true);
    }
    const Value policy(Dictionary{{"users", Value(Array{Value(static_cast<unsigned long long>(::getuid()))})},
                                  {"entitlements", Value(std::move(entitlements))}});
    root.write("/etc/zerithd/entitlements.d/test.plist", plist::encodeXml(policy));
  }

  void startAll() {
    entitle(false);
    const fs::path certs = root.path() / "collector/certs";
    const fs::path www = root.path() / "collector/www";
    collector = std::make_unique<CollectorProcess>(
        ZERITH_COLLECTOR_TOOL,
        std::vector<std::string>{"--generate-cert", certs.string(), "--serve", www.string(), "--status", "200"});
    ASSERT_GT(collector->port(), 0) << collector->said();

    Dictionary posting{{"client", "demo"},
                       {"service", "cli"},
                       {"override_dnu", 1},
                       {"locale_whitelist", Array{Value("GB")}},
                       {"filters", Array{Value(Dictionary{{"key", "none"}, {"action", "keep"}})}},
                       {"sampling_threshold", 1.0},
                       {"event_whitelist", Array{Value(0), Value(3), Value(6)}},
                       {"event_blacklist", Array{Value(6)}},
                       {"post_url", collector->url("/post")}};
    // No draw is below 0: this one is sampled out and batches what it gets.
    Dictionary sampled = posting;
    sampled.set("sampling_threshold", 0.0);
    sampled.erase("event_whitelist");
    sampled.erase("event_blacklist");
    const Value section(Dictionary{{"httpsPost", Dictionary{{"clients", Array{Value(posting)}}}},
                                   {"httpsPost2", Dictionary{{"clients", Array{Value(sampled)}}}}});
    const Value bag(Dictionary{{"version", "8.1.0"}, {"seed", section}, {"release", section}});
    publishSignedStorebag(bag, www, collector->url("/zerith"));
    startDaemon(collectorDaemonOptions(certs));
  }

  struct Run {
    int status;
    std::string out;
    std::string err;
  };
  Run zerithStatus(bool json) {
    const std::string rootPath = root.path().string();
    std::vector<const char*> argv = {"zerith", "--root", rootPath.c_str(), "status"};
    if (json) {
      argv.push_back("--json");
    }
    std::ostringstream out;
    std::ostringstream err;
    const int status = cli::run(static_cast<int>(argv.size()), argv.data(), out, err);
    return {status, out.str(), err.str()};
  }

  static Value event(int category) {
    return Value(Dictionary{{kZerithMessageParametersCategory, Value(category)},
                            {kZerithMessageParametersType, Value(1)},
                            {kZerithMessageParametersPayload, Value(Dictionary{{"n", category}})}});
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
      ASSERT_TRUE(client->sendMessage(event(category), 10s));
    }
    client->flushMessages(10s);  // the sampled-out batch goes
    ASSERT_TRUE(client->finishSession(10s));
  }
  // The transaction ends once the ended session has handed over its counts.
  ASSERT_TRUE(daemon->waitFor(kTransactionEnded)) << daemon->output();

  std::optional<nlohmann::ordered_json> report;
  while (!report) {
    const auto line = collector->nextLine("record");
    ASSERT_TRUE(line) << daemon->output();
    if ((*line)["record"]["_method"] == 0 && (*line)["record"]["_status"] == 1) {
      report = (*line)["record"];
    }
  }
  // As the report was made: the start message and category 3 posted, 5 and
  // 6 refused by the lists; the second backend's four events (start, 3, 5,
  // 6) batched and dropped at the flush.
  EXPECT_EQ((*report)["BackendCounts_httpsPost_sent"], 2);
  EXPECT_EQ((*report)["BackendCounts_httpsPost_droppedFiltered"], 1);
  EXPECT_EQ((*report)["BackendCounts_httpsPost_droppedBlacklisted"], 1);
  EXPECT_EQ((*report)["BackendCounts_httpsPost2_batched"], 4);
  EXPECT_EQ((*report)["BackendCounts_httpsPost2_droppedSampledOut"], 4);
  EXPECT_FALSE(report->contains("BackendCounts_httpsPost_batched"));
  EXPECT_EQ((*report)["GracefulTermination"], true);
  EXPECT_TRUE(report->contains("SessionsCount_YJ"));

  // Without its own entitlement the status is refused, the connection kept.
  const Run refused = zerithStatus(true);
  EXPECT_EQ(refused.status, cli::kExitRefused) << refused.err;
  EXPECT_NE(refused.err.find(ipc::kDaemonStatusEntitlement), std::string::npos) << refused.err;
  EXPECT_TRUE(daemon->waitFor("refusing the status to")) << daemon->output();

  entitle(true);
  const Run json = zerithStatus(true);
  ASSERT_EQ(json.status, 0) << json.err;
  const auto parsed = nlohmann::ordered_json::parse(json.out);
  // The asking connection is not listed; the refused one may still be, on
  // its way out, without backends.
  for (const auto& live : parsed["sessions"]) {
    EXPECT_TRUE(live["backends"].empty()) << json.out;
  }
  ASSERT_EQ(parsed["ended"].size(), 2u) << json.out;
  const auto& posting = parsed["ended"][0];
  EXPECT_EQ(posting["clientType"], 7);
  EXPECT_EQ(posting["backend"], "httpsPost");
  EXPECT_EQ(posting["sessions"], 1);
  // Now with the final report itself, posted, and its end-of-session flush.
  EXPECT_EQ(posting["counts"]["sent"], 3);
  EXPECT_EQ(posting["counts"]["droppedFiltered"], 1);
  EXPECT_EQ(posting["counts"]["droppedBlacklisted"], 1);
  EXPECT_EQ(posting["counts"]["droppedSampledOut"], 0);
  const auto& sampled = parsed["ended"][1];
  EXPECT_EQ(sampled["backend"], "httpsPost2");
  EXPECT_EQ(sampled["counts"]["batched"], 5);
  EXPECT_EQ(sampled["counts"]["droppedSampledOut"], 5);
  EXPECT_EQ(sampled["counts"]["sent"], 0);

  const Run table = zerithStatus(false);
  ASSERT_EQ(table.status, 0) << table.err;
  EXPECT_NE(table.out.find("Ended sessions, totals by client type and backend:"), std::string::npos) << table.out;
  EXPECT_NE(table.out.find("sampledOut 5"), std::string::npos) << table.out;
  EXPECT_NE(table.out.find("filtered 1, blacklisted 1"), std::string::npos) << table.out;
}

}  // namespace
}  // namespace zerith::test
