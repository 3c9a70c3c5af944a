#pragma once

// Both ends of a local stream socket, for the benchmarks' bare-socket
// references.

#include <sys/socket.h>

#include <benchmark/benchmark.h>

#include "platform/FileUtil.h"

namespace zerith::bench {

// Fills `a` and `b` with the two ends of a new socket pair; false, with the
// benchmark skipped, when the system gives none.
inline bool socketPair(benchmark::State& state, file::UniqueFd& a, file::UniqueFd& b) {
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
    state.SkipWithError("socketpair failed");
    return false;
  }
  a = file::UniqueFd(fds[0]);
  b = file::UniqueFd(fds[1]);
  return true;
}

}  // namespace zerith::bench
