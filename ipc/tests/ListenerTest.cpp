#include "ipc/Listener.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include "ipc/EntitlementPolicy.h"
#include "ipc/tests/IpcTestSupport.h"
#include "platform/FileUtil.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "tests/support/TempRoot.h"

namespace zerith::ipc::test {
namespace {

// Accepts every connection (the framework's tests refuse through the
// policy); keeps them.
class TestDelegate : public ListenerDelegate {
 public:
  std::shared_ptr<RecordingObject> object = std::make_shared<RecordingObject>();

  bool shouldAcceptNewConnection(Listener&, std::shared_ptr<Connection> connection) override {
    {
      std::lock_guard lock(mutex_);
      seen_.push_back(connection);
    }
    connection->setExportedObject(object);
    connection->resume();
    return true;
  }
  std::shared_ptr<Connection> last() {
    std::lock_guard lock(mutex_);
    return seen_.empty() ? nullptr : seen_.back();
  }
  ~TestDelegate() override {
    for (auto& c : seen_) {
      c->invalidate();
    }
  }

 private:
  std::mutex mutex_;
  std::vector<std::shared_ptr<Connection>> seen_;
};

// A resumed client connection to `path`, ended with the test.
struct Client {
  std::shared_ptr<SocketConnection> connection;
  explicit Client(const std::filesystem::path& path = paths::socketPath()) : connection(SocketConnection::connect(path)) {
    EXPECT_TRUE(connection) << path;
    if (connection) {
      connection->resume();
    }
  }
  ~Client() {
    if (connection) {
      connection->invalidate();
    }
  }
  SocketConnection::WaitedReply call(const std::string& op, Dictionary args = {}, std::chrono::milliseconds timeout = kWait) {
    return connection ? connection->callAndWait(op, std::move(args), timeout) : SocketConnection::WaitedReply{};
  }
};

struct ListenerFixture : ::testing::Test {
  zerith::test::TempRoot root;
  TestDelegate delegate;
  std::unique_ptr<Listener> listener;

  void start() {
    listener = Listener::create(paths::socketPath(), std::make_shared<EntitlementPolicy>());
    ASSERT_TRUE(listener);
    listener->setDelegate(&delegate);
    listener->resume();
  }
};

TEST_F(ListenerFixture, AcceptedClientIsServedWithTheEntitlementsThePolicyGrantsIt) {
  grantEntitlement(root);
  start();
  // The socket is open to everyone; the policy decides.
  struct stat st {};
  ASSERT_EQ(::lstat(paths::socketPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & (S_IFMT | 0777), S_IFSOCK | 0666u);
  Client client;
  ASSERT_TRUE(client.connection);
  EXPECT_EQ(client.call("hello", Dictionary{{"x", 1}}).args, (Dictionary{{"x", 1}}));
  auto server = delegate.last();
  ASSERT_TRUE(server);
  EXPECT_EQ(server->valueForEntitlement(kZerithdEntitlement), Value(true));
  EXPECT_EQ(server->peer().pid, ::getpid());
  // The client knows the listener's credentials too.
  EXPECT_EQ(client.connection->peer().pid, ::getpid());
}

TEST_F(ListenerFixture, ALiveListenerIsNotStolenARegularFileIsNotDeletedAndAnOverlongPathFails) {
  log::LogCapture capture;
  EXPECT_EQ(Listener::create(std::string(200, 'x'), nullptr), nullptr);
  EXPECT_TRUE(capture.contains("is empty or longer than 107 bytes"));
  start();
  EXPECT_EQ(Listener::create(paths::socketPath(), nullptr), nullptr);
  EXPECT_TRUE(capture.has(log::Level::Error, "Listener: another process already listens on " + paths::socketPath().string()));

  root.write("/run/other/file", "keep me");
  EXPECT_EQ(Listener::create(root / "/run/other/file", nullptr), nullptr);
  EXPECT_TRUE(capture.has(log::Level::Error, "Listener: " + (root / "/run/other/file").string() + " exists and is not a socket"));
  EXPECT_EQ(file::readAll(root / "/run/other/file", 64), bytesOfText("keep me"));
}

TEST_F(ListenerFixture, StopEndsAcceptingButExistingConnectionsGoOn) {
  start();
  Client client;
  ASSERT_TRUE(client.call("before").args);
  listener->stop();
  EXPECT_FALSE(std::filesystem::exists(paths::socketPath()));
  Error error;
  EXPECT_EQ(SocketConnection::connect(paths::socketPath(), &error), nullptr);
  EXPECT_TRUE(client.call("after").args) << "an existing connection stopped with the listener";
}

// Socket activation: the parent binds a listening socket and starts this
// test binary again as the "service" with the socket as fd 3 and
// LISTEN_FDS/LISTEN_PID set (through sh, whose `exec` keeps the pid that
// LISTEN_PID names). The child serves one call on the passed socket.
TEST(ListenerActivation, ServesTheSocketTheServiceManagerPassesIn) {
  if (std::getenv("ZERITH_ACTIVATION_CHILD")) {
    log::LogCapture capture;
    zerith::test::TempRoot root;
    TestDelegate delegate;
    auto listener = Listener::create(paths::socketPath(), nullptr);
    ASSERT_TRUE(listener);
    EXPECT_TRUE(capture.has(log::Level::Default, "Listener: using the socket passed by the service manager (fd 3)"));
    EXPECT_FALSE(std::filesystem::exists(paths::socketPath())) << "made a socket of its own";
    listener->setDelegate(&delegate);
    listener->resume();
    EXPECT_TRUE(delegate.object->received.waitFor(1));
    return;
  }
  zerith::test::TempRoot root;
  const auto path = root / "/activated.sock";
  file::UniqueFd listening = boundSocket(path.string(), 4);
  ASSERT_TRUE(listening);

  const std::string self = std::filesystem::read_symlink("/proc/self/exe").string();
  const std::string filter = "--gtest_filter=ListenerActivation.ServesTheSocketTheServiceManagerPassesIn";
  const char* argv[] = {"sh", "-c", "LISTEN_PID=$$ exec \"$0\" \"$1\"", self.c_str(), filter.c_str(), nullptr};
  const char* envp[] = {"LISTEN_FDS=1", "ZERITH_ACTIVATION_CHILD=1", "PATH=/usr/bin:/bin", nullptr};
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    // The socket must reach the service as fd 3, open across exec (dup2
    // onto itself would keep close-on-exec).
    if (listening.get() == 3) {
      ::fcntl(3, F_SETFD, 0);
    } else {
      ::dup2(listening.get(), 3);
    }
    ::execve("/bin/sh", const_cast<char* const*>(argv), const_cast<char* const*>(envp));
    ::_exit(127);
  }
  // Connecting works as soon as the socket listens; the call is answered
  // once the child has taken the socket over.
  EXPECT_EQ(Client(path).call("via-activation", Dictionary{{"n", 1}}, 30s).args, (Dictionary{{"n", 1}}))
      << "the activated listener did not answer";
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "child status " << status;
}

}  // namespace
}  // namespace zerith::ipc::test
