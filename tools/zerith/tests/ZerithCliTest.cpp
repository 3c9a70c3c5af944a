#include "tools/zerith/ZerithCli.h"

#include <gtest/gtest.h>

#include <sstream>

#include "client/tests/TestDaemon.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

struct CliResult {
  int status;
  std::string out;
  std::string err;
};

CliResult runCli(std::vector<std::string> args) {
  args.insert(args.begin(), "zerith");
  std::vector<const char*> argv;
  for (const auto& a : args) {
    argv.push_back(a.c_str());
  }
  std::ostringstream out, err;
  const int status = cli::run(static_cast<int>(argv.size()), argv.data(), out, err);
  return {status, out.str(), err.str()};
}

struct CliFixture : ::testing::Test {
  TempRoot root;
  std::unique_ptr<TestDaemon> daemon;
  void SetUp() override {
    grantEntitlement(root);
    daemon = std::make_unique<TestDaemon>();
  }
  std::vector<std::string> session(std::initializer_list<std::string> more) {
    std::vector<std::string> args{"--root", root.path().string(), "--timeout", "5000", "session", "--client-type", "7",
                                  "--session-id", "1"};
    args.insert(args.end(), more);
    return args;
  }
};

TEST_F(CliFixture, AScriptedSessionPrintsOneJsonLinePerStep) {
  const auto r = runCli(session({"--user-info", R"({"clientName":"mail"})", "--hierarchy-token", "T", "--hierarchy-level",
                                 "2", "--category", "1", "--type", "2", "--payload", R"({"k":"v"})", "--step", "set-info",
                                 "--step", "start", "--step", "display-url", "--step", "send", "--step", "flush", "--step",
                                 "finish"}));
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out,
            "{\"step\":\"set-info\"}\n"
            "{\"step\":\"start\",\"backends\":[\"httpsPost\",\"dashboard\"]}\n"
            "{\"step\":\"display-url\",\"url\":\"https://display.example/session\"}\n"
            "{\"step\":\"send\",\"result\":\"sent\"}\n"
            "{\"step\":\"flush\",\"result\":\"flushed\"}\n"
            "{\"step\":\"finish\"}\n");
  const auto calls = daemon->waitForClient().session->log.calls();
  ASSERT_EQ(calls.size(), 6u);
  EXPECT_EQ(calls[0].args.get("sessionInfo"),
            Value(Dictionary{{"sessionID", 1u}, {"clientType", 7u}, {"hierarchyToken", Dictionary{{"tokenID", "T"}, {"level", 2u}}}}));
  EXPECT_EQ(calls[0].args.get("userInfo"), Value(Dictionary{{"clientName", "mail"}}));
  EXPECT_EQ(calls[3].args.get("message"), Value(Dictionary{{"category", 1u}, {"type", 2u}, {"payload", Dictionary{{"k", "v"}}}}));
}

TEST_F(CliFixture, StepArgumentsReachTheSession) {
  const auto r = runCli(session({"--step", R"(send={"category":3,"type":4,"payload":{}})", "--step",
                                 R"(one-shot={"category":5,"type":6,"payload":{"x":1}})", "--step", "shared-key=k=[1]",
                                 "--step", "shared-key=gone=null", "--step", "digest-key=AAH/:3", "--step",
                                 R"(upload-log=["a"])", "--step", "upload-file=/tmp/f.log"}));
  EXPECT_EQ(r.status, 0) << r.err;
  const auto calls = daemon->waitForClient().session->log.calls();
  ASSERT_EQ(calls.size(), 7u);
  EXPECT_EQ(calls[1].args.get("category"), Value(5u));
  EXPECT_EQ(calls[1].args.get("payload"), Value(Dictionary{{"x", 1}}));
  EXPECT_EQ(Value(calls[2].args), Value(Dictionary{{"key", "k"}, {"value", Array{Value(1)}}}));
  EXPECT_EQ(Value(calls[3].args), Value(Dictionary{{"key", "gone"}, {"value", Value()}}));
  EXPECT_EQ(Value(calls[4].args), Value(Dictionary{{"digestKey", Data{0, 1, 255}}, {"algorithm", 3}}));
  EXPECT_NE(r.out.find("{\"step\":\"upload-log\",\"success\":false,\"error\":{\"domain\":\"com.velmar.zerith.ErrorDomain\",\"code\":-1,\"description\":\"no upload backend\"}}\n"),
            std::string::npos) << r.out;
}

TEST_F(CliFixture, UnreachableDaemonExitsWithAClearMessage) {
  const auto r = runCli({"--socket", (root / "/nowhere/sock").string(), "session", "--client-type", "1", "--session-id", "1",
                         "--step", "start"});
  EXPECT_EQ(r.status, cli::kExitUnreachable);
  EXPECT_EQ(r.err, "zerith: the daemon is unreachable: Cannot connect to " + (root / "/nowhere/sock").string() +
                       ": No such file or directory\n");
  EXPECT_EQ(r.out, "");
}

TEST_F(CliFixture, RefusedClientExitsWithTheRefusalStatus) {
  grantEntitlement(root, "<string>yes</string>");
  const auto r = runCli(session({"--step", "set-info", "--step", "start"}));
  EXPECT_EQ(r.status, cli::kExitRefused);
  EXPECT_EQ(r.out, "{\"step\":\"set-info\",\"failure\":\"The connection was invalidated\"}\n");
  EXPECT_EQ(r.err, "zerith: the daemon closed the session during set-info (is this user granted com.velmar.private.zerithd?)\n");
}

TEST_F(CliFixture, AStepThatTimesOutStopsTheScript) {
  daemon->prepare = [](ipc::test::RecordingSession& s) { s.answer = false; };
  auto args = session({"--step", "set-info", "--step", "display-url", "--step", "finish"});
  args[3] = "50";  // --timeout
  const auto r = runCli(args);
  EXPECT_EQ(r.status, cli::kExitStepFailed);
  EXPECT_EQ(r.out, "{\"step\":\"set-info\"}\n{\"step\":\"display-url\",\"failure\":\"No answer to fetchDisplayURL: within 50 ms\"}\n");
  EXPECT_EQ(r.err, "zerith: display-url: No answer to fetchDisplayURL: within 50 ms\n");
}

TEST_F(CliFixture, BadCommandLinesAreRefusedBeforeConnecting) {
  EXPECT_EQ(runCli(session({"--step", "launch"})).err, "zerith: unknown step \"launch\" (see zerith session --help)\n");
  EXPECT_EQ(runCli(session({"--step", "send={oops"})).err, "zerith: send message is not valid JSON: {oops\n");
  EXPECT_EQ(runCli(session({"--step", "upload-log={}"})).status, cli::kExitUsage);
  EXPECT_EQ(runCli({"session", "--step", "start"}).status, cli::kExitUsage);  // no client type
  EXPECT_EQ(runCli({"--help"}).status, 0);
  EXPECT_EQ(daemon->accepted.count(), 0);
}

TEST_F(CliFixture, TheDaemonsMessagesPrintAsEventLines) {
  std::thread sender([&] {
    auto client = daemon->waitForClient();
    ASSERT_TRUE(client.session->log.waitFor(1));
    client.toClient->sendMessageToClient(Value(), 2.5, 1, 2, Value(Dictionary{{"a", 1}}));
  });
  // finish is answered after the session recorded it; the message then
  // arrives while the script waits.
  const auto r = runCli(session({"--step", "finish", "--step", "wait=300"}));
  sender.join();
  EXPECT_EQ(r.status, 0);
  EXPECT_NE(r.out.find("{\"event\":\"message\",\"message\":null,\"timestamp\":2.5,\"category\":1,\"type\":2,\"payload\":{\"a\":1}}\n"),
            std::string::npos) << r.out;
}

TEST(Cli, IdentifierAndVersion) {
  TempRoot root;
  const auto id = runCli({"--root", root.path().string(), "identifier", "--dnu"});
  EXPECT_EQ(id.status, 0);
  EXPECT_EQ(id.out, "{\"identifier\":\"" + Zerith::getPersistentIdentifierForDNU(true) + "\",\"dnu\":true}\n");
  const auto v = runCli({"--root", root.path().string(), "version"});
  EXPECT_EQ(v.out, "{\"version\":\"8.0\",\"publicKey\":\"" + (root / "/usr/share/zerith/publicKey.der").string() + "\"}\n");
}

}  // namespace
}  // namespace zerith::test
