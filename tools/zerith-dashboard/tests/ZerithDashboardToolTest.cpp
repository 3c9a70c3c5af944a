// zerith-dashboard as users run it: the built executable on a loopback port,
// fed by a real dashboard backend and by hand-made datagrams.

#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <vector>

#include "backends/DashboardBackend.h"
#include "tests/support/CollectorProcess.h"
#include "tests/support/UdpTestServer.h"
#include "tools/zerith-dashboard/DashboardReceiver.h"
#include "transport/tests/TransportTestSupport.h"

namespace zerith::test {
namespace {

using namespace std::chrono_literals;

TEST(ZerithDashboardToolTest, ReliableBackendsDatagramsArePrintedAndAcknowledged) {
  CollectorProcess tool(ZERITH_DASHBOARD_TOOL, {"--ack"});
  const auto port = static_cast<std::uint16_t>(tool.port());
  ASSERT_NE(port, 0) << tool.said();
  auto backend = DashboardBackend::initWithName(
      "dashboard", Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(port)}, {"reliable", Value(1000)}}),
      std::nullopt);
  ASSERT_NE(backend, nullptr);
  Recorder<std::size_t> counts;  // the retransmission queue's sizes
  backend->setQueueObserver([&](std::size_t count, bool) { counts.add(count); });
  backend->setSessionID(77);
  backend->setCompType(5);
  backend->sendMessage(Value(Dictionary{{"name", Value("a=b c")}}), timeval{12, 345678}, std::uint16_t{3},
                       std::uint16_t{4}, std::uint16_t{9});
  const auto line = tool.nextLine();
  ASSERT_TRUE(line.has_value());
  EXPECT_TRUE(hasMembers(*line, R"({"time":12.344,"sender":"YF","sessionID":77,"event":9,"method":3,"respCode":4,
      "reliable":true,"items":{"name":"a=b c"},"acknowledged":true})"));
  // The queue drains by the tool's acknowledgement, not by giving up
  // after five sendings (a second apart).
  EXPECT_TRUE(counts.waitUntil([](const auto& sizes) { return !sizes.empty() && sizes.back() == 0; }, 10s));
  EXPECT_EQ(backend->counters().get(BackendCount::delivered), 1u);
  backend->setQueueObserver(nullptr);  // the observer's locals end with the test
  backend->cleanup();
}

TEST(ZerithDashboardToolTest, MalformedDatagramIsReportedNotDecoded) {
  CollectorProcess tool(ZERITH_DASHBOARD_TOOL, {});
  const auto port = static_cast<std::uint16_t>(tool.port());
  ASSERT_NE(port, 0) << tool.said();
  UdpTestServer sender;
  sender.sendTo(port, std::vector<std::uint8_t>(10, 0xff));
  const auto json = tool.nextLine().value_or(nlohmann::ordered_json::object());
  EXPECT_EQ(json["size"], 10);
  EXPECT_EQ(json["error"], "10 bytes, shorter than the 64-byte header");
}

TEST(ZerithDashboardToolTest, DroppedShareLosesDatagramsWithoutALine) {
  tools::ReceiverOptions options;
  options.dropDatagrams = 1.0;
  tools::DashboardReceiver all(options);
  UdpTestServer().sendTo(all.port(), std::vector<std::uint8_t>(64, 0));
  EXPECT_FALSE(all.receiveOne().has_value());
}

}  // namespace
}  // namespace zerith::test
