#include "ipc/Listener.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>

#include "ipc/EntitlementPolicy.h"
#include "ipc/tests/IpcTestSupport.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "tests/support/TempRoot.h"

namespace zerith::ipc::test {
namespace {

// Accepts or refuses by a flag; keeps the connections it accepted.
class TestDelegate : public ListenerDelegate {
 public:
  bool accept = true;
  std::shared_ptr<RecordingObject> object = std::make_shared<RecordingObject>();

  bool shouldAcceptNewConnection(Listener&, std::shared_ptr<Connection> connection) override {
    {
      std::lock_guard lock(mutex_);
      seen_.push_back(connection);
    }
    asked.hit();
    if (!accept) {
      return false;
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

  Counter asked;

 private:
  std::mutex mutex_;
  std::vector<std::shared_ptr<Connection>> seen_;
};

void writePolicy(const zerith::test::TempRoot& root, const std::string& name, const std::string& body) {
  root.write("/etc/zerithd/entitlements.d/" + name,
             "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n" + body + "\n</plist>\n");
}

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
  void TearDown() override { listener.reset(); }
};

TEST_F(ListenerFixture, CreatesTheSocketAndItsFoldersOpenToEveryone) {
  start();
  struct stat st {};
  ASSERT_EQ(::lstat(paths::socketPath().c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 0777, 0666u);
}

TEST_F(ListenerFixture, AcceptedClientIsServedWithTheEntitlementsThePolicyGrantsIt) {
  writePolicy(root, "clients.plist",
              "<dict><key>users</key><array><integer>" + std::to_string(::getuid()) +
                  "</integer></array><key>entitlements</key><dict><key>com.velmar.private.zerithd</key><true/>"
                  "</dict></dict>");
  start();
  auto client = SocketConnection::connect(paths::socketPath());
  ASSERT_TRUE(client);
  client->resume();
  const auto result = callAndWait(*client, "hello", Dictionary{{"x", 1}});
  ASSERT_TRUE(result.args);
  EXPECT_EQ(*result.args, (Dictionary{{"x", 1}}));
  auto server = delegate.last();
  ASSERT_TRUE(server);
  EXPECT_EQ(server->valueForEntitlement(kZerithdEntitlement), Value(true));
  EXPECT_EQ(server->peer().pid, ::getpid());
  // The client knows the listener's credentials too.
  EXPECT_EQ(client->peer().pid, ::getpid());
  client->invalidate();
}

TEST_F(ListenerFixture, RefusedConnectionIsClosedAndItsPendingCallFails) {
  delegate.accept = false;
  start();
  auto client = SocketConnection::connect(paths::socketPath());
  ASSERT_TRUE(client);
  Counter invalidated;
  client->setInvalidationHandler([&] { invalidated.hit(); });
  client->resume();
  const auto result = callAndWait(*client, "hello", Dictionary{});
  ASSERT_TRUE(result.arrived);
  ASSERT_TRUE(result.error);
  EXPECT_TRUE(invalidated.waitFor(1));
  EXPECT_TRUE(delegate.object->calls().empty());
}

TEST_F(ListenerFixture, StaleSocketFileIsReplaced) {
  {
    auto first = Listener::create(paths::socketPath(), nullptr);
    ASSERT_TRUE(first);
  }
  // A listener that died without cleaning up leaves a socket nobody serves.
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strcpy(address.sun_path, paths::socketPath().c_str());
  {
    file::UniqueFd dead(::socket(AF_UNIX, SOCK_STREAM, 0));
    ASSERT_EQ(::bind(dead.get(), reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
  }
  start();
  auto client = SocketConnection::connect(paths::socketPath());
  ASSERT_TRUE(client);
  client->resume();
  EXPECT_TRUE(callAndWait(*client, "x", Dictionary{}).args);
  client->invalidate();
}

TEST_F(ListenerFixture, ALiveListenerIsNotStolenAndARegularFileIsNotDeleted) {
  log::LogCapture capture;
  start();
  EXPECT_EQ(Listener::create(paths::socketPath(), nullptr), nullptr);
  EXPECT_TRUE(capture.has(log::Level::Error, "Listener: another process already listens on " + paths::socketPath().string()));

  root.write("/run/other/file", "keep me");
  EXPECT_EQ(Listener::create(root / "/run/other/file", nullptr), nullptr);
  EXPECT_TRUE(capture.has(log::Level::Error, "Listener: " + (root / "/run/other/file").string() + " exists and is not a socket"));
  std::ifstream in(root / "/run/other/file");
  std::string text;
  std::getline(in, text);
  EXPECT_EQ(text, "keep me");
}

TEST_F(ListenerFixture, StopEndsAcceptingButExistingConnectionsGoOn) {
  start();
  auto client = SocketConnection::connect(paths::socketPath());
  ASSERT_TRUE(client);
  client->resume();
  ASSERT_TRUE(callAndWait(*client, "before", Dictionary{}).args);
  listener->stop();
  EXPECT_FALSE(std::filesystem::exists(paths::socketPath()));
  Error error;
  EXPECT_EQ(SocketConnection::connect(paths::socketPath(), &error), nullptr);
  const auto after = callAndWait(*client, "after", Dictionary{});
  ASSERT_TRUE(after.args) << "an existing connection stopped with the listener";
  client->invalidate();
}

TEST_F(ListenerFixture, ManyClientsAtOnceAreAllServed) {
  start();
  constexpr int kClients = 24;
  std::vector<std::shared_ptr<SocketConnection>> clients;
  for (int i = 0; i < kClients; ++i) {
    clients.push_back(SocketConnection::connect(paths::socketPath()));
    ASSERT_TRUE(clients.back());
    clients.back()->resume();
  }
  Counter answered;
  for (int i = 0; i < kClients; ++i) {
    clients[static_cast<std::size_t>(i)]->call("n", Dictionary{{"i", i}}, [&, i](std::optional<Dictionary> a, std::optional<Error>) {
      if (a && a->get("i").intValue() == i) {
        answered.hit();
      }
    });
  }
  EXPECT_TRUE(answered.waitFor(kClients));
  for (auto& c : clients) {
    c->invalidate();
  }
}

TEST(ListenerCreate, AnOverlongPathFailsWithALog) {
  log::LogCapture capture;
  EXPECT_EQ(Listener::create(std::string(200, 'x'), nullptr), nullptr);
  EXPECT_TRUE(capture.contains("is empty or longer than 107 bytes"));
}

}  // namespace
}  // namespace zerith::ipc::test
