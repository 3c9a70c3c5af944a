// The spool and the accounting of events end to end: the real daemon posts
// client events to the real collector (a process of its own), which closes
// connections, stalls, answers 503 and then recovers, reading its behaviour
// from a file before every request and dropping records it took before.
// With "spoolEnabled" every event sent while it failed arrives exactly once
// by record ID after it recovers, also when the daemon was killed (SIGKILL)
// and started again; the age limit drops batches and says how many records
// it dropped; bad spool files are moved aside. Without the key a failed
// batch is gone. Under a flood `zerith status` says of every event
// whether it was delivered, is still in the spool or was dropped and why.

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <iostream>
#include <map>
#include <random>
#include <set>
#include <span>
#include <thread>

#include "backends/BackendCounters.h"
#include "backends/Spool.h"
#include "tests/e2e/E2eFixture.h"
#include "tests/support/Command.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/URLSession.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;
using Json = nlohmann::ordered_json;

// The collector's lines, read on a thread of their own so that its output
// pipe never fills while a test floods: the records taken, and the record
// IDs of the numbered events (method 3, payload "n") by number.
class CollectorReader {
 public:
  explicit CollectorReader(CollectorProcess& collector)
      : thread_([this, &collector] {
          while (!stop_) {
            if (auto line = collector.nextLine({}, 200ms);
                line && line->value("kind", "") == "record" && line->value("status", 0) == 200) {
              std::lock_guard lock(mutex_);
              ++records_;
              const auto& record = (*line)["record"];
              if (record.value("_method", 0) == 3) {
                ids_[record.value("n", -1)].insert(record.value("_recordID", std::string("none")));
              }
            }
          }
        }) {}
  ~CollectorReader() {
    stop_ = true;
    thread_.join();
  }
  std::size_t recordsTaken() const {
    std::lock_guard lock(mutex_);
    return records_;
  }
  std::map<int, std::set<std::string>> idsByNumber() const {
    std::lock_guard lock(mutex_);
    return ids_;
  }
  // Waits (bounded) until `records` records were taken.
  bool waitForRecords(std::size_t records, std::chrono::seconds timeout) const {
    return waitUntil(timeout, [&] { return records_ >= records; });
  }
  // Waits (bounded) until every number in `wanted` was taken.
  bool waitFor(const std::set<int>& wanted, std::chrono::seconds timeout) const {
    return waitUntil(timeout,
                     [&] { return std::all_of(wanted.begin(), wanted.end(), [&](int n) { return ids_.count(n); }); });
  }

 private:
  template <typename Done>
  bool waitUntil(std::chrono::seconds timeout, Done done) const {
    for (const auto deadline = std::chrono::steady_clock::now() + timeout; std::chrono::steady_clock::now() < deadline;
         std::this_thread::sleep_for(100ms)) {
      std::lock_guard lock(mutex_);
      if (done()) {
        return true;
      }
    }
    return false;
  }

  mutable std::mutex mutex_;
  std::size_t records_ = 0;
  std::map<int, std::set<std::string>> ids_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

// The behaving collector serving the signed collector storebag (posting to
// its "/post", `clientEntry` added to the demo client's entry), its reader,
// and the daemon trusting it; `keys` go into the daemon's defaults first.
class SpoolTest : public E2eTest {
 protected:
  void startAll(const Dictionary& keys, const Dictionary& clientEntry = {{"expedite", 0}, {"event_threshold", 100}},
                bool status = false) {
    grant(Value(true), status);
    for (const auto& [key, value] : keys) {
      Defaults("com.velmar.zerith").setObject(key, value);
    }
    behave("answer");
    collector = startCollector({"--serve", (root.path() / "collector/www").string(), "--behaviour-file",
                                behaviourFile.string(), "--drop-duplicates"});
    ASSERT_GT(collector->port(), 0);
    publishSignedStorebag(collectorStorebag(collector->url("/post"), clientEntry), root.path() / "collector/www",
                          collector->url("/zerith"));
    reader = std::make_unique<CollectorReader>(*collector);
    startDaemon(trusting(collectorCA()));
  }

  // Writes the collector's behaviour ("answer", "stall 300", "status 503", ...).
  void behave(const std::string& text) {
    fs::create_directories(behaviourFile.parent_path());
    ASSERT_TRUE(file::writeAtomically(
        behaviourFile, std::span<const std::uint8_t>(reinterpret_cast<const std::uint8_t*>(text.data()), text.size())));
  }

  // The spool on, retried after 0.2 s and then at most every second.
  static Dictionary spoolOn(Dictionary more = {}) {
    Dictionary keys{{"spoolEnabled", true}, {"spoolRetryInitialSeconds", 0.2}, {"spoolRetryMaxSeconds", 1.0}};
    for (const auto& [key, value] : more) {
      keys.set(key, value);
    }
    return keys;
  }

  // Event number `n` (category 3, type 4) padded with `pad` bytes.
  static Value numbered(int n, std::size_t pad) {
    return event(3, 4, Value(Dictionary{{"n", n}, {"pad", std::string(pad, 'p')}}));
  }

  // A demo session whose start record went out while the collector answered,
  // so that every later batch holds only the test's events.
  std::unique_ptr<Zerith> startSession(std::uint32_t sessionID) {
    ZerithReply started;
    const std::size_t before = reader->recordsTaken();
    auto client = startDemoSession(sessionID, &started);
    if (!client) {
      return nullptr;
    }
    EXPECT_EQ(started["backends"], Value(Array{Value("httpsPost")})) << daemon->output();
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
    reader->waitFor(numbers(first, last), timeout);
    return reader->idsByNumber();
  }
  static std::set<int> numbers(int first, int last) {
    std::set<int> all;
    for (int n = first; n <= last; ++n) {
      all.insert(n);
    }
    return all;
  }

  // Every event of `wanted` arrived under one record ID of 32 characters: its
  // batch was formed once, and its repeats were dropped.
  void expectEachOnce(const std::map<int, std::set<std::string>>& ids, const std::set<int>& wanted) const {
    for (const int n : wanted) {
      ASSERT_EQ(ids.count(n), 1u) << "event " << n << " lost\n" << daemon->output();
      EXPECT_EQ(ids.at(n).size(), 1u) << "event " << n;
      EXPECT_EQ(ids.at(n).begin()->size(), 32u) << *ids.at(n).begin();
    }
  }

  fs::path spoolFolder() const { return root.path() / "var/lib/zerithd/spool"; }

  fs::path behaviourFile = root.path() / "collector/behaviour";
  std::unique_ptr<CollectorProcess> collector;
  std::unique_ptr<CollectorReader> reader;
};

TEST_F(SpoolTest, EventsSentWhileTheCollectorClosesStallsAndFailsArriveOnceAfterItRecovers) {
  startAll(spoolOn());
  auto client = startSession(501);
  ASSERT_TRUE(client);
  int first = 1;
  for (const char* failure : {"close", "stall 300", "status 503"}) {
    behave(failure);
    sendBatch(*client, first, 5);
    first += 5;
    ASSERT_TRUE(daemon->waitFor("Spool: kept batch", static_cast<std::size_t>(first / 5))) << daemon->output();
  }
  // The 503 still disables the backend; its batch is kept all the same.
  EXPECT_TRUE(daemon->waitFor("postJSONMessage: backend httpsPost disabled by server 503 return code"));

  behave("answer");
  expectEachOnce(taken(1, 15), numbers(1, 15));
  ASSERT_TRUE(daemon->waitFor("Spool: empty")) << daemon->output();
  EXPECT_EQ(daemon->count("Spool: delivered batch"), 3u);
  client->finishSession(10s);
}

TEST_F(SpoolTest, SpooledBatchesSurviveAKillAndBadFilesAreMovedAside) {
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
  const std::string bytes = readText(files.front());
  const auto plant = [&](const std::string& name, std::string contents, std::size_t at = 0, char change = 0) {
    contents[at] = static_cast<char>(contents[at] ^ change);
    std::ofstream(folder / name, std::ios::binary) << contents;
  };
  plant("0000000000000001-00000000.zspool", bytes, 8, static_cast<char>(bytes[8] ^ 7));  // format version 7
  plant("0000000000000002-00000000.zspool", bytes.substr(0, bytes.size() / 2));
  plant("0000000000000003-00000000.zspool", bytes, bytes.size() - 3, 0x55);
  plant(".tmp-0000000000000004-00000000.zspool.XyZ123", bytes.substr(0, 40));

  behave("answer");
  daemon.reset();
  startDaemon(trusting(collectorCA()));
  ASSERT_TRUE(daemon->waitFor("Spool: empty", 1, 20s)) << daemon->output();

  const auto ids = taken(1, 10);
  expectEachOnce(ids, numbers(1, 10));
  // The batch the kill may have cut arrives whole or not at all. Its records
  // are read a line each, so once one is in, the rest are waited for.
  const auto third = [](const std::map<int, std::set<std::string>>& got) {
    return std::ranges::count_if(numbers(11, 15), [&](int n) { return got.contains(n); });
  };
  const auto arrived = third(ids) == 0 ? 0 : third(taken(11, 15, 10s));
  EXPECT_TRUE(arrived == 0 || arrived == 5) << arrived;

  // Each moved aside with its cause (the names under bad/ are the store's
  // own test's).
  EXPECT_EQ(daemon->count("Spool: moved"), 3u) << daemon->output();
  EXPECT_TRUE(daemon->waitFor("format version 7 (this daemon reads 1)"));
  EXPECT_TRUE(daemon->waitFor("checksum mismatch"));
  EXPECT_TRUE(daemon->waitFor("truncated"));
  // The planted one, and perhaps the kill's own.
  EXPECT_GE(daemon->count("a write that did not finish"), 1u);
  EXPECT_TRUE(daemon->running());
}

TEST_F(SpoolTest, TheAgeLimitDropsBatchesBeforeTheirRetry) {
  startAll(spoolOn(
      {{"spoolMaxAgeSeconds", Value(1)}, {"spoolRetryInitialSeconds", Value(3)}, {"spoolRetryMaxSeconds", Value(3)}}));
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

// Several clients flood a collector that stalls every post and then answers
// again: nothing is lost without a count.
class AccountingFloodTest : public SpoolTest, public ::testing::WithParamInterface<bool> {};

TEST_P(AccountingFloodTest, EveryAcceptedEventIsDeliveredSpooledOrDroppedWithAReason) {
  constexpr int kClients = 4;
  constexpr int kEvents = 250;
  const bool spool = GetParam();
  Dictionary keys = spool ? spoolOn() : Dictionary{};
  keys.set("postsInFlightPerBackend", 4);
  keys.set("postsWaitingPerBackend", 8);
  startAll(keys, {{"expedite", 0}, {"event_threshold", 9}}, /*status=*/true);

  std::vector<std::unique_ptr<Zerith>> clients;
  for (int c = 0; c < kClients; ++c) {
    clients.push_back(startDemoSession(static_cast<std::uint32_t>(700 + c)));
    ASSERT_TRUE(clients.back()) << daemon->output();
  }
  behave("stall 1500");
  std::atomic<int> sent{0};
  std::atomic<int> running{kClients};
  std::vector<std::thread> threads;
  for (int c = 0; c < kClients; ++c) {
    threads.emplace_back([&, c] {
      for (int i = 0; i < kEvents; ++i) {
        sent += clients[c]->sendMessage(numbered(c * kEvents + i, 300), 10s) ? 1 : 0;
      }
      --running;
    });
  }
  std::size_t peakDescriptors = 0;
  for (; running > 0; std::this_thread::sleep_for(20ms)) {
    peakDescriptors = std::max(peakDescriptors, procEntries(daemon->pid(), "fd"));
  }
  for (auto& t : threads) {
    t.join();
  }
  behave("answer");
  for (auto& client : clients) {
    client->flushMessages(10s);
    client->finishSession(10s);
  }
  clients.clear();
  EXPECT_EQ(sent, kClients * kEvents);

  // The ended sessions' totals once nothing is in a batch, in flight or in
  // the spool (bounded wait).
  Json counts;
  for (int i = 0; i < 600; ++i, std::this_thread::sleep_for(100ms)) {
    for (const auto& total : statusJson().value("ended", Json::array())) {
      if (total.value("backend", "") == "httpsPost" && total.value("sessions", 0u) == kClients) {
        counts = total["counts"];
      }
    }
    if (!counts.is_null() &&
        counts.value("inBatch", 0) + counts.value("inFlight", 0) + counts.value("inSpool", 0) == 0) {
      break;
    }
  }
  ASSERT_FALSE(counts.is_null()) << statusJson().dump();
  BackendCountsSnapshot snapshot{};
  for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
    snapshot[i] = counts.value(std::string(backendCountName(static_cast<BackendCount>(i))), 0ull);
  }
  const auto get = [&](BackendCount what) { return snapshot[static_cast<std::size_t>(what)]; };
  std::cout << "[ figures ] spool " << spool << ": peak descriptors " << peakDescriptors << ", " << counts.dump()
            << "\n";
  // Every event the client sent and its start and end records.
  EXPECT_GE(get(BackendCount::accepted), static_cast<std::uint64_t>(kClients * kEvents)) << counts;
  EXPECT_EQ(unaccounted(snapshot), 0) << counts;
  EXPECT_EQ(get(BackendCount::inBatch) + get(BackendCount::inFlight) + get(BackendCount::inSpool), 0u) << counts;
  // The collector took what was counted delivered.
  reader->waitForRecords(get(BackendCount::delivered), 10s);
  EXPECT_EQ(reader->recordsTaken(), get(BackendCount::delivered)) << counts;
  if (spool) {
    // What found no post slot or no answer waited in the spool.
    EXPECT_EQ(get(BackendCount::delivered), get(BackendCount::accepted)) << counts;
    EXPECT_GT(get(BackendCount::retried), 0u) << counts;
  } else {
    EXPECT_GT(get(BackendCount::droppedBusy), 0u) << counts;
    EXPECT_GT(get(BackendCount::droppedTransportError), 0u) << counts;
    EXPECT_TRUE(daemon->waitFor("posts in flight and waiting at their limits, no spool")) << daemon->output();
  }
  // A stalled collector holds no more than the limit's posts: their sockets
  // and body files, not one per batch.
  EXPECT_LT(peakDescriptors, 100u);
}

INSTANTIATE_TEST_SUITE_P(Spool, AccountingFloodTest, ::testing::Bool(),
                         [](const auto& info) { return info.param ? "SpoolOn" : "SpoolOff"; });

// The write-ahead spool under SIGKILL at random moments: every event whose
// send the daemon answered arrives, once, after restarts.
TEST_F(SpoolTest, AKillAtRandomMomentsLosesNoAnsweredEventAndDeliversEachOnce) {
  startAll(spoolOn(), {{"expedite", 1}});  // every event is a batch of its own
  std::mt19937 random(std::random_device{}());
  std::set<int> answered;
  constexpr int kRounds = 4;
  for (int round = 0, next = 0; round < kRounds; ++round, next += 5000) {
    if (round > 0) {
      behave("answer");
      startDaemon(trusting(collectorCA()));
    }
    auto client = startDemoSession(static_cast<std::uint32_t>(800 + round));
    ASSERT_TRUE(client) << daemon->output();
    // Posts answered, stalled or refused when the kill comes.
    behave(round % 2 == 0 ? "answer" : "stall 300");
    std::atomic<bool> stop{false};
    std::vector<int> acked;
    std::thread sender([&] {
      for (int n = next; n < next + 5000 && !stop && client->sendMessage(numbered(n, 300), 5s); ++n) {
        acked.push_back(n);
      }
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(std::uniform_int_distribution<int>(200, 1200)(random)));
    daemon->signal(SIGKILL);
    ASSERT_TRUE(daemon->waitForExit(10s));
    stop = true;
    sender.join();
    client.reset();
    answered.insert(acked.begin(), acked.end());
    daemon.reset();
  }
  behave("answer");
  startDaemon(trusting(collectorCA()));
  ASSERT_FALSE(answered.empty());
  EXPECT_TRUE(reader->waitFor(answered, 60s)) << daemon->output();
  expectEachOnce(reader->idsByNumber(), answered);
  std::cout << "[ figures ] " << answered.size() << " answered events over " << kRounds << " kills, all delivered\n";
}

// The spool written and read at once under load, without the daemon:
// writers keep batches (and write them ahead of posts that then fail) while
// the retry reads and posts them. A good file is never moved aside; every
// kept record is delivered once; a batch that the reader would refuse is
// never written.

// The collector is a process of its own, so that only this process runs
// short of descriptors.
TEST_F(SpoolTest, ConcurrentWritesAndReadsNeverMoveAGoodFile) {
  behave("status 503");
  collector = startCollector({"--behaviour-file", behaviourFile.string()});
  ASSERT_TRUE(URLSession::setExtraCAFile(collectorCA().string()));
  // Its lines are read all along, so that its output never fills.
  reader = std::make_unique<CollectorReader>(*collector);
  const SpoolConfig config{
      .enabled = true, .retryInitialSeconds = 0.02, .retryMaxSeconds = 0.1, .commitIntervalSeconds = 0.005};
  auto spool = Spool::create(
      root.path() / "spool", config,
      ReportingSessionConnectivityHelper::initWithDelegate(std::weak_ptr<ConnectivityHelperDelegate>(),
                                                           ReportingSessionConnectivityHelper::POSTRequestMode()));
  const auto request = [&](int writer, int n, std::size_t headerBytes) {
    URLRequest r;
    r.httpMethod = "POST";
    r.url = collector->url("/post");
    r.headers = {{"Content-Type", "application/json"}, {"X-Batch", std::string(headerBytes, 'h')}};
    const std::string body = R"({"events":[{"w":)" + std::to_string(writer) + R"(,"n":)" + std::to_string(n) + "}]}";
    r.body.assign(body.begin(), body.end());
    return r;
  };

  constexpr int kWriters = 4;
  constexpr int kBatches = 60;
  std::atomic<int> refusedAhead{0};
  std::vector<std::thread> writers;
  for (int w = 0; w < kWriters; ++w) {
    writers.emplace_back([&, w] {
      for (int n = 0; n < kBatches; ++n) {
        // Every tenth batch carries a header longer than the reader takes.
        const std::size_t header = n % 10 == 9 ? kSpoolMaxHeaderSize + 1 : 100;
        if (w % 2 == 0) {
          spool->keep(request(w, n, header), 1, nullptr);
          continue;
        }
        // Written ahead; its live post then fails.
        EXPECT_TRUE(spool->writeAhead(request(w, n, header), 1, nullptr, [&, spool](std::optional<std::string> name) {
          if (name) {
            spool->liveAnswered(*name, Spool::LiveAnswer::failed);
          } else {
            ++refusedAhead;
          }
        }));
      }
    });
  }
  for (auto& t : writers) {
    t.join();
  }
  behave("answer");
  const auto deadline = std::chrono::steady_clock::now() + 30s;
  while (spool->pendingBatches() > 0 && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(20ms);
  }
  spool->sync([] {});

  EXPECT_EQ(spool->pendingBatches(), 0u);
  EXPECT_FALSE(fs::exists(root.path() / "spool/bad")) << "a good file was moved aside";
  const auto& counts = spool->counters();
  const std::uint64_t oversize = kWriters * kBatches / 10;
  // The oversize batches were never written: refused ahead (posted live
  // instead) or dropped by keep; every other batch arrived.
  EXPECT_EQ(static_cast<std::uint64_t>(refusedAhead) + counts.get(BackendCount::droppedSpoolFull), oversize);
  EXPECT_EQ(counts.get(BackendCount::spooled), kWriters * kBatches - oversize);
  EXPECT_EQ(counts.get(BackendCount::delivered), counts.get(BackendCount::spooled));
  EXPECT_EQ(counts.get(BackendCount::inSpool), 0u);
}

}  // namespace
}  // namespace zerith::test
