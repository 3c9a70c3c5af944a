#include "tests/support/NginxServer.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <stdexcept>
#include <vector>

#include "platform/FileUtil.h"

namespace zerith::test {

namespace {

constexpr const char* kNginx = "/usr/sbin/nginx";

// nginx with `args`, its output appended to `output`, `listenFd` (when
// >= 0) handed over as an inherited listening socket. The socket is
// close-on-exec here (no other child gets it); nginx gets a duplicate.
std::unique_ptr<ChildProcess> spawnNginx(std::vector<std::string> args, const std::filesystem::path& output,
                                         int listenFd) {
  args.insert(args.begin(), kNginx);
  const int inheritFd = listenFd == 3 ? 4 : 3;
  const file::UniqueFd in(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  const file::UniqueFd out(::open(output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
  std::vector<std::pair<int, int>> descriptors = {
      {in.get(), STDIN_FILENO}, {out.get(), STDOUT_FILENO}, {out.get(), STDERR_FILENO}};
  std::vector<std::string> environment;
  if (listenFd >= 0) {
    descriptors.emplace_back(listenFd, inheritFd);
    environment.push_back("NGINX=" + std::to_string(inheritFd) + ";");
  }
  return std::make_unique<ChildProcess>(args, descriptors, environment);
}

}  // namespace

bool NginxServer::available() { return ::access(kNginx, X_OK) == 0; }

NginxServer::NginxServer(Options options, const TestCA& ca) : options_(std::move(options)) {
  try {
    start(ca);
  } catch (const std::runtime_error& e) {
    error_ = e.what();
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

void NginxServer::start(const TestCA& ca) {
  if (!available()) {
    error_ = "nginx is not installed";
    return;
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
    return;
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

  const std::vector<std::string> base = {"-p", dir.string(), "-c", conf.string(), "-e", (dir / "error.log").string()};
  const fs::path output = dir / "nginx.out";
  // Check the configuration first, so that a mistake is an error here and
  // not a hanging request later.
  auto testArgs = base;
  testArgs.push_back("-t");
  if (spawnNginx(testArgs, output, -1)->waitForExit(std::chrono::seconds(10)) != 0) {
    error_ = "nginx -t refused the configuration:\n" + readText(output);
    return;
  }
  auto runArgs = base;
  runArgs.insert(runArgs.end(), {"-g", "daemon off;"});
  nginx_ = spawnNginx(runArgs, output, listener.get());
}

void NginxServer::stop() {
  if (nginx_) {
    nginx_->stop(std::chrono::seconds(5));
    nginx_.reset();
  }
}

}  // namespace zerith::test
