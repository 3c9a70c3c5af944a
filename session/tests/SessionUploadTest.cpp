// The session's side of file uploads: what it refuses before any backend is
// asked. The daemon opens the client's file for the client's identity (here
// the fake connection's peer, user 0) and never follows a link, enters a
// "..", or opens a folder, FIFO or device.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "daemon/tests/AgentFixture.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;

class SessionUploadTest : public AgentFixture {
 protected:
  SessionUploadTest() {
    files = root.path() / "client";
    fs::create_directories(files / "sub");
    std::ofstream(files / "report.log") << "report";
  }

  // Uploads `url` and expects the refusal line and a NO.
  void expectRefused(const std::string& url, const std::string& path, const std::string& reason) {
    auto s = newSession(sessionInfo(5));
    logs.clear();
    std::optional<bool> uploaded;
    s.session->uploadFileAtPath(Value(url), Value("client token"), [&](bool ok) { uploaded = ok; });
    EXPECT_EQ(uploaded, false) << url;
    EXPECT_TRUE(logs.has(Level::Error, "uploadFileWithURL: Refusing to upload " + path + ": " + reason)) << url;
    EXPECT_TRUE(logs.has(Level::Error, "uploadFileWithURL: File upload failed for " + path)) << url;
  }

  fs::path files;
};

TEST_F(SessionUploadTest, LinksFifosFoldersDevicesTraversalAndRelativePathsAreRefused) {
  fs::create_symlink(files / "report.log", files / "link.log");
  ASSERT_EQ(::mkfifo((files / "pipe").c_str(), 0600), 0);
  const std::string base = files.string();

  expectRefused("file://" + base + "/link.log", base + "/link.log", "the file is a symbolic link");
  expectRefused("file://" + base + "/pipe", base + "/pipe", "the file is a FIFO");
  expectRefused("file://" + base + "/sub", base + "/sub", "the file is a folder");
  expectRefused("file:///dev/null", "/dev/null", "the file is a device");
  expectRefused("file://" + base + "/sub/../report.log", base + "/sub/../report.log",
                "the path holds a \"..\" component");
  expectRefused("client/report.log", "client/report.log", "the path is not absolute");
  expectRefused("file://" + base + "/report%00.log", base + std::string("/report\0.log", 12),
                "the path holds a zero byte");
  EXPECT_TRUE(fs::exists(files / "report.log"));
}

TEST_F(SessionUploadTest, AcceptableFileWithoutAnUploadBackendIsNotUploaded) {
  auto s = newSession(sessionInfo(5));
  std::optional<bool> uploaded;
  // Percent escapes of the URL are undone.
  std::ofstream(files / "a b.log") << "x";
  s.session->uploadFileAtPath(Value("file://" + files.string() + "/a%20b.log"), Value(), [&](bool ok) { uploaded = ok; });
  EXPECT_EQ(uploaded, false);
  EXPECT_FALSE(logs.contains("Refusing to upload"));
  EXPECT_TRUE(logs.has(Level::Error, "uploadFileWithURL: File upload failed for " + files.string() + "/a b.log"));
  EXPECT_TRUE(fs::exists(files / "a b.log"));
}

}  // namespace
}  // namespace zerith::test
