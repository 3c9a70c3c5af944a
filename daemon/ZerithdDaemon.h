#pragma once

// The process entry of zerithd, apart from option parsing: lowers the
// process's priority to utility, removes stale upload bodies, listens under
// "com.velmar.zerithd" with one agent as the listener's delegate, reports
// readiness, and runs until SIGTERM or SIGINT.
//
// Stopping: the listener stops accepting at once. With no keep-alive
// transaction open the process exits at once; otherwise it waits until the
// transaction ends (every session's transport has closed) or the stop
// time-out passes.

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <ostream>

namespace zerith {

struct DaemonOptions {
  std::filesystem::path root;
  bool debug = false;
  std::optional<std::filesystem::path> caFile;
  std::chrono::milliseconds stopTimeout{std::chrono::seconds(30)};
};

class ZerithdDaemon {
 public:
  explicit ZerithdDaemon(DaemonOptions options);

  // Blocks SIGTERM, SIGINT and SIGHUP in the calling thread, so that every thread
  // started later inherits the mask and only run() receives them. Call
  // first thing in main.
  static void blockStopSignals();

  // A write past the file size limit (SIGXFSZ) or to a closed pipe or socket
  // (SIGPIPE) must not kill the daemon: both are ignored, and the write
  // fails with EFBIG or EPIPE where every write's other errors are handled.
  // Call first thing in main.
  static void ignoreWriteSignals();

  // The exit status.
  int run();

  // What the daemon would read when it starts, checked without starting it
  // (zerithd --check): the defaults domains it reads, the storebag public
  // keys, the entitlements policy files, the device file and the --ca-file.
  // One line per problem on `out`, then their count; the exit status is 0
  // when there is none, 1 otherwise.
  int check(std::ostream& out) const;

  // Ends the process once run() has returned: flushes the log and exits
  // without static destructors, which would race the thread pools and the
  // HTTP transport thread that live until the process ends. Sanitizer builds
  // check for leaks first.
  [[noreturn]] static void exitProcess(int status);

  // Nice 10 and best-effort I/O priority 7; failures are logged and ignored.
  static void setUtilityQualityOfService();

 private:
  DaemonOptions options_;
};

}  // namespace zerith
