#pragma once

// What the connection's source files share: the queue limits in force, the
// registry of every connection and small helpers. Internal to the
// connection, not part of its interface.

#if defined(__GLIBC__)
#include <malloc.h>
#endif

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <limits>
#include <memory>
#include <mutex>
#include <string>
#include <system_error>
#include <vector>

#include "ipc/SocketConnection.h"
#include "platform/Log.h"

namespace zerith::ipc {

namespace socket_detail {

inline std::string errnoText(int err) { return std::error_code(err, std::generic_category()).message(); }

inline std::atomic<std::size_t> gPauseReadingAt{QueueLimits{}.pauseReadingAt};
inline std::atomic<std::size_t> gResumeReadingAt{QueueLimits{}.resumeReadingAt};
inline std::atomic<std::size_t> gPerConnection{QueueLimits{}.perConnection};
inline std::atomic<std::size_t> gAllConnections{QueueLimits{}.allConnections};
inline std::atomic<std::size_t> gCallsInFlight{QueueLimits{}.callsInFlight};

}  // namespace socket_detail

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
      const std::size_t limit = socket_detail::gAllConnections.load();
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
    if (!giveBackArmed.load() || total.load() >= socket_detail::gResumeReadingAt.load() ||
        !giveBackArmed.exchange(false)) {
      return;
    }
#if defined(__GLIBC__)
    ::malloc_trim(0);
#endif
    log.debug("Replies that waited for slow readers are gone; memory given back ({} bytes still waiting)",
              total.load());
  }
};


}  // namespace zerith::ipc
