#pragma once

// A backend for the session's tests and benchmarks, made through the real
// factory (ZerithBackend::registerBackendKind) under any name. It records
// what the session hands it and behaves as its storebag profile says:
//
//   "whitelist", "blacklist"  arrays of categories (the base class's lists)
//   "state"                   the state updateState decides (default 2)
//   "threshold"               the sampling threshold updateState sets
//   "result"                  text every send returns ("%u" of the event
//                             number is appended), absent: nil
//   "flushResult"             text of the flush completion
//   "flushError"              the flush completes with an error of that text
//   "flushDeferred"           true: the completion waits for completeFlush()
//   "batchedBytes"            what batchedEventsSize answers
//   "displayURL"              the display URL
//   "sink"                    true: record nothing but a count (benchmarks)

#include <condition_variable>
#include <memory>
#include <mutex>
#include <ostream>
#include <string>
#include <vector>

#include "backends/ZerithBackend.h"

namespace zerith::test {

class RecordingBackend final : public ZerithBackend {
 public:
  struct Event {
    Value message;
    std::uint16_t method = 0;
    std::uint16_t respCode = 0;
    std::uint16_t eventID = 0;
    std::int32_t flag = 0;

    bool operator==(const Event&) const = default;
    // Readable events in test failures.
    friend void PrintTo(const Event& e, std::ostream* os) {
      *os << "{" << e.message.description() << ", method " << e.method << ", respCode " << e.respCode << ", event "
          << e.eventID << ", flag " << e.flag << "}";
    }
  };

  RecordingBackend(std::string name, Value profile, std::optional<std::string> productFamily)
      : ZerithBackend(std::move(name), std::move(profile), std::move(productFamily)) {
    const Value& p = this->profile();
    if (!p["whitelist"].isNil()) {
      setEventWhitelist(p["whitelist"]);
    }
    if (!p["blacklist"].isNil()) {
      setEventBlacklist(p["blacklist"]);
    }
    if (const auto* url = p["displayURL"].string()) {
      setDisplayURL(*url);
    }
    sink_ = p["sink"].boolValue();
  }

  // Every name in `names` becomes a recording backend kind.
  static void registerAs(std::initializer_list<std::string> names) {
    for (const auto& name : names) {
      registerBackendKind(name, [](std::string_view n, const Value& profile,
                                   const std::optional<std::string>& family, std::int32_t) {
        return std::make_shared<RecordingBackend>(std::string(n), profile, family);
      });
    }
  }

  void updateState() override {
    const Value& p = profile();
    setState(p["state"].isNil() ? kBackendStateEnabled : static_cast<std::int32_t>(p["state"].intValue()));
    if (!p["threshold"].isNil()) {
      setSamplingThreshold(p["threshold"]);
    }
  }

  using ZerithBackend::sendMessage;
  std::optional<std::string> sendMessage(const Value& message, const timeval&, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID, std::int32_t flag) override {
    counters().add(BackendCount::sent);
    {
      std::lock_guard lock(mutex_);
      ++count_;
      if (!sink_) {
        events_.push_back({message, method, respCode, eventID, flag});
      }
    }
    changed_.notify_all();
    if (const auto* text = profile()["result"].string()) {
      return *text + std::to_string(eventID);
    }
    return std::nullopt;
  }

  std::optional<std::string> flushMessagesWithCompletion(FlushCompletion completion) override {
    const Value& p = profile();
    const Value result = p["flushResult"];
    std::optional<Error> error;
    if (const auto* text = p["flushError"].string()) {
      error = Error{"com.velmar.zerith.test", 7, *text};
    }
    {
      std::lock_guard lock(mutex_);
      ++flushes_;
      if (p["flushDeferred"].boolValue()) {
        deferred_.push_back([completion, result, error] {
          if (completion) {
            completion(result, error);
          }
        });
        changed_.notify_all();
        return std::nullopt;
      }
    }
    if (completion) {
      completion(result, error);
    }
    return result.string() ? std::optional<std::string>(*result.string()) : std::nullopt;
  }

  // Runs the oldest deferred flush completion; false when none waits.
  bool completeFlush() {
    std::function<void()> next;
    {
      std::lock_guard lock(mutex_);
      if (deferred_.empty()) {
        return false;
      }
      next = std::move(deferred_.front());
      deferred_.erase(deferred_.begin());
    }
    next();
    return true;
  }

  std::uint32_t batchedEventsSize() override {
    return static_cast<std::uint32_t>(profile()["batchedBytes"].unsignedValue());
  }

  void cleanup() override {
    {
      std::lock_guard lock(mutex_);
      ++cleanups_;
    }
    changed_.notify_all();
  }

  std::vector<Event> events() const { return read(events_); }
  std::size_t count() const { return read(count_); }
  int flushes() const { return read(flushes_); }
  int cleanups() const { return read(cleanups_); }
  // The session cleans its backends up last in its teardown, after its end
  // message and flush: wait for that rather than for the dealloc line.
  bool waitForCleanups(int n, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return cleanups_ >= n; });
  }
  bool waitForCount(std::size_t n, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return count_ >= n; });
  }

  // Backends reachable only through the session: the recording one of that
  // name, or nullptr.
  static std::shared_ptr<RecordingBackend> of(const std::shared_ptr<ZerithBackend>& backend) {
    return std::dynamic_pointer_cast<RecordingBackend>(backend);
  }

 private:
  template <typename T>
  T read(const T& member) const {
    std::lock_guard lock(mutex_);
    return member;
  }

  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  bool sink_ = false;
  std::size_t count_ = 0;
  int flushes_ = 0;
  int cleanups_ = 0;
  std::vector<Event> events_;
  std::vector<std::function<void()>> deferred_;
};

}  // namespace zerith::test
