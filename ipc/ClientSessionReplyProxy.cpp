#include "ipc/ClientSessionReplyProxy.h"

#include "ipc/ClientSessionWire.h"

namespace zerith::ipc {

ClientSessionReplyProxy::ClientSessionReplyProxy(std::weak_ptr<Connection> connection)
    : connection_(std::move(connection)) {}

void ClientSessionReplyProxy::sendMessageToClient(const Value& message, double timestamp, std::uint16_t category,
                                                  std::uint16_t type, const Value& payload) {
  if (auto c = connection_.lock()) {
    c->send(wire::kSendMessageToClient, wire::sendMessageToClientArgs(message, timestamp, category, type, payload));
  }
}

}  // namespace zerith::ipc
