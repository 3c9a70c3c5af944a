#pragma once

// The service listener: a Unix-domain stream socket named after the service
// ("com.velmar.zerithd" -> <runtime folder>/com.velmar.zerithd), created by
// the daemon or handed over by systemd socket activation.

#include <sys/resource.h>

#include <cstddef>
#include <filesystem>
#include <memory>

#include "ipc/Connection.h"

namespace zerith::ipc {

class Listener;

class ListenerDelegate {
 public:
  virtual ~ListenerDelegate() = default;
  // Called for every new connection before it delivers anything. Return
  // false to refuse (the connection is closed). On true the delegate has
  // set up the connection and resumed it.
  virtual bool shouldAcceptNewConnection(Listener& listener, std::shared_ptr<Connection> connection) = 0;
};

class EntitlementPolicy;

// Connections the listener keeps open at once. At `total` it stops accepting
// (new clients wait in the socket's backlog, or their connect fails once the
// backlog is full) until a connection closes; a uid at `perUid` has its
// further connections closed at once. Both stay below the descriptor limit,
// so that the daemon keeps descriptors for its files and servers.
struct ConnectionLimits {
  std::size_t total = 0;
  std::size_t perUid = 0;

  // From the process's descriptor limit: an eighth of it (at least 64) is
  // kept for everything but clients, and one uid may hold a quarter of the
  // rest.
  static ConnectionLimits forDescriptorLimit(rlim_t descriptors);
  // The limits of this process (RLIMIT_NOFILE's soft limit), with the
  // defaults keys "maxConnections" and "maxConnectionsPerUser" of
  // `defaultsDomain` taking their place when set (positive integers; never
  // above what the descriptors allow).
  static ConnectionLimits forThisProcess(const std::string& defaultsDomain);
};

class Listener {
 public:
  virtual ~Listener() = default;

  // Listens on `socketPath` (an inherited systemd socket when one was passed
  // in, otherwise a new socket at that path). The policy supplies each
  // peer's entitlements at accept time. nullptr (logged) when the socket
  // cannot be set up.
  static std::unique_ptr<Listener> create(const std::filesystem::path& socketPath,
                                          std::shared_ptr<const EntitlementPolicy> policy);

  virtual void setDelegate(ListenerDelegate* delegate) = 0;
  // Before resume(); without a call the limits are those of
  // ConnectionLimits::forDescriptorLimit for the process's descriptor limit.
  // A listener that takes no connections of its own (a test's) ignores it.
  virtual void setConnectionLimits(const ConnectionLimits& /*limits*/) {}
  // Connections open now (accepted and not yet closed).
  virtual std::size_t openConnections() const { return 0; }
  virtual void resume() = 0;
  // Stops accepting; existing connections go on.
  virtual void stop() = 0;
};

}  // namespace zerith::ipc
