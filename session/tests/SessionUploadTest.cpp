// The session's side of file uploads: the daemon reads only through the
// descriptor that came with the call, refuses anything but a readable
// regular file before a backend is asked, and keeps client text out of its
// log lines' structure.

#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "daemon/tests/AgentFixture.h"
#include "platform/SandboxExtension.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;

std::shared_ptr<const file::UniqueFd> opened(const fs::path& path, int flags) {
  return std::make_shared<const file::UniqueFd>(::open(path.c_str(), flags | O_CLOEXEC));
}

class SessionUploadTest : public AgentFixture {
 protected:
  SessionUploadTest() {
    files = root.path() / "client";
    fs::create_directories(files / "sub");
    std::ofstream(files / "report.log") << "report";
  }

  // Uploads through `descriptor` and returns the answer (uploaded, removeFile).
  std::optional<std::pair<bool, bool>> upload(const std::string& url, std::shared_ptr<const file::UniqueFd> descriptor) {
    auto s = newSession(sessionInfo(5));
    logs.clear();
    std::optional<std::pair<bool, bool>> answer;
    s.session->uploadFileWithDescriptor(Value(url), std::move(descriptor),
                                        [&](bool ok, bool remove) { answer = std::make_pair(ok, remove); });
    return answer;
  }

  fs::path files;
};

TEST_F(SessionUploadTest, WhatIsNotAReadableRegularFileIsRefusedBeforeAnyBackend) {
  ASSERT_EQ(::mkfifo((files / "pipe").c_str(), 0600), 0);
  // A file over the cap costs no disk: a hole.
  {
    std::ofstream(files / "huge.log");
  }
  fs::resize_file(files / "huge.log", sandbox::kMaxUploadFileBytes + 1);
  const struct {
    const char* name;
    fs::path path;
    int flags;
    std::string reason;
  } cases[] = {
      {"no descriptor", "", -1, "no descriptor came with the request"},
      {"FIFO", files / "pipe", O_RDONLY | O_NONBLOCK, "the file is a FIFO"},
      {"folder", files / "sub", O_RDONLY | O_DIRECTORY, "the file is a folder"},
      {"device", "/dev/null", O_RDONLY, "the file is a device"},
      {"write-only", files / "report.log", O_WRONLY, "the descriptor is not open for reading"},
      {"path only", files / "report.log", O_PATH, "the descriptor is not open for reading"},
      {"too large", files / "huge.log", O_RDONLY, "more than the 67108864 an upload may have"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string url = "file://" + (files / "report.log").string();
    const auto answer = upload(url, c.flags < 0 ? nullptr : opened(c.path, c.flags));
    ASSERT_TRUE(answer);
    EXPECT_EQ(*answer, std::make_pair(false, false));
    EXPECT_TRUE(logs.contains("uploadFileWithURL: Refusing to upload " + (files / "report.log").string() + ": "));
    EXPECT_TRUE(logs.contains(c.reason));
    EXPECT_TRUE(logs.has(Level::Error, "uploadFileWithURL: File upload failed for " + (files / "report.log").string()));
  }
  EXPECT_TRUE(fs::exists(files / "report.log"));
}

TEST_F(SessionUploadTest, AcceptableFileWithoutAnUploadBackendIsNotUploaded) {
  std::ofstream(files / "a b.log") << "x";
  // Percent escapes of the URL are undone for the name.
  const auto answer = upload("file://" + files.string() + "/a%20b.log", opened(files / "a b.log", O_RDONLY));
  ASSERT_TRUE(answer);
  EXPECT_EQ(*answer, std::make_pair(false, false));
  EXPECT_FALSE(logs.contains("Refusing to upload"));
  EXPECT_TRUE(logs.has(Level::Error, "uploadFileWithURL: File upload failed for " + files.string() + "/a b.log"));
  EXPECT_TRUE(fs::exists(files / "a b.log"));
}

TEST_F(SessionUploadTest, ClientTextInTheLogIsEscaped) {
  // A name that would end the line and forge another, and a backslash.
  const auto answer = upload("/tmp/x\n<ERROR> forged\\line", nullptr);
  ASSERT_TRUE(answer);
  EXPECT_TRUE(logs.has(Level::Error, "uploadFileWithURL: File upload failed for /tmp/x\\n<ERROR> forged\\\\line"));
  EXPECT_FALSE(logs.contains("\n<ERROR> forged"));
}

}  // namespace
}  // namespace zerith::test
