#include "ipc/ClientSessionExporter.h"

#include "ipc/ClientSessionWire.h"
#include "ipc/DaemonStatus.h"
#include "ipc/Frame.h"
#include "ipc/SocketConnection.h"

namespace zerith::ipc {

namespace {

using namespace wire;

Value valueOf(const std::optional<Error>& error) { return error ? error->toValue() : Value(); }

}  // namespace

ClientSessionExporter::ClientSessionExporter(std::shared_ptr<ClientSessionInterface> session, std::string peer,
                                             uid_t peerUid)
    : session_(std::move(session)), peer_(std::move(peer)), peerUid_(peerUid) {}

bool ClientSessionExporter::answersWithoutWaiting(const Message& message) const {
  const std::string& name = message.operation;
  return name == kFetchDisplayURL || name == kSendMessage || name == kSetSessionInfo || name == kUpdateSharedData ||
         name == kUpdateSharedDataForKey || name == kSetDigestKey;
}

void ClientSessionExporter::handleMessage(const Message& message, std::shared_ptr<Reply> reply) {
  const OperationSpec* op = sessionOperation(message.operation);
  const std::string from = peer_.empty() ? std::string() : " from " + peer_;
  if (statusHandler_ && message.operation == kFetchDaemonStatus) {
    // No arguments; the status is worked out whether or not it is read.
    statusHandler_([reply, wantsReply = message.call.has_value()](Value status, std::optional<Error> error) {
      if (wantsReply) {
        reply->send(Dictionary{{kStatusArgument, std::move(status)}, {kError, valueOf(error)}});
      }
    });
    return;
  }
  if (!op) {
    const Error error = unknownOperationError(message.operation);
    badCallLog().log(peerUid_, "ClientSessionExporter: {}{}", error.description, from);
    if (message.call) {
      reply->fail(error);
    }
    return;
  }
  if (auto why = checkArguments(*op, message.args)) {
    badCallLog().log(peerUid_, "ClientSessionExporter: {}{}", *why, from);
    if (message.call) {
      reply->fail(argumentError(std::move(*why)));
    }
    return;
  }
  if (!session_) {
    if (message.call) {
      reply->fail(Error{kErrorDomain, -1, "The session is gone"});
    }
    return;
  }

  const Dictionary& a = message.args;
  const bool wantsReply = message.call.has_value();
  const std::string name = op->name;
  // The completions, only when the caller will read them.
  auto value = [&](const char* key) -> ClientSessionInterface::ValueCompletion {
    if (!wantsReply) {
      return nullptr;
    }
    return [reply, key](Value v) { reply->send(Dictionary{{key, std::move(v)}}); };
  };
  auto valueError = [&]() -> ClientSessionInterface::ValueErrorCompletion {
    if (!wantsReply) {
      return nullptr;
    }
    return [reply](Value v, std::optional<Error> e) { reply->send(Dictionary{{kResult, std::move(v)}, {kError, valueOf(e)}}); };
  };
  auto booleanError = [&]() -> ClientSessionInterface::BoolErrorCompletion {
    if (!wantsReply) {
      return nullptr;
    }
    return [reply](bool ok, std::optional<Error> e) { reply->send(Dictionary{{kSuccess, ok}, {kError, valueOf(e)}}); };
  };
  auto u16 = [&](const char* key) { return static_cast<std::uint16_t>(a.get(key).intValue()); };

  ClientSessionInterface& s = *session_;
  if (name == kSetSessionInfo) {
    s.setSessionInfo(a.get("sessionInfo"), a.get("userInfo"), a.get("frameworksToCheck"),
                     a.get("hasAggregationBlock").boolValue());
  } else if (name == kStartConfig) {
    s.startConfigWithCompletionHandler(value(kBackends));
  } else if (name == kFetchStates) {
    s.fetchStatesWithUserInfo(a.get("userInfo"), value(kBackends));
  } else if (name == kFetchDisplayURL) {
    s.fetchDisplayURL(value(kURL));
  } else if (name == kSendMessage) {
    s.sendMessageWithDictionary(a.get("message"), value(kResult));
  } else if (name == kFlushMessages) {
    s.flushMessagesWithCompletion(valueError());
  } else if (name == kFinishSession) {
    s.finishSessionGracefully();
  } else if (name == kUploadFile) {
    // The extension token is the descriptor that came with the call.
    ClientSessionInterface::UploadCompletion uploaded;
    if (wantsReply) {
      uploaded = [reply](bool ok, bool remove) { reply->send(Dictionary{{kSuccess, ok}, {kRemoveFile, remove}}); };
    }
    s.uploadFileWithDescriptor(a.get("fileURL"), message.descriptors.empty() ? nullptr : message.descriptors.front(),
                               std::move(uploaded));
  } else if (name == kUploadLogData) {
    s.uploadLogData(a.get("logData"), booleanError());
  } else if (name == kSendMessageWithSessionInfo) {
    s.sendMessageWithSessionInfo(a.get("sessionInfo"), a.get("userInfo"), u16("category"), u16("type"), a.get("payload"),
                                 value(kResult));
  } else if (name == kUpdateSharedData) {
    s.updateSharedDataWithDictionary(a.get("dictionary"));
  } else if (name == kUpdateSharedDataForKey) {
    s.updateSharedDataForKey(a.get("key"), a.get("value"));
  } else if (name == kSetDigestKey) {
    s.setDigestKey(a.get("digestKey"), static_cast<std::int32_t>(a.get("algorithm").intValue()));
  }
  if (!op->hasCompletion && wantsReply) {
    reply->send(Dictionary());
  }
}

}  // namespace zerith::ipc
