// Nothing lost without a count: several clients flood a collector that
// stalls every post and then answers again; afterwards `zerith status` says
// of every event the backend accepted whether it was delivered, is still in
// the spool or was dropped and why, and the collector took what it says was
// delivered. Then the write-ahead spool under SIGKILL at random moments:
// every event whose send the daemon answered arrives, once, after restarts.

#include <dirent.h>
#include <fmt/format.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <iostream>
#include <random>
#include <set>
#include <thread>

#include "backends/BackendCounters.h"
#include "tests/e2e/BehavingCollector.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

using Json = nlohmann::ordered_json;

class AccountingTest : public BehavingCollectorTest {
 protected:
  // The ended sessions' totals of the HTTPS backend once nothing is in a
  // batch, in flight or in the spool (bounded wait).
  Json settledTotals(std::size_t sessions) {
    Json counts;
    for (int i = 0; i < 600; ++i) {
      for (const auto& total : statusJson().value("ended", Json::array())) {
        if (total.value("backend", "") == "httpsPost" && total.value("sessions", 0u) == sessions) {
          counts = total["counts"];
        }
      }
      if (!counts.is_null() && counts.value("inBatch", 0) == 0 && counts.value("inFlight", 0) == 0 &&
          counts.value("inSpool", 0) == 0) {
        return counts;
      }
      std::this_thread::sleep_for(100ms);
    }
    return counts;
  }

  static std::uint64_t openDescriptors(pid_t pid) {
    std::uint64_t n = 0;
    if (DIR* dir = ::opendir(fmt::format("/proc/{}/fd", pid).c_str())) {
      while (::readdir(dir)) {
        ++n;
      }
      ::closedir(dir);
    }
    return n;
  }
};

struct FloodRow {
  const char* name;
  bool spool;
};

class AccountingFloodTest : public AccountingTest, public ::testing::WithParamInterface<FloodRow> {};

TEST_P(AccountingFloodTest, EveryAcceptedEventIsDeliveredSpooledOrDroppedWithAReason) {
  constexpr int kClients = 4;
  constexpr int kEvents = 250;
  Dictionary keys = GetParam().spool ? spoolOn() : Dictionary{};
  keys.set("postsInFlightPerBackend", 4);
  keys.set("postsWaitingPerBackend", 8);
  startAll(keys, Dictionary{{"expedite", 0}, {"event_threshold", 9}},
           /*status=*/true);

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
        if (clients[c]->sendMessage(numbered(c * kEvents + i, 300), 10s)) {
          ++sent;
        }
      }
      --running;
    });
  }
  std::uint64_t peakDescriptors = 0;
  while (running > 0) {
    peakDescriptors = std::max(peakDescriptors, openDescriptors(daemon->pid()));
    std::this_thread::sleep_for(20ms);
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

  const Json counts = settledTotals(kClients);
  ASSERT_FALSE(counts.is_null()) << statusJson().dump();
  BackendCountsSnapshot snapshot{};
  for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
    snapshot[i] = counts.value(std::string(backendCountName(static_cast<BackendCount>(i))), 0ull);
  }
  const auto get = [&](BackendCount what) { return snapshot[static_cast<std::size_t>(what)]; };
  std::cout << "[ figures ] " << GetParam().name << ": peak descriptors " << peakDescriptors << ", " << counts.dump()
            << "\n";
  // Every event the client sent and its start and end records.
  EXPECT_GE(get(BackendCount::accepted), static_cast<std::uint64_t>(kClients * kEvents)) << counts;
  EXPECT_EQ(unaccounted(snapshot), 0) << counts;
  EXPECT_EQ(get(BackendCount::inBatch) + get(BackendCount::inFlight) + get(BackendCount::inSpool), 0u) << counts;
  // The collector took what was counted delivered.
  for (int i = 0; i < 100 && reader->recordsTaken() < get(BackendCount::delivered); ++i) {
    std::this_thread::sleep_for(100ms);
  }
  EXPECT_EQ(reader->recordsTaken(), get(BackendCount::delivered)) << counts;
  if (GetParam().spool) {
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

INSTANTIATE_TEST_SUITE_P(Spool, AccountingFloodTest,
                         ::testing::Values(FloodRow{"SpoolOn", true}, FloodRow{"SpoolOff", false}),
                         [](const ::testing::TestParamInfo<FloodRow>& info) { return std::string(info.param.name); });

TEST_F(AccountingTest, AKillAtRandomMomentsLosesNoAnsweredEventAndDeliversEachOnce) {
  startAll(spoolOn(), Dictionary{{"expedite", 1}});  // every event is a batch of its own
  std::mt19937 random(std::random_device{}());
  std::set<int> answered;
  int next = 0;
  constexpr int kRounds = 4;
  for (int round = 0; round < kRounds; ++round) {
    if (round > 0) {
      behave("answer");
      startDaemon(daemonOptions());
    }
    auto client = startDemoSession(static_cast<std::uint32_t>(800 + round));
    ASSERT_TRUE(client) << daemon->output();
    // Posts answered, stalled or refused when the kill comes.
    behave(round % 2 == 0 ? "answer" : "stall 300");
    std::atomic<bool> stop{false};
    std::vector<int> acked;
    std::thread sender([&] {
      for (int i = 0; i < 5000 && !stop; ++i) {
        const int n = next + i;
        if (!client->sendMessage(numbered(n, 300), 5s)) {
          return;
        }
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
    next += 5000;
    daemon.reset();
  }
  behave("answer");
  startDaemon(daemonOptions());
  ASSERT_FALSE(answered.empty());
  EXPECT_TRUE(reader->waitFor(answered, 60s)) << daemon->output();
  const auto ids = reader->idsByNumber();
  for (const int n : answered) {
    ASSERT_EQ(ids.count(n), 1u) << "event " << n << " lost\n" << daemon->output();
    // One record ID: the batch was formed once, and its repeats were dropped.
    EXPECT_EQ(ids.at(n).size(), 1u) << "event " << n;
  }
  std::cout << "[ figures ] " << answered.size() << " answered events over " << kRounds << " kills, all delivered\n";
}

}  // namespace
}  // namespace zerith::test
