// Uploads through the real daemon and client framework: the framework opens
// the file with the client's own rights and passes the descriptor; the
// daemon reads only through it and deletes nothing itself.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "ipc/ClientSessionWire.h"
#include "tests/e2e/E2eFixture.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;

constexpr uid_t kNobody = 65534;

// Runs `work` on a thread of its own whose user is `uid` (the rest of the
// process keeps its identity: the raw system call changes one thread only).
template <typename F>
auto asUser(uid_t uid, F&& work) {
  return std::async(std::launch::async,
                    [uid, work = std::forward<F>(work)]() mutable {
                      // Saved user stays root so that the thread could go back;
                      // the effective and file-system user is `uid`.
                      EXPECT_EQ(::syscall(SYS_setresgid, uid, uid, 0), 0);
                      EXPECT_EQ(::syscall(SYS_setresuid, uid, uid, 0), 0);
                      return work();
                    })
      .get();
}

class UploadByDescriptorTest : public E2eTest {
 protected:
  void SetUp() override {
    grant(Value(true));
    files = root.path() / "client";
    fs::create_directories(files);
    ::chmod(root.path().c_str(), 0755);
    ::chmod(files.c_str(), 0777);
  }

  // A daemon whose demo client type has an upload backend posting to `postURL`.
  void startWithUploadServer(const std::string& postURL) {
    Dictionary client{{"client", "demo"},
                      {"service", "cli"},
                      {"override_dnu", 1},
                      {"sampling_threshold", 1.0},
                      {"locale_whitelist", Array{Value("GB")}},
                      {"post_url", postURL}};
    const Value section(Dictionary{{"uploadServer", Dictionary{{"clients", Array{Value(std::move(client))}}}}});
    serveSignedStorebag(https, Value(Dictionary{{"version", "8.1.0"}, {"seed", section}, {"release", section}}));
    startDaemon(testCAOptions());
  }

  static void rootOnly(const fs::path& path) {
    std::ofstream(path) << "secret";
    ::chown(path.c_str(), 0, 0);
    ::chmod(path.c_str(), 0600);
  }

  HttpsTestServer https;
  fs::path files;
};

TEST_F(UploadByDescriptorTest, ClientRightsDecideWhatCanBeUploaded) {
  if (::geteuid() != 0) {
    GTEST_SKIP() << "changing a thread's user needs root";
  }
  startWithUploadServer(https.url("/upload"));
  https.on("/upload", Reply{.body = "success"});
  rootOnly(files / "secret.log");
  fs::create_directories(files / "closed");
  std::ofstream(files / "closed" / "theirs.log") << "theirs";
  ::chown((files / "closed" / "theirs.log").c_str(), kNobody, kNobody);
  ::chmod((files / "closed").c_str(),
          0700);  // root's folder: nobody cannot search it

  auto client = startDemoSession(1);
  ASSERT_TRUE(client);
  // Connected as root, then dropped to nobody: the framework's own open
  // fails, and nothing reaches the daemon.
  for (const fs::path& path : {files / "secret.log", files / "closed" / "theirs.log"}) {
    const ZerithReply upload =
        asUser(kNobody, [&] { return client->uploadFile(Value("file://" + path.string()), Value(), 10s); });
    ASSERT_TRUE(upload.error) << path;
    EXPECT_NE(upload.error->description.find("Permission denied"), std::string::npos) << upload.error->description;
  }

  // A connection made by root and handed to nobody (SCM_RIGHTS of the
  // socket): nobody cannot open the root-only file, and the daemon does not
  // open the named path for the connection's root credentials: a call
  // without a descriptor is refused.
  int pair[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
  file::UniqueFd sender(pair[0]), receiver(pair[1]);
  file::UniqueFd connection = connectToDaemonSocket();
  ASSERT_TRUE(connection);
  ASSERT_TRUE(sendDescriptor(sender.get(), connection.get()));
  const bool refusedToOpen = asUser(kNobody, [&] {
    const file::UniqueFd handed = receiveDescriptor(receiver.get());
    const bool denied = ::open((files / "secret.log").c_str(), O_RDONLY | O_CLOEXEC) < 0 && errno == EACCES;
    // What the new holder can still do: name the path without a descriptor.
    const Data call = ipc::encodeCall(ipc::wire::kUploadFile, 1,
                                      ipc::wire::uploadFileArgs(Value((files / "secret.log").string()), Value()));
    return handed && denied &&
           ::send(handed.get(), call.data(), call.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(call.size());
  });
  EXPECT_TRUE(refusedToOpen);
  const auto answer = RawFrameSocket(std::move(connection)).replyTo(1);
  ASSERT_TRUE(answer);
  EXPECT_EQ((*answer)["args"]["success"], Value(false));
  EXPECT_TRUE(daemon->waitFor("Refusing to upload " + (files / "secret.log").string() +
                              ": no descriptor came with the request"));
  EXPECT_FALSE(https.waitForRequestTo("/upload", std::chrono::milliseconds(0)));
  EXPECT_TRUE(fs::exists(files / "secret.log"));
}

}  // namespace
}  // namespace zerith::test
