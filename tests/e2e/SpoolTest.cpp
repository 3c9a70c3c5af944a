// The spool end to end: the real daemon posting client events to the real
// collector, which closes connections, stalls, answers 503 and then
// recovers. With "spoolEnabled" every event sent while it failed arrives
// exactly once by record ID after it recovers, also when the daemon was
// killed (SIGKILL) and started again; limits drop the oldest batches first
// and say how many records they dropped; bad spool files are moved aside.
// Without the key a failed batch is gone.

#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <sstream>

#include "ipc/DaemonStatus.h"
#include "tests/e2e/BehavingCollector.h"
#include "tools/zerith/ZerithCli.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;
using Json = nlohmann::ordered_json;

class HTTPSSpoolTest : public BehavingCollectorTest {
 protected:
  // Events wait for the flush: one post per batch.
  void startAll(const Dictionary& keys) {
    BehavingCollectorTest::startAll(keys, Dictionary{{"expedite", 0}, {"event_threshold", 100}});
  }

  std::unique_ptr<Zerith> startSession(std::uint32_t sessionID) {
    ZerithReply started;
    const std::size_t before = reader->recordsTaken();
    auto client = startDemoSession(sessionID, &started);
    if (!client) {
      return nullptr;
    }
    EXPECT_EQ(started["backends"], Value(Array{Value("httpsPost")})) << daemon->output();
    // The session's start record goes out while the collector answers, so
    // that every later batch holds only the test's events.
    EXPECT_TRUE(client->flushMessages(10s));
    EXPECT_TRUE(reader->waitForRecords(before + 1, 10s)) << daemon->output();
    return client;
  }

  // Events numbered [first, first + count) as one batch, posted by a flush.
  void sendBatch(Zerith& client, int first, int count) {
    for (int n = first; n < first + count; ++n) {
      ASSERT_TRUE(client.sendMessage(numbered(n, 200), 10s));
    }
    ASSERT_TRUE(client.flushMessages(10s));
  }

  // What the collector took of events [first, last]: record IDs by event
  // number, once all arrived or `timeout` passed.
  std::map<int, std::set<std::string>> taken(int first, int last, std::chrono::seconds timeout = 30s) {
    std::set<int> wanted;
    for (int n = first; n <= last; ++n) {
      wanted.insert(n);
    }
    reader->waitFor(wanted, timeout);
    return reader->idsByNumber();
  }

  fs::path spoolFolder() const { return root.path() / "var/lib/zerithd/spool"; }
};

TEST_F(HTTPSSpoolTest, EventsSentWhileTheCollectorClosesStallsAndFailsArriveOnceAfterItRecovers) {
  startAll(spoolOn());
  auto client = startSession(501);
  ASSERT_TRUE(client);

  behave("close");
  sendBatch(*client, 1, 5);
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 1)) << daemon->output();
  behave("stall 300");
  sendBatch(*client, 6, 5);
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 2)) << daemon->output();
  behave("status 503");
  sendBatch(*client, 11, 5);
  // The 503 still disables the backend; its batch is kept all the same.
  ASSERT_TRUE(daemon->waitFor("postJSONMessage: backend httpsPost disabled by server 503 return code"))
      << daemon->output();
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 3)) << daemon->output();
  struct stat st {};
  ASSERT_EQ(::stat(spoolFolder().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);

  behave("answer");
  const auto ids15 = taken(1, 15);
  for (int n = 1; n <= 15; ++n) {
    ASSERT_EQ(ids15.count(n), 1u) << "event " << n << " never arrived\n" << daemon->output();
    const auto& ids = ids15.at(n);
    EXPECT_EQ(ids.size(), 1u) << "event " << n;
    EXPECT_EQ(ids.begin()->size(), 32u) << *ids.begin();
  }
  ASSERT_TRUE(daemon->waitFor("Spool: empty")) << daemon->output();
  EXPECT_EQ(daemon->count("Spool: delivered batch"), 3u);
  client->finishSession(10s);
}

TEST_F(HTTPSSpoolTest, BatchesKeptAfterTheirSessionEndedCountInTheEndedTotals) {
  startAll(spoolOn());
  auto client = startSession(505);
  ASSERT_TRUE(client);
  behave("close");
  sendBatch(*client, 1, 5);
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 1)) << daemon->output();
  // The final report's batch fails too, and its answer comes when the
  // session and its backend may be gone.
  client->finishSession(10s);
  client.reset();
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 2)) << daemon->output();
  behave("answer");
  ASSERT_TRUE(daemon->waitFor("Spool: empty")) << daemon->output();

  const Value policy(Dictionary{
      {"users", Value(Array{Value(static_cast<unsigned long long>(::getuid()))})},
      {"entitlements", Value(Dictionary{{"com.velmar.private.zerithd", true}, {ipc::kDaemonStatusEntitlement, true}})}});
  root.write("/etc/zerithd/entitlements.d/test.plist", plist::encodeXml(policy));
  const std::string rootPath = root.path().string();
  std::vector<const char*> argv = {"zerith", "--root", rootPath.c_str(), "status", "--json"};
  std::ostringstream out;
  std::ostringstream err;
  ASSERT_EQ(cli::run(static_cast<int>(argv.size()), argv.data(), out, err), 0) << err.str();
  const auto status = Json::parse(out.str());
  ASSERT_EQ(status["ended"].size(), 1u) << out.str();
  const auto& counts = status["ended"][0]["counts"];
  // Every batch is written ahead: the start record went through at once,
  // the five events and the final report failed, were posted again and
  // delivered.
  EXPECT_GE(counts.value("spooled", 0), 7) << out.str();
  EXPECT_EQ(counts.value("delivered", 0), counts.value("spooled", 0)) << out.str();
  EXPECT_EQ(counts.value("retried", 0), counts.value("spooled", 0) - 1) << out.str();
  EXPECT_EQ(counts.value("inSpool", 0), 0) << out.str();
  EXPECT_EQ(counts.value("droppedTransportError", 0), 0) << out.str();
}

TEST_F(HTTPSSpoolTest, SpooledBatchesSurviveAKillAndBadFilesAreMovedAside) {
  startAll(spoolOn());
  auto client = startSession(502);
  ASSERT_TRUE(client);
  behave("close");
  sendBatch(*client, 1, 5);
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 1)) << daemon->output();
  sendBatch(*client, 6, 5);
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 2)) << daemon->output();
  // The third batch may be anywhere between the failed post and the rename
  // when the kill comes.
  sendBatch(*client, 11, 5);
  daemon->signal(SIGKILL);
  ASSERT_TRUE(daemon->waitForExit(10s));
  client.reset();

  // Left behind by other versions, a cut copy and a crash mid-write.
  const fs::path folder = spoolFolder();
  std::vector<fs::path> files;
  for (const auto& entry : fs::directory_iterator(folder)) {
    if (entry.path().extension() == ".zspool") {
      files.push_back(entry.path());
    }
  }
  ASSERT_GE(files.size(), 2u);
  std::string bytes;
  {
    std::ifstream in(files.front(), std::ios::binary);
    bytes.assign((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  }
  const auto plant = [&](const std::string& name, const std::string& contents) {
    std::ofstream(folder / name, std::ios::binary) << contents;
  };
  std::string otherVersion = bytes;
  otherVersion[8] = 7;
  plant("0000000000000001-00000000.zspool", otherVersion);
  plant("0000000000000002-00000000.zspool", bytes.substr(0, bytes.size() / 2));
  std::string corrupt = bytes;
  corrupt[bytes.size() - 3] ^= 0x55;
  plant("0000000000000003-00000000.zspool", corrupt);
  plant(".tmp-0000000000000004-00000000.zspool.XyZ123", bytes.substr(0, 40));

  behave("answer");
  daemon.reset();
  startDaemon(daemonOptions());
  ASSERT_TRUE(daemon->waitFor("Spool: empty", 1, 20s)) << daemon->output();

  const auto ids = taken(1, 10);
  for (int n = 1; n <= 10; ++n) {
    ASSERT_EQ(ids.count(n), 1u) << "event " << n << " lost\n" << daemon->output();
    EXPECT_EQ(ids.at(n).size(), 1u) << "event " << n;
  }
  // The batch the kill may have cut arrives whole or not at all.
  std::size_t third = 0;
  for (int n = 11; n <= 15; ++n) {
    third += ids.count(n);
  }
  EXPECT_TRUE(third == 0 || third == 5) << third;

  EXPECT_EQ(daemon->count("Spool: moved"), 3u) << daemon->output();
  EXPECT_TRUE(daemon->waitFor("format version 7 (this daemon reads 1)"));
  EXPECT_TRUE(daemon->waitFor("checksum mismatch"));
  EXPECT_TRUE(daemon->waitFor("truncated"));
  // The planted one, and perhaps the kill's own.
  EXPECT_GE(daemon->count("a write that did not finish"), 1u);
  std::set<std::string> bad;
  for (const auto& entry : fs::directory_iterator(folder / "bad")) {
    bad.insert(entry.path().filename().string());
  }
  EXPECT_EQ(bad, (std::set<std::string>{"0000000000000001-00000000.zspool", "0000000000000002-00000000.zspool",
                                        "0000000000000003-00000000.zspool"}));
  EXPECT_TRUE(daemon->running());
}

TEST_F(HTTPSSpoolTest, TheSizeLimitDropsTheOldestBatchesAndCountsThem) {
  Dictionary keys = spoolOn();
  keys.set("spoolMaxBytes", Value(4096));
  startAll(keys);
  auto client = startSession(503);
  ASSERT_TRUE(client);
  behave("close");
  for (int batch = 0; batch < 8; ++batch) {
    sendBatch(*client, batch * 5 + 1, 5);
    ASSERT_TRUE(daemon->waitFor("Spool: kept batch", static_cast<std::size_t>(batch) + 1)) << daemon->output();
  }
  ASSERT_GE(daemon->count("Spool: dropped the oldest batch"), 1u) << daemon->output();
  const std::size_t droppedBatches = daemon->count("Spool: dropped the oldest batch");
  const std::string lastCount = fmt::format("; {} records dropped so far", droppedBatches * 5);
  EXPECT_TRUE(daemon->waitFor(lastCount)) << daemon->output();

  behave("answer");
  ASSERT_TRUE(daemon->waitFor("Spool: empty", 1, 20s)) << daemon->output();
  const int firstKept = static_cast<int>(droppedBatches) * 5 + 1;
  const auto ids = taken(firstKept, 40);
  for (int n = 1; n <= 40; ++n) {
    // The oldest batches went first; every later one arrived once.
    EXPECT_EQ(ids.count(n), n >= firstKept ? 1u : 0u) << "event " << n;
  }
  client->finishSession(10s);
}

TEST_F(HTTPSSpoolTest, TheAgeLimitDropsBatchesBeforeTheirRetry) {
  Dictionary keys = spoolOn();
  keys.set("spoolMaxAgeSeconds", Value(1));
  keys.set("spoolRetryInitialSeconds", Value(3));
  keys.set("spoolRetryMaxSeconds", Value(3));
  startAll(keys);
  auto client = startSession(504);
  ASSERT_TRUE(client);
  behave("close");
  sendBatch(*client, 1, 5);
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 1)) << daemon->output();
  behave("answer");
  ASSERT_TRUE(daemon->waitFor("older than 1 seconds; 5 records dropped so far")) << daemon->output();
  EXPECT_EQ(daemon->count("Spool: delivered batch"), 0u);
  EXPECT_TRUE(taken(1, 5, 2s).empty());
  client->finishSession(10s);
}

TEST_F(HTTPSSpoolTest, WithoutTheKeyAFailedBatchIsGoneAndRecordsCarryNoID) {
  startAll(Dictionary{});
  auto client = startSession(505);
  ASSERT_TRUE(client);
  behave("close");
  sendBatch(*client, 1, 5);
  ASSERT_TRUE(daemon->waitFor("HTTPSPostBackend(postJsonMessage): post error:")) << daemon->output();
  behave("answer");
  sendBatch(*client, 6, 1);
  const auto ids = taken(6, 6);
  ASSERT_EQ(ids.count(6), 1u) << daemon->output();
  EXPECT_EQ(*ids.at(6).begin(), "none");
  for (int n = 1; n <= 5; ++n) {
    EXPECT_EQ(ids.count(n), 0u) << "event " << n;
  }
  EXPECT_EQ(daemon->count("Spool:"), 0u);
  EXPECT_FALSE(fs::exists(spoolFolder()));
  client->finishSession(10s);
}

}  // namespace
}  // namespace zerith::test
