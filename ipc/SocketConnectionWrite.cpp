// A connection's writing, from any thread: frames go to the outbox and to
// the kernel in batches, within the per-connection and process-wide limits
// on the bytes that wait for a slow reader.

#include "ipc/SocketConnection.h"
#include "ipc/SocketConnectionHelpers.h"

#include <sys/socket.h>
#include <sys/uio.h>

#include <algorithm>
#include <asio/error.hpp>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstring>

#include "platform/Executors.h"

namespace zerith::ipc {

// The queue limits in force and the helpers the connection's files share.
using namespace socket_detail;

namespace {

// Chunks of the outbox handed to the kernel in one sendmsg.
constexpr std::size_t kFramesPerWrite = 64;
// Frames that wait are gathered into chunks of up to this size, so that
// queueing one takes no allocation of its own and a write takes many.
constexpr std::size_t kOutboxChunkBytes = 64u << 10;

std::int64_t steadyNanos() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace

// ---- writing (any thread) -----------------------------------------------------

namespace {

// Room for the SCM_RIGHTS of one frame.
struct DescriptorControl {
  alignas(cmsghdr) char bytes[CMSG_SPACE(sizeof(int) * kMaxDescriptorsPerFrame)];
};

// Sets `message` up to carry `fds` (at most kMaxDescriptorsPerFrame).
void attachDescriptors(msghdr& message, DescriptorControl& control, const std::vector<file::UniqueFd>& fds) {
  if (fds.empty()) {
    return;
  }
  const std::size_t count = std::min<std::size_t>(fds.size(), kMaxDescriptorsPerFrame);
  message.msg_control = control.bytes;
  message.msg_controllen = CMSG_SPACE(sizeof(int) * count);
  cmsghdr* c = CMSG_FIRSTHDR(&message);
  c->cmsg_level = SOL_SOCKET;
  c->cmsg_type = SCM_RIGHTS;
  c->cmsg_len = CMSG_LEN(sizeof(int) * count);
  for (std::size_t i = 0; i < count; ++i) {
    const int fd = fds[i].get();
    std::memcpy(CMSG_DATA(c) + i * sizeof(int), &fd, sizeof(int));
  }
}

}  // namespace

int SocketConnection::sendSome(const std::uint8_t* bytes, std::size_t size, std::size_t& sent,
                               std::vector<file::UniqueFd>* descriptors) {
  while (sent < size) {
    iovec part{const_cast<std::uint8_t*>(bytes + sent), size - sent};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    DescriptorControl control;
    if (descriptors != nullptr) {
      attachDescriptors(message, control, *descriptors);
    }
    const ssize_t n = ::sendmsg(fd_, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n > 0) {
      sent += static_cast<std::size_t>(n);
      if (descriptors != nullptr) {
        descriptors->clear();  // they left with the first byte; ours close
      }
      continue;
    }
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      return 0;
    }
    return n < 0 ? errno : EPIPE;
  }
  return 0;
}

namespace {

// The calling thread's buffer for the call frames it writes: encoded in
// place and written from there, copied only when they have to wait in the
// outbox. Kept for the next frame unless a large one made it large.
constexpr std::size_t kKeptFrameBuffer = 64u << 10;
Data& threadFrameBuffer() {
  static thread_local Data buffer;
  return buffer;
}

}  // namespace

bool SocketConnection::writeCall(std::string_view operation, std::optional<std::uint64_t> call,
                                 const Dictionary& args, std::vector<file::UniqueFd> descriptors) {
  Data& buffer = threadFrameBuffer();
  bplist::Shape shape;
  const std::size_t size =
      encodeCallAt(buffer, 0, operation, call, args, static_cast<std::uint32_t>(descriptors.size()), &shape);
  if (auto why = frameRefusal(size - kFrameHeaderBytes, shape)) {
    // The other end would refuse the frame and close the connection: this
    // call alone fails, and the connection goes on.
    log_.error("{}: {} not sent: {}", description(), operation, *why);
    if (call) {
      failCall(*call, Error{kErrorDomain, -1, "The message was not sent: " + *why});
    }
    return false;
  }
  const bool written = writeBytes(buffer.data(), size, nullptr, std::move(descriptors));
  if (buffer.size() > kKeptFrameBuffer) {
    Data().swap(buffer);
  }
  return written;
}

bool SocketConnection::writeFrame(Data frame, std::vector<file::UniqueFd> descriptors) {
  return writeBytes(frame.data(), frame.size(), &frame, std::move(descriptors));
}

void SocketConnection::enqueue(const std::uint8_t* bytes, std::size_t size, Data* owned,
                               std::vector<file::UniqueFd> descriptors) {
  setOutboxBytes(outboxBytes_ + size);
  if (descriptors.empty() && !outbox_.empty() && outbox_.back().size() + size <= kOutboxChunkBytes) {
    Data& last = outbox_.back();
    last.insert(last.end(), bytes, bytes + size);
    return;
  }
  if (owned != nullptr && bytes == owned->data() && size == owned->size()) {
    outbox_.push_back(std::move(*owned));
  } else {
    // Room for the frames that follow: a chunk that grew by doubling would
    // copy what it holds at every step.
    Data chunk;
    chunk.reserve(std::max(size, kOutboxChunkBytes));
    chunk.assign(bytes, bytes + size);
    outbox_.push_back(std::move(chunk));
  }
  outboxDescriptors_.push_back(std::move(descriptors));
}

bool SocketConnection::writeBytes(const std::uint8_t* bytes, std::size_t size, Data* owned,
                                  std::vector<file::UniqueFd> descriptors) {
  int err = 0;
  bool overflow = false;
  std::size_t limit = 0;
  {
    std::unique_lock lock(writeMutex_);
    if (writeClosed_) {
      return false;
    }
    if (clientEnd_ && outboxBytes_ > gPauseReadingAt.load()) {
      waitForRoom(lock);
      if (writeClosed_) {
        return false;
      }
    }
    if (outbox_.empty() && !corked_) {
      std::size_t sent = 0;
      err = sendSome(bytes, size, sent, &descriptors);
      if (!err && sent < size) {
        // What the socket did not take waits; descriptors that left with
        // the first byte are gone from `descriptors`.
        outboxOffset_ = 0;
        enqueue(bytes + sent, size - sent, owned, std::move(descriptors));
        armWritable();
      }
    } else {
      // Behind frames that wait for the socket, or gathered for the write at
      // the end of a delivery: either way it leaves after them.
      enqueue(bytes, size, owned, std::move(descriptors));
      limit = gPerConnection.load();
      overflow = outboxBytes_ > limit;
    }
    if (err || overflow) {
      writeClosed_ = true;
    }
  }
  if (overflow) {
    log_.error("{}: closing connection: peer does not read ({} bytes waiting)", description(), limit);
    beginInvalidation();
    return false;
  }
  if (err) {
    writeFailed(err);
    return false;
  }
  if (QueueRegistry::get().total.load() > gAllConnections.load()) {
    QueueRegistry::get().enforce();
  }
  return !isInvalidated();
}

void SocketConnection::waitForRoom(std::unique_lock<std::mutex>& lock) {
  // The threads that drain the outbox must never wait for it: a socket
  // thread writes it out, and a block of the queue holds the deliveries
  // that end a gathering write.
  if (onSocketThread() || queue_.isCurrent()) {
    return;
  }
  log_.debug("{}: peer does not read ({} bytes waiting); the writer waits", description(), outboxBytes_);
  ++drainWaiters_;
  drained_.wait(lock, [this] { return writeClosed_ || outboxBytes_ < gResumeReadingAt.load(); });
  --drainWaiters_;
}

void SocketConnection::cork() {
  std::lock_guard lock(writeMutex_);
  corked_ = true;
}

void SocketConnection::uncork() {
  int err = 0;
  {
    std::lock_guard lock(writeMutex_);
    corked_ = false;
    // With a wait for the socket armed, onWritable drains the outbox.
    if (writeClosed_ || outbox_.empty() || writeArmed_) {
      return;
    }
    err = drainOutbox();
    if (err) {
      writeClosed_ = true;
    } else if (!outbox_.empty()) {
      armWritable();
    }
  }
  if (err) {
    writeFailed(err);
  }
}

int SocketConnection::drainOutbox() {
  std::size_t bytes = outboxBytes_;
  int err = 0;
  while (!outbox_.empty()) {
    iovec parts[kFramesPerWrite];
    std::size_t count = 0;
    std::size_t offered = 0;
    // A frame with descriptors starts a write of its own: they travel with
    // its first byte.
    for (auto it = outbox_.begin(); it != outbox_.end() && count < kFramesPerWrite; ++it, ++count) {
      if (count > 0 && !outboxDescriptors_[count].empty()) {
        break;
      }
      const std::size_t skip = count == 0 ? outboxOffset_ : 0;
      parts[count].iov_base = it->data() + skip;
      parts[count].iov_len = it->size() - skip;
      offered += it->size() - skip;
    }
    msghdr message{};
    message.msg_iov = parts;
    message.msg_iovlen = count;
    DescriptorControl control;
    attachDescriptors(message, control, outboxDescriptors_.front());
    const ssize_t n = ::sendmsg(fd_, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      break;
    }
    if (n <= 0) {
      err = n < 0 ? errno : EPIPE;
      break;
    }
    auto taken = static_cast<std::size_t>(n);
    bytes -= taken;
    outboxDescriptors_.front().clear();
    while (taken > 0) {
      const std::size_t left = outbox_.front().size() - outboxOffset_;
      if (taken < left) {
        outboxOffset_ += taken;
        break;
      }
      taken -= left;
      outbox_.pop_front();
      outboxDescriptors_.pop_front();
      outboxOffset_ = 0;
    }
    if (static_cast<std::size_t>(n) < offered) {
      break;  // the socket is full
    }
  }
  setOutboxBytes(bytes);
  if (outbox_.empty() && outboxWasLarge_) {
    std::deque<Data>().swap(outbox_);
    std::deque<std::vector<file::UniqueFd>>().swap(outboxDescriptors_);
    outboxWasLarge_ = false;
  }
  return err;
}

void SocketConnection::setOutboxBytes(std::size_t bytes) {
  auto& registry = QueueRegistry::get();
  if (bytes >= outboxBytes_) {
    registry.total += bytes - outboxBytes_;
  } else {
    registry.total -= outboxBytes_ - bytes;
  }
  if (outboxBytes_ == 0 && bytes > 0) {
    waitingSince_ = steadyNanos();
  } else if (bytes == 0) {
    waitingSince_ = 0;
  }
  if (bytes >= gPauseReadingAt.load()) {
    outboxWasLarge_ = true;
  }
  outboxBytes_ = bytes;
  queued_ = bytes;
  if (drainWaiters_ > 0 && bytes < gResumeReadingAt.load()) {
    drained_.notify_all();
  }
}

void SocketConnection::closeOverGlobalLimit(std::size_t total, std::size_t limit) {
  if (!invalidated_) {
    log_.error(
        "{}: closing connection: replies waiting for all connections ({} bytes) exceed the limit of {}; this peer "
        "reads slowest ({} bytes waiting)",
        description(), total, limit, queued_.load());
  }
  beginInvalidation();
}

// Called with writeMutex_ held.
void SocketConnection::armWritable() {
  if (writeArmed_) {
    return;
  }
  writeArmed_ = true;
  queue_.async([self = std::static_pointer_cast<SocketConnection>(shared_from_this())] {
    if (self->invalidated_) {
      return;
    }
    self->socket_.async_wait(asio::socket_base::wait_write,
                             [self](const std::error_code& ec) { self->onWritable(ec); });
  });
}

void SocketConnection::onWritable(const std::error_code& ec) {
  int err = 0;
  bool readOn = false;
  {
    std::lock_guard lock(writeMutex_);
    writeArmed_ = false;
    if (ec || writeClosed_) {
      return;
    }
    err = drainOutbox();
    if (err) {
      writeClosed_ = true;
    } else {
      if (!outbox_.empty()) {
        armWritable();
      }
      readOn = mayReadOn();
    }
  }
  if (err) {
    writeFailed(err);
    return;
  }
  if (readOn) {
    readOnLater();
  }
  QueueRegistry::get().giveBackIfDrained(log_);
}

// Called with writeMutex_ held: ends a pause once the peer has caught up.
bool SocketConnection::mayReadOn() {
  if (!readPaused_ || writeClosed_ || (!clientEnd_ && outboxBytes_ >= gResumeReadingAt.load()) ||
      callsInFlight_.load() >= std::max<std::size_t>(gCallsInFlight.load() / 2, 1)) {
    return false;
  }
  readPaused_ = false;
  readPausedFlag_ = false;
  return true;
}

void SocketConnection::readOnLater() {
  log_.debug("{}: peer caught up; reading resumed", description());
  queue_.async([self = std::static_pointer_cast<SocketConnection>(shared_from_this())] {
    if (!self->invalidated_) {
      self->continueReading();
    }
  });
}

void SocketConnection::callTaken() { ++callsInFlight_; }

void SocketConnection::callAnswered() {
  --callsInFlight_;
  if (!readPausedFlag_.load()) {
    return;
  }
  bool readOn = false;
  {
    std::lock_guard lock(writeMutex_);
    readOn = mayReadOn();
  }
  if (readOn) {
    readOnLater();
  }
}

void SocketConnection::writeFailed(int err) {
  if (err == EPIPE || err == ECONNRESET) {
    log_.debug("{}: peer went away while writing", description());
  } else {
    log_.error("{}: closing connection: write failed: {}", description(), errnoText(err));
  }
  beginInvalidation();
}

}  // namespace zerith::ipc
