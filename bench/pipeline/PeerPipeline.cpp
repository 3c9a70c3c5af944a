#include "bench/pipeline/PeerPipeline.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <thread>
#include <vector>

extern char** environ;

namespace zerith::bench {

namespace {

bool acceptsConnections(const std::filesystem::path& path) {
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    return false;
  }
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  const bool ok = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0;
  ::close(fd);
  return ok;
}

}  // namespace

std::filesystem::path PeerPipeline::binary() {
  if (const char* env = std::getenv("ZERITH_PEER_BINARY"); env && *env) {
    return env;
  }
  return "/usr/sbin/syslog-ng";
}

std::string PeerPipeline::configuration(const Options& o, const std::filesystem::path& socketPath) {
  std::ostringstream c;
  c << "@version: 3.38\n"
       "options {\n"
       "  stats-freq(0); mark-freq(0); use-dns(no); dns-cache(no); chain-hostnames(no);\n"
       "  log-fifo-size(10000); time-reopen(1);\n"
       "};\n"
       // One JSON object per line; the window of 100 per connection holds
       // the readers back when the destination's queue is full.
       "source s_bench { unix-stream(\"" << socketPath.string()
    << "\" flags(no-parse) max-connections(64) log-iw-size(6400) log-msg-size(65536)); };\n"
       "parser p_json { json-parser(prefix(\".ev.\")); };\n"
       "destination d_collector {\n"
       "  http(url(\"" << o.postURL << "\") method(\"POST\") workers(1)\n"
       "       batch-lines(" << o.batchLines << ") batch-bytes(0) batch-timeout(200)\n"
       "       headers(\"Content-Type: application/json\")\n"
       "       tls(ca-file(\"" << o.caFile.string() << "\") peer-verify(yes))\n"
       "       body-prefix(\"{\\\"postTime\\\":0,\\\"events\\\":[\") delimiter(\",\") body-suffix(\"]}\")\n"
       "       body(\"$(format-json --key .ev.* --rekey .ev.* --shift 4)\"));\n"
       "};\n"
       "log { source(s_bench); parser(p_json); destination(d_collector); flags(flow-control); };\n";
  return c.str();
}

PeerPipeline::PeerPipeline(Options options) : options_(std::move(options)) {
  std::filesystem::create_directories(options_.folder);
  socketPath_ = options_.folder / "peer.sock";
  outputPath_ = options_.folder / "peer.err";
  const auto configPath = options_.folder / "peer.conf";
  std::ofstream(configPath) << configuration(options_, socketPath_);

  const std::vector<std::string> args = {binary().string(),
                                         "--foreground",
                                         "--stderr",
                                         "--no-caps",
                                         "--cfgfile=" + configPath.string(),
                                         "--persist-file=" + (options_.folder / "peer.persist").string(),
                                         "--pidfile=" + (options_.folder / "peer.pid").string(),
                                         "--control=" + (options_.folder / "peer.ctl").string()};
  std::vector<char*> argv;
  for (const auto& a : args) {
    argv.push_back(const_cast<char*>(a.c_str()));
  }
  argv.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, outputPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  posix_spawn_file_actions_adddup2(&actions, STDOUT_FILENO, STDERR_FILENO);
  const int rc = ::posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (rc != 0) {
    pid_ = -1;
    return;
  }
  // The peer tells nobody when it is ready: its source socket accepting a
  // connection is the sign. Bounded; a peer that exits ends the wait.
  const auto deadline = std::chrono::steady_clock::now() + options_.startTimeout;
  while (std::chrono::steady_clock::now() < deadline) {
    if (acceptsConnections(socketPath_)) {
      ready_ = true;
      return;
    }
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
}

PeerPipeline::~PeerPipeline() { stop(); }

std::string PeerPipeline::output() const {
  std::ifstream in(outputPath_);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

int PeerPipeline::stop() {
  if (pid_ <= 0) {
    return -1;
  }
  ::kill(pid_, SIGTERM);
  int status = 0;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (::waitpid(pid_, &status, WNOHANG) == 0) {
    if (std::chrono::steady_clock::now() > deadline) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, &status, 0);
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  pid_ = -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

}  // namespace zerith::bench
