#pragma once

// Recorders, an agent that counts keep-alive releases, and a fixture with a
// temporary root, a log capture, the test CA trusted and an HTTPS server.

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/RemoveFiles.h"  // <regex>, included the way GCC 12 with sanitizers wants it
#include "platform/Log.h"
#include "transport/ConnectivityHelperDelegate.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/TempRoot.h"
#include "tests/support/TestCA.h"
#include "transport/ReportingSessionConnectivityInterface.h"
#include "transport/URLSession.h"

namespace zerith::test {

inline constexpr auto kWait = std::chrono::seconds(10);

inline Data bytes(const std::string& s) { return Data(s.begin(), s.end()); }
inline std::string text(const Data& d) { return std::string(d.begin(), d.end()); }

// A body whose every position differs from its neighbours, so that a lost,
// repeated or reordered piece shows.
inline std::string patternBody(std::size_t size) {
  std::string body(size, '\0');
  for (std::size_t i = 0; i < size; ++i) {
    body[i] = static_cast<char>((i * 131 + i / 256 + i / 65536) & 0xff);
  }
  return body;
}

// Items appended from several threads, in order, with a bounded wait.
template <typename T>
class Recorder {
 public:
  void add(T item) {
    {
      std::lock_guard lock(mutex_);
      items_.push_back(std::move(item));
    }
    changed_.notify_all();
  }
  std::vector<T> items() const {
    std::lock_guard lock(mutex_);
    return items_;
  }
  template <typename Done>
  bool waitUntil(Done done, std::chrono::milliseconds timeout) const {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return done(items_); });
  }

 private:
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<T> items_;
};

struct CompletionCall {
  Data data;
  std::optional<HTTPURLResponse> response;
  std::optional<Error> error;
};

// Every completion call; shared so that a late call never touches a
// finished test's stack.
class Completions : public Recorder<CompletionCall>, public std::enable_shared_from_this<Completions> {
 public:
  using Call = CompletionCall;
  static std::shared_ptr<Completions> make() { return std::make_shared<Completions>(); }

  URLCompletion handler(std::function<void(const Call&)> also = nullptr) {
    return [self = shared_from_this(), also](const Data& data, const std::optional<HTTPURLResponse>& response,
                                             const std::optional<Error>& error) {
      Call call{data, response, error};
      if (also) also(call);
      self->add(std::move(call));
    };
  }
  bool waitFor(std::size_t count, std::chrono::milliseconds timeout = kWait) const {
    return waitUntil([&](const std::vector<Call>& calls) { return calls.size() >= count; }, timeout);
  }
  std::vector<Call> calls() const { return items(); }
  std::size_t count() const { return items().size(); }
};

class EventLog : public Recorder<std::string> {
 public:
  std::vector<std::string> events() const { return items(); }
  bool waitFor(const std::string& event, std::chrono::milliseconds timeout = kWait) const { return waitForCount(event, 1, timeout); }
  bool waitForCount(const std::string& event, std::size_t count, std::chrono::milliseconds timeout = kWait) const {
    return waitUntil([&](const std::vector<std::string>& events) {
      return static_cast<std::size_t>(std::count(events.begin(), events.end(), event)) >= count;
    }, timeout);
  }
};

// The agent as a connectivity helper sees it: only the keep-alive release
// matters here.
class ReleaseCountingAgent : public ConnectivityHelperDelegate {
 public:
  explicit ReleaseCountingAgent(std::shared_ptr<EventLog> log) : log_(std::move(log)) {}

  void releaseVeskTransaction() override { log_->add("releaseVeskTransaction"); }

 private:
  std::shared_ptr<EventLog> log_;
};

inline bool isUUIDString(const std::string& s) {
  static const std::regex uuid("^[0-9A-F]{8}-[0-9A-F]{4}-[0-9A-F]{4}-[0-9A-F]{4}-[0-9A-F]{12}$");
  return std::regex_match(s, uuid);
}

class TransportTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(URLSession::setExtraCAFile(TestCA::shared().caFile().string())); }
  void TearDown() override { server.stop(); }

  static URLRequest get(const std::string& url) {
    URLRequest r;
    r.url = url;
    return r;
  }
  static URLRequest post(const std::string& url, const std::string& body) {
    URLRequest r;
    r.httpMethod = "POST";
    r.url = url;
    r.body = bytes(body);
    return r;
  }

  TempRoot root;
  log::LogCapture logs;
  HttpsTestServer server;
};

}  // namespace zerith::test
