#include "ipc/SocketConnection.h"
#include "ipc/SocketConnectionHelpers.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>

#include "platform/Executors.h"

namespace zerith::ipc {

// The queue limits in force and the helpers the connection's files share.
using namespace socket_detail;

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

// ---- calls on the peer --------------------------------------------------------

Error SocketConnection::goneError() { return Error{kErrorDomain, -1, "The connection was invalidated"}; }

void SocketConnection::send(const std::string& operation, Dictionary args) {
  writeCall(operation, std::nullopt, args);
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

namespace {

// The calling thread's wake-up for the replies it waits for: an eventfd,
// shared with the reply handlers that hold it, so that a reply arriving
// after its caller gave up never writes to a descriptor number the thread
// has given back. Null when the process has no descriptor left.
std::shared_ptr<const file::UniqueFd> callerWakeFd() {
  thread_local std::shared_ptr<const file::UniqueFd> wake;
  if (!wake) {
    file::UniqueFd fd(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (fd) {
      wake = std::make_shared<const file::UniqueFd>(std::move(fd));
    }
  }
  return wake;
}

}  // namespace

SocketConnection::WaitedReply SocketConnection::callAndWait(const std::string& operation, Dictionary args,
                                                            std::chrono::milliseconds timeout,
                                                            std::vector<file::UniqueFd> descriptors) {
  struct Waiter {
    std::mutex mutex;
    std::condition_variable done;
    bool arrived = false;
    WaitedReply reply;
    std::shared_ptr<const file::UniqueFd> wake;
  };
  auto waiter = std::make_shared<Waiter>();
  waiter->wake = callerWakeFd();
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
        if (waiter->wake) {
          const std::uint64_t one = 1;
          [[maybe_unused]] const ssize_t n = ::write(waiter->wake->get(), &one, sizeof(one));
        } else {
          waiter->done.notify_one();
        }
      },
      true, std::move(descriptors));
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  WaitedReply late;
  late.timedOut = true;
  auto answered = [&]() -> std::optional<WaitedReply> {
    std::lock_guard lock(waiter->mutex);
    if (waiter->arrived) {
      return std::move(waiter->reply);
    }
    return std::nullopt;
  };
  if (!waiter->wake) {
    std::unique_lock lock(waiter->mutex);
    if (!waiter->done.wait_until(lock, deadline, [&] { return waiter->arrived; })) {
      return late;
    }
    return std::move(waiter->reply);
  }
  // The reply wakes this thread through its eventfd, or through the socket
  // when this thread reads it. A thread of the connection's own queue or a
  // socket thread only waits: they are what reads otherwise.
  bool watchSocket = clientEnd_ && !onSocketThread() && !queue_.isCurrent();
  for (;;) {
    if (auto reply = answered()) {
      return std::move(*reply);
    }
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) {
      return late;
    }
    pollfd watched[2] = {{waiter->wake->get(), POLLIN, 0}, {fd_, POLLIN, 0}};
    const int ready = ::poll(watched, watchSocket ? 2 : 1, static_cast<int>(std::min<std::int64_t>(left.count(), 60'000)));
    if (ready < 0 && errno != EINTR) {
      // Not expected of poll with valid descriptors; the socket threads still
      // read, and the wake-up still comes, so wait for that alone.
      watchSocket = false;
      continue;
    }
    if ((watched[0].revents & POLLIN) != 0) {
      std::uint64_t count = 0;
      [[maybe_unused]] const ssize_t n = ::read(waiter->wake->get(), &count, sizeof(count));
    }
    if (watchSocket && watched[1].revents != 0 && !readForCaller()) {
      // Another thread reads (or reading is held back): its delivery of
      // the reply writes the wake-up; polling the socket on would only spin.
      watchSocket = false;
    }
  }
}

void SocketConnection::failCall(std::uint64_t call, Error error) {
  std::optional<PendingCall> pending;
  {
    std::lock_guard lock(callsMutex_);
    if (const auto it = pending_.find(call); it != pending_.end()) {
      pending = std::move(it->second);
      pending_.erase(it);
    }
  }
  if (pending) {
    queue_.async([handler = std::move(pending->handler), error = std::move(error)] { handler(std::nullopt, error); });
  }
}

void SocketConnection::startCall(std::string_view operation, Dictionary args, ReplyHandler handler,
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
  writeCall(operation, number, args, std::move(descriptors));
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
