#pragma once

// The client's side of the reply direction: incoming
// "sendMessageToClient:timestamp:category:type:payload:" calls, type-checked,
// handed to a ClientSessionReplyInterface. Unknown operations and wrong
// argument types are logged and, when a reply was asked for, refused with an
// error reply.

#include <memory>

#include "ipc/ClientSessionInterface.h"
#include "ipc/Connection.h"
#include "platform/Log.h"

namespace zerith::ipc {

class ClientSessionReplyExporter final : public ExportedObject {
 public:
  explicit ClientSessionReplyExporter(std::shared_ptr<ClientSessionReplyInterface> target);

  void handleMessage(const Message& message, std::shared_ptr<Reply> reply) override;

 private:
  std::shared_ptr<ClientSessionReplyInterface> target_;
  log::Logger log_{"ipc"};
};

}  // namespace zerith::ipc
