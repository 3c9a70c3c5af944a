// A client end (a connection made by connect) whose daemon stops reading:
// the thread that sends one-way messages waits at the outbox's mark instead
// of growing it, nothing is lost once the daemon reads again, the threads
// that drain the connection never wait, and the end of the connection
// releases a waiting writer. (The daemon's end never waits: FloodTest.)

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <atomic>
#include <future>
#include <memory>
#include <thread>

#include "ipc/SocketConnection.h"
#include "ipc/tests/IpcTestSupport.h"
#include "platform/Log.h"
#include "tests/support/TempRoot.h"

namespace zerith::ipc::test {
namespace {

constexpr std::size_t kPause = 64u << 10;
constexpr std::size_t kResume = 16u << 10;
constexpr std::size_t kPad = 4000;

Data eventArgsPad() { return Data(kPad, 0x65); }

// Far more one-way events than the kernel's socket buffers and the outbox's
// mark take.
constexpr int kHeldBackEvents = 1500;

// Sends kHeldBackEvents one-way events from a thread of its own, noting the
// most the outbox held after each send.
struct EventWriter {
  std::atomic<int> sent{0};
  std::atomic<std::size_t> mostQueued{0};
  std::thread thread;

  explicit EventWriter(SocketConnection& connection) {
    thread = std::thread([this, &connection] {
      for (int n = 0; n < kHeldBackEvents; ++n) {
        connection.send("event", Dictionary{{"n", n}, {"pad", Value(eventArgsPad())}});
        mostQueued = std::max(mostQueued.load(), connection.queuedBytes());
        ++sent;
      }
    });
  }
  ~EventWriter() {
    if (thread.joinable()) {
      thread.join();
    }
  }
};

// Small marks for the test's lifetime; a listening socket in a root of its
// own, the client end connected to it with SocketConnection::connect, and
// the accepted daemon end as a raw socket the test reads (or leaves unread)
// itself.
class ClientBackpressure : public ::testing::Test {
 protected:
  ClientBackpressure() {
    setQueueLimits({.pauseReadingAt = kPause, .resumeReadingAt = kResume, .perConnection = 1u << 20,
                    .allConnections = 1u << 30});
    Error error;
    connection = SocketConnection::connect((root / "/client.sock").string(), &error);
    EXPECT_TRUE(connection) << error.description;
    raw.emplace(file::UniqueFd(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC)), 64u << 20);
    EXPECT_TRUE(raw->fd() >= 0);
    if (connection) {
      connection->setInvalidationHandler([this] { invalidated.hit(); });
      connection->resume();
    }
  }
  // The end of the connection also releases a writer that still waits.
  ~ClientBackpressure() override {
    if (connection) {
      connection->invalidate();
      invalidated.waitFor(1);
    }
    writer.reset();
    setQueueLimits(QueueLimits{});
  }

  // True once the writer, started here, waits at the outbox mark.
  bool writerHeldBack() {
    if (connection) {
      writer = std::make_unique<EventWriter>(*connection);
    }
    return writer && capture.waitFor(connection->description() + ": peer does not read (") &&
           writer->sent.load() < kHeldBackEvents;
  }

  log::LogCapture capture;
  zerith::test::TempRoot root;
  file::UniqueFd listening = boundSocket((root / "/client.sock").string(), 1);
  std::optional<RawFrameSocket> raw;
  std::shared_ptr<SocketConnection> connection;
  Counter invalidated;
  std::unique_ptr<EventWriter> writer;
};

TEST_F(ClientBackpressure, OneWayEventsToADaemonThatStopsReadingWaitAtTheMarkAndAllArriveOnceItReads) {
  ASSERT_TRUE(writerHeldBack());
  const std::size_t frame = encodeCall("event", std::nullopt, Dictionary{{"n", 0}, {"pad", Value(eventArgsPad())}}).size();
  EXPECT_GT(connection->queuedBytes(), kPause);
  EXPECT_LE(connection->queuedBytes(), kPause + frame + 16);

  for (int n = 0; n < kHeldBackEvents; ++n) {
    const auto event = readIncoming(*raw);
    ASSERT_TRUE(event) << "event " << n << " of " << kHeldBackEvents << " missing";
    ASSERT_EQ(event->kind, IncomingMessage::Kind::Call);
    EXPECT_FALSE(event->call.call) << "a one-way event carries no call number";
    ASSERT_EQ(event->call.args.get("n").intValue(), n);
  }
  writer->thread.join();
  EXPECT_EQ(writer->sent.load(), kHeldBackEvents);
  EXPECT_LE(writer->mostQueued.load(), kPause + frame + 16) << "the outbox grew past its mark";
  EXPECT_EQ(connection->queuedBytes(), 0u);
  EXPECT_FALSE(connection->isInvalidated());
  EXPECT_FALSE(capture.contains("closing connection"));
}

TEST_F(ClientBackpressure, AClientEndOverTheMarkStillReadsItsReplies) {
  // A daemon that waits for its replies to be read before it reads on, and a
  // client that would read them only once its own outbox drained, would wait
  // for each other for ever.
  ASSERT_TRUE(connection);
  Counter answered;
  for (int n = 0; n < 3; ++n) {
    connection->call("ask", Dictionary{{"n", n}}, [&](std::optional<Dictionary> args, std::optional<Error>) {
      EXPECT_TRUE(args);
      answered.hit();
    });
  }
  ASSERT_TRUE(writerHeldBack());
  ASSERT_TRUE(raw->write(framesOf(3, [](int n) { return encodeReply(static_cast<std::uint64_t>(n + 1), Dictionary{}); })));
  EXPECT_TRUE(answered.waitFor(3)) << "the client stopped reading because its own outbox was full";
  EXPECT_FALSE(connection->readingPaused());
}

// How a waiting writer is released: the client ends the connection, or the
// daemon goes away.
class ClientBackpressureRelease : public ClientBackpressure, public ::testing::WithParamInterface<bool> {};

TEST_P(ClientBackpressureRelease, QueueBlocksNeverWaitAndTheEndOfTheConnectionReleasesAWaitingWriterAtOnce) {
  ASSERT_TRUE(writerHeldBack());
  // Over the mark, nothing read: a block of the connection's own queue still
  // gets its frame queued (past the mark) and goes on.
  Counter fromQueue;
  connection->queue().async([&] {
    connection->send("fromQueue", Dictionary{});
    fromQueue.hit();
  });
  EXPECT_TRUE(fromQueue.waitFor(1)) << "a block of the connection's queue waited for the outbox";
  EXPECT_GT(connection->queuedBytes(), kPause);
  if (GetParam()) {
    connection->invalidate();
  } else {
    raw->close();  // the daemon goes away
  }
  // Every send after the end returns at once; the writer gets through the rest.
  auto done = std::async(std::launch::async, [&] { writer->thread.join(); });
  ASSERT_EQ(done.wait_for(kWait), std::future_status::ready) << "the writer still waits after the connection ended";
  EXPECT_EQ(writer->sent.load(), kHeldBackEvents);
  EXPECT_TRUE(invalidated.waitFor(1));
  EXPECT_EQ(connection->queuedBytes(), 0u);
}

INSTANTIATE_TEST_SUITE_P(ByClientOrDaemon, ClientBackpressureRelease, ::testing::Bool(),
                         [](const auto& info) { return info.param ? "ClientInvalidates" : "DaemonGoesAway"; });

}  // namespace
}  // namespace zerith::ipc::test
