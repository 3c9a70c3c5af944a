#include "backends/UploadBackend.h"

#include <gtest/gtest.h>
#include <fcntl.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "backends/tests/BackendTestSupport.h"
#include "platform/Log.h"
#include "platform/SandboxExtension.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/TempRoot.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/URLSession.h"
#include "zerith/ZerithConstants.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;

constexpr char kUdid[] = "0123456789abcdef0123456789abcdef01234567";

// The answer of one upload: (taken, serverSucceeded), or nullopt when none
// came within the wait.
using Answer = std::optional<std::pair<bool, bool>>;

class UploadBackendTest : public ::testing::Test {
 protected:
  UploadBackendTest() {
    URLSession::setExtraCAFile(TestCA::shared().caFile().string());
    files = root.path() / "client";
    fs::create_directories(files);
    // A client's file, and a collector that takes it.
    writeFile(files / "report.log", "data");
    https.on("/upload", Reply{.body = "success"});
    backend = UploadBackend::initWithName(kZerithBackendUploadServer,
                                          Value(Dictionary{{"post_url", Value(https.url("/upload"))},
                                                           {"display_url", Value("https://display/")}}),
                                          std::nullopt);
    backend->setUdid(kUdid);
    backend->setSessionID(7);
    backend->setReportingSessionConnectivityDelegate(transport);
  }

  // Starts an upload of `path` for user `client`, read through a descriptor
  // as the daemon reads a client's file; the future holds the answer.
  std::future<std::pair<bool, bool>> start(const fs::path& path, uid_t client = 1000,
                                           std::chrono::milliseconds limit = std::chrono::seconds(20)) {
    UploadRequest request;
    request.name = path.filename().string();
    request.client = client;
    request.deadline = std::chrono::steady_clock::now() + limit;
    request.file = sandbox::GrantedFile::adopt(
        std::make_shared<const file::UniqueFd>(::open(path.c_str(), O_RDONLY | O_CLOEXEC)), request.name);
    auto answer = std::make_shared<std::promise<std::pair<bool, bool>>>();
    auto future = answer->get_future();
    backend->uploadFileAtPath(request, [answer](bool taken, bool ok) { answer->set_value({taken, ok}); });
    return future;
  }
  static Answer wait(std::future<std::pair<bool, bool>>& f, std::chrono::seconds limit = std::chrono::seconds(20)) {
    if (f.wait_for(limit) != std::future_status::ready) {
      return std::nullopt;
    }
    return f.get();
  }
  Answer upload(const fs::path& path) {
    auto f = start(path);
    return wait(f);
  }

  log::LogCapture logs;
  TempRoot root;
  HttpsTestServer https;
  std::shared_ptr<ReportingSessionConnectivityHelper> transport =
      ReportingSessionConnectivityHelper::initWithDelegate({}, ReportingSessionConnectivityHelper::POSTRequestMode());
  fs::path files;
  std::shared_ptr<UploadBackend> backend;
};

TEST_F(UploadBackendTest, EmptyOrChangedFilesAreRefused) {
  writeFile(files / "empty.log", "");
  EXPECT_EQ(upload(files / "empty.log"), std::make_pair(false, false));
  EXPECT_TRUE(logs.has(Level::Error, "UploadBackend(uploadFileAtPath): Input file is empty"));

  writeFile(files / "growing.log", "first");
  auto granted = sandbox::GrantedFile::adopt(
      std::make_shared<const file::UniqueFd>(::open((files / "growing.log").c_str(), O_RDONLY | O_CLOEXEC)), "g");
  ASSERT_NE(granted, nullptr);
  std::ofstream(files / "growing.log", std::ios::app) << " and more";
  std::string why;
  EXPECT_FALSE(granted->readAll(&why).has_value());
  EXPECT_EQ(why, "the file changed while it was read");
  EXPECT_EQ(https.requestCount(), 0u);
}

// An http:// address is upgraded: the end-to-end uploads test posts to one.
TEST_F(UploadBackendTest, TheAddressNamesDeviceSessionAndFileAndOnlyHttpIsPosted) {
  EXPECT_EQ(upload(files / "report.log"), std::make_pair(true, true));
  ASSERT_EQ(https.requestCount(), 1u);
  const auto request = https.requests()[0];
  EXPECT_EQ(request.target, std::string("/upload?uuid=") + kUdid +
                                "&sequence=7&description=Vidra%20AFRC%20log%20(Uploaded%20by%20QPX)"
                                "&filename=report.log.gz&raw=true");
  EXPECT_EQ(request.header("Content-Type"), "application/octet-stream");
  EXPECT_EQ(request.header("Content-Encoding"), "gzip");
  EXPECT_EQ(backend->displayURL(), "https://display/");
  backend->setUploadURL("ftp-only-address");
  EXPECT_EQ(upload(files / "report.log"), std::make_pair(false, false));
  EXPECT_TRUE(logs.contains("is not an http(s) URL"));
}

TEST_F(UploadBackendTest, StalledServerEndsWithNoAtTheTimeLimit) {
  https.holdAnswers();
  const auto began = std::chrono::steady_clock::now();
  auto f = start(files / "report.log", 1000, std::chrono::milliseconds(1500));
  EXPECT_EQ(wait(f, std::chrono::seconds(10)), std::make_pair(false, false));
  EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(8));
  EXPECT_EQ(uploadLoad().running, 0u);
  https.releaseAnswers();
}

TEST_F(UploadBackendTest, UploadsBeyondTheLimitsWaitWithoutAThreadOrAreRefused) {
  https.holdAnswers();
  // Two run for one client (the per-client limit), eight wait, the rest are
  // refused at once; another client still gets a slot of the four.
  std::vector<std::future<std::pair<bool, bool>>> mine;
  for (int i = 0; i < 12; ++i) {
    mine.push_back(start(files / "report.log", 1000));
  }
  auto theirs = start(files / "report.log", 2000);
  ASSERT_TRUE(https.waitForRequests(3));
  EXPECT_EQ(uploadLoad().running, 3u);
  EXPECT_EQ(uploadLoad().waiting, 8u);
  for (int i = 10; i < 12; ++i) {
    EXPECT_EQ(wait(mine[i], std::chrono::seconds(5)), std::make_pair(false, false)) << i;
  }
  EXPECT_TRUE(logs.contains("uploads run and 8 wait already"));
  https.releaseAnswers();
  for (int i = 0; i < 10; ++i) {
    EXPECT_EQ(wait(mine[i]), std::make_pair(true, true)) << i;
  }
  EXPECT_EQ(wait(theirs), std::make_pair(true, true));
  EXPECT_EQ(https.requestCount(), 11u);
  EXPECT_EQ(uploadLoad().running + uploadLoad().waiting, 0u);
}

TEST_F(UploadBackendTest, QueryEncodingKeepsTheQueryCharactersAndEscapesTheRest) {
  EXPECT_EQ(UploadBackend::percentEncodeQuery("a b%c#d&e=f/g?h\xc3\xa9"), "a%20b%25c%23d&e=f/g?h%C3%A9");
}

}  // namespace
}  // namespace zerith::test
