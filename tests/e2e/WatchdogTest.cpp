// The service manager's watchdog: the daemon pings while every pool, queue
// and thread of it makes progress, and stops pinging once one of them is
// wedged (here the main operation queue, through the daemon's test hook),
// so that the manager would restart it.

#include <algorithm>
#include <string>
#include <thread>

#include "tests/e2e/E2eFixture.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

class WatchdogTest : public E2eTest {
 protected:
  std::size_t pings() const {
    const auto all = daemon->notifications();
    return static_cast<std::size_t>(std::count_if(
        all.begin(), all.end(), [](const std::string& m) { return m.find("WATCHDOG=1") != std::string::npos; }));
  }
};

TEST_F(WatchdogTest, PingsWhileServingAndStopsOnceAQueueIsWedged) {
  grant(Value(true));
  DaemonProcess::Options options;
  options.arguments = {"--stop-timeout", "5"};
  // A 900 ms watchdog: a ping every 300 ms while all is well.
  options.environment = {{"WATCHDOG_USEC", "900000"}, {"ZERITHD_TEST_WEDGE_MAIN_QUEUE_AFTER_MS", "3000"}};
  startDaemon(options);
  ASSERT_TRUE(daemon->waitFor("Watchdog on, pinging every 300 ms")) << daemon->output();

  for (int i = 0; i < 50 && pings() < 4; ++i) {
    std::this_thread::sleep_for(100ms);
  }
  ASSERT_GE(pings(), 4u) << daemon->output();

  ASSERT_TRUE(daemon->waitFor("watchdog: no progress on the main operation queue", 1, 10s)) << daemon->output();
  const std::size_t atStall = pings();
  std::this_thread::sleep_for(2s);  // six ping periods
  EXPECT_EQ(pings(), atStall) << daemon->output();
  // Only the one queue is wedged: the daemon still answers and stops.
  auto client = connect();
  ASSERT_TRUE(client);
  EXPECT_TRUE(client->setSessionInfo(sessionInfo(9), Value(), Value(), false, 10s));
}

}  // namespace
}  // namespace zerith::test
