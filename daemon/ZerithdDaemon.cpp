#include "daemon/ZerithdDaemon.h"

#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <system_error>
#include <thread>

#include <asio/post.hpp>
#include <fmt/format.h>

#include <systemd/sd-daemon.h>

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif
#if defined(ZERITH_COVERAGE)
// _Exit skips the exit handler that writes the coverage counters.
extern "C" void __gcov_dump(void);
#endif

#include "backends/Spool.h"
#include "config/DeviceInfo.h"
#include "config/StorebagVerify.h"
#include "daemon/KeepAliveTransaction.h"
#include "daemon/StorebagCache.h"
#include "daemon/Watchdog.h"
#include "daemon/ZerithdAgent.h"
#include "ipc/EntitlementPolicy.h"
#include "ipc/Listener.h"
#include "platform/DefaultsKeys.h"
#include "platform/Executors.h"
#include "platform/Log.h"
#include "platform/ThreadPools.h"
#include "platform/Paths.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/TransferEngine.h"
#include "transport/URLSession.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* l = new log::Logger("daemon");
  return *l;
}

// From linux/ioprio.h, which older kernels' headers lack.
constexpr int kIoprioClassShift = 13;
constexpr int kIoprioClassBestEffort = 2;
constexpr int kIoprioWhoProcess = 1;

// SIGTERM and SIGINT stop the daemon; SIGHUP drops the cached storebags.
sigset_t stopSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGHUP);
  return set;
}

// The heartbeats' roads: every pool, the transport thread and its delegate
// queue, each socket thread, and the agent lock (taken on the general pool).
std::vector<Watchdog::Probe> watchdogProbes(const std::weak_ptr<ZerithdAgent>& agent) {
  std::vector<Watchdog::Probe> probes;
  probes.push_back({"the general pool and the agent lock", [agent](std::function<void()> beat) {
                      asio::post(ioContext(Pool::General), [agent, beat = std::move(beat)] {
                        if (const auto a = agent.lock()) {
                          std::lock_guard lock(a->agentLock());
                        }
                        beat();
                      });
                    }});
  probes.push_back({"the transport pool", [](std::function<void()> beat) {
                      asio::post(ioContext(Pool::Transport), std::move(beat));
                    }});
  probes.push_back({"the main operation queue",
                    [](std::function<void()> beat) { mainOperationQueue().async(std::move(beat)); }});
  probes.push_back({"the transport thread",
                    [](std::function<void()> beat) { TransferEngine::instance().post(std::move(beat)); }});
  const auto contexts = socketContexts();
  for (std::size_t i = 0; i < contexts.size(); ++i) {
    probes.push_back({fmt::format("socket thread {}", i + 1), [context = contexts[i]](std::function<void()> beat) {
                        asio::post(*context, std::move(beat));
                      }});
  }
  return probes;
}

std::unique_ptr<Watchdog> startWatchdog(const std::shared_ptr<ZerithdAgent>& agent) {
  const auto period = Watchdog::periodFromEnvironment();
  if (!period) {
    return nullptr;
  }
  logger().info("main: Watchdog on, pinging every {} ms while the daemon makes progress", period->count());
  // Test hook: wedges the main operation queue for good after a delay, so
  // that a test sees the pings stop.
  if (const char* wedge = std::getenv("ZERITHD_TEST_WEDGE_MAIN_QUEUE_AFTER_MS"); wedge && *wedge) {
    const auto delay = std::chrono::milliseconds(std::strtoll(wedge, nullptr, 10));
    logger().error("main: Test hook: the main operation queue wedges in {} ms", delay.count());
    mainOperationQueue().after(delay, [] {
      for (;;) {
        std::this_thread::sleep_for(std::chrono::hours(1));
      }
    });
  }
  return std::make_unique<Watchdog>(*period, watchdogProbes(agent), [](const char* state) { sd_notify(0, state); });
}

}  // namespace

ZerithdDaemon::ZerithdDaemon(DaemonOptions options) : options_(std::move(options)) {}

void ZerithdDaemon::blockStopSignals() {
  const sigset_t set = stopSignals();
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

void ZerithdDaemon::ignoreWriteSignals() {
  struct sigaction ignore {};
  ignore.sa_handler = SIG_IGN;
  sigemptyset(&ignore.sa_mask);
  sigaction(SIGPIPE, &ignore, nullptr);
  sigaction(SIGXFSZ, &ignore, nullptr);
}

void ZerithdDaemon::setUtilityQualityOfService() {
  // Linux keeps the nice value per thread; threads started later inherit it.
  if (setpriority(PRIO_PROCESS, 0, 10) != 0) {
    logger().debug("main: Unable to lower the scheduling priority: {}", std::strerror(errno));
  }
  const int ioprio = (kIoprioClassBestEffort << kIoprioClassShift) | 7;
  if (syscall(SYS_ioprio_set, kIoprioWhoProcess, 0, ioprio) != 0) {
    logger().debug("main: Unable to lower the I/O priority: {}", std::strerror(errno));
  }
}

int ZerithdDaemon::run() {
  setUtilityQualityOfService();
  logger().info("startLogging: Daemon starts logging...");

  std::error_code ec;
  std::filesystem::create_directories(paths::socketPath().parent_path(), ec);
  if (ec) {
    logger().error("main: Unable to create the runtime folder {}: {}", paths::socketPath().parent_path().string(),
                   ec.message());
    return 1;
  }
  if (options_.caFile && !URLSession::setExtraCAFile(options_.caFile->string())) {
    logger().error("main: Unable to load CA certificates from {}", options_.caFile->string());
    return 1;
  }
  ReportingSessionConnectivityHelper::cleanupStorageRootFolder();
  // Batches that an earlier run spooled go out now, whether or not a
  // client comes back: each file carries its URL and headers.
  Spool::shared();

  auto listener = ipc::Listener::create(paths::socketPath(), std::make_shared<const ipc::EntitlementPolicy>());
  if (!listener) {
    logger().error("main: Unable to listen on {}", paths::socketPath().string());
    return 1;
  }
  const auto limits = ipc::ConnectionLimits::forThisProcess("com.velmar.zerith");
  listener->setConnectionLimits(limits);
  logger().info("main: at most {} client connections, {} per user", limits.total, limits.perUid);
  // A misspelt key or a value out of range would otherwise be ignored
  // without a word, or only when a session first reads it.
  for (const std::string& problem : defaultsDomainProblems(kZerithDomain)) {
    logger().error("main: {}", problem);
  }
  const auto transaction = std::make_shared<KeepAliveTransaction>();
  const auto agent = ZerithdAgent::create(transaction, std::make_unique<StorebagCache>());
  listener->setDelegate(agent.get());
  listener->resume();
  logger().info("main: Listener resumes with sandbox, start loop.");
  sd_notify(0, "READY=1\nSTATUS=Listening");
  const auto watchdog = startWatchdog(agent);

  const sigset_t set = stopSignals();
  int signal = 0;
  for (;;) {
    signal = sigwaitinfo(&set, nullptr);
    if (signal < 0 && errno == EINTR) {
      continue;
    }
    if (signal != SIGHUP) {
      break;
    }
    // The operator changed the storebag server, the public key or the disk
    // cache: without this the in-memory copies stay until their max age and a
    // failed fetch is not retried for 900 seconds.
    const std::size_t dropped = agent->dropCachedStorebags();
    logger().info("main: Received SIGHUP, dropped {} cached storebag(s) and their waits; the next session fetches again",
                  dropped);
    sd_notify(0, "STATUS=Listening (cached storebags dropped)");
  }
  listener->stop();
  logger().info("main: Received signal {}, no longer accepting connections", signal);
  sd_notify(0, "STOPPING=1");
  if (transaction->isOpen()) {
    logger().info("main: Waiting up to {} ms for the keep-alive transaction to end", options_.stopTimeout.count());
    sd_notify(0, "STATUS=Draining sessions");
    if (transaction->waitUntilClosed(std::chrono::steady_clock::now() + options_.stopTimeout)) {
      logger().info("main: Keep-alive transaction ended, exiting");
    } else {
      logger().error("main: Stop time-out passed with the keep-alive transaction still open, exiting");
    }
  }
  listener.reset();
  // The count is read under the keep-alive lock: a release under way
  // finishes (and logs its end) before the process goes.
  agent->veskTransactionReference();
  return 0;
}

int ZerithdDaemon::check(std::ostream& out) const {
  std::vector<std::string> problems;
  std::vector<std::string_view> domains;
  for (const DefaultsSetting& setting : kDefaultsSettings) {
    if (std::find(domains.begin(), domains.end(), setting.domain) == domains.end()) {
      domains.push_back(setting.domain);
      for (std::string& problem : defaultsDomainProblems(setting.domain)) {
        problems.push_back(std::move(problem));
      }
    }
  }
  for (std::string& problem : storebagKeyProblems()) {
    problems.push_back(std::move(problem));
  }
  for (const std::string& problem : ipc::EntitlementPolicy().problems()) {
    problems.push_back("entitlements policy: " + problem);
  }
  if (auto problem = deviceFileProblem()) {
    problems.push_back(std::move(*problem));
  }
  if (options_.caFile && !URLSession::setExtraCAFile(options_.caFile->string())) {
    problems.push_back(fmt::format("no CA certificate can be loaded from {}", options_.caFile->string()));
  }
  for (const std::string& problem : problems) {
    out << "zerithd: " << problem << '\n';
  }
  out << (problems.empty() ? std::string("zerithd: no problems\n")
                           : fmt::format("zerithd: {} problem{}\n", problems.size(), problems.size() == 1 ? "" : "s"));
  return problems.empty() ? 0 : 1;
}

void ZerithdDaemon::exitProcess(int status) {
  spdlog::apply_all([](const std::shared_ptr<spdlog::logger>& l) { l->flush(); });
  std::fflush(stdout);
  std::fflush(stderr);
#if defined(__SANITIZE_ADDRESS__)
  __lsan_do_leak_check();
#endif
#if defined(ZERITH_COVERAGE)
  __gcov_dump();
#endif
  std::_Exit(status);
}

}  // namespace zerith
