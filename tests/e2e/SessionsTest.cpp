// The real daemon and the real client framework over the real socket: a
// session's lifecycle, the keep-alive count across sessions, messages from
// the daemon to its clients. Then sessions working together, with several
// client connections at once: a signed storebag over HTTPS enables the
// adaptor backend (with the example plugin, which writes every event it is
// handed as one JSON line to a file) and the energy-log backend for client
// type 7. What the plugin wrote is what the backends received.

#include <filesystem>
#include <fstream>
#include <sstream>

#include "ipc/ClientSessionWire.h"
#include "tests/e2e/E2eFixture.h"

namespace zerith::test {
namespace {

using log::Level;

class ClientSessionTest : public E2eTest {
 protected:
  void SetUp() override { startDaemon({.arguments = {"--stop-timeout", "10"}}); }
};

TEST_F(ClientSessionTest, LifecycleOperationsAnswerAsASessionWithoutBackends) {
  auto client = connect();
  ASSERT_TRUE(client);
  ASSERT_TRUE(client->setSessionInfo(sessionInfo(42), Value(), Value(), false, 10s));

  // No storebag server answers: the start completes with nil.
  const auto started = client->startConfig(20s);
  ASSERT_TRUE(started) << started.error->description;
  EXPECT_TRUE(started["backends"].isNil());
  // The error line ends with the cause (the storebag server is unreachable).
  EXPECT_TRUE(daemon->waitFor("fetchAndCacheStorebag: Unable to fetch storebag for client type 7: "));

  const auto states = client->fetchStates(Value(Dictionary{{kZerithUserInfoClientName, Value("mail")}}), 10s);
  ASSERT_TRUE(states);
  EXPECT_TRUE(states["backends"].isNil());

  const auto url = client->fetchDisplayURL(10s);
  ASSERT_TRUE(url);
  EXPECT_EQ(url["url"], Value("URL not available"));

  const auto sent = client->sendMessage(event(1, 2), 10s);
  ASSERT_TRUE(sent);
  EXPECT_TRUE(sent["result"].isNil());
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "sendMessageWithDictionary: No backends available to send message"));

  const auto flushed = client->flushMessages(10s);
  ASSERT_TRUE(flushed);
  EXPECT_TRUE(flushed["result"].isNil());
  EXPECT_EQ(flushed["error"], (Error{kZerithErrorDomain, -1, "No backends available to send message"}).toValue());

  const auto upload = client->uploadFile(Value("file:///dev/null"), Value(), 10s);
  ASSERT_TRUE(upload);
  EXPECT_EQ(upload["success"], Value(false));
  const auto logData = client->uploadLogData(Value(Array{Value("a")}), 10s);
  ASSERT_TRUE(logData);
  EXPECT_EQ(logData["success"], Value(false));
  EXPECT_TRUE(logData["error"].isNil());

  const auto oneShot = client->sendMessageWithSessionInfo(Value(Dictionary{}), Value(), 1, 2, Value(), 10s);
  ASSERT_TRUE(oneShot);
  EXPECT_EQ(oneShot["result"], Value("Could not retrieve identifiers from sessionInfo"));

  ASSERT_TRUE(client->finishSession(10s));

  client->invalidate();
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "dealloc: ZerithdSession dealloc: 42"));
  EXPECT_TRUE(daemon->waitForExact(Level::Default, kTransactionEnded));
}

TEST_F(ClientSessionTest, SessionsArrivingWhileAnEndedTransportClosesKeepThePairing) {
  // A session that arrives after the list became empty but before the
  // previous transport closed begins a second transaction; the count then
  // needs both releases. Whether a round hits that window depends on timing
  // (the agent's unit tests force it), so every round checks the pairing:
  // each session releases once, and there is one end each time the count
  // reaches 0.
  constexpr const char* kRelease = "releaseVeskTransaction: Vesk transaction ref count is ";
  constexpr const char* kBegin = "createReportingSessionWithDelegate: Vesk transaction started with session";
  int secondTransactions = 0;
  for (std::size_t round = 1; round <= 20; ++round) {
    const std::size_t beginsBefore = daemon->count(kBegin);
    const std::size_t zerosBefore = daemon->countExact(Level::Default, std::string(kRelease) + "0");
    auto a = connect();
    ASSERT_TRUE(a && a->fetchDisplayURL(10s));
    a.reset();
    auto b = connect();
    ASSERT_TRUE(b && b->fetchDisplayURL(10s));
    b.reset();
    ASSERT_TRUE(daemon->waitFor(kRelease, 2 * round)) << daemon->output();
    const std::size_t allZeros = daemon->countExact(Level::Default, std::string(kRelease) + "0");
    // The end follows its "ref count is 0" line.
    ASSERT_TRUE(daemon->waitForExact(Level::Default, kTransactionEnded, allZeros));
    const std::size_t begins = daemon->count(kBegin) - beginsBefore;
    const std::size_t zeros = allZeros - zerosBefore;
    EXPECT_GE(zeros, 1u);
    if (begins == 2 && zeros == 1) {
      ++secondTransactions;  // b began a transaction while a's was still counted
    }
    EXPECT_EQ(daemon->countExact(Level::Default, kTransactionEnded), allZeros);
    EXPECT_EQ(daemon->count(std::string(kRelease) + "-"), 0u);
  }
  RecordProperty("second_transactions", secondTransactions);
}

class SessionsTogetherTest : public E2eTest {
 protected:
  void SetUp() override {
    const Value bag(Dictionary{{"version", Value("6.1.0")},
                               {"seed", Value(Dictionary{{kZerithBackendKovu, Value(Dictionary{})},
                                                         {kZerithBackendPellamlog, Value(Dictionary{})}})}});
    serveSignedStorebag(server, bag);

    const auto plugin = paths::adaptorPluginPath();
    std::filesystem::create_directories(plugin.parent_path());
    std::filesystem::copy_file(ZERITH_KOVU_EXAMPLE_PLUGIN, plugin);
    adaptorOutput = root / "/var/tmp/kovu.jsonl";
    std::filesystem::create_directories(adaptorOutput.parent_path());

    DaemonProcess::Options options = trusting(TestCA::shared().caFile(), "C");
    options.environment.emplace_back("KOVU_EXAMPLE_OUTPUT", adaptorOutput.string());
    startDaemon(options);
  }

  // A started session: its reporting backends are the storebag's two.
  void start(Zerith& client, const Value& sessionInfo, bool aggregator = false) {
    ASSERT_TRUE(client.setSessionInfo(sessionInfo, Value(), Value(), aggregator, 10s));
    const auto started = client.startConfig(20s);
    ASSERT_TRUE(started) << started.error->description;
    EXPECT_EQ(started["backends"], Value(Array{Value("kovu"), Value("pellamlog")})) << daemon->output();
  }

  // The payloads ("dict") of the events of one kind that the adaptor backend
  // handed on, in order, as one array. The adaptor writes while the session
  // dispatches, before the reply (or the daemon's log line) that the test
  // waited for, so one read sees them.
  nlohmann::json adaptorDictsOf(unsigned method, unsigned respCode) const {
    nlohmann::json found = nlohmann::json::array();
    std::ifstream in(adaptorOutput);
    for (std::string line; std::getline(in, line);) {
      if (auto l = nlohmann::json::parse(line); l["method"] == method && l["respCode"] == respCode) {
        found.push_back(std::move(l["dict"]));
      }
    }
    return found;
  }

  HttpsTestServer server;
  std::filesystem::path adaptorOutput;
};

TEST_F(SessionsTogetherTest, ThreeLevelsShareStatesDataAndTheRootsAggregator) {
  // Declared before the clients, so that they outlive them: the daemon
  // still sends to the root's aggregation block while the grandchild ends.
  Received atRoot;
  Received atGrandchild;
  auto root = connect();
  auto child = connect();
  auto grandchild = connect();
  ASSERT_TRUE(root && child && grandchild);
  atRoot.attach(*root);
  atGrandchild.attach(*grandchild);
  start(*root, hierarchy(1, "call-1", 0), /*aggregator=*/true);
  start(*child, hierarchy(2, "call-1", 1));
  start(*grandchild, hierarchy(3, "call-1", 2), /*aggregator=*/true);
  ASSERT_TRUE(child->updateSharedData(Value(Dictionary{{"room", Value("blue")}}), 10s));

  // Children take their states from the same-named backend one level up.
  for (const std::string backend : {"kovu", "pellamlog"}) {
    EXPECT_TRUE(daemon->waitForExact(
        Level::Debug,
        "HTTPSPostBackend(syncReportingStates): " + backend + ": state and sampling rate updated to 2, 0.00%", 2));
  }
  const auto sent = grandchild->sendMessage(event(20, 3, Value(Dictionary{{"x", Value(1)}})), 10s);
  ASSERT_TRUE(sent);
  EXPECT_TRUE(sent["result"].isNil());  // neither backend returns a result
  EXPECT_EQ(adaptorDictsOf(20, 3), nlohmann::json::parse(R"([{"SharedData":{"room":"blue"},"ClientData":{"x":1}}])"));

  const auto aggregated = atRoot.waitFor([](const auto& m) { return m.category == 20 && !m.sessionInfo.isNil(); });
  ASSERT_TRUE(aggregated.has_value());
  EXPECT_EQ(aggregated->sessionInfo, hierarchy(3, "call-1", 2));
  EXPECT_EQ(aggregated->payload, Value(Dictionary{{"x", Value(1)}}));
  // The grandchild's own aggregator was ended, the root's wins: the end
  // reached the grandchild over its own connection as an empty message.
  EXPECT_TRUE(atGrandchild.waitFor([](const auto& m) { return m.sessionInfo.isNil() && m.payload.isNil(); }));
  for (const auto& m : atGrandchild.all()) {
    EXPECT_NE(m.category, 20u);  // only the end-of-aggregation message
  }
  // Every session's start message went through the adaptor.
  EXPECT_EQ(adaptorDictsOf(0, 0).size(), 3u);
}

TEST_F(SessionsTogetherTest, BadEventsAndVanishingClientsLeaveTheOtherSessionsWorking) {
  auto aggregator = connect();
  auto child = connect();
  ASSERT_TRUE(aggregator && child);
  start(*aggregator, hierarchy(61, "call-4", 0), /*aggregator=*/true);
  start(*child, hierarchy(62, "call-4", 1));

  const auto noCategory = child->sendMessage(Value(Dictionary{{kZerithMessageParametersType, Value(1)}}), 10s);
  ASSERT_TRUE(noCategory);
  EXPECT_TRUE(noCategory["result"].isNil());
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "sendMessageWithDictionary: Missing mandatory parameter 'category'"));
  ASSERT_TRUE(child->sendMessage(Value(Dictionary{{kZerithMessageParametersCategory, Value(1)}}), 10s));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "sendMessageWithDictionary: Missing mandatory parameter 'type'"));
  ASSERT_TRUE(child->sendMessage(event(70, 1, Value("not a dictionary")), 10s));
  EXPECT_TRUE(daemon->waitForExact(
      Level::Error, "sendMessageWithDictionary: Dropping event with category 70 as its payload is not a dictionary"));

  // A raw client asks for a flush and vanishes before the answer.
  auto raw = RawFrameSocket::connect();
  ASSERT_TRUE(raw);
  ASSERT_TRUE(raw->call(ipc::wire::kSetSessionInfo, 1,
                        Dictionary{{"sessionInfo", sessionInfo(63)}, {"hasAggregationBlock", Value(false)}}));
  ASSERT_TRUE(raw->call(ipc::wire::kStartConfig, 2));
  ASSERT_TRUE(raw->call(ipc::wire::kFlushMessages, 3));
  raw->close();
  ASSERT_TRUE(daemon->waitForExact(Level::Debug, "dealloc: ZerithdSession dealloc: 63"));

  // The aggregating root vanishes while its child keeps sending.
  aggregator.reset();
  ASSERT_TRUE(daemon->waitForExact(Level::Debug, "dealloc: ZerithdSession dealloc: 61"));
  for (unsigned k = 0; k < 5; ++k) {
    ASSERT_TRUE(child->sendMessage(event(71, k), 10s));
  }
  EXPECT_EQ(adaptorDictsOf(71, 4).size(), 1u);
  EXPECT_EQ(adaptorDictsOf(70, 1).size(), 0u);
  ASSERT_TRUE(child->flushMessages(10s));
}

TEST_F(SessionsTogetherTest, TheCommandLineDrivesAHierarchyFromJsonLines) {
  root.write("/var/tmp/script.jsonl",
             R"(# a call with one stream, a shared room, and a one-shot report
{"session":"call","step":"open","clientType":7,"sessionID":81,"hierarchyToken":"cli","hierarchyLevel":0,"aggregation":true}
{"session":"call","step":"start"}
{"session":"call","step":"shared-data","dictionary":{"room":"green"}}
{"session":"stream","step":"open","clientType":7,"sessionID":82,"hierarchyToken":"cli","hierarchyLevel":1}
{"session":"stream","step":"start"}
{"session":"stream","step":"send","category":90,"type":1,"payload":{"jitter":4}}
{"session":"stream","step":"flush"}
{"session":"solo","step":"open","clientType":7,"sessionID":83,"setInfo":false}
{"session":"solo","step":"one-shot","category":91,"type":1,"payload":{"once":1}}
{"session":"stream","step":"close"}
{"session":"call","step":"finish"}
)");
  const CliResult run = zerith({"sessions", "--script", (root / "/var/tmp/script.jsonl").string()});
  ASSERT_EQ(run.status, 0) << run.err << run.out;

  std::vector<nlohmann::json> lines;
  std::istringstream in(run.out);
  for (std::string l; std::getline(in, l);) {
    lines.push_back(nlohmann::json::parse(l));
  }
  auto stepLine = [&](const std::string& session, const std::string& step) {
    for (const auto& l : lines) {
      if (l.value("session", "") == session && l.value("step", "") == step) {
        return l;
      }
    }
    return nlohmann::json();
  };
  EXPECT_EQ(stepLine("call", "start")["backends"], nlohmann::json::parse(R"(["kovu","pellamlog"])"));
  EXPECT_EQ(stepLine("stream", "flush").count("failure"), 0u) << run.out;
  EXPECT_EQ(stepLine("solo", "one-shot")["result"], "finished");
  // The stream's event reached the call's aggregation block.
  bool aggregated = false;
  for (const auto& l : lines) {
    aggregated |= l.value("session", "") == "call" && l.value("event", "") == "message" && l["category"] == 90;
  }
  EXPECT_TRUE(aggregated) << run.out;
  EXPECT_EQ(adaptorDictsOf(90, 1),
            nlohmann::json::parse(R"([{"SharedData":{"room":"green"},"ClientData":{"jitter":4}}])"));
  EXPECT_EQ(adaptorDictsOf(91, 1), nlohmann::json::parse(R"([{"once":1}])"));

  // A line that cannot run ends the script with status 2 and says which.
  root.write("/var/tmp/bad.jsonl", "{\"session\":\"x\",\"step\":\"send\",\"category\":1,\"type\":1}\n");
  const CliResult bad = zerith({"sessions", "--script", (root / "/var/tmp/bad.jsonl").string()});
  EXPECT_EQ(bad.status, 2);
  EXPECT_NE(bad.err.find("line 1: no open session \"x\""), std::string::npos) << bad.err;
}

}  // namespace
}  // namespace zerith::test
