#include "platform/RateLimitedLog.h"

#include <mutex>
#include <unordered_map>

#include "platform/SerialQueue.h"

namespace zerith::log {

namespace {

using Clock = std::chrono::steady_clock;
// The key that every key past kMaxKeys shares.
constexpr std::uint64_t kOverflowKey = UINT64_MAX;

}  // namespace

struct RateLimitedLog::State : std::enable_shared_from_this<State> {
  struct Entry {
    Clock::time_point since;
    std::uint64_t counted = 0;
    std::string last;
  };

  State(std::string subsystem, Level l, Clock::duration i)
      : logger(subsystem), level(l), interval(i), timers("com.velmar.zerithd.ratelimitedlog." + subsystem) {}

  void emit(const std::string& text) const {
    switch (level) {
      case Level::Error: logger.error("{}", text); break;
      case Level::Default: logger.info("{}", text); break;
      case Level::Debug: logger.debug("{}", text); break;
    }
  }

  // Ends the key's interval: its summary line, if anything was counted.
  void close(std::uint64_t key) {
    std::string line;
    {
      std::lock_guard lock(mutex);
      const auto it = entries.find(key);
      if (it == entries.end()) {
        return;
      }
      if (it->second.counted > 0) {
        const auto seconds = std::chrono::duration_cast<std::chrono::duration<double>>(interval).count();
        line = fmt::format("{} (and {} more like it in the last {:g} s)", it->second.last, it->second.counted, seconds);
      }
      entries.erase(it);
    }
    if (!line.empty()) {
      emit(line);
    }
  }

  const Logger logger;
  const Level level;
  const Clock::duration interval;
  const SerialQueue timers;
  mutable std::mutex mutex;
  std::unordered_map<std::uint64_t, Entry> entries;
  std::uint64_t suppressedTotal = 0;
  bool stopped = false;
};

RateLimitedLog::RateLimitedLog(std::string subsystem, Level level, Clock::duration interval)
    : state_(std::make_shared<State>(std::move(subsystem), level, interval)) {}

RateLimitedLog::~RateLimitedLog() {
  std::lock_guard lock(state_->mutex);
  state_->stopped = true;  // pending summaries are dropped with the owner
}

void RateLimitedLog::log(std::uint64_t key, std::string text) {
  State& s = *state_;
  if (s.logger.debugEnabled()) {
    s.emit(text);  // a debug log holds nothing back
    return;
  }
  {
    std::lock_guard lock(s.mutex);
    if (s.entries.size() >= kMaxKeys && !s.entries.contains(key)) {
      key = kOverflowKey;
    }
    const auto [it, fresh] = s.entries.try_emplace(key);
    if (!fresh) {
      ++it->second.counted;
      ++s.suppressedTotal;
      it->second.last = std::move(text);
      return;
    }
    it->second.since = Clock::now();
    // The interval's end logs what was counted meanwhile and lets the next
    // line through.
    s.timers.after(s.interval, [weak = std::weak_ptr<State>(state_), key] {
      if (auto alive = weak.lock()) {
        bool stopped = false;
        {
          std::lock_guard lock(alive->mutex);
          stopped = alive->stopped;
        }
        if (!stopped) {
          alive->close(key);
        }
      }
    });
  }
  s.emit(text);
}

std::uint64_t RateLimitedLog::suppressed() const {
  std::lock_guard lock(state_->mutex);
  return state_->suppressedTotal;
}

}  // namespace zerith::log
