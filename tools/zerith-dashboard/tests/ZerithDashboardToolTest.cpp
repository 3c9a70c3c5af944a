// zerith-dashboard as users run it: the built executable on a loopback port,
// fed by a real dashboard backend and by hand-made datagrams.

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "backends/DashboardBackend.h"
#include "tools/zerith-dashboard/DashboardReceiver.h"

extern char** environ;

namespace zerith::test {
namespace {

using namespace std::chrono_literals;

// The tool as a child process, with its standard output and error read line
// by line under a time limit.
class Tool {
 public:
  explicit Tool(std::vector<std::string> args) {
    args.insert(args.begin(), ZERITH_DASHBOARD_TOOL);
    int out[2];
    int err[2];
    EXPECT_EQ(::pipe(out), 0);
    EXPECT_EQ(::pipe(err), 0);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, out[1], 1);
    posix_spawn_file_actions_adddup2(&actions, err[1], 2);
    posix_spawn_file_actions_addclose(&actions, out[0]);
    posix_spawn_file_actions_addclose(&actions, err[0]);
    std::vector<char*> argv;
    for (auto& a : args) {
      argv.push_back(a.data());
    }
    argv.push_back(nullptr);
    EXPECT_EQ(posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ), 0);
    posix_spawn_file_actions_destroy(&actions);
    ::close(out[1]);
    ::close(err[1]);
    out_ = out[0];
    err_ = err[0];
  }
  ~Tool() {
    ::kill(pid_, SIGTERM);
    ::waitpid(pid_, nullptr, 0);
    ::close(out_);
    ::close(err_);
  }

  std::optional<std::string> outLine() { return line(out_, outBuffer_); }
  std::optional<std::string> errLine() { return line(err_, errBuffer_); }

  // The port from "zerith-dashboard: listening on 127.0.0.1:<port>".
  std::uint16_t port() {
    const auto l = errLine();
    EXPECT_TRUE(l.has_value());
    if (!l) {
      return 0;
    }
    return static_cast<std::uint16_t>(std::stoi(l->substr(l->rfind(':') + 1)));
  }

 private:
  static std::optional<std::string> line(int fd, std::string& buffer) {
    const auto deadline = std::chrono::steady_clock::now() + 10s;
    for (;;) {
      if (const auto nl = buffer.find('\n'); nl != std::string::npos) {
        std::string l = buffer.substr(0, nl);
        buffer.erase(0, nl + 1);
        return l;
      }
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
      pollfd p{fd, POLLIN, 0};
      if (left.count() <= 0 || ::poll(&p, 1, static_cast<int>(left.count())) <= 0) {
        return std::nullopt;
      }
      char chunk[4096];
      const ssize_t n = ::read(fd, chunk, sizeof chunk);
      if (n <= 0) {
        return std::nullopt;
      }
      buffer.append(chunk, static_cast<std::size_t>(n));
    }
  }

  pid_t pid_ = -1;
  int out_ = -1;
  int err_ = -1;
  std::string outBuffer_;
  std::string errBuffer_;
};

void sendRaw(std::uint16_t port, const std::vector<std::uint8_t>& bytes) {
  const int fd = ::socket(AF_INET, SOCK_DGRAM, 0);
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  to.sin_port = htons(port);
  ::sendto(fd, bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to);
  ::close(fd);
}

TEST(ZerithDashboardToolTest, ReliableBackendsDatagramsArePrintedAndAcknowledged) {
  Tool tool({"--ack"});
  const std::uint16_t port = tool.port();
  ASSERT_NE(port, 0);
  auto backend = DashboardBackend::initWithName(
      "dashboard", Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(port)}, {"reliable", Value(5)}}),
      std::nullopt);
  ASSERT_NE(backend, nullptr);
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<std::size_t> counts;
  backend->setQueueObserver([&](std::size_t count, bool) {
    std::lock_guard lock(mutex);
    counts.push_back(count);
    changed.notify_all();
  });
  backend->setSessionID(77);
  backend->setCompType(5);
  backend->sendMessage(Value(Dictionary{{"name", Value("a=b c")}}), timeval{12, 345678}, std::uint16_t{3},
                       std::uint16_t{4}, std::uint16_t{9});
  const auto line = tool.outLine();
  ASSERT_TRUE(line.has_value());
  const auto json = nlohmann::json::parse(*line);
  EXPECT_EQ(json["time"], 12.344);
  EXPECT_EQ(json["sender"], "YF");
  EXPECT_EQ(json["sessionID"], 77);
  EXPECT_EQ(json["event"], 9);
  EXPECT_EQ(json["method"], 3);
  EXPECT_EQ(json["respCode"], 4);
  EXPECT_EQ(json["reliable"], true);
  EXPECT_EQ(json["items"]["name"], "a=b c");
  EXPECT_EQ(json["acknowledged"], true);
  // Acknowledged: nothing is sent again, the queue drains.
  {
    std::unique_lock lock(mutex);
    EXPECT_TRUE(changed.wait_for(lock, 10s, [&] { return !counts.empty() && counts.back() == 0; }));
  }
  backend->setQueueObserver(nullptr);  // the observer's locals end with the test
  backend->cleanup();
}

TEST(ZerithDashboardToolTest, MalformedDatagramsAreReportedNotDecoded) {
  Tool tool({});
  const std::uint16_t port = tool.port();
  ASSERT_NE(port, 0);
  sendRaw(port, std::vector<std::uint8_t>(10, 0xff));
  auto json = nlohmann::json::parse(tool.outLine().value_or("{}"));
  EXPECT_EQ(json["size"], 10);
  EXPECT_EQ(json["error"], "10 bytes, shorter than the 64-byte header");
  std::vector<std::uint8_t> liar(64, 0);  // its length field says 65535 bytes
  sendRaw(port, liar);
  json = nlohmann::json::parse(tool.outLine().value_or("{}"));
  EXPECT_EQ(json["error"], "length field says 65535 bytes, 64 arrived");
}

TEST(ZerithDashboardToolTest, DroppedShareLosesDatagramsWithoutALine) {
  tools::ReceiverOptions options;
  options.dropDatagrams = 1.0;
  tools::DashboardReceiver all(options);
  sendRaw(all.port(), std::vector<std::uint8_t>(64, 0));
  EXPECT_FALSE(all.receiveOne().has_value());
}

}  // namespace
}  // namespace zerith::test
