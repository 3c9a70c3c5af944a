// Sessions working together in the real zerithd, over the real socket, with
// several client connections at once: a signed storebag over HTTPS enables
// the adaptor backend (with the example plugin, which writes every event it
// is handed as one JSON line to a file) and the energy-log backend for
// client type 7. What the plugin wrote is what the backends received.

#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <thread>

#include "ipc/ClientSessionWire.h"
#include "platform/Json.h"
#include "tests/e2e/E2eFixture.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

using log::Level;

// What a client's aggregation block received.
class Aggregated {
 public:
  struct Message {
    Value sessionInfo;
    unsigned category;
    unsigned type;
    Value payload;
  };
  void attach(Zerith& client) {
    client.setMessageHandler(
        [this](const Value& info, double, std::uint16_t category, std::uint16_t type, const Value& payload) {
          std::lock_guard lock(mutex_);
          messages_.push_back({info, category, type, payload});
          changed_.notify_all();
        });
  }
  // Waits until a message of that category arrives; nullopt on time-out.
  std::optional<Message> waitFor(unsigned category, std::chrono::milliseconds timeout = 10s) {
    std::unique_lock lock(mutex_);
    std::optional<Message> found;
    changed_.wait_for(lock, timeout, [&] {
      for (const auto& m : messages_) {
        if (m.category == category && !m.sessionInfo.isNil()) {
          found = m;
          return true;
        }
      }
      return false;
    });
    return found;
  }
  std::vector<Message> all() {
    std::lock_guard lock(mutex_);
    return messages_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Message> messages_;
};

class SessionsTogetherTest : public E2eTest {
 protected:
  void SetUp() override {
    grant(Value(true));
    const Value bag(Dictionary{{"version", Value("6.1.0")},
                               {"seed", Value(Dictionary{{kZerithBackendKovu, Value(Dictionary{})},
                                                         {kZerithBackendPellamlog, Value(Dictionary{})}})}});
    serveSignedStorebag(server, bag);

    const auto plugin = paths::adaptorPluginPath();
    std::filesystem::create_directories(plugin.parent_path());
    std::filesystem::copy_file(ZERITH_KOVU_EXAMPLE_PLUGIN, plugin);
    adaptorOutput = root / "/var/tmp/kovu.jsonl";
    std::filesystem::create_directories(adaptorOutput.parent_path());

    DaemonProcess::Options options = testCAOptions("C");
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

  // The events the adaptor backend handed on, in order.
  std::vector<nlohmann::json> adaptorLines() const {
    std::vector<nlohmann::json> lines;
    std::ifstream in(adaptorOutput);
    std::string line;
    while (std::getline(in, line)) {
      lines.push_back(nlohmann::json::parse(line));
    }
    return lines;
  }
  // Lines of one event kind. The adaptor writes while the session
  // dispatches, before the reply (or the daemon's log line) that the test
  // waited for, so one read sees them.
  std::vector<nlohmann::json> adaptorLinesOf(unsigned method, unsigned respCode) const {
    std::vector<nlohmann::json> found;
    for (auto& l : adaptorLines()) {
      if (l["method"] == method && l["respCode"] == respCode) {
        found.push_back(l);
      }
    }
    return found;
  }

  // The combined identifier the daemon logged for a session.
  std::string combinedIDOf(std::uint32_t sessionID) const {
    const std::regex line(
        "updateCombinedSessionID: Updating combined session "
        "ID '([^']+)' for session " +
        std::to_string(sessionID) + " backends");
    std::smatch m;
    const std::string out = daemon->output();
    std::string last;
    for (auto it = std::sregex_iterator(out.begin(), out.end(), line); it != std::sregex_iterator(); ++it) {
      last = (*it)[1];
    }
    return last;
  }

  HttpsTestServer server;
  std::filesystem::path adaptorOutput;
};

TEST_F(SessionsTogetherTest, ThreeLevelsShareStatesIdentifiersDataAndTheRootsAggregator) {
  // Declared before the clients, so that they outlive them: the daemon
  // still sends to the root's aggregation block while the grandchild ends.
  Aggregated atRoot;
  Aggregated atGrandchild;
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
  EXPECT_TRUE(daemon->waitForExact(Level::Debug,
                                   "HTTPSPostBackend(syncReportingStates): kovu: state "
                                   "and sampling rate updated to 2, 0.00%",
                                   2));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug,
                                   "HTTPSPostBackend(syncReportingStates): pellamlog: "
                                   "state and sampling rate updated to 2, 0.00%",
                                   2));
  // "root.parent.own": the grandchild's identifier extends the child's.
  const std::string childID = combinedIDOf(2);
  const std::string grandchildID = combinedIDOf(3);
  ASSERT_EQ(std::count(childID.begin(), childID.end(), '.'), 1) << childID;
  ASSERT_EQ(std::count(grandchildID.begin(), grandchildID.end(), '.'), 2) << grandchildID;
  EXPECT_EQ(grandchildID.rfind(childID + ".", 0), 0u) << childID << " / " << grandchildID;
  EXPECT_EQ(grandchildID.size(), 3 * 24 + 2);

  // The grandchild's own aggregator was ended: the root's wins.
  EXPECT_TRUE(
      daemon->waitForExact(Level::Debug, "shutdownSessionAggregation: Disable aggregation module for session 3"));

  const auto sent = grandchild->sendMessage(event(20, 3, Value(Dictionary{{"x", Value(1)}})), 10s);
  ASSERT_TRUE(sent);
  EXPECT_TRUE(sent["result"].isNil());  // neither backend returns a result
  const auto lines = adaptorLinesOf(20, 3);
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0]["dict"], nlohmann::json::parse(R"({"SharedData":{"room":"blue"},"ClientData":{"x":1}})"));

  const auto aggregated = atRoot.waitFor(20);
  ASSERT_TRUE(aggregated.has_value());
  EXPECT_EQ(aggregated->sessionInfo, hierarchy(3, "call-1", 2));
  EXPECT_EQ(aggregated->payload, Value(Dictionary{{"x", Value(1)}}));
  for (const auto& m : atGrandchild.all()) {
    EXPECT_NE(m.category, 20u);  // only the end-of-aggregation message
  }
  // Every session's start message went through the adaptor.
  EXPECT_EQ(adaptorLinesOf(0, 0).size(), 3u);
}

TEST_F(SessionsTogetherTest, GapsTokenChangesAndParentsLeavingFirstLeaveTheOthersWorking) {
  auto root = connect();
  auto orphan = connect();
  ASSERT_TRUE(root && orphan);
  start(*root, hierarchy(1, "call-2", 0));
  // Level 2 without a level 1: a gap, so no combined identifier.
  start(*orphan, hierarchy(5, "call-2", 2));
  EXPECT_TRUE(
      daemon->waitFor("parentSessionIDStringForSession: Found a gap in hierarchy (one of "
                      "parents missing): incomplete parentSessionID is"));
  EXPECT_TRUE(daemon->waitForExact(Level::Default,
                                   "syncReportingStates: child session 5 (backend kovu) "
                                   "with hierarchy 2 is missing its parent"));
  EXPECT_EQ(combinedIDOf(5), "");

  // The orphan moves to another token; the first token's shared data no
  // longer reaches it.
  ASSERT_TRUE(root->updateSharedData(Value(Dictionary{{"room", Value("red")}}), 10s));
  ASSERT_TRUE(orphan->setSessionInfo(hierarchy(5, "call-3", 0), Value(), Value(), false, 10s));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug,
                                   "updateCorrelatedSessions: Adding session 5 to list for "
                                   "hierarchyToken call-3 with hierarchyLevel 0"));
  ASSERT_TRUE(orphan->sendMessage(event(31, 1, Value(Dictionary{{"k", Value(1)}})), 10s));
  ASSERT_TRUE(root->sendMessage(event(32, 1), 10s));
  ASSERT_EQ(adaptorLinesOf(31, 1).size(), 1u);
  EXPECT_EQ(adaptorLinesOf(31, 1)[0]["dict"], nlohmann::json::parse(R"({"ClientData":{"k":1}})"));
  EXPECT_EQ(adaptorLinesOf(32, 1)[0]["dict"], nlohmann::json::parse(R"({"SharedData":{"room":"red"}})"));

  // A parent that leaves before its child: the child goes on alone.
  auto child = connect();
  ASSERT_TRUE(child);
  start(*child, hierarchy(6, "call-2", 1));
  root.reset();
  ASSERT_TRUE(daemon->waitForExact(Level::Debug, "dealloc: ZerithdSession dealloc: 1"));
  ASSERT_TRUE(child->sendMessage(event(33, 1), 10s));
  ASSERT_TRUE(child->fetchStates(Value(Dictionary{{kZerithUserInfoClientName, Value("after")}}), 10s));
  EXPECT_TRUE(daemon->waitForExact(Level::Default,
                                   "syncReportingStates: child session 6 (backend kovu) "
                                   "with hierarchy 1 is missing its parent"));
  EXPECT_EQ(adaptorLinesOf(33, 1).size(), 1u);
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
  EXPECT_TRUE(daemon->waitForExact(Level::Error,
                                   "sendMessageWithDictionary: Dropping event with category "
                                   "70 as its payload is not a dictionary"));
  // Shared data that is not a dictionary is refused at the connection.
  const auto shared = child->updateSharedData(Value(Array{Value(1)}), 10s);
  ASSERT_FALSE(shared);
  EXPECT_NE(shared.error->description.find("dictionary"), std::string::npos) << shared.error->description;

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
  EXPECT_EQ(adaptorLinesOf(71, 4).size(), 1u);
  EXPECT_EQ(adaptorLinesOf(70, 1).size(), 0u);
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
  const CliRun run = zerith({"sessions", "--script", (root / "/var/tmp/script.jsonl").string()});
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
  ASSERT_EQ(adaptorLinesOf(90, 1).size(), 1u);
  EXPECT_EQ(adaptorLinesOf(90, 1)[0]["dict"],
            nlohmann::json::parse(R"({"SharedData":{"room":"green"},"ClientData":{"jitter":4}})"));
  EXPECT_EQ(adaptorLinesOf(91, 1)[0]["dict"], nlohmann::json::parse(R"({"once":1})"));

  // A line that cannot run ends the script with status 2 and says which.
  root.write("/var/tmp/bad.jsonl", "{\"session\":\"x\",\"step\":\"send\",\"category\":1,\"type\":1}\n");
  const CliRun bad = zerith({"sessions", "--script", (root / "/var/tmp/bad.jsonl").string()});
  EXPECT_EQ(bad.status, 2);
  EXPECT_NE(bad.err.find("line 1: no open session \"x\""), std::string::npos) << bad.err;
}

}  // namespace
}  // namespace zerith::test
