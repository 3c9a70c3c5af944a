#pragma once

// The daemon's way to call its client: ClientSessionReplyInterface over the
// client's connection. Holds the connection weakly; once it is gone calls
// are dropped.

#include <memory>

#include "ipc/ClientSessionInterface.h"
#include "ipc/Connection.h"

namespace zerith::ipc {

class ClientSessionReplyProxy final : public ClientSessionReplyInterface {
 public:
  explicit ClientSessionReplyProxy(std::weak_ptr<Connection> connection);

  void sendMessageToClient(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                           const Value& payload) override;

 private:
  std::weak_ptr<Connection> connection_;
};

}  // namespace zerith::ipc
