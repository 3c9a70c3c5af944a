// A connection's reading, on its queue: bytes from the socket become frames,
// frames become calls and replies delivered to the exported object or the
// waiting caller, within the input and call limits.

#include "ipc/SocketConnection.h"
#include "ipc/SocketConnectionHelpers.h"

#include <sys/socket.h>
#include <sys/uio.h>

#include <algorithm>
#include <asio/error.hpp>
#include <cerrno>
#include <cstring>

#include "platform/Executors.h"

namespace zerith::ipc {

// The queue limits in force and the helpers the connection's files share.
using namespace socket_detail;

namespace {

constexpr std::size_t kReadChunk = 64u << 10;

// Set while a thread waiting for its reply reads for the connection: like a
// socket thread, it hands a message that may wait to the queue's pool.
thread_local bool tCallerReads = false;

// Sends the reply to one call through the connection that delivered it.
class SocketReply final : public Reply {
 public:
  // Counts as a call waiting for its answer on `connection` until it is
  // answered or dropped.
  SocketReply(const std::shared_ptr<SocketConnection>& connection, std::optional<std::uint64_t> call)
      : connection_(connection), call_(call) {
    if (call_) {
      connection->callTaken();
    }
  }
  ~SocketReply() override {
    if (call_ && !answered_.exchange(true)) {
      if (auto c = connection_.lock()) {
        c->callAnswered();
      }
    }
  }

  void send(Dictionary args) override {
    if (!call_ || answered_.exchange(true)) {
      return;
    }
    if (auto c = connection_.lock()) {
      c->writeFrame(encodeReply(*call_, args));
      c->callAnswered();
    }
  }

  void fail(const Error& error) override {
    if (!call_ || answered_.exchange(true)) {
      return;
    }
    if (auto c = connection_.lock()) {
      c->writeFrame(encodeErrorReply(*call_, error));
      c->callAnswered();
    }
  }

 private:
  std::weak_ptr<SocketConnection> connection_;
  std::optional<std::uint64_t> call_;
  std::atomic<bool> answered_{false};
};

}  // namespace

// ---- reading (on the queue) ---------------------------------------------------

void SocketConnection::startRead() {
  if (invalidated_ || readArmed_.exchange(true)) {
    return;
  }
  // No buffer is held while the connection waits: the bytes are read when
  // they are there, into the reading thread's own buffer, and only an
  // unfinished frame stays with the connection (its decoder). They are read
  // by hand (recvmsg): a call may carry descriptors, which a plain read would
  // drop.
  socket_.async_wait(asio::socket_base::wait_read,
                     [self = std::static_pointer_cast<SocketConnection>(shared_from_this())](const std::error_code& ec) {
                       self->readArmed_ = false;
                       self->onReadable(ec);
                     });
}

std::vector<std::shared_ptr<const file::UniqueFd>> SocketConnection::claimDescriptors(std::uint64_t frameStart,
                                                                                     std::uint32_t count) {
  closeStrayDescriptors(frameStart + 1);
  std::vector<std::shared_ptr<const file::UniqueFd>> claimed;
  if (count == 0 || receivedDescriptors_.empty()) {
    return claimed;
  }
  ReceivedDescriptors& front = receivedDescriptors_.front();
  if (front.first > frameStart) {
    return claimed;  // they came with a later frame
  }
  for (auto& fd : front.fds) {
    if (claimed.size() < count) {
      claimed.push_back(std::make_shared<const file::UniqueFd>(std::move(fd)));
    }
  }
  if (front.fds.size() > count) {
    log_.error("{}: closed {} descriptors beyond the {} a call claimed", description(), front.fds.size() - count, count);
  }
  receivedDescriptors_.pop_front();  // what was not claimed closes here
  return claimed;
}

void SocketConnection::closeStrayDescriptors(std::uint64_t before) {
  while (!receivedDescriptors_.empty() && receivedDescriptors_.front().end < before) {
    log_.error("{}: closed {} descriptors that no call claimed", description(), receivedDescriptors_.front().fds.size());
    receivedDescriptors_.pop_front();
  }
}

void SocketConnection::onReadable(const std::error_code& ec) {
  // The chunk is read and handled as a turn of the connection's queue: right
  // here on the reading thread when the queue is free (no hand-off on the way
  // to the exported object), else queued behind what the queue is doing.
  // Never by waiting for the queue: a reading thread that waited could hold
  // the very pool thread the queue needs.
  auto handle = [this, ec] {
    if (ec) {
      readFailed(ec);
      return;
    }
    readChunk();
  };
  if (queue_.runIfFree(handle)) {
    return;
  }
  if (!ec && callerReading_.load()) {
    rearmAfterCaller_ = true;
    // The caller's turn takes the flag as it ends; when it ended before
    // seeing it, the flag is still ours to act on.
    if (callerReading_.load() || !rearmAfterCaller_.exchange(false)) {
      return;
    }
  }
  queue_.async([self = std::static_pointer_cast<SocketConnection>(shared_from_this()), handle] { handle(); });
}

bool SocketConnection::readChunk() {
  if (invalidated_) {
    return false;
  }
  thread_local std::vector<std::uint8_t> chunk(kReadChunk);
  iovec part{chunk.data(), chunk.size()};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * kMaxDescriptorsPerFrame)];
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof(control);
  const ssize_t n = ::recvmsg(fd_, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (n < 0) {
    const int err = errno;
    if (err == EAGAIN || err == EWOULDBLOCK || err == EINTR) {
      startRead();
      return false;
    }
    readFailed(std::error_code(err, std::system_category()));
    return false;
  }
  std::vector<file::UniqueFd> fds;
  for (cmsghdr* c = CMSG_FIRSTHDR(&message); c != nullptr; c = CMSG_NXTHDR(&message, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) {
      continue;
    }
    const std::size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t i = 0; i < count; ++i) {
      int fd = -1;
      std::memcpy(&fd, CMSG_DATA(c) + i * sizeof(int), sizeof(int));
      fds.emplace_back(fd);
    }
  }
  if ((message.msg_flags & MSG_CTRUNC) != 0) {
    // More than a frame may carry, or no descriptor left in this process:
    // the kernel closed what did not fit.
    log_.error("{}: descriptors sent with a call were cut off (at most {} per call, or none left here)",
               description(), kMaxDescriptorsPerFrame);
  }
  if (n == 0) {
    readFailed(asio::error::eof);
    return false;
  }
  const auto size = static_cast<std::size_t>(n);
  if (!fds.empty()) {
    receivedDescriptors_.push_back(ReceivedDescriptors{bytesReceived_, bytesReceived_ + size, std::move(fds)});
  }
  bytesReceived_ += size;
  decoder_.append(chunk.data(), size);
  continueReading();
  return true;
}

bool SocketConnection::readForCaller() {
  if (!resumed_ || invalidated_ || readPausedFlag_.load()) {
    return false;
  }
  bool read = false;
  queue_.runIfFree([&] {
    // Reading may have been held back since the check above; the flag is
    // only set in a turn, so this second look is the one that counts.
    if (readPausedFlag_.load()) {
      return;
    }
    tCallerReads = true;
    callerReading_ = true;
    read = readChunk();
    callerReading_ = false;
    tCallerReads = false;
    // Held back meanwhile: the end of the pause arms the wait.
    if (rearmAfterCaller_.exchange(false) && !readPausedFlag_.load()) {
      startRead();
    }
  });
  return read;
}

bool SocketConnection::outboxHoldsReading(std::size_t waiting) const {
  // A client end reads on whatever it has to write: what it reads are the
  // daemon's replies, and a daemon that waits for the client to read them
  // before it reads on would never drain the client's outbox. Its writers
  // are held back instead (waitForRoom).
  return !clientEnd_ && waiting >= gPauseReadingAt.load();
}

void SocketConnection::continueReading() {
  for (;;) {
    cork();
    const InputState state = processInput();
    // The chunk's replies leave before the next read and before the outbox
    // is weighed for a pause.
    uncork();
    switch (state) {
      case InputState::Closed:
      case InputState::HandedOff: return;
      case InputState::NeedMore:
        // The next frame starts at bytesDecoded_: descriptors that came
        // before it belong to no frame.
        closeStrayDescriptors(bytesDecoded_ + 1);
        decoder_.releaseSpare();
        if (accountInput()) {
          startRead();
        }
        return;
      case InputState::Paused: break;
    }
    std::size_t waiting = 0;
    std::size_t unanswered = 0;
    bool hold = false;
    {
      std::lock_guard lock(writeMutex_);
      if (writeClosed_) {
        return;
      }
      waiting = outboxBytes_;
      unanswered = callsInFlight_.load();
      hold = outboxHoldsReading(waiting) || unanswered >= gCallsInFlight.load();
      if (hold) {
        // onWritable or callAnswered reads on once the peer has caught up.
        readPaused_ = true;
        readPausedFlag_ = true;
        QueueRegistry::get().giveBackArmed = true;
      }
    }
    if (hold) {
      if (outboxHoldsReading(waiting)) {
        log_.debug("{}: peer does not read its replies ({} bytes waiting); reading paused", description(), waiting);
      } else {
        log_.debug("{}: {} calls wait for their answers; reading paused", description(), unanswered);
      }
      return;
    }
    // The peer caught up between the check and the lock: deliver on.
  }
}

SocketConnection::InputState SocketConnection::processInput() {
  for (;;) {
    if (invalidated_) {
      return InputState::Closed;
    }
    if (outboxHoldsReading(queued_.load()) || callsInFlight_.load() >= gCallsInFlight.load()) {
      return InputState::Paused;
    }
    plist::Bytes body;
    std::string why;
    switch (decoder_.next(body, why)) {
      case FrameDecoder::Status::NeedMore: return InputState::NeedMore;
      case FrameDecoder::Status::Invalid: protocolError(why); return InputState::Closed;
      case FrameDecoder::Status::Frame: break;
    }
    const std::uint64_t frameStart = bytesDecoded_;
    bytesDecoded_ += kFrameHeaderBytes + body.size();
    auto message = decodeMessage(body, &why);
    if (!message) {
      protocolError(why);
      return InputState::Closed;
    }
    message->call.descriptors = claimDescriptors(frameStart, message->descriptorCount);
    if (handledWithoutWaiting(*message)) {
      deliver(std::move(*message));
      continue;
    }
    if (onSocketThread() || tCallerReads) {
      // The rest of this turn goes to the pool; the socket thread goes back
      // to the other connections. The queue runs it right after this turn.
      // The message that may wait is delivered there uncorked.
      auto waiting = std::make_shared<IncomingMessage>(std::move(*message));
      queue_.async([self = std::static_pointer_cast<SocketConnection>(shared_from_this()), waiting] {
        if (self->invalidated_) {
          return;
        }
        self->deliver(std::move(*waiting));
        self->continueReading();
      });
      return InputState::HandedOff;
    }
    // Already on the pool: what the chunk wrote so far leaves now, and no
    // frame waits for this handler, which may take long.
    uncork();
    deliver(std::move(*message));
    cork();
  }
}

bool SocketConnection::handledWithoutWaiting(const IncomingMessage& message) {
  if (message.kind == IncomingMessage::Kind::Reply) {
    std::lock_guard lock(callsMutex_);
    const auto it = pending_.find(message.replyTo);
    return it == pending_.end() || it->second.neverWaits;
  }
  std::lock_guard lock(stateMutex_);
  return !exported_ || exported_->answersWithoutWaiting(message.call);
}

void SocketConnection::deliver(IncomingMessage message) {
  if (message.kind == IncomingMessage::Kind::Reply) {
    ReplyHandler handler;
    {
      std::lock_guard lock(callsMutex_);
      const auto it = pending_.find(message.replyTo);
      if (it != pending_.end()) {
        handler = std::move(it->second.handler);
        pending_.erase(it);
      }
    }
    if (!handler) {
      log_.error("{}: reply to unknown call {}", description(), message.replyTo);
      return;
    }
    if (message.replyError) {
      handler(std::nullopt, std::move(message.replyError));
    } else {
      handler(std::move(message.replyArgs), std::nullopt);
    }
    return;
  }
  std::shared_ptr<ExportedObject> exported;
  {
    std::lock_guard lock(stateMutex_);
    exported = exported_;
  }
  auto reply = std::make_shared<SocketReply>(std::static_pointer_cast<SocketConnection>(shared_from_this()),
                                             message.call.call);
  if (!exported) {
    log_.error("{}: no object is exported for \"{}\"", description(), message.call.operation);
    reply->fail(Error{kErrorDomain, -1, "No object is exported on this connection"});
    return;
  }
  exported->handleMessage(message.call, std::move(reply));
}

bool SocketConnection::accountInput() {
  QueueRegistry& registry = QueueRegistry::get();
  const std::size_t held = decoder_.held();
  registry.input += held;
  registry.input -= inputHeld_;
  inputHeld_ = held;
  const std::size_t limit = gAllConnections.load();
  const std::size_t input = registry.input.load();
  const std::size_t waiting = registry.total.load();
  const std::size_t all = input + waiting;
  // Past the limit the reader goes when unfinished frames are what fills it
  // (or its own frame alone is large); when waiting replies are, the
  // slowest reader of those goes instead (QueueRegistry::enforce).
  if (decoder_.buffered() == 0 || all <= limit || (input < waiting && decoder_.buffered() < gPauseReadingAt.load())) {
    return true;
  }
  badCallLog().log(peer_.uid,
                   "{}: closing connection: unfinished frames and waiting replies of all connections ({} bytes) exceed "
                   "the limit of {}; this peer holds an unfinished frame of {} bytes",
                   description(), all, limit, decoder_.buffered());
  beginInvalidation();
  return false;
}

void SocketConnection::releaseInput() {
  decoder_ = FrameDecoder();
  QueueRegistry::get().input -= inputHeld_;
  inputHeld_ = 0;
}

void SocketConnection::readFailed(const std::error_code& ec) {
  if (invalidated_) {
    return;
  }
  if (decoder_.buffered() > 0) {
    badCallLog().log(peer_.uid, "{}: closing connection: it ended inside a frame ({} bytes unread)", description(),
                     decoder_.buffered());
  } else if (ec == asio::error::eof || ec == asio::error::connection_reset) {
    log_.debug("{}: peer closed the connection", description());
  } else {
    log_.error("{}: closing connection: read failed: {}", description(), ec.message());
  }
  beginInvalidation();
}

void SocketConnection::protocolError(const std::string& why) {
  badCallLog().log(peer_.uid, "{}: closing connection: {}", description(), why);
  beginInvalidation();
}

}  // namespace zerith::ipc
