#pragma once

// The `zerith` command-line client: shell scripts' way to run a reporting
// session with the daemon. Results are JSON lines on `out`, problems go to
// `err`; the return value is the process's exit status:
//   0 every step succeeded, 2 bad command line, 3 the daemon is unreachable,
//   4 the daemon refused or closed the session, 5 a step failed (time-out,
//   call refused).

#include <ostream>

namespace zerith::cli {

inline constexpr int kExitUsage = 2;
inline constexpr int kExitUnreachable = 3;
inline constexpr int kExitRefused = 4;
inline constexpr int kExitStepFailed = 5;

int run(int argc, const char* const* argv, std::ostream& out, std::ostream& err);

}  // namespace zerith::cli
