#include "ipc/ClientSessionReplyExporter.h"

#include "ipc/ClientSessionWire.h"

namespace zerith::ipc {

ClientSessionReplyExporter::ClientSessionReplyExporter(std::shared_ptr<ClientSessionReplyInterface> target)
    : target_(std::move(target)) {}

void ClientSessionReplyExporter::handleMessage(const Message& message, std::shared_ptr<Reply> reply) {
  const wire::OperationSpec* op = wire::replyOperation(message.operation);
  if (!op) {
    const Error error = wire::unknownOperationError(message.operation);
    log_.error("ClientSessionReplyExporter: {}", error.description);
    if (message.call) {
      reply->fail(error);
    }
    return;
  }
  if (auto why = wire::checkArguments(*op, message.args)) {
    log_.error("ClientSessionReplyExporter: {}", *why);
    if (message.call) {
      reply->fail(wire::argumentError(std::move(*why)));
    }
    return;
  }
  const Dictionary& a = message.args;
  if (target_) {
    target_->sendMessageToClient(a.get("message"), a.get("timestamp").doubleValue(),
                                 static_cast<std::uint16_t>(a.get("category").intValue()),
                                 static_cast<std::uint16_t>(a.get("type").intValue()), a.get("payload"));
  }
  if (message.call) {
    reply->send(Dictionary());
  }
}

}  // namespace zerith::ipc
