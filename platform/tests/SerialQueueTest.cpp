#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <string>
#include <vector>

#include "platform/SerialQueue.h"

namespace zerith {
namespace {

// Every pool thread runs a block that queues work on a queue of its own and
// then waits for that queue's turn: the turn needs a drainer from the same
// pool. Without a thread joining the pool, all of them wait for ever.
TEST(SerialQueueTest, SyncFromEveryPoolThreadOntoBusyQueuesDoesNotStarveThePool) {
  constexpr int kOuter = 64;
  std::vector<SerialQueue> outer;
  std::vector<SerialQueue> inner;
  for (int i = 0; i < kOuter; ++i) {
    outer.emplace_back("test.outer." + std::to_string(i));
    inner.emplace_back("test.inner." + std::to_string(i));
  }
  std::atomic<int> done{0};
  std::promise<void> all;
  for (int i = 0; i < kOuter; ++i) {
    outer[static_cast<std::size_t>(i)].async([&, i] {
      auto& q = inner[static_cast<std::size_t>(i)];
      std::atomic<bool> ran{false};
      q.async([&] { ran = true; });
      const bool sawEarlier = q.sync([&] { return ran.load(); });
      EXPECT_TRUE(sawEarlier);
      if (done.fetch_add(1) + 1 == kOuter) {
        all.set_value();
      }
    });
  }
  ASSERT_EQ(all.get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready)
      << done.load() << " of " << kOuter << " finished";
}

TEST(SerialQueueTest, NestedSyncOntoAnotherQueueAndCancelledTimers) {
  SerialQueue a("test.a");
  SerialQueue b("test.b");
  std::promise<bool> nested;
  a.async([&] { nested.set_value(b.sync([&] { return a.isCurrent() && b.isCurrent(); })); });
  EXPECT_TRUE(nested.get_future().get());

  std::atomic<int> fired{0};
  auto t = a.after(std::chrono::milliseconds(50), [&] { fired++; });
  t.cancel();
  std::promise<void> p;
  a.after(std::chrono::milliseconds(100), [&] { p.set_value(); });
  p.get_future().wait();
  EXPECT_EQ(fired.load(), 0);
}

TEST(SerialQueueTest, RunIfFreeRunsInlineOnlyWhenNothingElseHoldsOrWaitsForTheQueue) {
  SerialQueue q("test.tryrun");
  bool ranInline = false;
  EXPECT_TRUE(q.runIfFree([&] { ranInline = q.isCurrent(); }));
  EXPECT_TRUE(ranInline);
  // Inside its own block the queue is not free (and it must not deadlock).
  EXPECT_FALSE(q.sync([&] { return q.runIfFree([] {}); }));
  // Busy with a running block: refused at once, not waited for.
  std::promise<void> release;
  std::promise<void> started;
  q.async([&] {
    started.set_value();
    release.get_future().wait();
  });
  started.get_future().wait();
  bool ran = false;
  EXPECT_FALSE(q.runIfFree([&] { ran = true; }));
  EXPECT_FALSE(ran);
  release.set_value();
  q.sync([] {});
  EXPECT_TRUE(q.runIfFree([] {}));
}

}  // namespace
}  // namespace zerith
