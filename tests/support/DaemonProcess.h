#pragma once

// Runs the real zerithd binary for end-to-end tests: started in a TempRoot
// with --debug, its standard error captured line by line, readiness taken
// from its own sd_notify("READY=1") through a notify socket of ours, and
// stopped with SIGTERM (killed when it has not gone 2 s after). Every wait is
// bounded, so a daemon that hangs fails the test instead of hanging it.

#include <signal.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/FileUtil.h"
#include "platform/Log.h"
#include "tests/support/Command.h"

namespace zerith::test {

class TempRoot;

class DaemonProcess {
 public:
  struct Options {
    std::vector<std::string> arguments{};                            // after --root and --debug
    std::vector<std::pair<std::string, std::string>> environment{};  // added to ours
    bool debug = true;
    std::chrono::milliseconds readyTimeout{15000};
  };

  // Starts <build>/daemon/zerithd (or $ZERITHD_BINARY) and waits for its
  // readiness; ready() tells whether it came.
  DaemonProcess(const TempRoot& root, Options options);
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  bool ready() const;
  pid_t pid() const { return child_->pid(); }
  bool running() { return !waitForExit(std::chrono::milliseconds(0)); }

  // The captured standard error so far.
  std::string output() const;
  // Lines whose message text contains `needle`.
  std::size_t count(std::string_view needle) const;
  // A line whose message is exactly `text` at `level`.
  bool has(log::Level level, std::string_view text) const { return countExact(level, text) > 0; }
  std::size_t countExact(log::Level level, std::string_view text) const;
  // Waits until `occurrences` lines contain `needle`; false on time-out.
  bool waitFor(std::string_view needle, std::size_t occurrences = 1,
               std::chrono::milliseconds timeout = std::chrono::milliseconds(10000)) const;
  bool waitForExact(log::Level level, std::string_view text, std::size_t occurrences = 1,
                    std::chrono::milliseconds timeout = std::chrono::milliseconds(10000)) const;
  // The messages received on the notify socket ("READY=1", "STATUS=...").
  std::vector<std::string> notifications() const;

  void signal(int signal) { child_->signal(signal); }
  // The exit status (the code, or 128 + signal), nullopt when it did not
  // exit in time.
  std::optional<int> waitForExit(std::chrono::milliseconds timeout);
  // SIGTERM, then waitForExit.
  std::optional<int> stop(std::chrono::milliseconds timeout = std::chrono::milliseconds(10000)) {
    signal(SIGTERM);
    return waitForExit(timeout);
  }

 private:
  struct Line {
    log::Level level;
    std::string text;
  };
  using Match = std::function<bool(const Line&)>;

  void readLoop();
  void consumeOutput(std::string_view bytes);
  std::size_t countLines(const Match& match) const;  // mutex_ held
  std::size_t countNow(const Match& match) const;
  bool waitLines(const Match& match, std::size_t occurrences, std::chrono::milliseconds timeout) const;

  std::unique_ptr<ChildProcess> child_;
  file::UniqueFd stderrRead_;
  file::UniqueFd notifySocket_;
  file::UniqueFd wakeRead_;
  file::UniqueFd wakeWrite_;
  std::thread reader_;

  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::string output_;
  std::string partial_;
  std::vector<Line> lines_;
  std::vector<std::string> notifications_;
  bool ready_ = false;
};

// A quiet daemon (no debug log, a 5 s stop timeout) in `root`, whose
// entitlements policy lets the current user open sessions: the benchmarks'
// daemon. ZERITHD_BINARY, when unset, becomes `builtBinary`.
std::unique_ptr<DaemonProcess> startEntitledDaemon(TempRoot& root, const char* builtBinary);

// A bare client socket connected to the daemon's listener (the socket path
// of the current root), for tests that speak the wire protocol themselves;
// empty when nothing listens there.
file::UniqueFd connectToDaemonSocket();

}  // namespace zerith::test
