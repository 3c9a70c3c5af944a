#pragma once

// A daemon stand-in for the framework's tests: the real listener on the
// TempRoot's socket, admitting clients the way zerithd does (a boolean true
// "com.velmar.private.zerithd" from the entitlements policy), each served
// by the real exporter in front of a recording session.

#include <gtest/gtest.h>

#include <memory>
#include <mutex>
#include <vector>

#include "ipc/ClientSessionExporter.h"
#include "ipc/ClientSessionReplyProxy.h"
#include "ipc/EntitlementPolicy.h"
#include "ipc/Listener.h"
#include "ipc/tests/IpcTestSupport.h"
#include "ipc/tests/RecordingSession.h"
#include "platform/Paths.h"

namespace zerith::test {

using ipc::test::grantEntitlement;

class TestDaemon : public ipc::ListenerDelegate {
 public:
  struct Client {
    std::shared_ptr<ipc::Connection> connection;
    std::shared_ptr<ipc::test::RecordingSession> session;
    std::shared_ptr<ipc::ClientSessionReplyProxy> toClient;
  };

  TestDaemon() {
    listener_ = ipc::Listener::create(paths::socketPath(), std::make_shared<ipc::EntitlementPolicy>());
    if (listener_) {
      listener_->setDelegate(this);
      listener_->resume();
    }
  }
  ~TestDaemon() override {
    listener_.reset();
    const auto all = clients();
    for (auto& c : all) {
      c.connection->invalidate();
    }
    // The handlers refer to this object: let them all run first.
    gone.waitFor(static_cast<int>(all.size()));
  }

  bool shouldAcceptNewConnection(ipc::Listener&, std::shared_ptr<ipc::Connection> connection) override {
    const bool entitled = connection->valueForEntitlement(ipc::kZerithdEntitlement) == Value(true);
    if (entitled) {
      Client c{connection, std::make_shared<ipc::test::RecordingSession>(),
               std::make_shared<ipc::ClientSessionReplyProxy>(connection)};
      prepare(*c.session);
      connection->setExportedObject(std::make_shared<ipc::ClientSessionExporter>(c.session, connection->description()));
      connection->setInvalidationHandler([this] { gone.hit(); });
      connection->resume();
      std::lock_guard lock(mutex_);
      clients_.push_back(std::move(c));
    }
    accepted.hit();
    return entitled;
  }

  std::vector<Client> clients() {
    std::lock_guard lock(mutex_);
    return clients_;
  }
  // The latest admitted client, waiting for it to arrive.
  Client waitForClient(std::size_t n = 1) {
    EXPECT_TRUE(accepted.waitFor(static_cast<int>(n)));
    auto all = clients();
    return all.size() >= n ? all[n - 1] : Client{};
  }

  // Adjusts each new session before it is used.
  std::function<void(ipc::test::RecordingSession&)> prepare = [](ipc::test::RecordingSession&) {};
  ipc::test::Counter accepted;
  ipc::test::Counter gone;

 private:
  std::unique_ptr<ipc::Listener> listener_;
  std::mutex mutex_;
  std::vector<Client> clients_;
};

// A fresh root whose policy admits this user, and a TestDaemon serving it.
struct DaemonFixture : ::testing::Test {
  TempRoot root;
  std::unique_ptr<TestDaemon> daemon;

  void SetUp() override {
    grantEntitlement(root);
    daemon = std::make_unique<TestDaemon>();
  }
};

}  // namespace zerith::test
