// Peers that send calls without reading the replies, over real sockets: the
// connection throttles them instead of buffering, the outboxes of all
// connections stay under the process's limit with the slowest reader closed
// first, and an ordinary peer beside them goes on being answered.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <atomic>
#include <future>
#include <memory>
#include <mutex>
#include <vector>

#include "ipc/SocketConnection.h"
#include "ipc/tests/IpcTestSupport.h"
#include "platform/Log.h"

namespace zerith::ipc::test {
namespace {

// A call whose echoed reply is about `pad` bytes, so that outboxes fill fast.
Data paddedCall(std::uint64_t n, std::size_t pad) {
  return encodeCall("echo", n, Dictionary{{"n", static_cast<long long>(n)}, {"pad", Value(Data(pad, 0x61))}});
}

// Each test lowers the limits it reaches; the defaults come back afterwards. Captures the log.
class Flood : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(queuedBytesOfAllConnections(), 0u) << "an earlier test left bytes queued"; }
  void TearDown() override { setQueueLimits(QueueLimits{}); }

  log::LogCapture capture;
};

// Writes calls into the peer's socket without reading, until the connection
// has stopped reading and the socket stays full for 300 ms. Returns the
// number of calls written, or stops at `maxCalls` (the connection never
// pushed back).
int floodUntilHeldBack(RawPeer& peer, std::size_t pad, int maxCalls) {
  const int fd = peer.raw.fd();
  ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
  int calls = 0;
  Data pending;
  std::size_t offset = 0;
  const auto deadline = std::chrono::steady_clock::now() + kWait * 3;
  while (calls < maxCalls) {
    if (std::chrono::steady_clock::now() > deadline) {
      ADD_FAILURE() << "the connection neither took calls nor paused its reading";
      break;
    }
    if (offset == pending.size()) {
      pending = paddedCall(static_cast<std::uint64_t>(calls + 1), pad);
      offset = 0;
    }
    const ssize_t n = ::send(fd, pending.data() + offset, pending.size() - offset, MSG_NOSIGNAL);
    if (n > 0) {
      offset += static_cast<std::size_t>(n);
      if (offset == pending.size()) {
        ++calls;
      }
      continue;
    }
    if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK) {
      ADD_FAILURE() << "flood write failed: " << std::strerror(errno);
      break;
    }
    pollfd p{fd, POLLOUT, 0};
    if (::poll(&p, 1, 300) == 0 && peer.connection->readingPaused()) {
      break;  // held back (a slow machine alone may leave the socket full for a while)
    }
  }
  ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) & ~O_NONBLOCK);
  return calls;
}

TEST_F(Flood, APeerThatDoesNotReadIsThrottledAndServedInFullOnceItReads) {
  setQueueLimits({.pauseReadingAt = 256u << 10, .resumeReadingAt = 64u << 10});
  RawPeer flooder;
  constexpr std::size_t kPad = 2000;
  constexpr int kMax = 50000;  // 100 MB of calls: far beyond what a throttled connection takes
  const int written = floodUntilHeldBack(flooder, kPad, kMax);
  ASSERT_LT(written, kMax) << "the connection never stopped taking calls";
  ASSERT_TRUE(capture.waitFor(flooder.connection->description() + ": peer does not read its replies ("));
  EXPECT_TRUE(flooder.connection->readingPaused());
  // Held at the mark: at most one reply past it.
  EXPECT_GE(flooder.connection->queuedBytes(), 256u << 10);
  EXPECT_LT(flooder.connection->queuedBytes(), (256u << 10) + kPad + 200);
  EXPECT_LT(flooder.object->calls().size(), static_cast<std::size_t>(written)) << "every call was taken in";
  EXPECT_EQ(flooder.invalidated.count(), 0);

  // Reading the replies lets the connection read on; every call is answered
  // in order and nothing stays queued.
  for (int i = 1; i <= written; ++i) {
    ASSERT_EQ(flooder.nextReplyTo(), static_cast<std::uint64_t>(i)) << "of " << written;
  }
  EXPECT_EQ(flooder.object->calls().size(), static_cast<std::size_t>(written));
  EXPECT_TRUE(capture.contains(flooder.connection->description() + ": peer caught up; reading resumed"));
  EXPECT_FALSE(flooder.connection->readingPaused());
  EXPECT_EQ(flooder.connection->queuedBytes(), 0u);
  EXPECT_TRUE(capture.waitFor("memory given back"));
}

TEST_F(Flood, SeveralFloodersStayUnderTheLimitForAllTheSlowestIsClosedFirstAndOthersAreServed) {
  // Each flooder is held at about 256 KiB; the third one takes the total past
  // 640 KiB, which closes the one that has waited longest: not the one whose
  // replies crossed the limit, and not the newer one that holds as much.
  constexpr std::size_t kLimit = 640u << 10;
  setQueueLimits({.pauseReadingAt = 256u << 10, .resumeReadingAt = 64u << 10, .allConnections = kLimit});
  RawPeer normal;
  std::vector<std::unique_ptr<RawPeer>> flooders;
  constexpr std::size_t kPad = 1000;
  for (int i = 0; i < 3; ++i) {
    flooders.push_back(std::make_unique<RawPeer>());
    floodUntilHeldBack(*flooders.back(), kPad, 100000);
    EXPECT_LT(flooders.back()->connection->queuedBytes(), (256u << 10) + kPad + 200) << "held past the mark";
    EXPECT_LE(queuedBytesOfAllConnections(), kLimit);
    // The ordinary client between the floods gets its answer.
    normal.write(paddedCall(static_cast<std::uint64_t>(i + 1), 10));
    EXPECT_EQ(normal.nextReplyTo(), static_cast<std::uint64_t>(i + 1));
  }
  auto& first = *flooders[0];
  ASSERT_TRUE(first.invalidated.waitFor(1)) << "the slowest reader stayed open";
  EXPECT_TRUE(flooders[0]->seesEof());
  EXPECT_TRUE(capture.contains(first.connection->description() +
                               ": closing connection: replies waiting for all connections ("));
  EXPECT_TRUE(capture.contains("exceed the limit of " + std::to_string(kLimit) + "; this peer reads slowest ("));
  EXPECT_EQ(flooders[1]->invalidated.count(), 0);
  EXPECT_EQ(flooders[2]->invalidated.count(), 0);
  EXPECT_EQ(capture.count("reads slowest"), 1u);
  EXPECT_LE(queuedBytesOfAllConnections(), kLimit);

  // The survivors are answered in full once they read.
  for (int f = 1; f < 3; ++f) {
    auto& peer = *flooders[static_cast<std::size_t>(f)];
    const auto delivered = peer.object->calls().size();
    for (std::size_t i = 1; i <= delivered; ++i) {
      ASSERT_EQ(peer.nextReplyTo(), i) << "flooder " << f;
    }
  }
  normal.write(paddedCall(99, 10));
  ASSERT_TRUE(normal.readMessage());
  flooders.clear();
  EXPECT_TRUE(capture.waitFor("memory given back"));
  EXPECT_EQ(queuedBytesOfAllConnections(), 0u);
}

TEST_F(Flood, CallsLeftUnansweredHoldBackFurtherCallsUntilHalfAreAnswered) {
  // An object that answers later (as a flush does) keeps its replies; the
  // peer reads everything, so only the unanswered calls can hold it back.
  setQueueLimits({.callsInFlight = 64});
  RawPeer peer;
  std::mutex held;
  std::vector<std::shared_ptr<Reply>> unanswered;
  std::atomic<bool> answerAtOnce{false};
  peer.object->answer = [&](const Message&, std::shared_ptr<Reply> r) {
    if (answerAtOnce) {
      r->send(Dictionary{});
      return;
    }
    std::lock_guard lock(held);
    unanswered.push_back(std::move(r));
  };
  peer.write(framesOf(200, [](int n) { return paddedCall(static_cast<std::uint64_t>(n + 1), 10); }));
  ASSERT_TRUE(capture.waitFor(peer.connection->description() + ": 64 calls wait for their answers; reading paused"));
  EXPECT_EQ(peer.object->calls().size(), 64u);
  EXPECT_EQ(peer.connection->callsInFlight(), 64u);

  // Answering 32 is not yet enough; the 33rd is.
  auto answer = [&](std::size_t count) {
    std::vector<std::shared_ptr<Reply>> now;
    {
      std::lock_guard lock(held);
      now.assign(unanswered.begin(), unanswered.begin() + static_cast<std::ptrdiff_t>(count));
      unanswered.erase(unanswered.begin(), unanswered.begin() + static_cast<std::ptrdiff_t>(count));
    }
    for (auto& r : now) {
      r->send(Dictionary{});
    }
  };
  answer(32);
  for (int i = 0; i < 32; ++i) {
    ASSERT_TRUE(peer.readMessage());
  }
  EXPECT_TRUE(peer.connection->readingPaused());
  EXPECT_EQ(peer.object->calls().size(), 64u);
  answer(1);
  // 31 remain unanswered: 33 more calls come in before the next pause.
  ASSERT_TRUE(peer.object->received.waitFor(64 + 33));
  ASSERT_TRUE(capture.waitFor(": 64 calls wait for their answers; reading paused"));
  EXPECT_EQ(peer.object->calls().size(), 97u);
  // Replies dropped unanswered count as answered too.
  answerAtOnce = true;
  {
    std::lock_guard lock(held);
    unanswered.clear();
  }
  ASSERT_TRUE(peer.object->received.waitFor(200));
  EXPECT_EQ(peer.object->calls().back().call, 200u);
}

TEST_F(Flood, MessagesTheDaemonSendsToAPeerThatNeverReadsCloseItAtTheConnectionLimit) {
  // Calls from this side are not held back by reading; the limit per
  // connection ends them.
  constexpr std::size_t kPerConnection = 2u << 20;
  setQueueLimits({.pauseReadingAt = 256u << 10, .resumeReadingAt = 64u << 10, .perConnection = kPerConnection});
  RawPeer peer;
  RawPeer bystander;
  // Sends from the daemon's end never wait for the peer, past the mark or not.
  auto sending = std::async(std::launch::async, [&] {
    for (int sent = 0; !peer.connection->isInvalidated() && sent < 10000; ++sent) {
      peer.connection->send("note", Dictionary{{"pad", Value(Data(4096, 0x63))}});
    }
  });
  ASSERT_EQ(sending.wait_for(kWait), std::future_status::ready) << "the daemon's end waited for its peer";
  ASSERT_TRUE(peer.invalidated.waitFor(1));
  EXPECT_TRUE(capture.has(log::Level::Error, peer.connection->description() + ": closing connection: peer does not read (" +
                                                 std::to_string(kPerConnection) + " bytes waiting)"));
  EXPECT_EQ(peer.connection->queuedBytes(), 0u);
  bystander.write(paddedCall(1, 10));
  EXPECT_EQ(bystander.nextReplyTo(), 1u);
}

}  // namespace
}  // namespace zerith::ipc::test
