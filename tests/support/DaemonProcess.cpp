#include "tests/support/DaemonProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <stdexcept>

#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "platform/Value.h"
#include "tests/support/TempRoot.h"

extern char** environ;

namespace zerith::test {

namespace {

using Clock = std::chrono::steady_clock;

int remainingMs(Clock::time_point deadline) {
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return left < 0 ? 0 : static_cast<int>(left);
}

// "2024-05-01 10:00:00.123456 daemon[debug] text" -> level and text.
std::optional<std::pair<log::Level, std::string>> parseLine(const std::string& line) {
  const auto open = line.find('[');
  const auto close = line.find("] ", open == std::string::npos ? 0 : open);
  if (open == std::string::npos || close == std::string::npos) {
    return std::nullopt;
  }
  const std::string level = line.substr(open + 1, close - open - 1);
  log::Level l = log::Level::Default;
  if (level == "debug" || level == "trace") {
    l = log::Level::Debug;
  } else if (level == "error" || level == "critical") {
    l = log::Level::Error;
  } else if (level != "info" && level != "warning") {
    return std::nullopt;
  }
  return std::make_pair(l, line.substr(close + 2));
}

}  // namespace

std::filesystem::path DaemonProcess::binary() {
  if (const char* env = std::getenv("ZERITHD_BINARY"); env && *env) {
    return env;
  }
  return buildDir() / "daemon" / "zerithd";
}

DaemonProcess::DaemonProcess(const TempRoot& root) : DaemonProcess(root, Options{}) {}

DaemonProcess::DaemonProcess(const TempRoot& root, Options options) {
  start(root, options);
  std::unique_lock lock(mutex_);
  changed_.wait_for(lock, options.readyTimeout, [this] { return ready_ || !stderrRead_; });
}

void DaemonProcess::start(const TempRoot& root, const Options& options) {
  int errPipe[2];
  int wake[2];
  if (::pipe2(errPipe, O_CLOEXEC) != 0 || ::pipe2(wake, O_CLOEXEC) != 0) {
    throw std::runtime_error("pipe2 failed");
  }
  stderrRead_.reset(errPipe[0]);
  file::UniqueFd stderrWrite(errPipe[1]);
  wakeRead_.reset(wake[0]);
  wakeWrite_.reset(wake[1]);

  notifyPath_ = root.path() / "notify.sock";
  // A daemon killed in this root earlier leaves its notify socket bound.
  std::filesystem::remove(notifyPath_);
  notifySocket_.reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, notifyPath_.c_str(), sizeof(addr.sun_path) - 1);
  if (!notifySocket_ || ::bind(notifySocket_.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    throw std::runtime_error("cannot bind the notify socket");
  }

  std::vector<std::string> args = {binary().string(), "--root", root.path().string()};
  if (options.debug) {
    args.emplace_back("--debug");
  }
  args.insert(args.end(), options.arguments.begin(), options.arguments.end());

  std::vector<std::string> env;
  auto overridden = [&](std::string_view entry) {
    const auto name = entry.substr(0, entry.find('='));
    if (name == "NOTIFY_SOCKET" || name == "JOURNAL_STREAM" || name == "ZERITHD_ROOT" || name == "LISTEN_FDS" ||
        name == "LISTEN_PID") {
      return true;
    }
    return std::any_of(options.environment.begin(), options.environment.end(),
                       [&](const auto& kv) { return kv.first == name; });
  };
  for (char** e = environ; e && *e; ++e) {
    if (!overridden(*e)) {
      env.emplace_back(*e);
    }
  }
  env.push_back("NOTIFY_SOCKET=" + notifyPath_.string());
  for (const auto& [k, v] : options.environment) {
    env.push_back(k + "=" + v);
  }

  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  std::vector<char*> envp;
  for (auto& e : env) envp.push_back(e.data());
  envp.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, stderrWrite.get(), STDERR_FILENO);
  posix_spawnattr_t attr;
  posix_spawnattr_init(&attr);
  // The child starts with no signal blocked, whatever this thread blocks.
  sigset_t none;
  sigemptyset(&none);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK);
  const int rc = posix_spawn(&pid_, argv[0], &actions, &attr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attr);
  if (rc != 0) {
    throw std::runtime_error("cannot start " + args[0] + ": " + std::strerror(rc));
  }
  pidFd_.reset(static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0)));
  reader_ = std::thread([this] { readLoop(); });
}

DaemonProcess::~DaemonProcess() {
  if (running()) {
    ::kill(pid_, SIGKILL);
    waitForExit(std::chrono::milliseconds(10000));
  }
  if (wakeWrite_) {
    const char byte = 0;
    [[maybe_unused]] const auto n = ::write(wakeWrite_.get(), &byte, 1);
  }
  if (reader_.joinable()) {
    reader_.join();
  }
}

void DaemonProcess::readLoop() {
  bool stderrOpen = true;
  for (;;) {
    pollfd fds[3] = {{wakeRead_.get(), POLLIN, 0},
                     {notifySocket_.get(), POLLIN, 0},
                     {stderrOpen ? stderrRead_.get() : -1, POLLIN, 0}};
    if (::poll(fds, 3, -1) < 0) {
      if (errno == EINTR) continue;
      return;
    }
    if (fds[0].revents) {
      // Drain what the process still wrote, then stop.
      if (stderrOpen) {
        char buf[4096];
        ::fcntl(stderrRead_.get(), F_SETFL, O_NONBLOCK);
        ssize_t n;
        while ((n = ::read(stderrRead_.get(), buf, sizeof buf)) > 0) consumeOutput({buf, static_cast<std::size_t>(n)});
      }
      return;
    }
    if (fds[1].revents & POLLIN) {
      char buf[4096];
      const ssize_t n = ::recv(notifySocket_.get(), buf, sizeof buf, 0);
      if (n > 0) {
        std::lock_guard lock(mutex_);
        std::string message(buf, static_cast<std::size_t>(n));
        std::size_t start = 0;
        while (start < message.size()) {
          auto end = message.find('\n', start);
          if (end == std::string::npos) end = message.size();
          const auto item = message.substr(start, end - start);
          if (item == "READY=1") ready_ = true;
          notifications_.push_back(item);
          start = end + 1;
        }
        changed_.notify_all();
      }
    }
    if (stderrOpen && (fds[2].revents & (POLLIN | POLLHUP | POLLERR))) {
      char buf[4096];
      const ssize_t n = ::read(stderrRead_.get(), buf, sizeof buf);
      if (n > 0) {
        consumeOutput({buf, static_cast<std::size_t>(n)});
      } else if (n == 0 || errno != EINTR) {
        stderrOpen = false;
        std::lock_guard lock(mutex_);
        stderrRead_.reset();
        changed_.notify_all();
      }
    }
  }
}

void DaemonProcess::consumeOutput(std::string_view bytes) {
  std::lock_guard lock(mutex_);
  output_.append(bytes);
  partial_.append(bytes);
  std::size_t newline;
  while ((newline = partial_.find('\n')) != std::string::npos) {
    const std::string line = partial_.substr(0, newline);
    partial_.erase(0, newline + 1);
    if (auto parsed = parseLine(line)) {
      lines_.push_back({parsed->first, std::move(parsed->second)});
    } else {
      lines_.push_back({log::Level::Error, line});
    }
  }
  changed_.notify_all();
}

bool DaemonProcess::ready() const {
  std::lock_guard lock(mutex_);
  return ready_;
}

bool DaemonProcess::running() {
  if (pid_ <= 0 || exitStatus_) {
    return false;
  }
  return !waitForExit(std::chrono::milliseconds(0));
}

std::string DaemonProcess::output() const {
  std::lock_guard lock(mutex_);
  return output_;
}

template <typename Match>
std::size_t DaemonProcess::countLines(Match match) const {
  return static_cast<std::size_t>(std::count_if(lines_.begin(), lines_.end(), match));
}

std::size_t DaemonProcess::count(std::string_view needle) const {
  std::lock_guard lock(mutex_);
  return countLines([&](const Line& l) { return l.text.find(needle) != std::string::npos; });
}

std::size_t DaemonProcess::countExact(log::Level level, std::string_view text) const {
  std::lock_guard lock(mutex_);
  return countLines([&](const Line& l) { return l.level == level && l.text == text; });
}

bool DaemonProcess::has(log::Level level, std::string_view text) const { return countExact(level, text) > 0; }

bool DaemonProcess::waitFor(std::string_view needle, std::size_t occurrences, std::chrono::milliseconds timeout) const {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] {
    return countLines([&](const Line& l) { return l.text.find(needle) != std::string::npos; }) >= occurrences;
  });
}

bool DaemonProcess::waitForExact(log::Level level, std::string_view text, std::size_t occurrences,
                                 std::chrono::milliseconds timeout) const {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] {
    return countLines([&](const Line& l) { return l.level == level && l.text == text; }) >= occurrences;
  });
}

std::vector<std::string> DaemonProcess::notifications() const {
  std::lock_guard lock(mutex_);
  return notifications_;
}

void DaemonProcess::signal(int sig) {
  if (pid_ > 0 && !exitStatus_) {
    ::kill(pid_, sig);
  }
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
  if (exitStatus_) {
    return exitStatus_;
  }
  if (pid_ <= 0) {
    return std::nullopt;
  }
  const auto deadline = Clock::now() + timeout;
  if (pidFd_) {
    pollfd fd{pidFd_.get(), POLLIN, 0};
    int rc;
    do {
      rc = ::poll(&fd, 1, remainingMs(deadline));
    } while (rc < 0 && errno == EINTR);
    if (rc == 0) {
      return std::nullopt;
    }
  }
  int status = 0;
  const pid_t done = ::waitpid(pid_, &status, pidFd_ ? 0 : WNOHANG);
  if (done != pid_) {
    return std::nullopt;
  }
  exitStatus_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  // Everything the process wrote is read before the caller looks at it.
  std::unique_lock lock(mutex_);
  changed_.wait_until(lock, std::max(deadline, Clock::now() + std::chrono::seconds(5)), [this] { return !stderrRead_; });
  return exitStatus_;
}

std::optional<int> DaemonProcess::stop(std::chrono::milliseconds timeout) {
  signal(SIGTERM);
  return waitForExit(timeout);
}

std::unique_ptr<DaemonProcess> startEntitledDaemon(TempRoot& root, const char* builtBinary) {
  if (!std::getenv("ZERITHD_BINARY")) {
    ::setenv("ZERITHD_BINARY", builtBinary, 1);
  }
  const Value policy(Dictionary{{"users", Value(Array{Value(static_cast<unsigned long long>(::getuid()))})},
                                {"entitlements", Value(Dictionary{{"com.velmar.private.zerithd", Value(true)}})}});
  root.write("/etc/zerithd/entitlements.d/bench.plist", plist::encodeXml(policy));
  DaemonProcess::Options options;
  options.debug = false;
  options.arguments = {"--stop-timeout", "5"};
  return std::make_unique<DaemonProcess>(root, options);
}

file::UniqueFd connectToDaemonSocket() {
  file::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  const std::string path = paths::socketPath().string();
  std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  if (!fd || ::connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    return file::UniqueFd();
  }
  return fd;
}

}  // namespace zerith::test
