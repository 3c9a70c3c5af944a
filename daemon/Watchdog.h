#pragma once

// The service manager's watchdog, pinged only while the daemon makes
// progress. Every round the watchdog hands a heartbeat to each of the
// daemon's threads and queues (the pools, the transport thread and its
// delegate queue, each socket thread, the agent lock); it pings
// ("WATCHDOG=1") only when every heartbeat of the round before has come
// back. A thread or queue that stays wedged stops the pings, and the service
// manager restarts the daemon once WatchdogSec has passed without one.
//
// A heartbeat that has not come back is not handed out again: a wedged
// queue holds at most one of them.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace zerith {

class Watchdog {
 public:
  // Hands `beat` to one thread or queue, which calls it when its turn comes.
  struct Probe {
    std::string name;
    std::function<void(std::function<void()> beat)> post;
  };
  using Notify = std::function<void(const char* state)>;

  // Rounds `period` apart; `notify` sends the service manager a state
  // ("WATCHDOG=1").
  Watchdog(std::chrono::milliseconds period, std::vector<Probe> probes, Notify notify);
  ~Watchdog();
  Watchdog(const Watchdog&) = delete;
  Watchdog& operator=(const Watchdog&) = delete;

  // The ping period for the service manager's watchdog (a third of its
  // time-out), nullopt when the manager set none (WATCHDOG_USEC).
  static std::optional<std::chrono::milliseconds> periodFromEnvironment();

  std::uint64_t pings() const { return pings_.load(); }

 private:
  struct Beats;
  void run();

  const std::chrono::milliseconds period_;
  const std::vector<Probe> probes_;
  const Notify notify_;
  const std::shared_ptr<Beats> beats_;
  std::atomic<std::uint64_t> pings_{0};
  std::mutex mutex_;
  std::condition_variable stop_;
  bool stopping_ = false;
  std::thread thread_;
};

}  // namespace zerith
