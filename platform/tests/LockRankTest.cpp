#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <string>

#include "platform/LockRank.h"
#include "platform/SerialQueue.h"

namespace zerith {
namespace {

// Checked in every build, whatever NDEBUG says: the bookkeeping itself.
using Checked = RankedMutex<std::mutex, true>;

struct OrderCase {
  const char* name;
  LockRank first;
  LockRank second;
  bool caught;
};

class LockOrderTest : public ::testing::TestWithParam<OrderCase> {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_P(LockOrderTest, SecondLockIsCheckedAgainstTheFirst) {
  const OrderCase& c = GetParam();
  Checked first(c.first, "first");
  Checked second(c.second, "second");
  const auto takeBoth = [&] {
    std::lock_guard a(first);
    std::lock_guard b(second);
  };
  if (c.caught) {
    EXPECT_DEATH(takeBoth(), "lock order violated: second .* while holding first");
  } else {
    takeBoth();
    EXPECT_EQ(lockrank::heldCount(), 0u);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Ranks, LockOrderTest,
    ::testing::Values(OrderCase{"AgentThenKeepAlive", LockRank::Agent, LockRank::KeepAlive, false},
                      OrderCase{"KeepAliveThenAgent", LockRank::KeepAlive, LockRank::Agent, true},
                      OrderCase{"TwoOfOneRank", LockRank::SessionClass, LockRank::SessionClass, true}),
    [](const auto& info) { return std::string(info.param.name); });

TEST(LockRankTest, LocksLetGoOutOfOrderAndAcrossAConditionWaitAreForgotten) {
  Checked agent(LockRank::Agent, "agent");
  Checked cache(LockRank::StorebagCache, "cache");
  std::condition_variable_any cv;
  {
    std::unique_lock a(agent);
    std::unique_lock c(cache);
    a.unlock();  // the lower rank first
    cv.wait_for(c, std::chrono::milliseconds(1));
    EXPECT_EQ(lockrank::heldCount(), 1u);
  }
  EXPECT_EQ(lockrank::heldCount(), 0u);  // nothing left over to fail a later, correct order
}

TEST(LockRankTest, WaitingForOtherThreadsWhileHoldingALockIsCaught) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  Checked agent(LockRank::Agent, "the agent lock");
  EXPECT_DEATH(
      {
        std::lock_guard a(agent);
        lockrank::assertNoLockHeld("a storebag fetch");
      },
      "lock order violated: a storebag fetch .* while holding the agent lock");
  lockrank::assertNoLockHeld("nothing held");
}

TEST(LockRankTest, AQueueTurnUnderARankedLockIsCaughtInDebugBuilds) {
  if (!kLockRanksChecked) {
    GTEST_SKIP() << "queue turns are checked when NDEBUG is not defined";
  }
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  SerialQueue backend("test.lockrank.backend");
  RankedMutex<std::recursive_mutex> agent(LockRank::Agent, "the agent lock");
  EXPECT_DEATH(
      {
        std::lock_guard a(agent);
        backend.sync([] {});
      },
      "lock order violated: test.lockrank.backend .* while holding the agent lock");
  // A turn first, then the lock: the order the daemon keeps.
  backend.sync([&] { std::lock_guard a(agent); });
}

}  // namespace
}  // namespace zerith
