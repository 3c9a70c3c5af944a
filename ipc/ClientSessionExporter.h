#pragma once

// The daemon's side of the client interface: turns incoming calls into
// ClientSessionInterface calls on a session, after checking every argument's
// type, and sends the completions back as replies.
//
// An unknown operation or an argument of the wrong type is logged at error
// level (rate-limited per uid: badCallLog()) and, when the caller asked for a reply, answered with an error reply
// (kZerithErrorDomain, code -1); the session is not called and the
// connection goes on. A completion is passed to the session only when the
// caller asked for a reply (otherwise the session gets an empty one, which
// it may skip). Operations without a completion answer an empty reply once
// the session has taken the call, when one was asked for.

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>

#include "ipc/ClientSessionInterface.h"
#include "ipc/Connection.h"
#include "platform/Log.h"

namespace zerith::ipc {

class ClientSessionExporter final : public ExportedObject {
 public:
  // `peer` names the connection in log lines (Connection::description());
  // `peerUid` is whose bad calls the error lines count (badCallLog()).
  explicit ClientSessionExporter(std::shared_ptr<ClientSessionInterface> session, std::string peer = {},
                                 uid_t peerUid = 0);

  void handleMessage(const Message& message, std::shared_ptr<Reply> reply) override;
  // The calls that only read or record the session's state: the display
  // URL, an event's dispatch to the backends, session info and shared data.
  // Configuration (which may fetch the storebag), flushes and uploads may
  // wait for the network.
  bool answersWithoutWaiting(const Message& message) const override;

  // Answers the daemon's status call (kFetchDaemonStatus in DaemonStatus.h):
  // the handler completes with the status, or nil and the error that
  // refused it. Without a handler the call is an unknown operation.
  using StatusHandler = std::function<void(ClientSessionInterface::ValueErrorCompletion)>;
  void setStatusHandler(StatusHandler handler) { statusHandler_ = std::move(handler); }

  const std::shared_ptr<ClientSessionInterface>& session() const { return session_; }

 private:
  std::shared_ptr<ClientSessionInterface> session_;
  std::string peer_;
  uid_t peerUid_ = 0;
  StatusHandler statusHandler_;
};

}  // namespace zerith::ipc
