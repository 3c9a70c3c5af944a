#include "ipc/Listener.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>

#include <asio/local/stream_protocol.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <unordered_map>
#include <vector>

#if defined(__GLIBC__)
#include <malloc.h>
#endif

#include "ipc/EntitlementPolicy.h"
#include "ipc/SocketConnection.h"
#include "platform/Defaults.h"
#include "platform/DefaultsKeys.h"
#include "platform/Executors.h"
#include "platform/Log.h"
#include "platform/RateLimitedLog.h"
#include "platform/ThreadPools.h"

namespace zerith::ipc {

namespace {

constexpr int kAcceptsPerTurn = 64;
constexpr auto kAcceptRetryDelay = std::chrono::milliseconds(100);
// Refusals of one uid are logged at most once per interval, with a count.
constexpr auto kRefusalLogInterval = std::chrono::seconds(10);
// The key of the refusal log that stands for "the listener is full".
constexpr std::uint64_t kFullKey = std::uint64_t{1} << 40;
// Descriptors kept for the daemon's own files, spool and servers: an eighth
// of the limit, at least this many.
constexpr rlim_t kMinReservedDescriptors = 64;
// The most connections derived from an unlimited descriptor limit.
constexpr rlim_t kMaxDerivedConnections = 1u << 20;
// After this many connections were open at once, the memory they took is
// given back once most of them have closed.
constexpr std::size_t kTrimAfterPeak = 64;
constexpr std::chrono::seconds kTrimDelays[] = {std::chrono::seconds(1), std::chrono::seconds(5)};
// The fewest socket states reserved at once (see reserveSocketStates).
constexpr std::size_t kMinSocketStateBlock = 64;

std::string errnoText(int err) { return std::error_code(err, std::generic_category()).message(); }

bool fillAddress(const std::filesystem::path& path, sockaddr_un& address) {
  const std::string p = path.string();
  if (p.empty() || p.size() >= sizeof(address.sun_path)) {
    return false;
  }
  address = sockaddr_un{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, p.c_str(), p.size() + 1);
  return true;
}

// True when a process accepts connections at `address`.
bool someoneListens(const sockaddr_un& address) {
  file::UniqueFd probe(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  return probe && ::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0;
}

// The socket library keeps the state it allocates for every descriptor it
// watches and reuses it for the next one, never freeing it. Allocated one at a
// time as connections arrive, each state lands between a connection's other
// blocks, and after a burst has closed those 176-byte states keep the pages
// around them from going back to the system (10,000 connections left 44 MiB
// behind this way). Reserving them as a block, before a connection needs
// one, keeps them together: the library's pool is grown by `count` states
// allocated back to back and handed back at once. They are registered on one
// descriptor of /dev/null, which the poller refuses to watch, so the reserve
// costs a single descriptor however large it is.
void reserveSocketStates(std::size_t count) {
  const file::UniqueFd placeholder(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  if (!placeholder) {
    return;  // without one, states are allocated as connections come
  }
  // Each socket thread's context has a pool of its own, and connections are
  // spread over them in turn.
  const auto contexts = socketContexts();
  const std::size_t each = (count + contexts.size() - 1) / contexts.size();
  std::vector<asio::posix::stream_descriptor> held;
  held.reserve(each * contexts.size());
  for (asio::io_context* context : contexts) {
    for (std::size_t n = 0; n < each; ++n) {
      std::error_code ec;
      held.emplace_back(*context).assign(placeholder.get(), ec);
      if (ec) {
        held.pop_back();
        break;
      }
    }
  }
  for (auto& descriptor : held) {
    (void)descriptor.release();  // back to the pool; `placeholder` closes once
  }
}

class SocketListener final : public Listener {
 public:
  struct State : std::enable_shared_from_this<State> {
    State(file::UniqueFd listenFd, std::shared_ptr<const EntitlementPolicy> p)
        : fd(listenFd.get()), acceptor(ioContext()), policy(std::move(p)) {
      std::error_code ec;
      acceptor.assign(asio::local::stream_protocol(), listenFd.get(), ec);
      if (!ec) {
        listenFd.release();
      } else {
        log.error("Listener: cannot use the listening socket: {}", ec.message());
      }
    }

    log::Logger log{"ipc"};
    const int fd;
    SerialQueue queue{"com.velmar.zerithd.listener"};
    asio::local::stream_protocol::acceptor acceptor;  // used on `queue`
    std::shared_ptr<const EntitlementPolicy> policy;

    // Open connections, in all and per uid. Touched by the accept loop and
    // by connections ending (on their own queues).
    mutable std::mutex countMutex;
    ConnectionLimits limits = ConnectionLimits::forDescriptorLimit(descriptorLimit());
    std::size_t open = 0;
    std::size_t peak = 0;  // most open since memory was last given back
    std::size_t socketStatesReserved = 0;  // on `queue`
    std::unordered_map<uid_t, std::size_t> openPerUid;
    bool acceptPaused = false;
    log::RateLimitedLog refusals{"ipc", log::Level::Default, kRefusalLogInterval};

    static rlim_t descriptorLimit() {
      rlimit rl{};
      return ::getrlimit(RLIMIT_NOFILE, &rl) == 0 ? rl.rlim_cur : 1024;
    }

    std::recursive_mutex mutex;  // held while the delegate decides
    Listener* owner = nullptr;
    ListenerDelegate* delegate = nullptr;
    bool resumed = false;
    // Set under `mutex`; the accept loop on `queue` reads it without.
    std::atomic<bool> stopped{false};

    void arm() {
      if (stopped) {
        return;
      }
      acceptor.async_wait(asio::socket_base::wait_read, [self = shared_from_this()](const std::error_code& ec) {
        self->queue.async([self, ec] { self->acceptReady(ec); });
      });
    }

    void acceptReady(const std::error_code& ec) {
      if (stopped) {
        return;
      }
      if (ec) {
        log.error("Listener: waiting for connections failed: {}", ec.message());
        queue.after(kAcceptRetryDelay, [self = shared_from_this()] { self->arm(); });
        return;
      }
      for (int n = 0; n < kAcceptsPerTurn && !stopped; ++n) {
        if (pauseIfFull()) {
          return;  // a closing connection arms again
        }
        const int client = ::accept4(fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
        if (client >= 0) {
          admit(file::UniqueFd(client));
          continue;
        }
        const int err = errno;
        if (err == EAGAIN || err == EWOULDBLOCK) {
          break;
        }
        if (err == EINTR || err == ECONNABORTED || err == EPROTO) {
          continue;
        }
        // Out of descriptors or memory: try again a little later instead of
        // spinning on a socket that stays readable.
        log.error("Listener: accept failed: {}", errnoText(err));
        queue.after(kAcceptRetryDelay, [self = shared_from_this()] { self->arm(); });
        return;
      }
      arm();
    }

    void admit(file::UniqueFd client) {
      std::string why;
      auto peer = readPeerCredentials(client.get(), &why);
      if (!peer) {
        log.error("Listener: refusing a connection whose peer is unknown: {}", why);
        return;
      }
      auto slot = take(*peer);
      if (!slot) {
        return;  // `client` closes
      }
      std::size_t openNow = 0;
      {
        std::lock_guard lock(countMutex);
        openNow = open;
      }
      if (openNow > socketStatesReserved) {
        const std::size_t block = std::max(kMinSocketStateBlock, openNow / 2);
        reserveSocketStates(block);
        socketStatesReserved = openNow + block;
      }
      Dictionary entitlements = policy ? policy->entitlementsFor(*peer) : Dictionary();
      auto connection = SocketConnection::adopt(std::move(client), std::move(*peer), std::move(entitlements));
      connection->holdUntilClosed(std::move(slot));
      bool accepted = false;
      {
        std::lock_guard lock(mutex);
        if (!stopped && delegate) {
          accepted = delegate->shouldAcceptNewConnection(*owner, connection);
        }
      }
      if (!accepted) {
        connection->invalidate();
      }
    }

    void close() {
      std::error_code ignored;
      acceptor.close(ignored);
    }

    // On `queue`: at the limit, accepting stops (the socket's backlog holds
    // who comes next) instead of failing or spinning on a readable socket.
    bool pauseIfFull() {
      std::size_t openNow = 0;
      std::size_t limit = 0;
      {
        std::lock_guard lock(countMutex);
        if (open < limits.total) {
          return false;
        }
        acceptPaused = true;
        openNow = open;
        limit = limits.total;
      }
      refusals.log(kFullKey, "Listener: {} connections are open, the limit of {}; new clients wait until one closes",
                   openNow, limit);
      return true;
    }

    // A place for a connection of `peer`; empty (and the refusal logged) when
    // its uid holds as many as one uid may. The place is given back when the
    // returned token goes.
    std::shared_ptr<void> take(const PeerCredentials& peer) {
      std::size_t held = 0;
      std::size_t limit = 0;
      {
        std::lock_guard lock(countMutex);
        std::size_t& mine = openPerUid[peer.uid];
        if (mine < limits.perUid) {
          ++mine;
          ++open;
          peak = std::max(peak, open);
          struct Slot {
            Slot(std::weak_ptr<State> owner, uid_t peerUid) : state(std::move(owner)), uid(peerUid) {}
            Slot(const Slot&) = delete;
            Slot& operator=(const Slot&) = delete;
            std::weak_ptr<State> state;
            uid_t uid;
            ~Slot() {
              if (auto self = state.lock()) {
                self->release(uid);
              }
            }
          };
          return std::make_shared<Slot>(weak_from_this(), peer.uid);
        }
        held = mine;
        limit = limits.perUid;
      }
      refusals.log(peer.uid, "Listener: refusing a client (uid {}, gid {}, pid {} at connect): its user holds {} connections, the most one user may have ({})",
                   peer.uid, peer.gid, peer.pid, held, limit);
      return nullptr;
    }

    void release(uid_t uid) {
      bool resumeAccepting = false;
      bool giveBack = false;
      {
        std::lock_guard lock(countMutex);
        if (const auto it = openPerUid.find(uid); it != openPerUid.end() && --it->second == 0) {
          openPerUid.erase(it);
        }
        --open;
        if (acceptPaused && open < limits.total) {
          acceptPaused = false;
          resumeAccepting = true;
        }
        if (peak >= kTrimAfterPeak && open <= peak / 4) {
          peak = open;
          giveBack = true;
        }
      }
      if (resumeAccepting) {
        queue.async([self = shared_from_this()] { self->arm(); });
      }
      if (giveBack) {
        // A burst of connections has mostly closed: the allocator's free
        // pages (their sockets', buffers' and sessions' memory) go back to
        // the system, once the sessions behind them have been torn down.
        // Thousands of sessions can take longer than the first delay to go,
        // so a second trim follows for what they free late.
        for (const auto delay : kTrimDelays) {
          queue.after(delay, [] {
#if defined(__GLIBC__)
            ::malloc_trim(0);
#endif
          });
        }
      }
    }
  };

  SocketListener(std::shared_ptr<State> state, std::filesystem::path createdPath, ino_t createdInode)
      : state_(std::move(state)), createdPath_(std::move(createdPath)), createdInode_(createdInode) {
    state_->owner = this;
  }

  ~SocketListener() override { stop(); }

  void setDelegate(ListenerDelegate* delegate) override {
    std::lock_guard lock(state_->mutex);
    state_->delegate = delegate;
  }

  void setConnectionLimits(const ConnectionLimits& limits) override {
    std::lock_guard lock(state_->countMutex);
    state_->limits = ConnectionLimits{std::max<std::size_t>(limits.total, 1),
                                      std::clamp<std::size_t>(limits.perUid, 1, std::max<std::size_t>(limits.total, 1))};
  }

  std::size_t openConnections() const override {
    std::lock_guard lock(state_->countMutex);
    return state_->open;
  }

  void resume() override {
    std::lock_guard lock(state_->mutex);
    if (state_->resumed || state_->stopped) {
      return;
    }
    state_->resumed = true;
    state_->queue.async([state = state_] { state->arm(); });
  }

  void stop() override {
    {
      std::lock_guard lock(state_->mutex);
      if (state_->stopped) {
        return;
      }
      state_->stopped = true;
      state_->delegate = nullptr;
      state_->owner = nullptr;
    }
    if (state_->queue.isCurrent()) {
      state_->close();
    } else {
      state_->queue.async([state = state_] { state->close(); });
    }
    // Remove the socket file we made, unless another listener has replaced
    // it since.
    struct stat st {};
    if (!createdPath_.empty() && ::lstat(createdPath_.c_str(), &st) == 0 && st.st_ino == createdInode_) {
      ::unlink(createdPath_.c_str());
    }
  }

 private:
  std::shared_ptr<State> state_;
  std::filesystem::path createdPath_;
  ino_t createdInode_ = 0;
};

// The listening socket systemd passed in for `socketPath`, if any. With a
// relocated root the path differs from the unit's; a single passed Unix
// stream listener is then taken as ours.
file::UniqueFd activatedSocket(const std::filesystem::path& socketPath, const log::Logger& log) {
  const int n = sd_listen_fds(0);
  if (n <= 0) {
    return file::UniqueFd();
  }
  int chosen = -1;
  for (int fd = SD_LISTEN_FDS_START; fd < SD_LISTEN_FDS_START + n; ++fd) {
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, socketPath.c_str(), 0) > 0) {
      chosen = fd;
      break;
    }
  }
  if (chosen < 0 && n == 1 && sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, nullptr, 0) > 0) {
    chosen = SD_LISTEN_FDS_START;
  }
  if (chosen < 0) {
    log.error("Listener: the service manager passed {} sockets, none a Unix stream listener for {}", n,
              socketPath.string());
    return file::UniqueFd();
  }
  const int flags = ::fcntl(chosen, F_GETFL);
  ::fcntl(chosen, F_SETFL, flags | O_NONBLOCK);
  ::fcntl(chosen, F_SETFD, FD_CLOEXEC);
  log.info("Listener: using the socket passed by the service manager (fd {})", chosen);
  return file::UniqueFd(chosen);
}

}  // namespace

ConnectionLimits ConnectionLimits::forDescriptorLimit(rlim_t descriptors) {
  descriptors = std::min(descriptors, kMaxDerivedConnections);
  const rlim_t reserved = std::max(kMinReservedDescriptors, descriptors / 8);
  const std::size_t total = descriptors > reserved + 16 ? descriptors - reserved : 16;
  return ConnectionLimits{total, std::max<std::size_t>(total / 4, 1)};
}

ConnectionLimits ConnectionLimits::forThisProcess(const std::string& defaultsDomain) {
  rlimit rl{};
  const rlim_t descriptors = ::getrlimit(RLIMIT_NOFILE, &rl) == 0 ? rl.rlim_cur : 1024;
  ConnectionLimits limits = forDescriptorLimit(descriptors);
  const std::size_t most = descriptors > kMinReservedDescriptors ? descriptors - kMinReservedDescriptors : 16;
  const Defaults defaults(defaultsDomain);
  const auto key = [&](const DefaultsSetting& setting, std::size_t& value) {
    std::string problem;
    if (const auto n = defaultsNumber(setting, defaults.objectForKey(setting.key), &problem)) {
      value = std::min<std::size_t>(static_cast<std::size_t>(*n), most);
    } else if (!problem.empty()) {
      log::Logger("ipc").error("Listener: ignoring \"{}\": it {}", setting.key, problem);
    }
  };
  const std::size_t derivedTotal = limits.total;
  key(defaultsSetting("maxConnections"), limits.total);
  if (limits.total != derivedTotal) {
    limits.perUid = std::max<std::size_t>(limits.total / 4, 1);
  }
  key(defaultsSetting("maxConnectionsPerUser"), limits.perUid);
  limits.perUid = std::min(limits.perUid, limits.total);
  return limits;
}

std::unique_ptr<Listener> Listener::create(const std::filesystem::path& socketPath,
                                           std::shared_ptr<const EntitlementPolicy> policy) {
  const log::Logger log("ipc");
  if (auto fd = activatedSocket(socketPath, log)) {
    auto state = std::make_shared<SocketListener::State>(std::move(fd), std::move(policy));
    if (!state->acceptor.is_open()) {
      return nullptr;
    }
    return std::make_unique<SocketListener>(std::move(state), std::filesystem::path(), 0);
  }

  sockaddr_un address{};
  if (!fillAddress(socketPath, address)) {
    log.error("Listener: socket path \"{}\" is empty or longer than {} bytes", socketPath.string(),
              sizeof(address.sun_path) - 1);
    return nullptr;
  }
  std::error_code ec;
  std::filesystem::create_directories(socketPath.parent_path(), ec);
  if (ec) {
    log.error("Listener: cannot create {}: {}", socketPath.parent_path().string(), ec.message());
    return nullptr;
  }
  struct stat st {};
  if (::lstat(socketPath.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      log.error("Listener: {} exists and is not a socket", socketPath.string());
      return nullptr;
    }
    if (someoneListens(address)) {
      log.error("Listener: another process already listens on {}", socketPath.string());
      return nullptr;
    }
    ::unlink(socketPath.c_str());  // stale, left by a process that is gone
  }

  file::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd) {
    log.error("Listener: cannot create a socket: {}", errnoText(errno));
    return nullptr;
  }
  if (::bind(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
    log.error("Listener: cannot bind {}: {}", socketPath.string(), errnoText(errno));
    return nullptr;
  }
  // Everyone may connect; the entitlements policy decides who stays.
  if (::chmod(socketPath.c_str(), 0666) != 0 || ::listen(fd.get(), SOMAXCONN) != 0 ||
      ::lstat(socketPath.c_str(), &st) != 0) {
    log.error("Listener: cannot listen on {}: {}", socketPath.string(), errnoText(errno));
    ::unlink(socketPath.c_str());
    return nullptr;
  }
  auto state = std::make_shared<SocketListener::State>(std::move(fd), std::move(policy));
  if (!state->acceptor.is_open()) {
    ::unlink(socketPath.c_str());
    return nullptr;
  }
  return std::make_unique<SocketListener>(std::move(state), socketPath, st.st_ino);
}

}  // namespace zerith::ipc
