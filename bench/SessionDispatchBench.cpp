// Events through sendMessageWithDictionary:reply: into a session with two
// backends, beside a bare Unix-socket echo of frames of the same sizes, in
// the same run.
//
// The daemon side runs in a child process started from this binary
// ("--serve <root>"): the real agent, listener, sessions and backend
// factory, with the storebag answered in process (no HTTPS fetch) and two
// recording backends registered through the factory as sinks. A child of
// our own is needed because the recording backend lives in the test tree
// and is not part of zerithd. The child's CPU time (utime + stime from
// /proc/<pid>/stat) over the timed loop gives the daemon's CPU microseconds
// per event.
//
// BM_UnixSocketEcho          the kernel's round trip for the call and reply frames
// BM_OneSessionTwoBackends   one client, one session, events round-robin over categories
// BM_TenSessionsOneHierarchy ten clients in one hierarchy (levels 0-9, shared data set),
//                            events round-robin over the ten
// BM_SameDaemonFetchDisplayURL  a call answered by the session without dispatch
// BM_ClientOneWayEvent       the client's side of one one-way event (the end-to-end
//                            benchmark's ten-key event, built beforehand)
// BM_ClientEventWithReply    the same with a reply block, at most 256 unanswered
// BM_BareSendOfTheEventFrame the reference for both: send() of the same frame

#include <benchmark/benchmark.h>

#include <fcntl.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <ctime>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <sstream>
#include <thread>
#include <vector>

#include "bench/BenchSocket.h"
#include "bench/pipeline/BenchEvent.h"
#include "daemon/KeepAliveTransaction.h"
#include "daemon/StorebagCache.h"
#include "daemon/ZerithdAgent.h"
#include "ipc/EntitlementPolicy.h"
#include "ipc/Frame.h"
#include "ipc/ClientSessionWire.h"
#include "ipc/Listener.h"
#include "platform/FileUtil.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "session/tests/RecordingBackend.h"
#include "tests/support/TempRoot.h"
#include "zerith/Zerith.h"
#include "zerith/ZerithConstants.h"

extern char** environ;

// Allocations made by the calling thread (every malloc, calloc and realloc,
// counted on the way to glibc's allocator), for the client benchmarks.
namespace {
thread_local std::uint64_t threadAllocations = 0;
}
extern "C" {
void* __libc_malloc(std::size_t size);
void* __libc_calloc(std::size_t n, std::size_t size);
void* __libc_realloc(void* p, std::size_t size);
void* malloc(std::size_t size) {
  ++threadAllocations;
  return __libc_malloc(size);
}
void* calloc(std::size_t n, std::size_t size) {
  ++threadAllocations;
  return __libc_calloc(n, size);
}
void* realloc(void* p, std::size_t size) {
  ++threadAllocations;
  return __libc_realloc(p, size);
}
}

namespace {

using Clock = std::chrono::steady_clock;
using namespace zerith;

constexpr auto kTimeout = std::chrono::seconds(10);

Value benchEvent(unsigned category) {
  return Value(Dictionary{{kZerithMessageParametersCategory, Value(category)},
                          {kZerithMessageParametersType, Value(2u)},
                          {kZerithMessageParametersPayload,
                           Value(Dictionary{{"rtt", Value(23)}, {"codec", Value("opus")}, {"loss", Value(0.01)}})}});
}

// --- The daemon side (child process) ------------------------------------------

int serve(const char* root, int readyFd) {
  paths::setRoot(root);
  log::configure(log::Options{});
  test::RecordingBackend::registerAs({"sinkA", "sinkB"});
  const Value sink(Dictionary{{"sink", Value(true)}});
  const Value storebag(Dictionary{{"sinkA", sink}, {"sinkB", sink}});
  auto agent = ZerithdAgent::create(
      std::make_shared<KeepAliveTransaction>(),
      std::make_unique<StorebagCache>(
          [] { return Date::now(); },
          [storebag](std::int32_t, std::int32_t& maxAge, Value& version, bool&) {
            maxAge = 3600;
            version = Value("1");
            return storebag;
          },
          [](const std::string&) { return std::optional<Date>(); }));
  auto listener = ipc::Listener::create(paths::socketPath(), std::make_shared<const ipc::EntitlementPolicy>());
  if (!listener) {
    return 1;
  }
  listener->setDelegate(agent.get());
  listener->resume();
  const char ready = 'r';
  if (::write(readyFd, &ready, 1) != 1) {
    return 1;
  }
  // Serve until the parent closes its end of the pipe.
  char byte = 0;
  while (::read(readyFd, &byte, 1) > 0) {
  }
  std::_Exit(0);
}

// --- The client side --------------------------------------------------------------

// Clock ticks of CPU (user + system) the process has used.
std::uint64_t cpuTicks(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(in)), {});
  const auto close = text.rfind(')');
  if (close == std::string::npos) {
    return 0;
  }
  std::istringstream fields(text.substr(close + 2));
  std::string field;
  std::uint64_t utime = 0;
  std::uint64_t stime = 0;
  for (int i = 3; fields >> field; ++i) {
    if (i == 14) {
      utime = std::stoull(field);
    } else if (i == 15) {
      stime = std::stoull(field);
      break;
    }
  }
  return utime + stime;
}

struct ServedDaemon {
  test::TempRoot root;
  pid_t pid = -1;
  file::UniqueFd control;
  bool ready = false;

  ServedDaemon() {
    const Value policy(Dictionary{{"users", Value(Array{Value(static_cast<unsigned long long>(::getuid()))})},
                                  {"entitlements", Value(Dictionary{{"com.velmar.private.zerithd", Value(true)}})}});
    root.write("/etc/zerithd/entitlements.d/bench.plist", plist::encodeXml(policy));
    root.write("/etc/machine-id", "0123456789abcdef0123456789abcdef\n");
    int fds[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
      return;
    }
    control.reset(fds[0]);
    const int childFd = ::dup(fds[1]);  // without CLOEXEC, for the child
    ::close(fds[1]);
    const std::string fd = std::to_string(childFd);
    const std::string rootPath = root.path().string();
    char* argv[] = {const_cast<char*>("/proc/self/exe"), const_cast<char*>("--serve"),
                    const_cast<char*>(rootPath.c_str()), const_cast<char*>(fd.c_str()), nullptr};
    // The daemon side's log stays off the benchmark's table.
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    if (::posix_spawn(&pid, "/proc/self/exe", &actions, nullptr, argv, environ) != 0) {
      pid = -1;
    }
    posix_spawn_file_actions_destroy(&actions);
    ::close(childFd);
    char byte = 0;
    ready = pid > 0 && ::read(control.get(), &byte, 1) == 1;
  }
  ~ServedDaemon() {
    control.reset();
    if (pid > 0) {
      int status = 0;
      ::waitpid(pid, &status, 0);
    }
  }
};

ServedDaemon& daemonProcess() {
  static ServedDaemon daemon;
  return daemon;
}

std::unique_ptr<Zerith> startedClient(const Value& sessionInfo) {
  auto client = Zerith::connect();
  if (!client || !client->setSessionInfo(sessionInfo, Value(), Value(), false, kTimeout)) {
    return nullptr;
  }
  const auto started = client->startConfig(kTimeout);
  if (!started || started["backends"].count() != 2) {
    return nullptr;
  }
  return client;
}

Value sessionInfo(std::uint32_t id, const std::optional<std::string>& token = {}, long long level = 0) {
  Dictionary d{{kZerithSessionInfoSessionID, Value(id)}, {kZerithSessionInfoClientType, Value(7)}};
  if (token) {
    d.set(kZerithSessionInfoHierarchyToken, Value(Dictionary{{kZerithHierarchyTokenTokenID, Value(*token)},
                                                             {kZerithHierarchyTokenLevel, Value(level)}}));
  }
  return Value(std::move(d));
}

// A started session of one client against the served daemon, or nullptr
// with the benchmark skipped and told why.
std::unique_ptr<Zerith> startedClientOrSkip(benchmark::State& state, const Value& info) {
  if (!daemonProcess().ready) {
    state.SkipWithError("the daemon side did not start");
    return nullptr;
  }
  auto client = startedClient(info);
  if (!client) {
    state.SkipWithError("the session did not start");
  }
  return client;
}

void runEvents(benchmark::State& state, std::vector<std::unique_ptr<Zerith>>& clients) {
  auto& daemon = daemonProcess();
  const std::uint64_t before = cpuTicks(daemon.pid);
  std::uint64_t events = 0;
  std::vector<double> micros;
  for (auto _ : state) {
    auto& client = clients[events % clients.size()];
    const auto start = Clock::now();
    if (!client->sendMessage(benchEvent(static_cast<unsigned>(events % 50) + 1), kTimeout)) {
      state.SkipWithError("sendMessage failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    ++events;
  }
  const std::uint64_t ticks = cpuTicks(daemon.pid) - before;
  if (events > 0) {
    state.counters["daemon_cpu_us_per_event"] =
        static_cast<double>(ticks) * 1e6 / static_cast<double>(::sysconf(_SC_CLK_TCK)) / static_cast<double>(events);
    std::sort(micros.begin(), micros.end());
    state.counters["p50_us"] = micros[micros.size() / 2];
    state.counters["p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
    state.SetItemsProcessed(static_cast<std::int64_t>(events));
  }
}

void BM_OneSessionTwoBackends(benchmark::State& state) {
  if (!daemonProcess().ready) {
    state.SkipWithError("the daemon side did not start");
    return;
  }
  std::vector<std::unique_ptr<Zerith>> clients;
  clients.push_back(startedClient(sessionInfo(1)));
  if (!clients[0]) {
    state.SkipWithError("the session did not start with two backends");
    return;
  }
  runEvents(state, clients);
}
BENCHMARK(BM_OneSessionTwoBackends)->UseRealTime()->MinTime(3.0);

void BM_TenSessionsOneHierarchy(benchmark::State& state) {
  if (!daemonProcess().ready) {
    state.SkipWithError("the daemon side did not start");
    return;
  }
  static std::uint32_t run = 0;
  const std::string token = "bench-" + std::to_string(++run);
  std::vector<std::unique_ptr<Zerith>> clients;
  for (std::uint32_t level = 0; level < 10; ++level) {
    clients.push_back(startedClient(sessionInfo(100 + level, token, level)));
    if (!clients.back()) {
      state.SkipWithError("a session did not start with two backends");
      return;
    }
  }
  if (!clients[0]->updateSharedData(Value(Dictionary{{"call", Value("bench")}, {"room", Value(7)}}), kTimeout)) {
    state.SkipWithError("updateSharedData failed");
    return;
  }
  runEvents(state, clients);
}
BENCHMARK(BM_TenSessionsOneHierarchy)->UseRealTime()->MinTime(3.0);

// A second reference on the same daemon side: a call that reaches the
// session and is answered without any dispatch (no backend, no aggregator,
// no agent lock), so that the difference to the runs above is what the
// dispatch of one event costs.
void BM_SameDaemonFetchDisplayURL(benchmark::State& state) {
  auto client = startedClientOrSkip(state, sessionInfo(2));
  if (!client) {
    return;
  }
  auto& daemon = daemonProcess();
  const std::uint64_t before = cpuTicks(daemon.pid);
  std::int64_t calls = 0;
  for (auto _ : state) {
    if (!client->fetchDisplayURL(kTimeout)) {
      state.SkipWithError("fetchDisplayURL failed");
      break;
    }
    ++calls;
  }
  if (calls > 0) {
    state.counters["daemon_cpu_us_per_call"] = static_cast<double>(cpuTicks(daemon.pid) - before) * 1e6 /
                                               static_cast<double>(::sysconf(_SC_CLK_TCK)) /
                                               static_cast<double>(calls);
    state.SetItemsProcessed(calls);
  }
}
BENCHMARK(BM_SameDaemonFetchDisplayURL)->UseRealTime()->MinTime(3.0);

// The reference: the same two frames moved by the kernel between two
// threads, nothing decoded.
bool writeAll(int fd, const Data& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

bool readFrame(int fd, std::vector<std::uint8_t>& body) {
  std::uint8_t header[4];
  std::size_t done = 0;
  while (done < 4) {
    const ssize_t n = ::read(fd, header + done, 4 - done);
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  const std::uint32_t size = (std::uint32_t{header[0]} << 24) | (std::uint32_t{header[1]} << 16) |
                             (std::uint32_t{header[2]} << 8) | header[3];
  body.resize(size);
  done = 0;
  while (done < size) {
    const ssize_t n = ::read(fd, body.data() + done, size - done);
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

void BM_UnixSocketEcho(benchmark::State& state) {
  file::UniqueFd client;
  file::UniqueFd server;
  if (!bench::socketPair(state, client, server)) {
    return;
  }
  const Data request =
      ipc::encodeCall("sendMessageWithDictionary:reply:", 1, Dictionary{{"message", benchEvent(1)}});
  const Data reply = ipc::encodeReply(1, Dictionary{});
  std::thread echo([fd = server.get(), &reply] {
    std::vector<std::uint8_t> body;
    while (readFrame(fd, body) && writeAll(fd, reply)) {
    }
  });
  std::vector<std::uint8_t> body;
  std::int64_t n = 0;
  for (auto _ : state) {
    if (!writeAll(client.get(), request) || !readFrame(client.get(), body)) {
      state.SkipWithError("echo failed");
      break;
    }
    ++n;
  }
  ::shutdown(client.get(), SHUT_RDWR);
  echo.join();
  state.counters["request_bytes"] = static_cast<double>(request.size());
  state.SetItemsProcessed(n);
}
BENCHMARK(BM_UnixSocketEcho)->UseRealTime()->MinTime(2.0);

// --- The client's side of one event -------------------------------------------------
//
// The framework's work for one event, from the call to its return, on the
// calling thread (the CPU column: that thread's CPU time) and in the whole
// client process (client_process_cpu_us_per_event: with the socket thread
// that writes out what the socket did not take at once and reads replies),
// against the daemon side above. The events' Values are built beforehand:
// building one is the caller's cost either way. The reference is a bare
// send() of the same frame on a Unix socket whose far end a thread reads and
// discards, so that the ratio to it says what the framework adds to the one
// system call an event needs.

constexpr std::size_t kClientEvents = 64;

std::vector<Value> clientEvents() {
  std::vector<Value> events;
  for (std::size_t i = 0; i < kClientEvents; ++i) {
    events.emplace_back(Dictionary{{kZerithMessageParametersCategory, Value(unsigned{bench::kEventCategory})},
                                   {kZerithMessageParametersType, Value(unsigned{bench::kEventType})},
                                   {kZerithMessageParametersPayload, bench::eventPayload(i)}});
  }
  return events;
}

double cpuSeconds(clockid_t clock) {
  timespec t{};
  ::clock_gettime(clock, &t);
  return static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_nsec) * 1e-9;
}

// Counts the process's CPU, the calling thread's allocations and the
// daemon's CPU over a client run.
struct ClientCounters {
  double process = cpuSeconds(CLOCK_PROCESS_CPUTIME_ID);
  std::uint64_t allocations = threadAllocations;
  std::uint64_t daemonTicks = cpuTicks(daemonProcess().pid);
  void report(benchmark::State& state, std::int64_t events) const {
    if (events <= 0) {
      return;
    }
    const auto n = static_cast<double>(events);
    state.counters["client_process_cpu_us_per_event"] = (cpuSeconds(CLOCK_PROCESS_CPUTIME_ID) - process) * 1e6 / n;
    state.counters["allocs_per_event"] = static_cast<double>(threadAllocations - allocations) / n;
    state.counters["daemon_cpu_us_per_event"] = static_cast<double>(cpuTicks(daemonProcess().pid) - daemonTicks) *
                                                1e6 / static_cast<double>(::sysconf(_SC_CLK_TCK)) / n;
    state.SetItemsProcessed(events);
  }
};

void BM_ClientOneWayEvent(benchmark::State& state) {
  auto client = startedClientOrSkip(state, sessionInfo(3));
  if (!client) {
    return;
  }
  const auto events = clientEvents();
  const ClientCounters counters;
  std::int64_t sent = 0;
  for (auto _ : state) {
    client->sendMessageWithDictionary(events[static_cast<std::size_t>(sent) % kClientEvents], nullptr);
    ++sent;
  }
  // Everything sent reached the daemon before the run counts.
  if (!client->flushMessages(std::chrono::seconds(60)) || !client->isValid()) {
    state.SkipWithError("the flush after the events failed");
    return;
  }
  counters.report(state, sent);
}
BENCHMARK(BM_ClientOneWayEvent)->MinTime(2.0);

void BM_ClientEventWithReply(benchmark::State& state) {
  auto client = startedClientOrSkip(state, sessionInfo(4));
  if (!client) {
    return;
  }
  struct Window {
    std::mutex mutex;
    std::condition_variable answered;
    std::int64_t outstanding = 0;
  };
  auto window = std::make_shared<Window>();
  const auto events = clientEvents();
  const ClientCounters counters;
  std::int64_t sent = 0;
  for (auto _ : state) {
    {
      std::unique_lock lock(window->mutex);
      if (!window->answered.wait_for(lock, kTimeout, [&] { return window->outstanding < 256; })) {
        state.SkipWithError("no reply for 10 s");
        return;
      }
      ++window->outstanding;
    }
    client->sendMessageWithDictionary(events[static_cast<std::size_t>(sent) % kClientEvents], [window](Value) {
      std::lock_guard lock(window->mutex);
      --window->outstanding;
      window->answered.notify_one();
    });
    ++sent;
  }
  std::unique_lock lock(window->mutex);
  if (!window->answered.wait_for(lock, std::chrono::seconds(60), [&] { return window->outstanding == 0; })) {
    state.SkipWithError("replies missing after 60 s");
    return;
  }
  counters.report(state, sent);
}
BENCHMARK(BM_ClientEventWithReply)->MinTime(2.0);

void BM_BareSendOfTheEventFrame(benchmark::State& state) {
  file::UniqueFd near;
  file::UniqueFd far;
  if (!bench::socketPair(state, near, far)) {
    return;
  }
  std::thread reader([fd = far.get()] {
    std::vector<std::uint8_t> buffer(64 << 10);
    while (::read(fd, buffer.data(), buffer.size()) > 0) {
    }
  });
  const Data frame = ipc::encodeCall(ipc::wire::kSendMessage, std::nullopt,
                                     ipc::wire::sendMessageArgs(clientEvents()[0]));
  const ClientCounters counters;
  std::int64_t sent = 0;
  for (auto _ : state) {
    if (!writeAll(near.get(), frame)) {
      state.SkipWithError("send failed");
      break;
    }
    ++sent;
  }
  ::shutdown(near.get(), SHUT_RDWR);
  reader.join();
  state.counters["frame_bytes"] = static_cast<double>(frame.size());
  counters.report(state, sent);
}
BENCHMARK(BM_BareSendOfTheEventFrame)->MinTime(2.0);

}  // namespace

int main(int argc, char** argv) {
  if (argc == 4 && std::strcmp(argv[1], "--serve") == 0) {
    return serve(argv[2], std::atoi(argv[3]));
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
    return 1;
  }
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
