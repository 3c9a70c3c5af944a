// The daemon's memory under a flood of calls whose replies are never read,
// as a hostile local client would send them: the real zerithd (temporary
// root, debug log off) and 1 or 10 entitled connections, each writing up to
// 1.5 M `fetchDisplayURL:` calls without reading a reply. Recorded in the
// same run: the daemon's resident memory when idle (one ordinary client
// served), its peak during the flood (VmHWM), and its resident memory once
// the flooders are gone; and the round trips of an ordinary client served
// beside the flood, beside its round trips before the flood.
//
// Run: build/release/bench/flood_bench --benchmark_counters_tabular=true

#include <benchmark/benchmark.h>

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "ipc/Frame.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/TempRoot.h"
#include "zerith/Zerith.h"

namespace {

using namespace zerith;
using Clock = std::chrono::steady_clock;

constexpr long kCallsPerFlooder = 1'500'000;
// A flooder that could not write for this long is held back by the daemon.
constexpr auto kHeldBack = std::chrono::milliseconds(1000);

// A field of /proc/<pid>/status in MB ("VmRSS", "VmHWM").
double statusMB(pid_t pid, const std::string& field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind(field + ":", 0) == 0) {
      return std::strtod(line.c_str() + field.size() + 1, nullptr) / 1024.0;
    }
  }
  return 0;
}

struct FloodResult {
  long callsWritten = 0;
  bool closedByDaemon = false;
};

// Writes calls without ever reading, until all are written, the daemon
// closes the connection, or the daemon holds the writer back.
FloodResult flood(int fd) {
  ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
  // Calls in batches of 512 frames: each one a complete `fetchDisplayURL:`.
  Data batch;
  constexpr int kBatch = 512;
  FloodResult result;
  long nextCall = 1;
  std::size_t offset = 0;
  auto refill = [&] {
    batch.clear();
    for (int i = 0; i < kBatch && nextCall <= kCallsPerFlooder; ++i, ++nextCall) {
      const Data frame = ipc::encodeCall("fetchDisplayURL:", static_cast<std::uint64_t>(nextCall), {});
      batch.insert(batch.end(), frame.begin(), frame.end());
    }
    offset = 0;
  };
  refill();
  while (!batch.empty()) {
    const ssize_t n = ::send(fd, batch.data() + offset, batch.size() - offset, MSG_NOSIGNAL);
    if (n > 0) {
      offset += static_cast<std::size_t>(n);
      if (offset == batch.size()) {
        result.callsWritten = nextCall - 1;
        refill();
      }
      continue;
    }
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      pollfd p{fd, POLLOUT, 0};
      if (::poll(&p, 1, static_cast<int>(kHeldBack.count())) == 0) {
        break;
      }
      continue;
    }
    result.closedByDaemon = true;
    break;
  }
  return result;
}

struct Daemon {
  test::TempRoot root;
  std::unique_ptr<test::DaemonProcess> process;

  Daemon() {
    process = test::startEntitledDaemon(root, ZERITHD_BUILT_BINARY);
  }
};

void BM_FloodWithoutReading(benchmark::State& state) {
  const int flooders = static_cast<int>(state.range(0));
  // A daemon of its own per case, so that each peak (VmHWM) is that case's.
  Daemon daemon;
  if (!daemon.process->ready()) {
    state.SkipWithError("the daemon did not start");
    return;
  }
  const pid_t pid = daemon.process->pid();
  auto client = Zerith::connect();
  if (!client || !client->fetchDisplayURL(std::chrono::seconds(10))) {
    state.SkipWithError("the ordinary client was not served");
    return;
  }
  const double idle = statusMB(pid, "VmRSS");
  // The ordinary client's round trips before any flood: the reference for
  // its round trips beside the flood.
  std::vector<double> quiet;
  for (int i = 0; i < 3000; ++i) {
    const auto t0 = Clock::now();
    if (!client->fetchDisplayURL(std::chrono::seconds(10))) {
      state.SkipWithError("the ordinary client was not served");
      return;
    }
    quiet.push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
  }
  std::sort(quiet.begin(), quiet.end());

  for (auto _ : state) {
    std::vector<file::UniqueFd> sockets;
    for (int i = 0; i < flooders; ++i) {
      sockets.push_back(test::connectToDaemonSocket());
      if (!sockets.back()) {
        state.SkipWithError("a flooder could not connect");
        return;
      }
    }
    std::vector<FloodResult> results(static_cast<std::size_t>(flooders));
    std::atomic<bool> flooding{true};
    const auto start = Clock::now();
    std::vector<std::thread> threads;
    for (int i = 0; i < flooders; ++i) {
      threads.emplace_back([&, i] { results[static_cast<std::size_t>(i)] = flood(sockets[static_cast<std::size_t>(i)].get()); });
    }
    // The ordinary client beside the flood.
    std::vector<double> micros;
    std::thread ordinary([&] {
      while (flooding) {
        const auto t0 = Clock::now();
        if (!client->fetchDisplayURL(std::chrono::seconds(10))) {
          micros.push_back(1e7);
          break;
        }
        micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
      }
    });
    for (auto& t : threads) {
      t.join();
    }
    const double floodSeconds = std::chrono::duration<double>(Clock::now() - start).count();
    flooding = false;
    ordinary.join();
    const double peak = statusMB(pid, "VmHWM");
    const double during = statusMB(pid, "VmRSS");
    sockets.clear();  // the flooders go away without reading
    // Let the daemon see the closes and drop what it held.
    std::this_thread::sleep_for(std::chrono::seconds(2));
    const double after = statusMB(pid, "VmRSS");

    long written = 0;
    int closed = 0;
    for (const auto& r : results) {
      written += r.callsWritten;
      closed += r.closedByDaemon ? 1 : 0;
    }
    std::sort(micros.begin(), micros.end());
    state.counters["idle_rss_MB"] = idle;
    state.counters["peak_rss_MB"] = peak;
    state.counters["held_rss_MB"] = during;
    state.counters["after_rss_MB"] = after;
    state.counters["peak_over_idle_MB"] = peak - idle;
    state.counters["calls_taken_per_flooder"] = static_cast<double>(written) / flooders;
    state.counters["flooders_closed"] = closed;
    state.counters["flood_s"] = floodSeconds;
    state.counters["quiet_p50_us"] = quiet[quiet.size() / 2];
    state.counters["quiet_p99_us"] = quiet[quiet.size() * 99 / 100];
    if (!micros.empty()) {
      state.counters["ordinary_calls"] = static_cast<double>(micros.size());
      state.counters["ordinary_p50_us"] = micros[micros.size() / 2];
      state.counters["ordinary_p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
    }
  }
}
BENCHMARK(BM_FloodWithoutReading)->Arg(1)->Arg(10)->Iterations(1)->UseRealTime()->Unit(benchmark::kSecond);

}  // namespace

BENCHMARK_MAIN();
