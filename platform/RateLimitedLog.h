#pragma once

// Log lines that a peer can cause, at most one per peer and interval.
//
// Each line belongs to a key (a client's uid). The first line of a key in an
// interval is logged as it is; the rest of that interval are counted, and
// when the interval ends one more line says how many there were, repeating
// the last of them ("... (and 99 more like it in the last 10 s)"). A peer
// that floods the daemon with refused connections or bad calls so leaves
// two lines per interval, whatever its rate. The keys tracked are bounded:
// once that many have a line in their current interval, further keys share
// one count. With debug logging on (--debug) every line is logged.

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/Log.h"

namespace zerith::log {

class RateLimitedLog {
 public:
  static constexpr std::size_t kMaxKeys = 1024;

  RateLimitedLog(std::string subsystem, Level level, std::chrono::steady_clock::duration interval);
  ~RateLimitedLog();
  RateLimitedLog(const RateLimitedLog&) = delete;
  RateLimitedLog& operator=(const RateLimitedLog&) = delete;

  // Logs `text` now, or counts it toward the key's summary line.
  void log(std::uint64_t key, std::string text);

  template <typename... Args>
  void log(std::uint64_t key, fmt::format_string<Args...> format, Args&&... args) {
    log(key, fmt::format(format, std::forward<Args>(args)...));
  }

  // Lines counted and not logged since the process started.
  std::uint64_t suppressed() const;

  struct State;

 private:
  std::shared_ptr<State> state_;
};

}  // namespace zerith::log
