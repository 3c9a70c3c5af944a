#pragma once

// Scenario helpers for the IPC tests: a raw peer that speaks bytes to a real
// connection, a connected pair of real connections, and bounded waits that
// fail a test instead of hanging it.

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <functional>
#include <future>
#include <mutex>
#include <thread>
#include <vector>

#include "ipc/Frame.h"
#include "ipc/SocketConnection.h"
#include "tests/support/RawFrameSocket.h"
#include "tests/support/TempRoot.h"

namespace zerith::ipc::test {

using namespace std::chrono_literals;
using zerith::test::frameWithBody;
using zerith::test::RawFrameSocket;
inline constexpr auto kWait = 10s;

// A policy under `root` that gives this user the daemon's entitlement as `value`.
inline void grantEntitlement(const zerith::test::TempRoot& root, const std::string& value = "<true/>") {
  root.write("/etc/zerithd/entitlements.d/test.plist",
             "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict><key>users</key><array><integer>" +
                 std::to_string(::getuid()) + "</integer></array><key>entitlements</key><dict>"
                 "<key>com.velmar.private.zerithd</key>" + value + "</dict></dict></plist>\n");
}

// Counts events and lets a test wait for a number of them.
class Counter {
 public:
  // Notifies under the lock: a waiter may destroy the counter as soon as it
  // sees the count.
  void hit() {
    std::lock_guard lock(mutex_);
    ++count_;
    changed_.notify_all();
  }
  bool waitFor(int n, std::chrono::milliseconds timeout = kWait) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return count_ >= n; });
  }
  int count() const {
    std::lock_guard lock(mutex_);
    return count_;
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  int count_ = 0;
};

// The value a completion was called with, waited for with a bounded wait
// (a default value and a failure when it never comes).
template <typename T>
class Answer {
 public:
  void set(T value) { promise_.set_value(std::move(value)); }
  T get() {
    if (future_.wait_for(kWait) != std::future_status::ready) {
      ADD_FAILURE() << "no completion";
      return T{};
    }
    return future_.get();
  }

 private:
  std::promise<T> promise_;
  std::future<T> future_ = promise_.get_future();
};

// Records the calls an exported object receives and answers them through a
// test-supplied function (default: echo the arguments back).
class RecordingObject : public ExportedObject {
 public:
  std::function<void(const Message&, std::shared_ptr<Reply>)> answer = [](const Message& m, std::shared_ptr<Reply> r) {
    r->send(m.args);
  };
  // Which calls may be handled on the socket thread (default: none).
  std::function<bool(const Message&)> quick;

  bool answersWithoutWaiting(const Message& message) const override { return quick && quick(message); }

  void handleMessage(const Message& message, std::shared_ptr<Reply> reply) override {
    {
      std::lock_guard lock(mutex_);
      calls_.push_back(message);
    }
    answer(message, std::move(reply));
    received.hit();
  }
  std::vector<Message> calls() const {
    std::lock_guard lock(mutex_);
    return calls_;
  }

  Counter received;

 private:
  mutable std::mutex mutex_;
  std::vector<Message> calls_;
};

// The next frame a connection wrote to a raw end; nullopt on EOF or time-out.
inline std::optional<IncomingMessage> readIncoming(RawFrameSocket& raw, std::chrono::milliseconds timeout = kWait) {
  const auto body = raw.readFrame(timeout);
  std::string why;
  return body ? decodeMessage(*body, &why) : std::nullopt;
}

inline std::pair<file::UniqueFd, file::UniqueFd> socketPair() {
  int fds[2];
  EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  return {file::UniqueFd(fds[0]), file::UniqueFd(fds[1])};
}

// One end of a socket pair as a real connection, the other end raw.
struct RawPeer {
  std::shared_ptr<SocketConnection> connection;
  RawFrameSocket raw;
  std::shared_ptr<RecordingObject> object = std::make_shared<RecordingObject>();
  Counter invalidated;

  // Not resumed: nothing is delivered until the test resumes the connection.
  explicit RawPeer(bool resume = true) : RawPeer(socketPair(), resume) {}
  ~RawPeer() {
    if (connection) {
      connection->invalidate();
      invalidated.waitFor(1);
    }
  }

  void write(const Data& bytes, std::size_t chunk = 0) { ASSERT_TRUE(raw.write(bytes, chunk)) << "peer write failed"; }
  void closeWrite() { ::shutdown(raw.fd(), SHUT_WR); }

  std::optional<IncomingMessage> readMessage(std::chrono::milliseconds timeout = kWait) {
    return readIncoming(raw, timeout);
  }
  // The call number the next frame answers; nullopt when none comes or it is
  // not a reply.
  std::optional<std::uint64_t> nextReplyTo() {
    const auto m = readMessage();
    return m && m->kind == IncomingMessage::Kind::Reply ? std::optional(m->replyTo) : std::nullopt;
  }
  // True when the connection closed its end (EOF) before the time-out.
  bool seesEof(std::chrono::milliseconds timeout = kWait) { return raw.waitClosed(timeout); }

 private:
  RawPeer(std::pair<file::UniqueFd, file::UniqueFd> ends, bool resume) : raw(std::move(ends.second), 64u << 20) {
    const PeerCredentials peer = *readPeerCredentials(ends.first.get());
    connection = SocketConnection::adopt(std::move(ends.first), peer, Dictionary());
    connection->setExportedObject(object);
    connection->setInvalidationHandler([this] { invalidated.hit(); });
    if (resume) {
      connection->resume();
    }
  }
};

// A socket bound at `path` and listening with `backlog` (0: bound only, as a
// listener that died leaves it).
inline file::UniqueFd boundSocket(const std::string& path, int backlog) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
  file::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  EXPECT_EQ(::bind(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0) << path;
  EXPECT_TRUE(backlog == 0 || ::listen(fd.get(), backlog) == 0) << path;
  return fd;
}

// Two real connections joined by a socket pair; serve() exports `object` on
// b and resumes both. With `clientEnd`, a is made as a client makes its
// connection (connect), which is the end whose waiting callers read their
// replies themselves.
struct ConnectedPair {
  std::shared_ptr<SocketConnection> a;
  std::shared_ptr<SocketConnection> b;
  std::shared_ptr<RecordingObject> object = std::make_shared<RecordingObject>();

  void serve() {
    b->setExportedObject(object);
    a->resume();
    b->resume();
  }

  explicit ConnectedPair(bool clientEnd = false) {
    if (clientEnd) {
      static std::atomic<int> made{0};
      const std::string path = "/tmp/zerith-pair-" + std::to_string(::getpid()) + "-" + std::to_string(++made) + ".sock";
      const file::UniqueFd listening = boundSocket(path, 1);
      a = SocketConnection::connect(path);
      file::UniqueFd accepted(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
      const PeerCredentials peer = *readPeerCredentials(accepted.get());
      b = SocketConnection::adopt(std::move(accepted), peer, Dictionary());
      ::unlink(path.c_str());
      return;
    }
    auto [ours, theirs] = socketPair();
    const PeerCredentials peer = *readPeerCredentials(ours.get());
    a = SocketConnection::adopt(std::move(ours), peer, Dictionary());
    b = SocketConnection::adopt(std::move(theirs), peer, Dictionary());
  }
  ~ConnectedPair() {
    a->invalidate();
    b->invalidate();
  }
};

// The outcome of one Connection::call with a completion, as an Answer.
inline auto callLater(Connection& connection, const std::string& op, Dictionary args) {
  auto answer = std::make_shared<Answer<SocketConnection::WaitedReply>>();
  connection.call(op, std::move(args), [answer](std::optional<Dictionary> a, std::optional<Error> e) {
    answer->set({std::move(a), std::move(e)});
  });
  return answer;
}

inline Data bytesOfText(const std::string& s) { return Data(s.begin(), s.end()); }

inline Data concat(std::initializer_list<Data> parts) {
  Data out;
  for (const auto& p : parts) {
    out.insert(out.end(), p.begin(), p.end());
  }
  return out;
}

// The frames make(0) .. make(n - 1) back to back, as one write.
inline Data framesOf(int n, const std::function<Data(int)>& make) {
  Data out;
  for (int i = 0; i < n; ++i) {
    const Data frame = make(i);
    out.insert(out.end(), frame.begin(), frame.end());
  }
  return out;
}

// Runs fn(0) .. fn(n - 1) on n threads at once and joins them all.
inline void onThreads(int n, const std::function<void(int)>& fn) {
  std::vector<std::thread> threads;
  for (int i = 0; i < n; ++i) {
    threads.emplace_back(fn, i);
  }
  for (auto& t : threads) {
    t.join();
  }
}

}  // namespace zerith::ipc::test
