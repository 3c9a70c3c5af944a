#pragma once

// The Connection over a Unix-domain stream socket.
//
// Reading: one wait for readable bytes is outstanding at a time, on one of
// the socket threads (socketContext()); the bytes are read into the reading
// thread's own buffer, so an idle connection holds no read buffer, and only
// a frame not complete yet stays with the connection. Each chunk is decoded and its messages delivered in a
// turn of the connection's serial queue (on the socket thread when the queue
// is free, so without a hand-off), and the next read starts only once that
// is done, so a peer that floods the socket waits for its earlier calls to be
// handled instead of filling memory. A call that may wait (see
// ExportedObject::answersWithoutWaiting), or a reply whose handler may, is
// handed with the rest of the chunk to a thread of the queue's pool: the
// socket thread serves other connections too.
//
// Writing: whole frames, from any thread, in the order the calls were made.
// A call's frame is encoded into the calling thread's own buffer and written
// straight from there when nothing waits and the socket takes it: one system
// call, no allocation, no other thread. What the socket does not take waits
// in an outbox that drains as the peer reads; frames that wait are gathered
// into chunks, so a sender that outpaces its peer queues each frame with a
// copy and the socket thread writes many with one system call. While the connection delivers the messages of one read chunk
// that answer without waiting, the frames written meanwhile (their replies
// above all, but also frames of other threads) are gathered in the outbox
// and leave in one write when that stretch of delivery ends: one system call
// and one wake-up of the peer per chunk instead of one per reply. Before a
// message that may wait is delivered, what was gathered leaves, and nothing
// is held while it runs.
//
// Backpressure on the client end (connections made by connect): a thread
// that writes a frame while the outbox holds more than pauseReadingAt bytes
// waits until it has drained below resumeReadingAt, as a blocking socket
// write would, so that a client sending one-way messages faster than the
// daemon reads is slowed down instead of reaching perConnection and losing
// its connection. Socket threads and blocks of the connection's own queue
// never wait (they are what drains it); their frames are queued. The end of
// the connection releases a waiting writer at once. The daemon's end never
// waits.
//
// Memory under a flood (QueueLimits): a peer that sends calls without reading
// the replies is throttled, not buffered. Once its outbox holds
// pauseReadingAt bytes the connection delivers no further call and stops
// reading its socket (the peer's writes then block in the kernel) until the
// outbox has drained below resumeReadingAt (on the daemon's ends: a client
// end reads its replies on, see below). Calls that are taken but not
// answered yet count too: at callsInFlight of them the connection takes no
// further call until half are answered. An outbox over perConnection
// (kMaxOutboxBytes) still means the peer has stopped reading; the connection
// is then closed. The outboxes of all connections together are held under
// allConnections: past it the connection whose peer has gone longest without
// catching up is closed first, then the next, until the total is back under
// the limit. The bytes held for unfinished frames count against the same
// limit: a chunk that takes them past it closes its connection. Once the
// bytes that waited are written or dropped, the memory they took is given
// back to the system.

// A standard header first: asio decides between aligned_alloc and operator
// new by a libstdc++ macro, and every translation unit must decide alike.
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <mutex>
#include <unordered_map>

#include <asio/local/stream_protocol.hpp>

#include "ipc/Connection.h"
#include "ipc/Frame.h"
#include "platform/FileUtil.h"
#include "platform/Log.h"
#include "platform/RateLimitedLog.h"

namespace zerith::ipc {

inline constexpr std::size_t kMaxOutboxBytes = 64u << 20;
inline constexpr std::size_t kMaxQueuedBytesAllConnections = 128u << 20;

struct QueueLimits {
  // Bytes waiting for one connection at which it stops reading, and below
  // which it reads again.
  std::size_t pauseReadingAt = 1u << 20;
  std::size_t resumeReadingAt = 256u << 10;
  // Bytes waiting for one connection / for all together past which
  // connections are closed.
  std::size_t perConnection = kMaxOutboxBytes;
  std::size_t allConnections = kMaxQueuedBytesAllConnections;
  // Calls taken from one connection and not answered yet: at this many the
  // connection takes no further call until half of them are answered.
  std::size_t callsInFlight = 1024;
};

// The process's limits; tests lower them to reach them with little traffic.
QueueLimits queueLimits();
void setQueueLimits(const QueueLimits& limits);
// Bytes waiting in the outboxes of all connections of the process.
std::size_t queuedBytesOfAllConnections();

// Errors a client's bad calls cause (malformed frames, unknown operations,
// arguments of the wrong type): one line per uid and interval, with a count
// of the rest, so that a flood of bad calls leaves a bounded log.
log::RateLimitedLog& badCallLog();

// The peer of a connected Unix socket as the kernel recorded it when the
// connection was made (SO_PEERCRED, SO_PEERGROUPS). nullopt, with `why`, when
// the socket does not say.
std::optional<PeerCredentials> readPeerCredentials(int fd, std::string* why = nullptr);

class SocketConnection final : public Connection {
  struct Private {};

 public:
  // Takes over a connected socket. `entitlements` is what the policy granted
  // the peer.
  static std::shared_ptr<SocketConnection> adopt(file::UniqueFd fd, PeerCredentials peer, Dictionary entitlements);
  // The client end: connects to the listener at `path`. nullptr (with
  // `error`) when nothing listens there.
  static std::shared_ptr<SocketConnection> connect(const std::filesystem::path& path, Error* error = nullptr);

  SocketConnection(Private, file::UniqueFd fd, PeerCredentials peer, Dictionary entitlements);
  ~SocketConnection() override;
  SocketConnection(const SocketConnection&) = delete;
  SocketConnection& operator=(const SocketConnection&) = delete;

  void setExportedObject(std::shared_ptr<ExportedObject> object) override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  void resume() override;
  void invalidate() override;

  void send(const std::string& operation, Dictionary args) override;
  void call(const std::string& operation, Dictionary args, ReplyHandler handler) override;
  void call(const std::string& operation, Dictionary args, std::vector<file::UniqueFd> descriptors,
            ReplyHandler handler) override;

  // Calls `operation` and waits for its reply, up to `timeout`. On a client
  // end the waiting thread reads the socket itself while nothing else does,
  // so that the reply wakes the caller directly instead of a socket thread
  // that then wakes the caller: one wake-up per call, which is what keeps a
  // round trip fast on busy cores. Messages that came with the reply and may
  // wait are handed to the queue's pool, as a socket thread hands them.
  // Not from a block of this connection's queue.
  struct WaitedReply {
    std::optional<Dictionary> args;  // set when answered
    std::optional<Error> error;      // the peer's error, or the connection's end
    bool timedOut = false;
  };
  WaitedReply callAndWait(const std::string& operation, Dictionary args, std::chrono::milliseconds timeout,
                          std::vector<file::UniqueFd> descriptors = {});

  const PeerCredentials& peer() const override { return peer_; }
  Value valueForEntitlement(const std::string& entitlement) const override;
  const SerialQueue& queue() const override { return queue_; }
  std::string description() const override;

  bool isInvalidated() const { return invalidated_.load(); }
  // Queues one encoded frame (reply paths use it). False when the connection
  // no longer writes.
  bool writeFrame(Data frame, std::vector<file::UniqueFd> descriptors = {});
  // Bytes waiting to be written to the peer.
  std::size_t queuedBytes() const { return queued_.load(); }
  // True while reading is held back because the peer does not read.
  bool readingPaused() const;
  // Calls delivered from the peer that are not answered yet (the reply
  // paths count them).
  std::size_t callsInFlight() const { return callsInFlight_.load(); }
  void callTaken();
  void callAnswered();
  // Keeps `token` until the connection has ended (the listener's count of
  // open connections goes with it).
  void holdUntilClosed(std::shared_ptr<void> token);

 private:
  friend struct QueueRegistry;
  enum class InputState { NeedMore, Paused, Closed, HandedOff };
  struct PendingCall {
    ReplyHandler handler;
    bool neverWaits = false;  // the handler may run on a socket thread
  };

  void startCall(std::string_view operation, Dictionary args, ReplyHandler handler, bool neverWaits,
                 std::vector<file::UniqueFd> descriptors = {});
  // Descriptors received with the bytes [first, end) of the stream.
  struct ReceivedDescriptors {
    std::uint64_t first = 0;
    std::uint64_t end = 0;
    std::vector<file::UniqueFd> fds;
  };
  // On the queue: the descriptors of the frame that starts at `frameStart`
  // and claims `count`; closes those that no frame claimed.
  std::vector<std::shared_ptr<const file::UniqueFd>> claimDescriptors(std::uint64_t frameStart, std::uint32_t count);
  void closeStrayDescriptors(std::uint64_t before);
  void onReadable(const std::error_code& ec);
  // In a turn of the queue: one recvmsg and the frames it completes. False
  // when nothing was there to read (the wait for more is armed again).
  bool readChunk();
  // From a thread waiting in callAndWait on a client end: reads and delivers
  // what has arrived when the queue is free and reading is not held back.
  // False when it read nothing: someone else reads, and delivers.
  bool readForCaller();
  // On a socket thread: may this message be handled here?
  bool handledWithoutWaiting(const IncomingMessage& message);

  void startRead();
  // Delivers buffered frames and reads on, unless the outbox holds the
  // reading back.
  void continueReading();
  // Do `waiting` bytes in the outbox hold the reading back? Only on the
  // daemon's ends.
  bool outboxHoldsReading(std::size_t waiting) const;
  InputState processInput();
  void deliver(IncomingMessage message);
  void readFailed(const std::error_code& ec);
  // After a chunk: brings the process's count of unfinished-frame bytes up
  // to date; false (and the connection closed, with a log line) when this
  // connection's unfinished frame takes the total past the limit.
  bool accountInput();
  // The decoder's memory goes, and with it the connection's share.
  void releaseInput();
  void protocolError(const std::string& why);

  // Ends the unanswered call `call` with `error`, on the queue.
  void failCall(std::uint64_t call, Error error);
  // Writes the frame of a call of this thread (encoded in the thread's own
  // buffer); false when the connection no longer writes, or when the frame
  // is more than a frame may carry (the call alone fails).
  bool writeCall(std::string_view operation, std::optional<std::uint64_t> call, const Dictionary& args,
                 std::vector<file::UniqueFd> descriptors = {});
  // Writes the frame `bytes` (held by `owned` when the outbox may take that
  // vector over instead of copying them).
  bool writeBytes(const std::uint8_t* bytes, std::size_t size, Data* owned, std::vector<file::UniqueFd> descriptors);
  // Called with writeMutex_ held: the frame joins the outbox behind what
  // waits, in the last chunk when it carries no descriptors and fits.
  void enqueue(const std::uint8_t* bytes, std::size_t size, Data* owned, std::vector<file::UniqueFd> descriptors);
  // Sends what the socket takes now; 0 or an errno.
  int sendSome(const std::uint8_t* bytes, std::size_t size, std::size_t& sent,
               std::vector<file::UniqueFd>* descriptors = nullptr);
  // Called with writeMutex_ held: writes as much of the outbox as the socket
  // takes, several frames per system call; 0 or an errno.
  int drainOutbox();
  // Called with writeMutex_ held, on a client end over the mark: waits until
  // the outbox has drained or the connection no longer writes.
  void waitForRoom(std::unique_lock<std::mutex>& lock);
  // Around a stretch of delivery whose messages answer without waiting:
  // frames written meanwhile gather in the outbox and leave at uncork.
  void cork();
  void uncork();
  void armWritable();
  void onWritable(const std::error_code& ec);
  void writeFailed(int err);
  // Called with writeMutex_ held: the outbox now holds `bytes`.
  void setOutboxBytes(std::size_t bytes);
  void closeOverGlobalLimit(std::size_t total, std::size_t limit);
  bool mayReadOn();
  void readOnLater();

  void beginInvalidation();
  void finishInvalidation();
  static Error goneError();

  log::Logger log_{"ipc"};
  SerialQueue queue_;
  const int fd_;
  const PeerCredentials peer_;
  const Dictionary entitlements_;
  asio::local::stream_protocol::socket socket_;
  bool socketOpen_ = false;  // set once by the constructor

  std::mutex stateMutex_;
  std::shared_ptr<ExportedObject> exported_;
  std::function<void()> invalidationHandler_;
  std::function<void()> interruptionHandler_;
  std::shared_ptr<void> closeToken_;
  std::atomic<bool> resumed_{false};
  std::atomic<bool> invalidated_{false};

  // Set while the one wait for readable bytes is outstanding: a caller that
  // reads for itself ends its turn with startRead() as a socket thread does,
  // and must not add a second wait.
  std::atomic<bool> readArmed_{false};
  // Set during a waiting caller's read turn. A socket thread woken by the
  // same bytes that finds the queue taken then leaves the wait's re-arming to
  // that turn (rearmAfterCaller_) instead of handing an empty read to the
  // pool: a thread less woken per call.
  std::atomic<bool> callerReading_{false};
  std::atomic<bool> rearmAfterCaller_{false};
  // Used only on the queue (or by the one outstanding read).
  FrameDecoder decoder_;
  std::size_t inputHeld_ = 0;  // decoder_.held() as last counted
  std::uint64_t bytesReceived_ = 0;  // stream offset of the next byte read
  std::uint64_t bytesDecoded_ = 0;   // stream offset of the next frame
  std::deque<ReceivedDescriptors> receivedDescriptors_;

  mutable std::mutex writeMutex_;
  // Frames waiting, in order, gathered into chunks of up to kOutboxChunkBytes
  // (a frame with descriptors starts a chunk of its own).
  std::deque<Data> outbox_;
  // Beside each chunk of the outbox: the descriptors that leave with its
  // first byte (empty for most).
  std::deque<std::vector<file::UniqueFd>> outboxDescriptors_;
  std::size_t outboxOffset_ = 0;  // of the front chunk
  std::size_t outboxBytes_ = 0;
  bool outboxWasLarge_ = false;  // its storage is let go once it drains
  bool writeArmed_ = false;
  bool writeClosed_ = false;
  bool readPaused_ = false;
  bool corked_ = false;
  // Writers waiting for the outbox to drain (client ends only).
  std::condition_variable drained_;
  std::size_t drainWaiters_ = 0;
  bool clientEnd_ = false;  // made by connect; set before the connection is shared
  // Mirrors for the process-wide limit, read without writeMutex_.
  std::atomic<std::size_t> queued_{0};
  std::atomic<std::int64_t> waitingSince_{0};  // steady-clock ns since the outbox was last empty; 0 when empty
  std::atomic<bool> readPausedFlag_{false};     // readPaused_, for callAnswered's quick check
  std::atomic<std::size_t> callsInFlight_{0};

  std::mutex callsMutex_;
  std::uint64_t nextCall_ = 1;
  bool callsClosed_ = false;
  std::unordered_map<std::uint64_t, PendingCall> pending_;
};

}  // namespace zerith::ipc
