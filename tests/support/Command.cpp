#include "tests/support/Command.h"

#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

extern char** environ;

namespace zerith::test {

CommandResult runCommand(const std::string& command, int timeoutSeconds) {
  CommandResult r;
  FILE* pipe = ::popen(("timeout " + std::to_string(timeoutSeconds) + " sh -c " + shellQuote(command)).c_str(), "r");
  if (pipe == nullptr) {
    return r;
  }
  char buffer[4096];
  for (std::size_t n; (n = std::fread(buffer, 1, sizeof(buffer), pipe)) > 0;) {
    r.output.append(buffer, n);
  }
  const int status = ::pclose(pipe);
  r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return r;
}

std::string shellQuote(const std::string& s) {
  std::string out = "'";
  for (const char c : s) {
    out += c == '\'' ? std::string("'\\''") : std::string(1, c);
  }
  return out + "'";
}

bool onPath(const std::string& tool) {
  const char* path = std::getenv("PATH");
  std::istringstream dirs(path ? path : "/usr/bin:/bin");
  std::string dir;
  while (std::getline(dirs, dir, ':')) {
    if (!dir.empty() && ::access((std::filesystem::path(dir) / tool).c_str(), X_OK) == 0) {
      return true;
    }
  }
  return false;
}

ChildProcess::ChildProcess(const std::vector<std::string>& args, const std::vector<std::pair<int, int>>& descriptors,
                           const std::optional<std::vector<std::string>>& environment) {
  const auto pointers = [](const std::vector<std::string>& strings) {
    std::vector<char*> out;
    for (const auto& s : strings) {
      out.push_back(const_cast<char*>(s.c_str()));
    }
    out.push_back(nullptr);
    return out;
  };
  const std::vector<char*> argv = pointers(args);
  const std::vector<char*> envp = environment ? pointers(*environment) : std::vector<char*>();
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  for (const auto& [ours, theirs] : descriptors) {
    posix_spawn_file_actions_adddup2(&actions, ours, theirs);
  }
  posix_spawnattr_t attr;
  posix_spawnattr_init(&attr);
  sigset_t none;
  sigemptyset(&none);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK);
  const int rc = ::posix_spawn(&pid_, argv[0], &actions, &attr, argv.data(), environment ? envp.data() : environ);
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attr);
  if (rc != 0) {
    throw std::runtime_error("cannot start " + args[0] + ": " + std::strerror(rc));
  }
  pidFd_.reset(static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0)));
}

ChildProcess::~ChildProcess() {
  if (running()) {
    signal(SIGKILL);
    waitForExit(std::chrono::seconds(10));
  }
}

void ChildProcess::signal(int sig) {
  if (!exitStatus_) {
    ::kill(pid_, sig);
  }
}

std::optional<int> ChildProcess::waitForExit(std::chrono::milliseconds timeout) {
  if (exitStatus_) {
    return exitStatus_;
  }
  if (pidFd_) {
    using Clock = std::chrono::steady_clock;
    const auto deadline = Clock::now() + timeout;
    pollfd fd{pidFd_.get(), POLLIN, 0};
    int rc;
    do {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
      rc = ::poll(&fd, 1, static_cast<int>(std::max<long long>(left.count(), 0)));
    } while (rc < 0 && errno == EINTR);
    if (rc == 0) {
      return std::nullopt;
    }
  }
  int status = 0;
  if (::waitpid(pid_, &status, pidFd_ ? 0 : WNOHANG) != pid_) {
    return std::nullopt;
  }
  exitStatus_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  return exitStatus_;
}

int ChildProcess::stop(std::chrono::milliseconds grace) {
  signal(SIGTERM);
  if (const auto status = waitForExit(grace)) {
    return *status;
  }
  signal(SIGKILL);
  return waitForExit(std::chrono::seconds(10)).value_or(-1);
}

std::string readText(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

}  // namespace zerith::test
