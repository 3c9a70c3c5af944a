#pragma once

// Command lines run from a test (an installed tool, a script, a system
// utility), bounded in time, and files read back whole.

#include <filesystem>
#include <string>

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

// The whole file; empty when it cannot be read.
std::string readText(const std::filesystem::path& path);

}  // namespace zerith::test
