#pragma once

// Command lines run from a test (an installed tool, a script, a system
// utility), bounded in time; child processes a test starts and stops itself;
// and files read back whole.

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/FileUtil.h"

namespace zerith::test {

struct CommandResult {
  int status = -1;     // the exit status; -1 when it did not exit (killed, or not started)
  std::string output;  // what it wrote to standard output
};

// Runs `command` with sh under coreutils' `timeout`, so a hung tool ends the
// test's wait; standard error goes where the command line sends it (append
// " 2>&1" to collect it with the output).
CommandResult runCommand(const std::string& command, int timeoutSeconds = 120);

// `s` as one sh word.
std::string shellQuote(const std::string& s);

// Whether an executable of that name is on PATH.
bool onPath(const std::string& tool);

// A program (args[0], a path) running as a child of the test, never left
// behind: the destructor kills and reaps it. It starts with no signal
// blocked, whatever the starting thread blocks; its descriptor `theirs` is
// our `ours` for each pair of `descriptors`, and `environment` replaces ours
// when given. Every wait is bounded.
class ChildProcess {
 public:
  // Throws std::runtime_error when the program cannot be started.
  ChildProcess(const std::vector<std::string>& args, const std::vector<std::pair<int, int>>& descriptors,
               const std::optional<std::vector<std::string>>& environment = std::nullopt);
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  pid_t pid() const { return pid_; }
  bool running() { return !waitForExit(std::chrono::milliseconds(0)); }
  void signal(int signal);
  // The exit status (the code, or 128 + signal), nullopt when it did not
  // exit in time.
  std::optional<int> waitForExit(std::chrono::milliseconds timeout);
  // SIGTERM, and SIGKILL when it has not ended after `grace`; its exit status.
  int stop(std::chrono::milliseconds grace);

 private:
  pid_t pid_ = -1;
  file::UniqueFd pidFd_;
  std::optional<int> exitStatus_;
};

// The whole file; empty when it cannot be read.
std::string readText(const std::filesystem::path& path);

}  // namespace zerith::test
