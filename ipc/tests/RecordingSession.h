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
                              {"hasAggregationBlock", hasAggregationBlock}}, false);
  }
  void startConfigWithCompletionHandler(ValueCompletion completion) override {
    record("startConfig", {}, bool(completion));
    complete([=, this] { completion(backends); }, bool(completion));
  }
  void fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completion) override {
    record("fetchStates", {{"userInfo", userInfo}}, bool(completion));
    complete([=, this] { completion(backends); }, bool(completion));
  }
  void fetchDisplayURL(ValueCompletion completion) override {
    record("fetchDisplayURL", {}, bool(completion));
    complete([=, this] { completion(displayURL); }, bool(completion));
  }
  void sendMessageWithDictionary(const Value& message, ValueCompletion reply) override {
    record("sendMessage", {{"message", message}}, bool(reply));
    complete([=, this] { reply(sendResult); }, bool(reply));
  }
  void flushMessagesWithCompletion(ValueErrorCompletion completion) override {
    record("flushMessages", {}, bool(completion));
    complete([=, this] { completion(flushResult, flushError); }, bool(completion));
  }
  void finishSessionGracefully() override { record("finishSession", {}, false); }
  void uploadFileAtPath(const Value& fileURL, const Value& extensionToken, BoolCompletion completion) override {
    record("uploadFile", {{"fileURL", fileURL}, {"extensionToken", extensionToken}}, bool(completion));
    complete([=, this] { completion(uploadFileResult); }, bool(completion));
  }
  void uploadFileWithDescriptor(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                UploadCompletion completion) override {
    record("uploadFile", {{"fileURL", fileURL}, {"descriptor", descriptor && *descriptor}}, bool(completion));
    complete([=, this] { completion(uploadFileResult, false); }, bool(completion));
  }
  void uploadLogData(const Value& logData, BoolErrorCompletion completion) override {
    record("uploadLogData", {{"logData", logData}}, bool(completion));
    complete([=, this] { completion(uploadLogResult, uploadLogError); }, bool(completion));
  }
  void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                  std::uint16_t type, const Value& payload, ValueCompletion reply) override {
    record("sendMessageWithSessionInfo",
           {{"sessionInfo", sessionInfo}, {"userInfo", userInfo}, {"category", unsigned{category}}, {"type", unsigned{type}},
            {"payload", payload}},
           bool(reply));
    complete([=, this] { reply(oneShotResult); }, bool(reply));
  }
  void updateSharedDataWithDictionary(const Value& dictionary) override {
    record("updateSharedData", {{"dictionary", dictionary}}, false);
  }
  void updateSharedDataForKey(const Value& key, const Value& value) override {
    record("updateSharedDataForKey", {{"key", key}, {"value", value}}, false);
  }
  void setDigestKey(const Value& digestKey, std::int32_t algorithm) override {
    record("setDigestKey", {{"digestKey", digestKey}, {"algorithm", algorithm}}, false);
  }

 private:
  void record(const char* op, Dictionary args, bool hasCompletion) { log.add({op, std::move(args), hasCompletion}); }
  void complete(std::function<void()> run, bool present) {
    if (!present) {
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
