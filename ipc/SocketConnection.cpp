#include "ipc/SocketConnection.h"

#include <sys/socket.h>
#include <sys/uio.h>
#include <sys/un.h>

#if defined(__GLIBC__)
#include <malloc.h>
#endif

#include <algorithm>
#include <asio/error.hpp>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <limits>

#include "platform/Executors.h"

namespace zerith::ipc {

namespace {

constexpr std::size_t kReadChunk = 64u << 10;
// Frames handed to the kernel in one sendmsg.
constexpr std::size_t kFramesPerWrite = 64;

std::string errnoText(int err) { return std::error_code(err, std::generic_category()).message(); }

std::int64_t steadyNanos() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

std::atomic<std::size_t> gPauseReadingAt{QueueLimits{}.pauseReadingAt};
std::atomic<std::size_t> gResumeReadingAt{QueueLimits{}.resumeReadingAt};
std::atomic<std::size_t> gPerConnection{QueueLimits{}.perConnection};
std::atomic<std::size_t> gAllConnections{QueueLimits{}.allConnections};
std::atomic<std::size_t> gCallsInFlight{QueueLimits{}.callsInFlight};

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

// Every connection of the process, for the limit on the bytes their outboxes
// hold together.
struct QueueRegistry {
  std::mutex mutex;
  std::vector<SocketConnection*> connections;
  std::atomic<std::size_t> total{0};
  // Bytes the read sides hold for frames not complete yet; they count
  // against the same limit as the outboxes.
  std::atomic<std::size_t> input{0};
  // Set once bytes have waited for a peer that did not read; the memory they
  // took is given back when the outboxes have drained again.
  std::atomic<bool> giveBackArmed{false};
  std::mutex enforcing;  // one closer at a time

  static QueueRegistry& get() {
    static auto* registry = new QueueRegistry();  // never destroyed: connections may outlive statics
    return *registry;
  }

  void add(SocketConnection* c) {
    std::lock_guard lock(mutex);
    connections.push_back(c);
  }
  void remove(SocketConnection* c) {
    std::lock_guard lock(mutex);
    connections.erase(std::remove(connections.begin(), connections.end(), c), connections.end());
  }

  // Closes the slowest readers until the total is back under the limit. The
  // slowest is the connection whose outbox has been waiting the longest
  // (never emptied since); of equals the one holding more.
  void enforce() {
    std::lock_guard one(enforcing);
    std::vector<const SocketConnection*> closed;
    for (;;) {
      const std::size_t limit = gAllConnections.load();
      const std::size_t now = total.load();
      if (now <= limit) {
        return;
      }
      std::vector<std::shared_ptr<Connection>> keep;  // released after the registry's lock
      std::shared_ptr<SocketConnection> victim;
      {
        std::lock_guard lock(mutex);
        std::int64_t oldest = std::numeric_limits<std::int64_t>::max();
        std::size_t most = 0;
        for (SocketConnection* c : connections) {
          const std::int64_t since = c->waitingSince_.load();
          const std::size_t bytes = c->queued_.load();
          if (since == 0 || bytes == 0 || since > oldest || (since == oldest && bytes <= most) ||
              std::find(closed.begin(), closed.end(), c) != closed.end()) {
            continue;
          }
          auto alive = c->weak_from_this().lock();
          if (!alive) {
            continue;  // being destroyed; its bytes go with it
          }
          keep.push_back(alive);
          victim = std::static_pointer_cast<SocketConnection>(alive);
          oldest = since;
          most = bytes;
        }
      }
      if (!victim) {
        return;
      }
      closed.push_back(victim.get());
      victim->closeOverGlobalLimit(now, limit);
    }
  }

  // After the outboxes have drained: returns the memory a flood took.
  void giveBackIfDrained(const log::Logger& log) {
    if (!giveBackArmed.load() || total.load() >= gResumeReadingAt.load() || !giveBackArmed.exchange(false)) {
      return;
    }
#if defined(__GLIBC__)
    ::malloc_trim(0);
#endif
    log.debug("Replies that waited for slow readers are gone; memory given back ({} bytes still waiting)",
              total.load());
  }
};

log::RateLimitedLog& badCallLog() {
  static auto* log = new log::RateLimitedLog("ipc", log::Level::Error, std::chrono::seconds(10));  // used until exit
  return *log;
}

QueueLimits queueLimits() {
  return QueueLimits{gPauseReadingAt.load(), gResumeReadingAt.load(), gPerConnection.load(), gAllConnections.load(),
                     gCallsInFlight.load()};
}

void setQueueLimits(const QueueLimits& limits) {
  gPauseReadingAt = limits.pauseReadingAt;
  gResumeReadingAt = std::min(limits.resumeReadingAt, limits.pauseReadingAt);
  gPerConnection = limits.perConnection;
  gAllConnections = limits.allConnections;
  gCallsInFlight = std::max<std::size_t>(limits.callsInFlight, 1);
}

std::size_t queuedBytesOfAllConnections() { return QueueRegistry::get().total.load(); }

std::optional<PeerCredentials> readPeerCredentials(int fd, std::string* why) {
  ucred cred{};
  socklen_t len = sizeof(cred);
  if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 || len != sizeof(cred)) {
    if (why) {
      *why = "SO_PEERCRED: " + errnoText(errno);
    }
    return std::nullopt;
  }
  PeerCredentials peer;
  peer.pid = cred.pid;
  peer.uid = cred.uid;
  peer.gid = cred.gid;
  std::vector<gid_t> groups(16);
  for (int attempt = 0; attempt < 4; ++attempt) {
    socklen_t bytes = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &bytes) == 0) {
      groups.resize(bytes / sizeof(gid_t));
      peer.groups = std::move(groups);
      return peer;
    }
    if (errno != ERANGE) {
      break;
    }
    // The kernel says how much room the list needs.
    groups.resize(std::max<std::size_t>(bytes / sizeof(gid_t), groups.size() * 2));
  }
  if (why) {
    *why = "SO_PEERGROUPS: " + errnoText(errno);
  }
  return std::nullopt;
}

std::shared_ptr<SocketConnection> SocketConnection::adopt(file::UniqueFd fd, PeerCredentials peer,
                                                          Dictionary entitlements) {
  return std::make_shared<SocketConnection>(Private{}, std::move(fd), std::move(peer), std::move(entitlements));
}

std::shared_ptr<SocketConnection> SocketConnection::connect(const std::filesystem::path& path, Error* error) {
  auto fail = [&](std::string text) -> std::shared_ptr<SocketConnection> {
    if (error) {
      *error = Error{kErrorDomain, -1, std::move(text)};
    }
    return nullptr;
  };
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string p = path.string();
  if (p.empty() || p.size() >= sizeof(address.sun_path)) {
    return fail("Socket path \"" + p + "\" is empty or too long");
  }
  std::memcpy(address.sun_path, p.c_str(), p.size() + 1);
  file::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) {
    return fail("Cannot create a socket: " + errnoText(errno));
  }
  int rc;
  do {
    rc = ::connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address));
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    return fail("Cannot connect to " + p + ": " + errnoText(errno));
  }
  std::string why;
  auto peer = readPeerCredentials(fd.get(), &why);
  if (!peer) {
    return fail("Cannot identify the listener at " + p + ": " + why);
  }
  auto connection = adopt(std::move(fd), std::move(*peer), Dictionary());
  connection->clientEnd_ = true;
  return connection;
}

SocketConnection::SocketConnection(Private, file::UniqueFd fd, PeerCredentials peer, Dictionary entitlements)
    : queue_("com.velmar.zerith.connection"),
      fd_(fd.get()),
      peer_(std::move(peer)),
      entitlements_(std::move(entitlements)),
      socket_(socketContext()) {
  std::error_code ec;
  socket_.assign(asio::local::stream_protocol(), fd.get(), ec);
  if (ec) {
    // Only a descriptor that is not a socket gets here; it behaves as closed.
    log_.error("{}: cannot use the socket: {}", description(), ec.message());
    writeClosed_ = true;
    return;  // `fd` closes it
  }
  fd.release();
  socketOpen_ = true;
  QueueRegistry::get().add(this);
}

SocketConnection::~SocketConnection() {
  if (socketOpen_) {
    QueueRegistry::get().remove(this);
  }
  QueueRegistry::get().total -= queued_.load();
  QueueRegistry::get().input -= inputHeld_;
}

bool SocketConnection::readingPaused() const {
  std::lock_guard lock(writeMutex_);
  return readPaused_;
}

void SocketConnection::setExportedObject(std::shared_ptr<ExportedObject> object) {
  std::lock_guard lock(stateMutex_);
  if (!invalidated_) {
    exported_ = std::move(object);
  }
}

void SocketConnection::setInterruptionHandler(std::function<void()> handler) {
  std::lock_guard lock(stateMutex_);
  interruptionHandler_ = std::move(handler);
}

void SocketConnection::setInvalidationHandler(std::function<void()> handler) {
  std::lock_guard lock(stateMutex_);
  if (!invalidated_) {
    invalidationHandler_ = std::move(handler);
  }
}

void SocketConnection::resume() {
  if (resumed_.exchange(true) || invalidated_) {
    return;
  }
  queue_.async([self = std::static_pointer_cast<SocketConnection>(shared_from_this())] { self->startRead(); });
}

void SocketConnection::invalidate() { beginInvalidation(); }

void SocketConnection::holdUntilClosed(std::shared_ptr<void> token) {
  std::lock_guard lock(stateMutex_);
  if (!invalidated_) {
    closeToken_ = std::move(token);
  }
  // Otherwise `token` goes here: the connection has ended already.
}

Value SocketConnection::valueForEntitlement(const std::string& entitlement) const {
  return entitlements_.get(entitlement);
}

std::string SocketConnection::description() const {
  return "<connection pid=" + std::to_string(peer_.pid) + " uid=" + std::to_string(peer_.uid) +
         " fd=" + std::to_string(fd_) + ">";
}

// ---- reading (on the queue) ---------------------------------------------------

void SocketConnection::startRead() {
  if (invalidated_) {
    return;
  }
  // No buffer is held while the connection waits: the bytes are read when
  // they are there, into the reading thread's own buffer, and only an
  // unfinished frame stays with the connection (its decoder). They are read
  // by hand (recvmsg): a call may carry descriptors, which a plain read would
  // drop.
  socket_.async_wait(asio::socket_base::wait_read,
                     [self = std::static_pointer_cast<SocketConnection>(shared_from_this())](const std::error_code& ec) {
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
    if (invalidated_) {
      return;
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
        return;
      }
      readFailed(std::error_code(err, std::system_category()));
      return;
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
      return;
    }
    const auto size = static_cast<std::size_t>(n);
    if (!fds.empty()) {
      receivedDescriptors_.push_back(ReceivedDescriptors{bytesReceived_, bytesReceived_ + size, std::move(fds)});
    }
    bytesReceived_ += size;
    decoder_.append(chunk.data(), size);
    continueReading();
  };
  if (!queue_.runIfFree(handle)) {
    queue_.async([self = std::static_pointer_cast<SocketConnection>(shared_from_this()), handle] { handle(); });
  }
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
    if (onSocketThread()) {
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

bool SocketConnection::writeFrame(Data frame, std::vector<file::UniqueFd> descriptors) {
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
      err = sendSome(frame.data(), frame.size(), sent, &descriptors);
      if (!err && sent < frame.size()) {
        outboxOffset_ = sent;
        setOutboxBytes(frame.size() - sent);
        outbox_.push_back(std::move(frame));
        outboxDescriptors_.push_back(std::move(descriptors));
        armWritable();
      }
    } else {
      // Behind frames that wait for the socket, or gathered for the write at
      // the end of a delivery: either way it leaves after them.
      setOutboxBytes(outboxBytes_ + frame.size());
      outbox_.push_back(std::move(frame));
      outboxDescriptors_.push_back(std::move(descriptors));
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

// ---- calls on the peer --------------------------------------------------------

Error SocketConnection::goneError() { return Error{kErrorDomain, -1, "The connection was invalidated"}; }

void SocketConnection::send(const std::string& operation, Dictionary args) {
  writeFrame(encodeCall(operation, std::nullopt, args));
}

void SocketConnection::call(const std::string& operation, Dictionary args, ReplyHandler handler) {
  startCall(operation, std::move(args), std::move(handler), false);
}

void SocketConnection::call(const std::string& operation, Dictionary args, std::vector<file::UniqueFd> descriptors,
                            ReplyHandler handler) {
  if (descriptors.size() > kMaxDescriptorsPerFrame) {
    queue_.async([handler = std::move(handler)] {
      handler(std::nullopt, Error{kErrorDomain, -1, "Too many descriptors for one call"});
    });
    return;
  }
  startCall(operation, std::move(args), std::move(handler), false, std::move(descriptors));
}

SocketConnection::WaitedReply SocketConnection::callAndWait(const std::string& operation, Dictionary args,
                                                            std::chrono::milliseconds timeout,
                                                            std::vector<file::UniqueFd> descriptors) {
  struct Waiter {
    std::mutex mutex;
    std::condition_variable done;
    bool arrived = false;
    WaitedReply reply;
  };
  auto waiter = std::make_shared<Waiter>();
  startCall(
      operation, std::move(args),
      [waiter](std::optional<Dictionary> a, std::optional<Error> e) {
        {
          std::lock_guard lock(waiter->mutex);
          waiter->arrived = true;
          waiter->reply.args = std::move(a);
          waiter->reply.error = std::move(e);
        }
        // After the lock: the woken caller does not block on it again. The
        // handler's own reference keeps the waiter alive meanwhile.
        waiter->done.notify_one();
      },
      true, std::move(descriptors));
  std::unique_lock lock(waiter->mutex);
  if (!waiter->done.wait_for(lock, timeout, [&] { return waiter->arrived; })) {
    WaitedReply late;
    late.timedOut = true;
    return late;
  }
  return std::move(waiter->reply);
}

void SocketConnection::startCall(const std::string& operation, Dictionary args, ReplyHandler handler,
                                 bool neverWaits, std::vector<file::UniqueFd> descriptors) {
  std::uint64_t number = 0;
  {
    std::lock_guard lock(callsMutex_);
    if (!callsClosed_) {
      number = nextCall_++;
      pending_.emplace(number, PendingCall{std::move(handler), neverWaits});
    }
  }
  if (number == 0) {
    queue_.async([handler = std::move(handler)] { handler(std::nullopt, goneError()); });
    return;
  }
  // A failed write invalidates the connection, which fails the call.
  const auto claimed = static_cast<std::uint32_t>(descriptors.size());
  writeFrame(encodeCall(operation, number, args, claimed), std::move(descriptors));
}

// ---- connections that pass no descriptors -------------------------------------------

void Connection::call(const std::string& operation, Dictionary args, std::vector<file::UniqueFd> descriptors,
                      ReplyHandler handler) {
  (void)operation;
  (void)args;
  descriptors.clear();
  handler(std::nullopt, Error{kErrorDomain, -1, "This connection cannot pass descriptors"});
}

// ---- invalidation ---------------------------------------------------------------

void SocketConnection::beginInvalidation() {
  if (invalidated_.exchange(true)) {
    return;
  }
  {
    std::lock_guard lock(writeMutex_);
    writeClosed_ = true;
    readPaused_ = false;
    readPausedFlag_ = false;
    setOutboxBytes(0);
    std::deque<Data>().swap(outbox_);
    std::deque<std::vector<file::UniqueFd>>().swap(outboxDescriptors_);
    drained_.notify_all();  // writers waiting for room return
    // Wakes the outstanding read; the descriptor itself is closed on the
    // queue, where every other socket operation starts.
    if (socketOpen_) {
      ::shutdown(fd_, SHUT_RDWR);
    }
  }
  QueueRegistry::get().giveBackIfDrained(log_);
  queue_.async([self = std::static_pointer_cast<SocketConnection>(shared_from_this())] { self->finishInvalidation(); });
}

void SocketConnection::finishInvalidation() {
  std::error_code ignored;
  socket_.close(ignored);
  releaseInput();
  std::unordered_map<std::uint64_t, PendingCall> pending;
  {
    std::lock_guard lock(callsMutex_);
    callsClosed_ = true;
    pending.swap(pending_);
  }
  for (auto& [number, call] : pending) {
    call.handler(std::nullopt, goneError());
  }
  std::function<void()> handler;
  std::shared_ptr<ExportedObject> exported;
  std::shared_ptr<void> token;  // given back after the handler, with the descriptor closed
  {
    std::lock_guard lock(stateMutex_);
    handler = std::move(invalidationHandler_);
    invalidationHandler_ = nullptr;
    token = std::move(closeToken_);
    interruptionHandler_ = nullptr;
    exported = std::move(exported_);
    exported_ = nullptr;
  }
  if (handler) {
    handler();
  }
  // `exported` (and whatever it holds) goes here, after the handler.
}

}  // namespace zerith::ipc
