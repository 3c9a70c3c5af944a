// The client kit's examples, run as a client team runs them against the
// real daemon: without a storebag every step still answers, and with
// backends for their client type the call's aggregation block receives every
// stream's event and the upload server takes the file, which the framework
// then removes.

#include <csignal>
#include <filesystem>
#include <future>
#include <map>

#include "tests/e2e/E2eFixture.h"
#include "tests/support/Command.h"

namespace zerith::test {
namespace {

class ExamplesTest : public E2eTest {
 protected:
  // The example `name` ("c_upload", "cpp_call") run with this test's root.
  CommandResult run(const std::string& name) const {
    const std::string binary = std::string(ZERITH_EXAMPLES_DIR) + "/zerith_example_" + name;
    return runCommand("ZERITHD_ROOT=" + shellQuote(root.path().string()) + " TMPDIR=" +
                          shellQuote(root.path().string()) + " " + shellQuote(binary) + " 2>&1",
                      60);
  }

  HttpsTestServer server;
};

TEST_F(ExamplesTest, EveryExampleRunsToItsEndWithoutAStorebag) {
  startDaemon();
  std::map<std::string, CommandResult> results;
  for (const std::string name : {"c_report", "c_upload", "cpp_report", "cpp_call", "cpp_reconnect"}) {
    const CommandResult& result = results[name] = run(name);
    EXPECT_EQ(result.status, 0) << name << ":\n" << result.output << daemon->output();
  }
  const CommandResult& call = results["cpp_call"];
  EXPECT_NE(call.output.find("call: no backends for this client type, so nothing is aggregated"), std::string::npos)
      << call.output;
  const CommandResult& upload = results["c_upload"];
  for (const char* line : {"upload file: {\"success\":false,\"removeFile\":false}", "the log file is still here",
                           "one-shot event: {\"result\":\"storebag not available\"}"}) {
    EXPECT_NE(upload.output.find(line), std::string::npos) << line << " in\n" << upload.output;
  }
  // The upload example removes the folder it wrote its file into.
  for (const auto& entry : std::filesystem::directory_iterator(root.path())) {
    EXPECT_NE(entry.path().filename().string().rfind("zerith-upload-", 0), 0u) << entry.path();
  }
}

TEST_F(ExamplesTest, TheCallReceivesEveryStreamEventAndTheUploadServerTakesTheFile) {
  server.on("/upload", {.status = 200, .body = "success"});
  serveSignedStorebag(server, storebag(Value(Dictionary{{kZerithBackendPellamlog, Value(Dictionary{})},
                                                        {"uploadServer", Dictionary{{"post_url", server.url("/upload")}}}})));
  startDaemon(trusting(TestCA::shared().caFile(), "C"));

  const CommandResult call = run("cpp_call");
  EXPECT_EQ(call.status, 0) << call.output << daemon->output();
  EXPECT_NE(call.output.find("call: 6 of 6 stream events aggregated"), std::string::npos) << call.output;
  EXPECT_NE(call.output.find("call: event 20/3 of session 102: {stream = 2; packetsLost = 2}"), std::string::npos)
      << call.output;

  const CommandResult upload = run("c_upload");
  EXPECT_EQ(upload.status, 0) << upload.output << daemon->output();
  for (const char* line : {"upload file: {\"success\":true,\"removeFile\":true}", "the log file was taken and removed",
                           "one-shot event: {\"result\":\"finished\"}"}) {
    EXPECT_NE(upload.output.find(line), std::string::npos) << line << " in\n" << upload.output;
  }
  ASSERT_TRUE(server.waitForRequestTo("/upload"));
  const auto requests = server.requests();
  const auto posted = std::find_if(requests.begin(), requests.end(), [](const auto& r) { return r.path == "/upload"; });
  ASSERT_NE(posted, requests.end());
  EXPECT_NE(posted->body.size(), 0u);
}

// The daemon dies under the reporter and a new one starts: the reporter
// connects again, and every event it made reaches a daemon.
TEST_F(ExamplesTest, TheReporterSendsEveryEventAcrossARestartOfTheDaemon) {
  startDaemon();
  auto reporter = std::async(std::launch::async, [this] { return run("cpp_reconnect"); });
  ASSERT_TRUE(daemon->waitFor("sendMessageWithDictionary: Sending message for session 200", 5)) << daemon->output();
  daemon->signal(SIGKILL);
  ASSERT_TRUE(daemon->waitForExit(10s));
  daemon.reset();
  startDaemon();
  const CommandResult result = reporter.get();
  EXPECT_EQ(result.status, 0) << result.output;
  EXPECT_NE(result.output.find("reconnect: connected again"), std::string::npos) << result.output;
  EXPECT_NE(result.output.find("reconnect: 30 events sent, 0 dropped, 0 not sent"), std::string::npos) << result.output;
}

}  // namespace
}  // namespace zerith::test
