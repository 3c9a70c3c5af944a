// One client connection calling fetchDisplayURL: as fast as it can against
// the real zerithd (started in a temporary root, debug log off), beside a
// bare Unix-socket echo that moves frames of the same sizes between two
// threads. The difference is what the daemon and the framework add to the
// kernel's round trip: decoding, the connection's queue, the session's
// answer, the reply's encoding and the client's wake-up.

#include <benchmark/benchmark.h>

#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "bench/BenchSocket.h"
#include "bench/pipeline/ProcStats.h"
#include "ipc/Frame.h"
#include "platform/FileUtil.h"
#include "platform/PropertyList.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/TempRoot.h"
#include "zerith/Zerith.h"

namespace {

using Clock = std::chrono::steady_clock;
using namespace zerith;

void reportLatencies(benchmark::State& state, std::vector<double>& micros) {
  if (micros.empty()) {
    return;
  }
  std::sort(micros.begin(), micros.end());
  auto at = [&](double q) { return micros[std::min(micros.size() - 1, static_cast<std::size_t>(q * micros.size()))]; };
  state.counters["p50_us"] = at(0.50);
  state.counters["p99_us"] = at(0.99);
  state.counters["round_trips"] =
      benchmark::Counter(static_cast<double>(micros.size()), benchmark::Counter::kIsRate);
}

// CPU seconds (user + system) of every thread of this process so far.
double processCpuSeconds() {
  rusage usage{};
  ::getrusage(RUSAGE_SELF, &usage);
  return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
         static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

// CPU per round trip of this process (both ends of the echo, or the
// client framework's threads) and, when given, of the daemon: on a loaded
// machine these hold where the times do not.
// Voluntary context switches (a thread going to sleep: each is a wake-up
// later) per round trip tell the thread hand-offs apart from the work.
struct CpuMark {
  double clientCpu = processCpuSeconds();
  std::uint64_t clientSwitches = bench::sampleProcess(::getpid()).value_or(bench::ProcSample{}).voluntarySwitches;
  std::optional<bench::ProcSample> daemon;
};

void reportCpu(benchmark::State& state, const CpuMark& before, pid_t daemon) {
  const double trips = static_cast<double>(state.iterations());
  if (trips == 0) {
    return;
  }
  state.counters["client_cpu_us"] = (processCpuSeconds() - before.clientCpu) * 1e6 / trips;
  if (const auto self = bench::sampleProcess(::getpid())) {
    state.counters["client_sleeps"] = static_cast<double>(self->voluntarySwitches - before.clientSwitches) / trips;
  }
  if (before.daemon) {
    if (const auto after = bench::sampleProcess(daemon)) {
      state.counters["daemon_cpu_us"] = (after->cpuSeconds - before.daemon->cpuSeconds) * 1e6 / trips;
      state.counters["daemon_sleeps"] =
          static_cast<double>(after->voluntarySwitches - before.daemon->voluntarySwitches) / trips;
    }
  }
}

// The frames one fetchDisplayURL: round trip moves.
Data requestFrame() { return ipc::encodeCall("fetchDisplayURL:", 1, {}); }
Data replyFrame() { return ipc::encodeReply(1, Dictionary{{"url", Value("URL not available")}}); }

bool writeAll(int fd, const Data& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

bool readExactly(int fd, std::uint8_t* out, std::size_t size) {
  std::size_t done = 0;
  while (done < size) {
    const ssize_t n = ::read(fd, out + done, size - done);
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

// Reads one length-prefixed frame.
bool readFrame(int fd, std::vector<std::uint8_t>& body) {
  std::uint8_t header[4];
  if (!readExactly(fd, header, 4)) return false;
  const std::uint32_t size = (std::uint32_t{header[0]} << 24) | (std::uint32_t{header[1]} << 16) |
                             (std::uint32_t{header[2]} << 8) | header[3];
  body.resize(size);
  return readExactly(fd, body.data(), size);
}

// The argument is the nice value of the echo's answering thread: 0, and 10,
// the utility priority zerithd sets itself to. Beside busy processes of
// nice 0 the second is the like-for-like reference for the daemon, which
// then gets a tenth of their weight on a core by design.
void BM_UnixSocketEcho(benchmark::State& state) {
  file::UniqueFd client;
  file::UniqueFd server;
  if (!bench::socketPair(state, client, server)) {
    return;
  }
  const Data request = requestFrame();
  const Data reply = replyFrame();
  const auto nice = static_cast<int>(state.range(0));
  std::thread echo([fd = server.get(), &reply, nice] {
    // Linux keeps the nice value per thread.
    if (nice != 0) {
      ::setpriority(PRIO_PROCESS, static_cast<id_t>(::gettid()), nice);
    }
    std::vector<std::uint8_t> body;
    while (readFrame(fd, body) && writeAll(fd, reply)) {
    }
  });
  std::vector<double> micros;
  std::vector<std::uint8_t> body;
  const CpuMark before;
  for (auto _ : state) {
    const auto start = Clock::now();
    if (!writeAll(client.get(), request) || !readFrame(client.get(), body)) {
      state.SkipWithError("echo failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  ::shutdown(client.get(), SHUT_RDWR);
  echo.join();
  reportCpu(state, before, 0);
  state.counters["request_bytes"] = static_cast<double>(request.size());
  state.counters["reply_bytes"] = static_cast<double>(reply.size());
  reportLatencies(state, micros);
}
BENCHMARK(BM_UnixSocketEcho)->Arg(0)->Arg(10)->ArgName("echo_nice")->UseRealTime()->MinTime(2.0);

// The daemon, started once for the run.
struct Daemon {
  test::TempRoot root;
  std::unique_ptr<test::DaemonProcess> process;
  std::unique_ptr<Zerith> client;

  Daemon() {
    process = test::startEntitledDaemon(root, ZERITHD_BUILT_BINARY);
    if (process->ready()) {
      client = Zerith::connect();
    }
  }
};

void BM_DaemonFetchDisplayURL(benchmark::State& state) {
  static Daemon daemon;
  if (!daemon.client) {
    state.SkipWithError("the daemon did not start");
    return;
  }
  std::vector<double> micros;
  CpuMark before;
  before.daemon = bench::sampleProcess(daemon.process->pid());
  for (auto _ : state) {
    const auto start = Clock::now();
    const auto reply = daemon.client->fetchDisplayURL(std::chrono::seconds(10));
    if (!reply) {
      state.SkipWithError("fetchDisplayURL failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportCpu(state, before, daemon.process->pid());
  reportLatencies(state, micros);
}
BENCHMARK(BM_DaemonFetchDisplayURL)->UseRealTime()->MinTime(2.0);

}  // namespace

BENCHMARK_MAIN();
