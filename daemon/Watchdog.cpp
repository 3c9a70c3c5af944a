#include "daemon/Watchdog.h"

#include <systemd/sd-daemon.h>

#include <algorithm>
#include <string>
#include <utility>

#include "platform/Log.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* l = new log::Logger("daemon");
  return *l;
}

}  // namespace

// Per probe: the heartbeat is out (handed over and not back yet), and when
// it was handed over. Shared with the heartbeats, which may come back after
// the watchdog has gone.
struct Watchdog::Beats {
  std::mutex mutex;
  std::vector<bool> out;
  std::vector<std::chrono::steady_clock::time_point> since;
};

Watchdog::Watchdog(std::chrono::milliseconds period, std::vector<Probe> probes, Notify notify)
    : period_(period), probes_(std::move(probes)), notify_(std::move(notify)), beats_(std::make_shared<Beats>()) {
  beats_->out.assign(probes_.size(), false);
  beats_->since.assign(probes_.size(), std::chrono::steady_clock::now());
  thread_ = std::thread([this] { run(); });
}

Watchdog::~Watchdog() {
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  stop_.notify_all();
  thread_.join();
}

std::optional<std::chrono::milliseconds> Watchdog::periodFromEnvironment() {
  std::uint64_t usec = 0;
  if (sd_watchdog_enabled(0, &usec) <= 0 || usec == 0) {
    return std::nullopt;
  }
  return std::chrono::milliseconds(std::max<std::uint64_t>(1, usec / 3000));
}

void Watchdog::run() {
  std::string stalled;  // the probes named in the last stall's log line
  std::unique_lock lock(mutex_);
  for (;;) {
    // Whatever is not back from the round before holds the ping back.
    std::string late;
    std::vector<std::size_t> due;
    const auto now = std::chrono::steady_clock::now();
    {
      std::lock_guard beats(beats_->mutex);
      for (std::size_t i = 0; i < probes_.size(); ++i) {
        if (beats_->out[i]) {
          const auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(now - beats_->since[i]).count();
          late += (late.empty() ? "" : ", ") + probes_[i].name + " (" + std::to_string(ms) + " ms)";
        } else {
          beats_->out[i] = true;
          beats_->since[i] = now;
          due.push_back(i);
        }
      }
    }
    if (late.empty()) {
      notify_("WATCHDOG=1");
      pings_.fetch_add(1);
      stalled.clear();
    } else if (late != stalled && stalled.empty()) {
      logger().error("watchdog: no progress on {}; the service manager is not pinged", late);
      stalled = late;
    }
    for (const std::size_t i : due) {
      probes_[i].post([beats = beats_, i] {
        std::lock_guard back(beats->mutex);
        beats->out[i] = false;
      });
    }
    if (stop_.wait_for(lock, period_, [this] { return stopping_; })) {
      return;
    }
  }
}

}  // namespace zerith
