// Upload requests through the real daemon: the daemon opens a client's file
// for the identity the socket reports, so links, FIFOs, folders and ".."
// paths are refused before any backend could read them.

#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "tests/e2e/E2eFixture.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;

class UploadRequestTest : public E2eTest {
 protected:
  void SetUp() override {
    grant(Value(true));
    startDaemon();
    files = root.path() / "client";
    fs::create_directories(files / "sub");
    std::ofstream(files / "report.log") << "report";
  }
  fs::path files;
};

TEST_F(UploadRequestTest, LinksFifosFoldersAndTraversalAreRefusedByTheDaemon) {
  Error error;
  auto client = Zerith::connect({}, &error);
  ASSERT_NE(client, nullptr) << error.description;
  fs::create_symlink(files / "report.log", files / "link.log");
  ASSERT_EQ(::mkfifo((files / "pipe").c_str(), 0600), 0);

  const std::pair<std::string, std::string> cases[] = {
      {(files / "link.log").string(), "the file is a symbolic link"},
      {(files / "pipe").string(), "the file is a FIFO"},
      {(files / "sub").string(), "the file is a folder"},
      {(files / "sub").string() + "/../report.log", "the path holds a \"..\" component"},
  };
  for (const auto& [path, reason] : cases) {
    const auto upload = client->uploadFile(Value("file://" + path), Value("any token"), 10s);
    ASSERT_TRUE(upload) << path;
    EXPECT_EQ(upload["success"], Value(false)) << path;
    EXPECT_TRUE(daemon->waitForExact(Level::Error, "uploadFileWithURL: Refusing to upload " + path + ": " + reason));
  }
  EXPECT_TRUE(fs::exists(files / "report.log"));
}

}  // namespace
}  // namespace zerith::test
