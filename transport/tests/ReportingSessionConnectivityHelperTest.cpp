// The connectivity helper against a real HTTPS server on loopback.

#include "transport/ReportingSessionConnectivityHelper.h"

#include <gtest/gtest.h>

#include <array>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "transport/tests/TransportTestSupport.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;
using Helper = ReportingSessionConnectivityHelper;
using log::Level;

class ConnectivityHelperTest : public TransportTest {
 protected:
  std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
  std::shared_ptr<ReleaseCountingAgent> agent = std::make_shared<ReleaseCountingAgent>(events);
};

bool emptyOrMissing(const fs::path& folder) {
  std::error_code ec;
  return fs::is_empty(folder, ec) || ec == std::errc::no_such_file_or_directory;
}

TEST(ConnectivityHelperTaskNumbering, TasksOfAllHelpersAreNumberedFrom00000001InOneSequence) {
  // A fresh process (the death-test child re-runs only this test) starts the
  // shared counter: incremented before use, eight lower-case hex digits.
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        auto session = URLSession::sessionWithConfiguration(URLSessionConfiguration::defaultSessionConfiguration(), {},
                                                            mainOperationQueue());
        std::string names;
        for (const std::uint32_t mode : {Helper::GETRequestMode(), 8u, Helper::GETRequestMode()}) {
          auto task = session->dataTaskWithRequest(URLRequest{});
          Helper::initWithDelegate({}, mode)->createHelperForTask(*task, nullptr);
          names += task->taskDescription() + " ";
        }
        std::_Exit(names == "Task_00000001 Task_00000002 Task_00000003 " ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
}

TEST_F(ConnectivityHelperTest, CompletionsThatPostThroughTheirOwnOrEachOthersHelperNeverStop) {
  // A backend's sessions share its posts in flight: a completion on one
  // helper's state queue starts the next post through another helper, or
  // through its own. Four chains hop between two helpers at once, a fifth
  // stays on one; waiting for each other's state queue, two completions once
  // stopped both helpers for good.
  server.on("/hop", Reply{.status = 204});
  const std::array helpers{Helper::initWithDelegate({}, 4), Helper::initWithDelegate({}, 4)};
  constexpr int kChains = 5;
  constexpr int kHops = 150;
  auto done = Completions::make();
  std::function<void(std::size_t, std::size_t, int)> hop = [&](std::size_t at, std::size_t next, int left) {
    helpers[at]->postURLRequestWithCompletionHandler(
        post(server.url("/hop"), "x"), left == 0 ? done->handler() : done->handler([&, at, next, left](const auto&) {
          hop(next, at, left - 1);
        }));
  };
  for (std::size_t chain = 0; chain < kChains; ++chain) {
    hop(chain % 2, chain < 4 ? 1 - chain % 2 : chain % 2, kHops - 1);
  }
  EXPECT_TRUE(done->waitFor(kChains * kHops, std::chrono::seconds(30))) << done->count() << " of " << kChains * kHops;
}

TEST_F(ConnectivityHelperTest, AnswerWithoutBodyCompletesExactlyOnceWithAnEmptyBuffer) {
  server.on("/empty", Reply{.status = 204});
  auto helper = Helper::initWithDelegate({}, 4);
  const std::string session = helper->sessionDescription();
  EXPECT_TRUE(logs.has(Level::Debug, "QFURLSession created with ID <" + session + ">, delegate 1"));

  auto done = Completions::make();
  helper->postURLRequestWithCompletionHandler(post(server.url("/empty"), "x"), done->handler());
  ASSERT_TRUE(done->waitFor(1));
  const std::string created = "createHelperForTask: created helperTask for task <";
  std::string task;  // "Task_0000002a"
  for (const auto& line : logs.lines()) {
    if (line.text.starts_with(created)) task = line.text.substr(created.size(), line.text.find('>') - created.size());
  }
  ASSERT_FALSE(task.empty());
  // The record is released after its completion ran: nothing can follow.
  ASSERT_TRUE(logs.waitFor("ConnectivityHelperTask with ID <" + task + "> dealloced"));

  ASSERT_EQ(done->count(), 1u);
  const auto call = done->calls()[0];
  ASSERT_TRUE(call.response.has_value());
  EXPECT_EQ(std::tuple(call.data.size(), call.response->statusCode, call.response->url, call.error.has_value()),
            std::tuple(0u, 204, server.url("/empty"), false));

  EXPECT_TRUE(logs.has(Level::Debug, "ConnectivityHelperTask with ID <" + task + "> created"));
  EXPECT_TRUE(logs.has(Level::Debug, "didReceiveResponse: for <session>:<task> <" + session + ">:<" + task + ">"));
  EXPECT_TRUE(logs.has(Level::Debug, "didSendBodyData: for <session>:<task> <" + session + ">:<" + task + ">: Sent 1 out of 1"));
  EXPECT_EQ(logs.count("didReceiveData:"), 0u);
  EXPECT_TRUE(logs.has(Level::Debug, "didCompleteWithError: for <session>:<task> <" + session + ">:<" + task +
                                         "> with response <HTTPURLResponse URL: " + server.url("/empty") +
                                         " Status Code: 204>, error (null)"));
}

TEST_F(ConnectivityHelperTest, LargeChunkedBodyArrivesWholeAndInOrder) {
  const std::string body = patternBody(3 * 1024 * 1024 + 17);
  server.on("/big", Reply{.status = 200, .body = body, .chunkSize = 7001});
  auto helper = Helper::initWithDelegate({}, Helper::GETRequestMode());
  auto done = Completions::make();
  URLRequest request = get(server.url("/big"));
  request.maxResponseBytes = 4u << 20;  // above the 1 MiB that requests take by default
  helper->getURLRequestWithCompletionHandler(request, done->handler());
  ASSERT_TRUE(done->waitFor(1));
  const auto call = done->calls()[0];
  EXPECT_FALSE(call.error.has_value());
  EXPECT_TRUE(text(call.data) == body) << call.data.size() << " of " << body.size() << " bytes, or not in order";
  EXPECT_GE(logs.count("didReceiveData: received "), 2u) << "expected the body in several deliveries";
}

// Each mode's configuration and the requests it refuses; unknown modes (0,
// 3) have no configuration and take none. Refused requests are logged, never
// registered, never sent and never completed.
TEST_F(ConnectivityHelperTest, ModesGetTheirConfigurationsAndRequestsOfTheWrongModeAreLoggedAndNeverComplete) {
  const auto shape = [](const std::optional<URLSessionConfiguration>& c) {
    return c ? std::vector<bool>{c->background, c->discretionary, c->requiresPowerPluggedIn, c->waitsForConnectivity,
                                 c->networkServiceType == NetworkServiceType::Background,
                                 c->sourceApplicationBundleIdentifier == "com.velmar.system.diagnostics"}
             : std::vector<bool>{};
  };
  struct Row {
    std::uint32_t mode;
    std::vector<bool> configuration;
    bool refusesGet, refusesPost;
  };
  auto done = Completions::make();
  for (const Row& row : {Row{Helper::POSTRequestMode(), {true, true, true, true, true, true}, true, false},
                         Row{Helper::GETRequestMode(), {true, true, false, true, false, true}, false, true},
                         Row{4, {false, false, false, true, false, true}, true, false},
                         Row{8, {false, false, false, true, false, true}, false, true}, Row{0, {}, true, true},
                         Row{3, {}, true, true}}) {
    const std::string m = std::to_string(row.mode);
    SCOPED_TRACE("mode " + m);
    EXPECT_EQ(shape(Helper::privateURLSessionConfigWithMode(row.mode)), row.configuration);
    auto helper = Helper::initWithDelegate(agent, row.mode);
    EXPECT_TRUE(isUUIDString(helper->sessionDescription()));
    if (row.refusesGet) {
      helper->getURLRequestWithCompletionHandler(get(server.url("/")), done->handler());
      EXPECT_TRUE(logs.has(Level::Error, "getURLRequestWithCompletionHandler: wrong mode for GET operation detected " + m));
    }
    if (row.refusesPost) {
      helper->postURLRequestWithCompletionHandler(post(server.url("/"), "b"), done->handler());
      EXPECT_TRUE(logs.has(Level::Error, "postURLRequestWithCompletionHandler: wrong mode for POST operation detected " + m));
    }
    if (row.configuration.empty()) {
      EXPECT_TRUE(logs.has(Level::Debug, "QFURLSession created with ID <" + helper->sessionDescription() + ">, delegate 0"));
      helper->invalidate();
      EXPECT_TRUE(logs.has(Level::Debug, "ReportingSessionConnectivityHelper:invalidate: QFURLSession with ID <" +
                                             helper->sessionDescription() + ">"));
    }
  }
  // Completions come only from registered tasks, and none was registered.
  EXPECT_EQ(logs.count("createHelperForTask:"), 0u);
  EXPECT_EQ(server.requestCount(), 0u);
  EXPECT_EQ(done->count(), 0u);
  EXPECT_TRUE(emptyOrMissing(Helper::storageRootFolder()));
  // Background helpers are known by their configuration's fresh identifier.
  const std::string identifier = Helper::privateURLSessionConfigWithMode(1)->identifier;
  EXPECT_TRUE(isUUIDString(identifier));
  EXPECT_NE(identifier, Helper::privateURLSessionConfigWithMode(1)->identifier);
}

TEST_F(ConnectivityHelperTest, UploadPostSendsTheExactBodyAndLeavesNoBodyFile) {
  const std::string body = patternBody(200 * 1024);  // every byte value among the first 256
  server.on("/upload", Reply{.status = 200, .body = "thanks"});
  auto helper = Helper::initWithDelegate({}, Helper::POSTRequestMode());
  auto done = Completions::make();
  helper->postURLRequestWithCompletionHandler(post(server.url("/upload"), body), done->handler());
  // Deleted at once: the open descriptor carries the upload.
  EXPECT_TRUE(emptyOrMissing(Helper::storageRootFolder()));

  ASSERT_TRUE(done->waitFor(1));
  const auto call = done->calls()[0];
  EXPECT_FALSE(call.error.has_value());
  EXPECT_EQ(text(call.data), "thanks");
  ASSERT_EQ(server.requestCount(), 1u);
  const auto r = server.requests()[0];
  EXPECT_TRUE(r.body == body) << "upload body differs (" << r.body.size() << " of " << body.size() << " bytes)";
  EXPECT_EQ(r.header("Content-Length"), std::to_string(body.size()));
  EXPECT_EQ(r.header("X-ZTH-Source-Application"), "com.velmar.system.diagnostics");
  EXPECT_TRUE(emptyOrMissing(Helper::storageRootFolder()));
  const std::string total = std::to_string(body.size());
  EXPECT_EQ(logs.count("Sent " + total + " out of " + total), 1u);
}

// A server outside the trusted authorities is refused end to end
// (StorebagStartTest); here: a bad CA file changes nothing, and trust that
// was added once does not linger in a cached store.
TEST_F(ConnectivityHelperTest, ExtraCAFileIsCheckedAndItsTrustDoesNotLinger) {
  server.on("/", Reply{.body = "ok"});
  auto helper = Helper::initWithDelegate({}, 8);
  auto done = Completions::make();
  EXPECT_FALSE(URLSession::setExtraCAFile((root.path() / "missing.pem").string()));
  root.write("/no-cert.pem", "-----BEGIN NOTHING-----\n");
  EXPECT_FALSE(URLSession::setExtraCAFile((root / "/no-cert.pem").string()));
  EXPECT_EQ(URLSession::extraCAFile(), TestCA::shared().caFile().string());
  EXPECT_TRUE(logs.contains("holds no certificate"));
  helper->getURLRequestWithCompletionHandler(get(server.url("/")), done->handler());
  ASSERT_TRUE(done->waitFor(1));
  EXPECT_FALSE(done->calls()[0].error.has_value());
  EXPECT_EQ(text(done->calls()[0].data), "ok");

  ASSERT_TRUE(URLSession::setExtraCAFile(""));
  helper->getURLRequestWithCompletionHandler(get(server.url("/")), done->handler());
  ASSERT_TRUE(done->waitFor(2));
  ASSERT_TRUE(done->calls()[1].error.has_value());
  EXPECT_EQ(done->calls()[1].error->code, 60);  // CURLE_PEER_FAILED_VERIFICATION
  EXPECT_TRUE(done->calls()[1].data.empty());
}

TEST_F(ConnectivityHelperTest, InvalidateLetsTheRunningTaskFinishThenReleasesOnce) {
  server.on("/slow", Reply{.body = "late"});
  server.holdAnswers();
  auto helper = Helper::initWithDelegate(agent, Helper::POSTRequestMode());
  const std::string session = helper->sessionDescription();
  auto done = Completions::make();
  helper->postURLRequestWithCompletionHandler(post(server.url("/slow"), "b"),
                                              done->handler([events = events](const auto&) { events->add("completion"); }));
  ASSERT_TRUE(server.waitForRequests(1));
  helper->invalidate();
  helper->invalidate();
  EXPECT_TRUE(logs.has(Level::Debug, "ReportingSessionConnectivityHelper:invalidate: QFURLSession with ID <" + session + ">"));

  // No new work once invalidated: answered at once, never sent.
  auto late = Completions::make();
  helper->postURLRequestWithCompletionHandler(post(server.url("/slow"), "late"), late->handler());
  ASSERT_TRUE(late->waitFor(1));
  ASSERT_TRUE(late->calls()[0].error.has_value());
  EXPECT_EQ(late->calls()[0].error->code, kURLErrorSessionInvalidated);

  helper.reset();  // the owner lets go while the task still runs
  server.releaseAnswers();
  ASSERT_TRUE(events->waitFor("releaseVeskTransaction"));
  ASSERT_TRUE(logs.waitFor("QFURLSession dealloced with ID <" + session + ">"));
  EXPECT_EQ(events->events(), (std::vector<std::string>{"completion", "releaseVeskTransaction"}));
  EXPECT_EQ(text(done->calls().at(0).data), "late");
  EXPECT_TRUE(logs.has(Level::Debug, "didBecomeInvalidWithError: session <" + session + "> invalidated with error (null)"));
  EXPECT_EQ(server.requestCount(), 1u);
}

TEST_F(ConnectivityHelperTest, InvalidationWithoutAgentOrWithoutTasksStillCompletes) {
  auto idle = Helper::initWithDelegate(agent, 8);
  idle->invalidate();
  ASSERT_TRUE(events->waitFor("releaseVeskTransaction"));

  // The agent is gone by the time the session becomes invalid: nothing to release.
  auto orphanAgent = std::make_shared<ReleaseCountingAgent>(events);
  auto orphan = Helper::initWithDelegate(orphanAgent, 8);
  const std::string orphanSession = orphan->sessionDescription();
  orphanAgent.reset();
  orphan->invalidate();
  ASSERT_TRUE(logs.waitFor("didBecomeInvalidWithError: session <" + orphanSession + ">"));
  EXPECT_EQ(events->events(), std::vector<std::string>{"releaseVeskTransaction"});
}

TEST_F(ConnectivityHelperTest, CleanupMakesTheStorageFolderAndRemovesOnlyStaleBodyFilesOfAnyCase) {
  EXPECT_FALSE(fs::exists(Helper::storageRootFolder()));
  Helper::cleanupStorageRootFolder();
  EXPECT_TRUE(fs::is_directory(Helper::storageRootFolder()));
  EXPECT_EQ(Helper::storageRootFolder(), root / "/tmp/zthstorage");

  const fs::path a = Helper::composeUniqueContainerURL();
  const fs::path b = Helper::composeUniqueContainerURL();
  EXPECT_NE(a, b);
  EXPECT_EQ(a.parent_path(), Helper::storageRootFolder());
  EXPECT_EQ(a.extension(), ".zthdiag");
  EXPECT_TRUE(isUUIDString(a.stem().string())) << a;
  std::ofstream(a) << "x";
  Helper::deleteContainerAtURL(a);
  Helper::deleteContainerAtURL(a);  // already gone: ignored
  EXPECT_FALSE(fs::exists(a));

  for (const char* name : {"A.zthdiag", "b.ZTHDIAG", "c.ZthDiag", "sub/d.zthdiag", "sub/deeper/e.zthdiag", "f.zthdiag/inner.txt"}) {
    root.write(std::string("/tmp/zthstorage/") + name, "stale");
  }
  for (const char* name : {"keep.txt", "zthdiag", "x.zthdiag.bak", "xzthdiag", "sub/keep.log", "sub/deeper/keep"}) {
    root.write(std::string("/tmp/zthstorage/") + name, "keep");
  }
  Helper::cleanupStorageRootFolder();
  std::vector<std::string> left;
  for (fs::recursive_directory_iterator it(Helper::storageRootFolder()), end; it != end; ++it) {
    left.push_back(it->path().lexically_relative(Helper::storageRootFolder()).generic_string());
  }
  std::sort(left.begin(), left.end());
  EXPECT_EQ(left, (std::vector<std::string>{"keep.txt", "sub", "sub/deeper", "sub/deeper/keep", "sub/keep.log", "x.zthdiag.bak",
                                            "xzthdiag", "zthdiag"}));
}

}  // namespace
}  // namespace zerith::test
