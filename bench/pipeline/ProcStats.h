#pragma once

// What /proc says about one process: its CPU time (user + system, all
// threads), its context switches (all threads: each voluntary switch is a
// wake-up), and its memory (peak RSS and the private part of the current
// RSS).

#include <sys/types.h>

#include <cstdint>
#include <optional>

namespace zerith::bench {

struct ProcSample {
  double cpuSeconds = 0;              // /proc/<pid>/stat utime + stime
  std::uint64_t voluntarySwitches = 0;     // summed over /proc/<pid>/task/*/status
  std::uint64_t involuntarySwitches = 0;
  std::uint64_t peakRssKiB = 0;       // VmHWM
  std::uint64_t rssKiB = 0;           // VmRSS
  std::uint64_t privateRssKiB = 0;    // Private_Clean + Private_Dirty of smaps_rollup
  std::uint64_t threads = 0;
};

// nullopt when the process is gone or /proc cannot be read.
std::optional<ProcSample> sampleProcess(pid_t pid);

}  // namespace zerith::bench
