#pragma once

// A ClientSessionInterface that records every call with its arguments (by
// their wire names) and answers with configurable values; and a
// ClientSessionReplyInterface that records the daemon's messages. Used by the
// IPC and client-framework tests and the connection fuzz target.

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "ipc/ClientSessionInterface.h"

namespace zerith::ipc::test {

struct RecordedCall {
  std::string operation;
  Dictionary args;
  bool hasCompletion = false;
};

class CallLog {
 public:
  void add(RecordedCall call) {
    std::lock_guard lock(mutex_);
    calls_.push_back(std::move(call));
    changed_.notify_all();
  }
  std::vector<RecordedCall> calls() const {
    std::lock_guard lock(mutex_);
    return calls_;
  }
  std::size_t size() const {
    std::lock_guard lock(mutex_);
    return calls_.size();
  }
  bool waitFor(std::size_t n, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return calls_.size() >= n; });
  }

 private:
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<RecordedCall> calls_;
};

class RecordingSession : public ClientSessionInterface {
 public:
  // What the completions answer.
  Value backends = Value(Array{Value("httpsPost"), Value("dashboard")});
  Value displayURL = Value("https://display.example/session");
  Value sendResult = Value("sent");
  Value flushResult = Value("flushed");
  std::optional<Error> flushError;
  bool uploadFileResult = true;
  bool uploadLogResult = false;
  std::optional<Error> uploadLogError = Error{"com.velmar.zerith.ErrorDomain", -1, "no upload backend"};
  Value oneShotResult = Value("one-shot");
  // When false, completions are kept in `held` instead of being called.
  bool answer = true;

  CallLog log;

  // The held completions, once at least `atLeast` are (a call is logged
  // before its completion is held, so a test that saw the log waits here).
  std::vector<std::function<void()>> takeHeld(std::size_t atLeast = 0) {
    std::unique_lock lock(heldMutex_);
    heldChanged_.wait_for(lock, std::chrono::seconds(10), [&] { return held_.size() >= atLeast; });
    return std::exchange(held_, {});
  }

  void setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                      bool hasAggregationBlock) override {
    record("setSessionInfo", {{"sessionInfo", sessionInfo}, {"userInfo", userInfo}, {"frameworksToCheck", frameworksToCheck},
                              {"hasAggregationBlock", hasAggregationBlock}});
  }
  void startConfigWithCompletionHandler(ValueCompletion completion) override {
    record("startConfig", {}, completion, [=, this] { completion(backends); });
  }
  void fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completion) override {
    record("fetchStates", {{"userInfo", userInfo}}, completion, [=, this] { completion(backends); });
  }
  void fetchDisplayURL(ValueCompletion completion) override {
    record("fetchDisplayURL", {}, completion, [=, this] { completion(displayURL); });
  }
  void sendMessageWithDictionary(const Value& message, ValueCompletion reply) override {
    record("sendMessage", {{"message", message}}, reply, [=, this] { reply(sendResult); });
  }
  void flushMessagesWithCompletion(ValueErrorCompletion completion) override {
    record("flushMessages", {}, completion, [=, this] { completion(flushResult, flushError); });
  }
  void finishSessionGracefully() override { record("finishSession", {}); }
  void uploadFileAtPath(const Value& fileURL, const Value& extensionToken, BoolCompletion completion) override {
    record("uploadFile", {{"fileURL", fileURL}, {"extensionToken", extensionToken}}, completion,
           [=, this] { completion(uploadFileResult); });
  }
  void uploadFileWithDescriptor(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                UploadCompletion completion) override {
    record("uploadFile", {{"fileURL", fileURL}, {"descriptor", descriptor && *descriptor}}, completion,
           [=, this] { completion(uploadFileResult, false); });
  }
  void uploadLogData(const Value& logData, BoolErrorCompletion completion) override {
    record("uploadLogData", {{"logData", logData}}, completion, [=, this] { completion(uploadLogResult, uploadLogError); });
  }
  void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                  std::uint16_t type, const Value& payload, ValueCompletion reply) override {
    record("sendMessageWithSessionInfo",
           {{"sessionInfo", sessionInfo}, {"userInfo", userInfo}, {"category", unsigned{category}}, {"type", unsigned{type}},
            {"payload", payload}},
           reply, [=, this] { reply(oneShotResult); });
  }
  void updateSharedDataWithDictionary(const Value& dictionary) override {
    record("updateSharedData", {{"dictionary", dictionary}});
  }
  void updateSharedDataForKey(const Value& key, const Value& value) override {
    record("updateSharedDataForKey", {{"key", key}, {"value", value}});
  }
  void setDigestKey(const Value& digestKey, std::int32_t algorithm) override {
    record("setDigestKey", {{"digestKey", digestKey}, {"algorithm", algorithm}});
  }

 private:
  void record(const char* op, Dictionary args) { log.add({op, std::move(args), false}); }
  // Logs the call, then answers it through `run` (or holds `run`) when the
  // caller passed a completion.
  template <typename Completion>
  void record(const char* op, Dictionary args, const Completion& completion, std::function<void()> run) {
    log.add({op, std::move(args), bool(completion)});
    if (!completion) {
      return;
    }
    if (answer) {
      run();
    } else {
      std::lock_guard lock(heldMutex_);
      held_.push_back(std::move(run));
      heldChanged_.notify_all();
    }
  }

  std::mutex heldMutex_;
  std::condition_variable heldChanged_;
  std::vector<std::function<void()>> held_;
};

class RecordingReplyTarget : public ClientSessionReplyInterface {
 public:
  CallLog log;
  void sendMessageToClient(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                           const Value& payload) override {
    log.add({"sendMessageToClient",
             {{"message", message}, {"timestamp", timestamp}, {"category", unsigned{category}}, {"type", unsigned{type}},
              {"payload", payload}},
             false});
  }
};

}  // namespace zerith::ipc::test
