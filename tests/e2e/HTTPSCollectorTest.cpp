// Events from a real client session through the real daemon to a real
// collector: the storebag (signed, served by the collector over HTTPS)
// enables the HTTPS backend for the client type, and the collector sees one
// record per event with the sender code and the session ID. (What a refusing
// server does to the backend is the backend's own tests' business.)

#include <algorithm>
#include <filesystem>

#include "backends/ZerithBackend.h"
#include "config/StorebagSigner.h"
#include "tests/e2e/E2eFixture.h"
#include "tests/support/CollectorProcess.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;

class HTTPSCollectorTest : public E2eTest {
 protected:
  // The collector, the signed storebag it serves, and the daemon trusting
  // its CA.
  void startAll() {
    grant(Value(true));
    const fs::path certs = root.path() / "collector/certs";
    const fs::path www = root.path() / "collector/www";
    collector = std::make_unique<CollectorProcess>(
        ZERITH_COLLECTOR_TOOL, std::vector<std::string>{"--generate-cert", certs.string(), "--serve", www.string()});
    ASSERT_GT(collector->port(), 0) << collector->said();

    const Value bag = collectorStorebag(collector->url("/post"));
    publishSignedStorebag(bag, www, collector->url("/zerith"));
    startDaemon(collectorDaemonOptions(certs));
  }

  // A started session; its start reply names the HTTPS backend.
  std::unique_ptr<Zerith> startSession(std::uint32_t sessionID) {
    ZerithReply started;
    auto client = startDemoSession(sessionID, &started);
    if (client) {
      EXPECT_EQ(started["backends"], Value(Array{Value("httpsPost")})) << daemon->output();
    }
    return client;
  }

  static Value event(int category, int type, Dictionary payload) {
    return Value(Dictionary{{kZerithMessageParametersCategory, Value(category)},
                            {kZerithMessageParametersType, Value(type)},
                            {kZerithMessageParametersPayload, Value(std::move(payload))}});
  }

  std::unique_ptr<CollectorProcess> collector;
};

TEST_F(HTTPSCollectorTest, ClientEventsArriveAsRecordsWithSenderCodeAndSessionID) {
  startAll();
  auto client = startSession(4242);
  ASSERT_TRUE(client);
  ASSERT_TRUE(client->sendMessage(event(3, 4, {{"bytes", 1200}, {"udid", "device-7"}}), 10s));
  ASSERT_TRUE(client->sendMessage(event(3, 5, {{"bytes", 1300}}), 10s));

  // The session's own start message may come first; find ours by method.
  std::vector<nlohmann::ordered_json> ours;
  while (ours.size() < 2) {
    const auto line = collector->nextLine("record");
    ASSERT_TRUE(line) << daemon->output();
    if ((*line)["record"]["_method"] == 3) {
      ours.push_back(*line);
    }
  }
  // Each event went in a post of its own, and posts in flight at once may
  // take different connections: the collector may see them in either order.
  std::sort(ours.begin(), ours.end(),
            [](const auto& a, const auto& b) { return a["record"]["_status"] < b["record"]["_status"]; });
  for (const auto& line : ours) {
    EXPECT_EQ(line["_sender"], "YJ");
    EXPECT_EQ(line["_sessionID"], 4242);
    EXPECT_EQ(line["record"]["clientName"], "demo");
    EXPECT_EQ(line["path"], "/post");
  }
  EXPECT_EQ(ours[0]["record"]["_status"], 4);
  EXPECT_EQ(ours[0]["record"]["bytes"], 1200);
  EXPECT_EQ(ours[0]["record"]["udid"], ZerithBackend::convertIntoSHA256("device-7"));
  EXPECT_EQ(ours[1]["record"]["_status"], 5);
  client->finishSession(10s);
}

}  // namespace
}  // namespace zerith::test
