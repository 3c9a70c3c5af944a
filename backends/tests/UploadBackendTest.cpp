#include "backends/UploadBackend.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

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
constexpr uid_t kOtherUser = 65534;

void writeFile(const fs::path& path, const std::string& contents) {
  std::ofstream(path, std::ios::binary) << contents;
}

class UploadBackendTest : public ::testing::Test {
 protected:
  UploadBackendTest() {
    URLSession::setExtraCAFile(TestCA::shared().caFile().string());
    files = root.path() / "client";
    fs::create_directories(files);
    backend = UploadBackend::initWithName(kZerithBackendUploadServer,
                                          Value(Dictionary{{"post_url", Value(https.url("/upload"))},
                                                           {"display_url", Value("https://display/")}}),
                                          std::nullopt);
    backend->setUdid(kUdid);
    backend->setSessionID(7);
    backend->setReportingSessionConnectivityDelegate(transport);
  }

  // An upload refused before anything went to the server.
  void expectRefused(const std::string& path) {
    logs.clear();
    EXPECT_FALSE(backend->uploadFileAtPath(path, nullptr)) << path;
    EXPECT_TRUE(logs.has(Level::Error, "UploadBackend(uploadFileAtPath): Only upload a regular file.")) << path;
    EXPECT_EQ(https.requestCount(), 0u);
  }

  log::LogCapture logs;
  TempRoot root;
  HttpsTestServer https;
  std::shared_ptr<ReportingSessionConnectivityHelper> transport =
      ReportingSessionConnectivityHelper::initWithDelegate({}, ReportingSessionConnectivityHelper::POSTRequestMode());
  fs::path files;
  std::shared_ptr<UploadBackend> backend;
};

TEST_F(UploadBackendTest, FileIsPostedGzippedWithItsQueryAndDeletedOnSuccess) {
  https.on("/upload", Reply{.body = "{\"result\": \"upload success\"}"});
  const fs::path file = files / "a b.log";
  const std::string contents = "line one\nline two\n" + std::string(10000, 'x');
  writeFile(file, contents);

  EXPECT_TRUE(backend->uploadFileAtPath(file.string(), nullptr));
  ASSERT_EQ(https.requestCount(), 1u);
  const auto request = https.requests()[0];
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.target, std::string("/upload?uuid=") + kUdid +
                                "&sequence=7&description=Vidra%20AFRC%20log%20(Uploaded%20by%20QPX)"
                                "&filename=a%20b.log.gz&raw=true");
  EXPECT_EQ(request.header("Content-Type"), "application/octet-stream");
  EXPECT_EQ(request.header("Content-Encoding"), "gzip");
  // The server undoes the gzip encoding it was told of (and refuses a body
  // that is not gzip).
  EXPECT_EQ(request.body, contents);
  EXPECT_FALSE(fs::exists(file));
  EXPECT_TRUE(logs.has(Level::Debug, "UploadBackend(uploadFileAtPath): Uploading file " + file.string()));
  EXPECT_TRUE(logs.has(Level::Debug, "UploadBackend(uploadFileAtPath): sending to |" + https.url("/upload") +
                                         "|, Json output: {\"result\": \"upload success\"}"));
}

TEST_F(UploadBackendTest, ReplyWithoutSuccessKeepsTheFileAndStillAnswersYes) {
  https.on("/upload", Reply{.body = "ok"});
  const fs::path file = files / "report.log";
  writeFile(file, "data");
  EXPECT_TRUE(backend->uploadFileAtPath(file.string(), nullptr));
  EXPECT_EQ(https.requestCount(), 1u);
  EXPECT_TRUE(fs::exists(file));
}

TEST_F(UploadBackendTest, TransportErrorIsLoggedAndStillAnswersYes) {
  RefusingPort refusing;
  backend->setUploadURL(refusing.url("/upload"));
  const fs::path file = files / "report.log";
  writeFile(file, "data");
  EXPECT_TRUE(backend->uploadFileAtPath(file.string(), nullptr));
  EXPECT_TRUE(logs.contains("UploadBackend(uploadFileAtPath): post "));
  EXPECT_TRUE(fs::exists(file));
}

TEST_F(UploadBackendTest, FoldersLinksFifosDevicesAndTraversalAreRefused) {
  writeFile(files / "real.log", "secret");
  fs::create_symlink(files / "real.log", files / "link.log");
  ASSERT_EQ(::mkfifo((files / "pipe").c_str(), 0600), 0);
  fs::create_directories(files / "sub");
  fs::create_directory_symlink(files / "sub", files / "linkdir");
  writeFile(files / "sub" / "inner.log", "x");

  expectRefused(files.string());                                   // a folder
  expectRefused((files / "link.log").string());                    // a symbolic link to a good file
  expectRefused((files / "linkdir" / "inner.log").string());       // a link on the way
  expectRefused((files / "pipe").string());                        // would block a reader
  expectRefused("/dev/zero");                                      // a device
  expectRefused((files / "sub" / ".." / "real.log").string());     // traversal
  expectRefused("client/real.log");                                // relative
  expectRefused((files / "missing.log").string());
  EXPECT_TRUE(fs::exists(files / "real.log"));
}

TEST_F(UploadBackendTest, EmptyFileIsRefused) {
  writeFile(files / "empty.log", "");
  EXPECT_FALSE(backend->uploadFileAtPath((files / "empty.log").string(), nullptr));
  EXPECT_TRUE(logs.has(Level::Error, "UploadBackend(uploadFileAtPath): Input file is empty"));
  EXPECT_EQ(https.requestCount(), 0u);
}

TEST_F(UploadBackendTest, ProfileWithoutPostURLMakesNoBackend) {
  EXPECT_EQ(UploadBackend::initWithName("uploadServer", Value(Dictionary{}), std::nullopt), nullptr);
  EXPECT_TRUE(logs.has(Level::Error, "UploadBackend(initWithName): can't resolve upload post URL."));
  EXPECT_EQ(ZerithBackend::newBackendWithName(kZerithBackendUploadServer, Value(Dictionary{}), std::nullopt, 0), nullptr);
  EXPECT_EQ(backend->displayURL(), "https://display/");
}

TEST_F(UploadBackendTest, QueryEncodingKeepsTheQueryCharactersAndEscapesTheRest) {
  EXPECT_EQ(UploadBackend::percentEncodeQuery("a b%c#d&e=f/g?h\xc3\xa9"), "a%20b%25c%23d&e=f/g?h%C3%A9");
}

// --- Files granted for a client's identity ------------------------------------------------

TEST_F(UploadBackendTest, TokenReadsTheFileTheSessionOpenedForTheClient) {
  https.on("/upload", Reply{.body = "success"});
  const fs::path file = files / "granted.log";
  writeFile(file, "granted contents");
  auto granted = sandbox::GrantedFile::open(file.string(), sandbox::Identity::ofProcess());
  ASSERT_NE(granted, nullptr);
  const std::string token = sandbox::issueExtension(granted);
  // The token stands for one file only.
  writeFile(files / "other.log", "other");
  EXPECT_FALSE(backend->uploadFileAtPath((files / "other.log").string(), token.c_str()));
  EXPECT_TRUE(backend->uploadFileAtPath(file.string(), token.c_str()));
  sandbox::revokeExtension(token);
  EXPECT_EQ(sandbox::consumeExtension(token.c_str()), nullptr);
  ASSERT_EQ(https.requestCount(), 1u);
  EXPECT_EQ(https.requests()[0].body, "granted contents");
  EXPECT_FALSE(fs::exists(file));
  EXPECT_TRUE(fs::exists(files / "other.log"));
}

TEST(GrantedFileTest, FileOfAnotherUserIsNeitherReadNorDeleted) {
  TempRoot root;
  const fs::path file = root.path() / "theirs.log";
  writeFile(file, "theirs");
  std::string why;
  if (::geteuid() == 0) {
    ASSERT_EQ(::chown(file.c_str(), kOtherUser, kOtherUser), 0);
    EXPECT_EQ(sandbox::GrantedFile::open(file.string(), sandbox::Identity{0, 0}, &why), nullptr);
    EXPECT_EQ(why, "the file belongs to user 65534, not to the client (user 0)");
  }
  // The other way round: a client that is not the file's owner.
  ASSERT_EQ(::chown(file.c_str(), ::geteuid(), ::getegid()), 0);
  EXPECT_EQ(sandbox::GrantedFile::open(file.string(), sandbox::Identity{kOtherUser, kOtherUser}, &why), nullptr);
  EXPECT_TRUE(fs::exists(file));
}

TEST(GrantedFileTest, FolderTheClientCannotSearchStopsTheOpen) {
  if (::geteuid() != 0) {
    GTEST_SKIP() << "opening with another identity needs root";
  }
  TempRoot root;
  ::chmod(root.path().c_str(), 0711);
  const fs::path closed = root.path() / "closed";
  fs::create_directories(closed);
  ::chmod(closed.c_str(), 0700);  // root's own
  const fs::path file = closed / "mine.log";
  writeFile(file, "mine");
  ASSERT_EQ(::chown(file.c_str(), kOtherUser, kOtherUser), 0);
  std::string why;
  EXPECT_EQ(sandbox::GrantedFile::open(file.string(), sandbox::Identity{kOtherUser, kOtherUser}, &why), nullptr);
  EXPECT_EQ(why, "the file cannot be reached (Permission denied)");
  // Searchable for everyone: the owner's file opens.
  ::chmod(closed.c_str(), 0711);
  EXPECT_NE(sandbox::GrantedFile::open(file.string(), sandbox::Identity{kOtherUser, kOtherUser}, &why), nullptr) << why;
}

TEST(GrantedFileTest, FileChangedAfterOpeningIsNotReadAndLargeFilesAreRefused) {
  TempRoot root;
  const fs::path file = root.path() / "growing.log";
  writeFile(file, "first");
  auto granted = sandbox::GrantedFile::open(file.string(), sandbox::Identity::ofProcess());
  ASSERT_NE(granted, nullptr);
  std::ofstream(file, std::ios::app) << " and more";
  std::string why;
  EXPECT_FALSE(granted->readAll(&why).has_value());
  EXPECT_EQ(why, "the file changed while it was read");

  const fs::path large = root.path() / "large.log";
  { std::ofstream(large, std::ios::binary).put('x'); }
  fs::resize_file(large, sandbox::kMaxUploadFileBytes + 1);
  EXPECT_EQ(sandbox::GrantedFile::open(large.string(), sandbox::Identity::ofProcess(), &why), nullptr);
  EXPECT_NE(why.find("more than the"), std::string::npos);
}

TEST(GrantedFileTest, RemoveLeavesANameThatNowNamesAnotherFile) {
  TempRoot root;
  const fs::path file = root.path() / "swapped.log";
  writeFile(file, "original");
  auto granted = sandbox::GrantedFile::open(file.string(), sandbox::Identity::ofProcess());
  ASSERT_NE(granted, nullptr);
  fs::remove(file);
  writeFile(file, "replacement");
  std::string why;
  EXPECT_FALSE(granted->remove(&why));
  EXPECT_EQ(why, "the name no longer names the uploaded file");
  EXPECT_TRUE(fs::exists(file));
}

}  // namespace
}  // namespace zerith::test
