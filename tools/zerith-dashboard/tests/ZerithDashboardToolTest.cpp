// zerith-dashboard as users run it: the built executable on a loopback port,
// fed by a real dashboard backend and by hand-made datagrams.

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <vector>

#include "backends/DashboardBackend.h"
#include "tests/support/CollectorProcess.h"
#include "tools/zerith-dashboard/DashboardReceiver.h"

namespace zerith::test {
namespace {

using namespace std::chrono_literals;

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
  CollectorProcess tool(ZERITH_DASHBOARD_TOOL, {"--ack"});
  const auto port = static_cast<std::uint16_t>(tool.port());
  ASSERT_NE(port, 0) << tool.said();
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
  const auto line = tool.nextLine();
  ASSERT_TRUE(line.has_value());
  auto json = *line;
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
  CollectorProcess tool(ZERITH_DASHBOARD_TOOL, {});
  const auto port = static_cast<std::uint16_t>(tool.port());
  ASSERT_NE(port, 0) << tool.said();
  sendRaw(port, std::vector<std::uint8_t>(10, 0xff));
  auto json = tool.nextLine().value_or(nlohmann::ordered_json::object());
  EXPECT_EQ(json["size"], 10);
  EXPECT_EQ(json["error"], "10 bytes, shorter than the 64-byte header");
  std::vector<std::uint8_t> liar(64, 0);  // its length field says 65535 bytes
  sendRaw(port, liar);
  json = tool.nextLine().value_or(nlohmann::ordered_json::object());
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
