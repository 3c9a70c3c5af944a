#include "tests/support/NginxServer.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/inotify.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>
#include <vector>

#include "platform/FileUtil.h"
#include "tests/support/Command.h"

namespace zerith::test {

namespace {

constexpr const char* kNginx = "/usr/sbin/nginx";

// Waits up to `timeout` for the child to end; kills it when it does not.
// Returns its wait status.
int reap(pid_t pid, int timeoutMs) {
  file::UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
  if (pidfd) {
    pollfd p{pidfd.get(), POLLIN, 0};
    int r;
    do {
      r = ::poll(&p, 1, timeoutMs);
    } while (r < 0 && errno == EINTR);
    if (r == 0) {
      ::kill(pid, SIGKILL);
    }
  }
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  return status;
}

// Runs nginx with `args`, its output going to `output`, with `listenFd`
// (when >= 0) handed over as an inherited listening socket. The socket is
// close-on-exec here (no other child gets it); nginx gets a duplicate.
pid_t spawnNginx(const std::vector<std::string>& args, const std::filesystem::path& output, int listenFd,
                 std::string& error) {
  const int inheritFd = listenFd == 3 ? 4 : 3;
  std::vector<char*> argv;
  for (const auto& a : args) {
    argv.push_back(const_cast<char*>(a.c_str()));
  }
  argv.push_back(nullptr);
  const std::string inherit = "NGINX=" + std::to_string(inheritFd) + ";";
  std::vector<char*> envp;
  if (listenFd >= 0) {
    envp.push_back(const_cast<char*>(inherit.c_str()));
  }
  envp.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, output.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
  posix_spawn_file_actions_adddup2(&actions, STDOUT_FILENO, STDERR_FILENO);
  if (listenFd >= 0) {
    posix_spawn_file_actions_adddup2(&actions, listenFd, inheritFd);
  }
  pid_t pid = -1;
  const int rc = ::posix_spawn(&pid, kNginx, &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  if (rc != 0) {
    error = std::string("posix_spawn nginx: ") + std::strerror(rc);
    return -1;
  }
  return pid;
}

}  // namespace

bool NginxServer::available() { return ::access(kNginx, X_OK) == 0; }

NginxServer::NginxServer(Options options, const TestCA& ca) : options_(std::move(options)) {
  if (!start(ca)) {
    stop();
  }
}

NginxServer::~NginxServer() { stop(); }

std::string NginxServer::url(std::string_view path) const {
  return "https://127.0.0.1:" + std::to_string(port_) + std::string(path);
}


std::string NginxServer::accessLog() const { return readText(options_.workDir / "access.log"); }

bool NginxServer::waitForAccessLog(std::string_view needle, std::chrono::milliseconds timeout) const {
  // Woken by every change in the work folder instead of polling on a timer.
  file::UniqueFd watch(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  if (!watch || ::inotify_add_watch(watch.get(), options_.workDir.c_str(), IN_MODIFY | IN_CREATE) < 0) {
    return false;
  }
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    if (accessLog().find(needle) != std::string::npos) {
      return true;
    }
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()).count();
    if (left <= 0) {
      return false;
    }
    pollfd p{watch.get(), POLLIN, 0};
    if (::poll(&p, 1, static_cast<int>(left)) > 0) {
      char events[4096];
      while (::read(watch.get(), events, sizeof events) > 0) {
      }
    }
  }
}

bool NginxServer::start(const TestCA& ca) {
  if (!available()) {
    error_ = "nginx is not installed";
    return false;
  }
  namespace fs = std::filesystem;
  const fs::path dir = fs::absolute(options_.workDir);
  std::error_code ec;
  fs::create_directories(dir / "tmp", ec);
  fs::create_directories(options_.documentRoot, ec);

  // The listening socket nginx inherits: bound and listening before nginx
  // runs, so clients never see a refused connection.
  file::UniqueFd listener(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  if (!listener || ::bind(listener.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      ::listen(listener.get(), 128) != 0 ||
      ::getsockname(listener.get(), reinterpret_cast<sockaddr*>(&address), &length) != 0) {
    error_ = std::string("listening socket: ") + std::strerror(errno);
    return false;
  }
  port_ = ntohs(address.sin_port);

  const fs::path conf = dir / "nginx.conf";
  std::ofstream(conf) << "error_log " << (dir / "error.log").string() << " info;\n"
                      << "pid " << (dir / "nginx.pid").string() << ";\n"
                      // One master and one worker (nginx 1.22 crashes on inherited
                      // sockets without a master); as the superuser the worker
                      // stays root so it can read the test's private folders.
                      << (::geteuid() == 0 ? "user root;\n" : "")
                      << "worker_processes 1;\n"
                      << "events { worker_connections 64; }\n"
                      << "http {\n"
                      << "  log_format zerith '$request_method $request_uri $status ims=\"$http_if_modified_since\"';\n"
                      << "  access_log " << (dir / "access.log").string() << " zerith;\n"
                      << "  client_body_temp_path " << (dir / "tmp/body").string() << ";\n"
                      << "  proxy_temp_path " << (dir / "tmp/proxy").string() << ";\n"
                      << "  fastcgi_temp_path " << (dir / "tmp/fastcgi").string() << ";\n"
                      << "  uwsgi_temp_path " << (dir / "tmp/uwsgi").string() << ";\n"
                      << "  scgi_temp_path " << (dir / "tmp/scgi").string() << ";\n"
                      << "  default_type application/octet-stream;\n"
                      << "  server {\n"
                      << "    listen 127.0.0.1:" << port_ << " ssl;\n"
                      << "    ssl_certificate " << ca.serverCertificateFile().string() << ";\n"
                      << "    ssl_certificate_key " << ca.serverKeyFile().string() << ";\n"
                      << "    root " << fs::absolute(options_.documentRoot).string() << ";\n"
                      << "    " << options_.serverDirectives << "\n"
                      << "  }\n"
                      << "}\n";

  const std::vector<std::string> base = {kNginx, "-p", dir.string(), "-c", conf.string(),
                                         "-e", (dir / "error.log").string()};
  const fs::path output = dir / "nginx.out";

  // Check the configuration first, so that a mistake is an error here and
  // not a hanging request later.
  auto testArgs = base;
  testArgs.push_back("-t");
  const pid_t tester = spawnNginx(testArgs, output, -1, error_);
  if (tester < 0) {
    return false;
  }
  const int status = reap(tester, 10000);
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
    error_ = "nginx -t refused the configuration:\n" + readText(output);
    return false;
  }

  auto runArgs = base;
  runArgs.push_back("-g");
  runArgs.push_back("daemon off;");
  pid_ = spawnNginx(runArgs, output, listener.get(), error_);
  return pid_ > 0;
}

void NginxServer::stop() {
  if (pid_ > 0) {
    ::kill(pid_, SIGTERM);
    reap(pid_, 5000);
    pid_ = -1;
  }
}

}  // namespace zerith::test
