#pragma once

// A client connection without a socket, for the agent's and the session's
// unit tests: it grants the entitlements it was given, records what the
// agent installs (exported object, handlers, resume) and every message the
// daemon sends to the client, and can play the connection's invalidation.

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "ipc/Connection.h"

namespace zerith::test {

class FakeConnection final : public ipc::Connection {
 public:
  explicit FakeConnection(Dictionary entitlements = {}) : entitlements_(std::move(entitlements)) {
    static int counter = 0;
    id_ = ++counter;
  }

  static std::shared_ptr<FakeConnection> entitled() {
    return std::make_shared<FakeConnection>(Dictionary{{"com.velmar.private.zerithd", Value(true)}});
  }

  struct Sent {
    std::string operation;
    Dictionary args;
  };

  void setExportedObject(std::shared_ptr<ipc::ExportedObject> object) override {
    std::lock_guard lock(mutex_);
    exported_ = std::move(object);
  }
  void setInterruptionHandler(std::function<void()> handler) override {
    std::lock_guard lock(mutex_);
    interruption_ = std::move(handler);
  }
  void setInvalidationHandler(std::function<void()> handler) override {
    std::lock_guard lock(mutex_);
    invalidation_ = std::move(handler);
  }
  void resume() override {
    std::lock_guard lock(mutex_);
    ++resumed_;
  }
  // Like a closing socket: the invalidation handler runs once, then the
  // connection lets go of what it held.
  void invalidate() override {
    std::function<void()> handler;
    std::shared_ptr<ipc::ExportedObject> exported;
    {
      std::lock_guard lock(mutex_);
      if (invalidated_) {
        return;
      }
      invalidated_ = true;
      handler = std::move(invalidation_);
      invalidation_ = nullptr;
      interruption_ = nullptr;
      exported = std::move(exported_);
    }
    if (handler) {
      handler();
    }
  }
  void interrupt() {
    if (const auto handler = read(interruption_)) {
      handler();
    }
  }

  void send(const std::string& operation, Dictionary args) override {
    std::lock_guard lock(mutex_);
    sent_.push_back({operation, std::move(args)});
  }
  void call(const std::string& operation, Dictionary args, ReplyHandler handler) override {
    send(operation, std::move(args));
    if (handler) {
      handler(std::nullopt, Error{"ipc", -1, "no peer"});
    }
  }

  const ipc::PeerCredentials& peer() const override { return peer_; }
  Value valueForEntitlement(const std::string& entitlement) const override { return entitlements_.get(entitlement); }
  const SerialQueue& queue() const override { return queue_; }
  std::string description() const override { return "<fake connection " + std::to_string(id_) + ">"; }

  std::shared_ptr<ipc::ExportedObject> exported() const { return read(exported_); }
  bool hasInvalidationHandler() const { return static_cast<bool>(read(invalidation_)); }
  bool hasInterruptionHandler() const { return static_cast<bool>(read(interruption_)); }
  int resumed() const { return read(resumed_); }
  std::vector<Sent> sent() const { return read(sent_); }

 private:
  template <typename T>
  T read(const T& member) const {
    std::lock_guard lock(mutex_);
    return member;
  }

  mutable std::mutex mutex_;
  Dictionary entitlements_;
  ipc::PeerCredentials peer_;
  SerialQueue queue_{"fake.connection"};
  std::shared_ptr<ipc::ExportedObject> exported_;
  std::function<void()> interruption_;
  std::function<void()> invalidation_;
  bool invalidated_ = false;
  int resumed_ = 0;
  int id_ = 0;
  std::vector<Sent> sent_;
};

}  // namespace zerith::test
