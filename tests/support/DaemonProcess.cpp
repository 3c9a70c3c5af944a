#include "tests/support/DaemonProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
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

// "2024-05-01 10:00:00.123456 daemon[debug] text" -> level and text; a line
// of another shape counts as an error with its whole text.
std::pair<log::Level, std::string> parseLine(const std::string& line) {
  const auto open = line.find('[');
  const auto close = line.find("] ", open == std::string::npos ? 0 : open);
  if (open == std::string::npos || close == std::string::npos) {
    return {log::Level::Error, line};
  }
  const std::string level = line.substr(open + 1, close - open - 1);
  if (level == "debug" || level == "trace") {
    return {log::Level::Debug, line.substr(close + 2)};
  }
  if (level == "error" || level == "critical") {
    return {log::Level::Error, line.substr(close + 2)};
  }
  if (level == "info" || level == "warning") {
    return {log::Level::Default, line.substr(close + 2)};
  }
  return {log::Level::Error, line};
}

sockaddr_un unixAddress(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
  return address;
}

std::filesystem::path daemonBinary() {
  if (const char* env = std::getenv("ZERITHD_BINARY"); env && *env) {
    return env;
  }
  return buildDir() / "daemon" / "zerithd";
}

}  // namespace

DaemonProcess::DaemonProcess(const TempRoot& root, Options options) {
  int errPipe[2];
  int wake[2];
  if (::pipe2(errPipe, O_CLOEXEC) != 0 || ::pipe2(wake, O_CLOEXEC) != 0) {
    throw std::runtime_error("pipe2 failed");
  }
  stderrRead_.reset(errPipe[0]);
  file::UniqueFd stderrWrite(errPipe[1]);
  wakeRead_.reset(wake[0]);
  wakeWrite_.reset(wake[1]);

  const std::filesystem::path notifyPath = root.path() / "notify.sock";
  // A daemon killed in this root earlier leaves its notify socket bound.
  std::filesystem::remove(notifyPath);
  notifySocket_.reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  const sockaddr_un addr = unixAddress(notifyPath.string());
  if (!notifySocket_ || ::bind(notifySocket_.get(), reinterpret_cast<const sockaddr*>(&addr), sizeof(addr)) != 0) {
    throw std::runtime_error("cannot bind the notify socket");
  }

  std::vector<std::string> args = {daemonBinary().string(), "--root", root.path().string()};
  if (options.debug) {
    args.emplace_back("--debug");
  }
  args.insert(args.end(), options.arguments.begin(), options.arguments.end());
  // Ours, without what would tie the child to our own service manager, and
  // with the test's own variables.
  std::vector<std::string> env;
  for (char** e = environ; e && *e; ++e) {
    const std::string_view name = std::string_view(*e).substr(0, std::string_view(*e).find('='));
    const bool overridden = name == "NOTIFY_SOCKET" || name == "JOURNAL_STREAM" || name == "ZERITHD_ROOT" ||
                            name == "LISTEN_FDS" || name == "LISTEN_PID" ||
                            std::any_of(options.environment.begin(), options.environment.end(),
                                        [&](const auto& kv) { return kv.first == name; });
    if (!overridden) {
      env.emplace_back(*e);
    }
  }
  env.push_back("NOTIFY_SOCKET=" + notifyPath.string());
  for (const auto& [k, v] : options.environment) {
    env.push_back(k + "=" + v);
  }
  child_ =
      std::make_unique<ChildProcess>(args, std::vector<std::pair<int, int>>{{stderrWrite.get(), STDERR_FILENO}}, env);
  reader_ = std::thread([this] { readLoop(); });
  std::unique_lock lock(mutex_);
  changed_.wait_for(lock, options.readyTimeout, [this] { return ready_ || !stderrRead_; });
}

DaemonProcess::~DaemonProcess() {
  // Stopped as the service manager stops it, so that its exit path runs (and
  // a coverage build writes the daemon's counters); a daemon still draining
  // sessions after that is killed.
  if (running() && !stop(std::chrono::milliseconds(2000))) {
    signal(SIGKILL);
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
  char buf[4096];
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
        ::fcntl(stderrRead_.get(), F_SETFL, O_NONBLOCK);
        ssize_t n;
        while ((n = ::read(stderrRead_.get(), buf, sizeof buf)) > 0) consumeOutput({buf, static_cast<std::size_t>(n)});
      }
      return;
    }
    if (fds[1].revents & POLLIN) {
      const ssize_t n = ::recv(notifySocket_.get(), buf, sizeof buf, 0);
      std::lock_guard lock(mutex_);
      std::string_view message(buf, n > 0 ? static_cast<std::size_t>(n) : 0);
      while (!message.empty()) {
        const std::string_view item = message.substr(0, message.find('\n'));
        ready_ = ready_ || item == "READY=1";
        notifications_.emplace_back(item);
        message.remove_prefix(std::min(message.size(), item.size() + 1));
      }
      changed_.notify_all();
    }
    if (stderrOpen && (fds[2].revents & (POLLIN | POLLHUP | POLLERR))) {
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
  for (std::size_t newline; (newline = partial_.find('\n')) != std::string::npos;) {
    auto [level, text] = parseLine(partial_.substr(0, newline));
    lines_.push_back({level, std::move(text)});
    partial_.erase(0, newline + 1);
  }
  changed_.notify_all();
}

bool DaemonProcess::ready() const {
  std::lock_guard lock(mutex_);
  return ready_;
}

std::string DaemonProcess::output() const {
  std::lock_guard lock(mutex_);
  return output_;
}

std::vector<std::string> DaemonProcess::notifications() const {
  std::lock_guard lock(mutex_);
  return notifications_;
}

std::size_t DaemonProcess::countLines(const Match& match) const {
  return static_cast<std::size_t>(std::count_if(lines_.begin(), lines_.end(), match));
}

std::size_t DaemonProcess::countNow(const Match& match) const {
  std::lock_guard lock(mutex_);
  return countLines(match);
}

bool DaemonProcess::waitLines(const Match& match, std::size_t occurrences, std::chrono::milliseconds timeout) const {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] { return countLines(match) >= occurrences; });
}

namespace {
auto containing(std::string_view needle) {
  return [needle](const auto& l) { return l.text.find(needle) != std::string::npos; };
}
auto exactly(log::Level level, std::string_view text) {
  return [level, text](const auto& l) { return l.level == level && l.text == text; };
}
}  // namespace

std::size_t DaemonProcess::count(std::string_view needle) const { return countNow(containing(needle)); }

std::size_t DaemonProcess::countExact(log::Level level, std::string_view text) const {
  return countNow(exactly(level, text));
}

bool DaemonProcess::waitFor(std::string_view needle, std::size_t occurrences, std::chrono::milliseconds timeout) const {
  return waitLines(containing(needle), occurrences, timeout);
}

bool DaemonProcess::waitForExact(log::Level level, std::string_view text, std::size_t occurrences,
                                 std::chrono::milliseconds timeout) const {
  return waitLines(exactly(level, text), occurrences, timeout);
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
  const auto status = child_->waitForExit(timeout);
  if (status) {
    // Everything the process wrote is read before the caller looks at it.
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, std::max(timeout, std::chrono::milliseconds(5000)), [this] { return !stderrRead_; });
  }
  return status;
}

std::unique_ptr<DaemonProcess> startEntitledDaemon(TempRoot& root, const char* builtBinary) {
  ::setenv("ZERITHD_BINARY", builtBinary, /*overwrite=*/0);
  const Value policy(Dictionary{{"users", Value(Array{Value(static_cast<unsigned long long>(::getuid()))})},
                                {"entitlements", Value(Dictionary{{"com.velmar.private.zerithd", Value(true)}})}});
  root.write("/etc/zerithd/entitlements.d/bench.plist", plist::encodeXml(policy));
  return std::make_unique<DaemonProcess>(root,
                                         DaemonProcess::Options{.arguments = {"--stop-timeout", "5"}, .debug = false});
}

file::UniqueFd connectToDaemonSocket() {
  file::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const sockaddr_un addr = unixAddress(paths::socketPath().string());
  if (!fd || ::connect(fd.get(), reinterpret_cast<const sockaddr*>(&addr), sizeof(addr)) != 0) {
    return file::UniqueFd();
  }
  return fd;
}

}  // namespace zerith::test
