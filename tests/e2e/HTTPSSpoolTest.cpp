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

#include "config/StorebagSigner.h"
#include "ipc/DaemonStatus.h"
#include "tests/e2e/BehavingCollector.h"
#include "tests/e2e/E2eFixture.h"
#include "tests/support/CollectorProcess.h"
#include "tools/zerith/ZerithCli.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;
using Json = nlohmann::ordered_json;

class HTTPSSpoolTest : public E2eTest {
 protected:
  void startAll(Dictionary spoolKeys) {
    grant(Value(true));
    for (const auto& [key, value] : spoolKeys) {
      Defaults("com.velmar.zerith").setObject(key, value);
    }
    const fs::path www = root.path() / "collector/www";
    behaviourFile = root.path() / "collector/behaviour";
    collector = startBehavingCollector(root.path(), behaviourFile);
    ASSERT_GT(collector->port(), 0) << collector->said();

    // Events wait for the flush: one post per batch.
    const Value bag = collectorStorebag(collector->url("/post"), Dictionary{{"expedite", 0}, {"event_threshold", 100}});
    publishSignedStorebag(bag, www, collector->url("/zerith"));
    startDaemon(daemonOptions());
  }

  DaemonProcess::Options daemonOptions() const { return collectorDaemonOptions(root.path() / "collector/certs"); }

  static Dictionary spoolOn() {
    return Dictionary{{"spoolEnabled", true}, {"spoolRetryInitialSeconds", 0.2}, {"spoolRetryMaxSeconds", 1.0}};
  }

  void behave(const std::string& text) { ASSERT_TRUE(writeBehaviour(behaviourFile, text)); }

  std::unique_ptr<Zerith> startSession(std::uint32_t sessionID) {
    ZerithReply started;
    auto client = startDemoSession(sessionID, &started);
    if (!client) {
      return nullptr;
    }
    EXPECT_EQ(started["backends"], Value(Array{Value("httpsPost")})) << daemon->output();
    // The session's start record goes out while the collector answers, so
    // that every later batch holds only the test's events.
    EXPECT_TRUE(client->flushMessages(10s));
    EXPECT_TRUE(collector->nextLine("record")) << daemon->output();
    return client;
  }

  // Events numbered [first, first + count) as one batch, posted by a flush.
  void sendBatch(Zerith& client, int first, int count) {
    for (int n = first; n < first + count; ++n) {
      ASSERT_TRUE(client.sendMessage(
          Value(Dictionary{{kZerithMessageParametersCategory, Value(3)},
                           {kZerithMessageParametersType, Value(4)},
                           {kZerithMessageParametersPayload, Value(Dictionary{{"n", n}, {"pad", std::string(200, 'p')}})}}),
          10s));
    }
    ASSERT_TRUE(client.flushMessages(10s));
  }

  // What the collector took of our events: record ID by event number, every
  // ID seen per number, and the duplicates it dropped.
  struct Taken {
    std::map<int, std::set<std::string>> idsByNumber;
    std::size_t duplicates = 0;
  };
  // Reads records until every number in `wanted` was taken, or `quiet`
  // passes without a line.
  Taken readTaken(const std::set<int>& wanted, std::chrono::milliseconds quiet = 8s) {
    Taken taken;
    auto complete = [&] {
      return std::all_of(wanted.begin(), wanted.end(), [&](int n) { return taken.idsByNumber.count(n) != 0; });
    };
    while (!complete()) {
      const auto line = collector->nextLine({}, quiet);
      if (!line) {
        break;
      }
      absorb(*line, taken);
    }
    return taken;
  }
  static void absorb(const Json& line, Taken& taken) {
    const std::string kind = line.value("kind", "");
    if (kind == "duplicate") {
      ++taken.duplicates;
    }
    if (kind != "record" || line.value("status", 0) != 200 || line["record"].value("_method", 0) != 3) {
      return;
    }
    taken.idsByNumber[line["record"].value("n", -1)].insert(line["record"].value("_recordID", std::string("none")));
  }

  fs::path spoolFolder() const { return root.path() / "var/lib/zerithd/spool"; }

  std::unique_ptr<CollectorProcess> collector;
  fs::path behaviourFile;
};

std::set<int> range(int first, int last) {
  std::set<int> out;
  for (int n = first; n <= last; ++n) {
    out.insert(n);
  }
  return out;
}

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
  ASSERT_TRUE(daemon->waitFor("postJSONMessage: backend httpsPost disabled by server 503 return code")) << daemon->output();
  ASSERT_TRUE(daemon->waitFor("Spool: kept batch", 3)) << daemon->output();
  struct stat st {};
  ASSERT_EQ(::stat(spoolFolder().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);

  behave("answer");
  const Taken taken = readTaken(range(1, 15));
  for (int n = 1; n <= 15; ++n) {
    ASSERT_EQ(taken.idsByNumber.count(n), 1u) << "event " << n << " never arrived\n" << daemon->output();
    const auto& ids = taken.idsByNumber.at(n);
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

  const Taken taken = readTaken(range(1, 10));
  for (int n = 1; n <= 10; ++n) {
    ASSERT_EQ(taken.idsByNumber.count(n), 1u) << "event " << n << " lost\n" << daemon->output();
    EXPECT_EQ(taken.idsByNumber.at(n).size(), 1u) << "event " << n;
  }
  // The batch the kill may have cut arrives whole or not at all.
  std::size_t third = 0;
  for (int n = 11; n <= 15; ++n) {
    third += taken.idsByNumber.count(n);
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
  const Taken taken = readTaken(range(firstKept, 40));
  for (int n = 1; n <= 40; ++n) {
    // The oldest batches went first; every later one arrived once.
    EXPECT_EQ(taken.idsByNumber.count(n), n >= firstKept ? 1u : 0u) << "event " << n;
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
  const Taken taken = readTaken(range(1, 5), 2s);
  EXPECT_TRUE(taken.idsByNumber.empty());
  client->finishSession(10s);
}

TEST_F(HTTPSSpoolTest, WithoutTheKeyAFailedBatchIsGoneAndRecordsCarryNoID) {
  startAll({});
  auto client = startSession(505);
  ASSERT_TRUE(client);
  behave("close");
  sendBatch(*client, 1, 5);
  ASSERT_TRUE(daemon->waitFor("HTTPSPostBackend(postJsonMessage): post error:")) << daemon->output();
  behave("answer");
  sendBatch(*client, 6, 1);
  const Taken taken = readTaken(range(6, 6));
  ASSERT_EQ(taken.idsByNumber.count(6), 1u) << daemon->output();
  EXPECT_EQ(*taken.idsByNumber.at(6).begin(), "none");
  for (int n = 1; n <= 5; ++n) {
    EXPECT_EQ(taken.idsByNumber.count(n), 0u) << "event " << n;
  }
  EXPECT_EQ(daemon->count("Spool:"), 0u);
  EXPECT_FALSE(fs::exists(spoolFolder()));
  client->finishSession(10s);
}

}  // namespace
}  // namespace zerith::test
