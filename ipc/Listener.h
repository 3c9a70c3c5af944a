#pragma once

// The service listener: a Unix-domain stream socket named after the service
// ("com.velmar.zerithd" -> <runtime folder>/com.velmar.zerithd), created by
// the daemon or handed over by systemd socket activation.

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
  virtual void resume() = 0;
  // Stops accepting; existing connections go on.
  virtual void stop() = 0;
};

}  // namespace zerith::ipc
