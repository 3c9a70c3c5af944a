#pragma once

// The system log. Three levels: error, default (spdlog's info) and debug.
// Under systemd (JOURNAL_STREAM names the file behind standard error) lines
// go to the journal as "<priority>subsystem: text", error, default and debug
// at the journal priorities err (3), info (6) and debug (7); otherwise to
// standard error with a time stamp. Debug is off unless asked for. One named Logger per
// subsystem; every Logger shares the process's sinks.
//
// Tests read the log through a LogCapture, an in-memory sink that is active
// for its lifetime and turns debug on while it exists.

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include <spdlog/spdlog.h>

namespace zerith::log {

enum class Level { Error, Default, Debug };

struct Options {
  bool debug = false;
  // nullopt: decide from JOURNAL_STREAM.
  std::optional<bool> journal;
};

// Called once by each executable's main; safe to skip (defaults apply).
void configure(const Options& options);

// The journal (syslog) priority a level is logged at.
int journalPriority(Level level);

// Text a client supplied (a path, a name), made safe for one log line:
// control characters become \n, \r, \t or \xNN and a backslash doubles, so
// that no client text can end a line or forge one.
std::string escaped(std::string_view text);

class Logger {
 public:
  explicit Logger(const std::string& subsystem);

  template <typename... Args>
  void error(fmt::format_string<Args...> format, Args&&... args) const {
    logger_->error(format, std::forward<Args>(args)...);
  }
  template <typename... Args>
  void info(fmt::format_string<Args...> format, Args&&... args) const {
    logger_->info(format, std::forward<Args>(args)...);
  }
  template <typename... Args>
  void debug(fmt::format_string<Args...> format, Args&&... args) const {
    logger_->debug(format, std::forward<Args>(args)...);
  }
  bool debugEnabled() const { return logger_->should_log(spdlog::level::debug); }

 private:
  std::shared_ptr<spdlog::logger> logger_;
};

struct CapturedLine {
  Level level;
  std::string logger;
  std::string text;
};

class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<CapturedLine> lines() const;
  // Lines whose text contains `needle` (at any level).
  std::size_t count(std::string_view needle) const;
  bool contains(std::string_view needle) const { return count(needle) > 0; }
  // Exactly this text at this level.
  bool has(Level level, std::string_view text) const;
  // Waits until a line containing `needle` has arrived; false on time-out.
  bool waitFor(std::string_view needle, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;
  void clear();

  struct Sink;

 private:
  std::shared_ptr<Sink> sink_;
};

}  // namespace zerith::log
