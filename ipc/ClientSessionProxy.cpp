#include "ipc/ClientSessionProxy.h"

#include "ipc/ClientSessionWire.h"
#include "ipc/ClientUploadFile.h"

namespace zerith::ipc {

using namespace wire;

ClientSessionProxy::ClientSessionProxy(std::shared_ptr<Connection> connection) : connection_(std::move(connection)) {}

void ClientSessionProxy::invoke(const char* operation, Dictionary args, Connection::ReplyHandler handler) {
  connection_->call(operation, std::move(args), std::move(handler));
}

void ClientSessionProxy::callValue(const std::string& operation, Dictionary args, const char* key, ValueCompletion completion) {
  if (!completion) {
    connection_->send(operation, std::move(args));
    return;
  }
  connection_->call(operation, std::move(args),
                    [key, completion = std::move(completion)](std::optional<Dictionary> reply, std::optional<Error>) {
                      completion(reply ? reply->get(key) : Value());
                    });
}

void ClientSessionProxy::setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                                        bool hasAggregationBlock) {
  connection_->send(kSetSessionInfo, setSessionInfoArgs(sessionInfo, userInfo, frameworksToCheck, hasAggregationBlock));
}

void ClientSessionProxy::startConfigWithCompletionHandler(ValueCompletion completion) {
  callValue(kStartConfig, Dictionary(), kBackends, std::move(completion));
}

void ClientSessionProxy::fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completionHandler) {
  callValue(kFetchStates, fetchStatesArgs(userInfo), kBackends, std::move(completionHandler));
}

void ClientSessionProxy::fetchDisplayURL(ValueCompletion completion) {
  callValue(kFetchDisplayURL, Dictionary(), kURL, std::move(completion));
}

void ClientSessionProxy::sendMessageWithDictionary(const Value& message, ValueCompletion reply) {
  // The name made once: an event is the call a client makes most.
  static const std::string operation(kSendMessage);
  callValue(operation, sendMessageArgs(message), kResult, std::move(reply));
}

void ClientSessionProxy::flushMessagesWithCompletion(ValueErrorCompletion completion) {
  if (!completion) {
    connection_->send(kFlushMessages, Dictionary());
    return;
  }
  connection_->call(kFlushMessages, Dictionary(),
                    [completion = std::move(completion)](std::optional<Dictionary> reply, std::optional<Error> error) {
                      if (!reply) {
                        completion(Value(), std::move(error));
                      } else {
                        completion(reply->get(kResult), errorArgument(*reply));
                      }
                    });
}

void ClientSessionProxy::finishSessionGracefully() { connection_->send(kFinishSession, Dictionary()); }

void ClientSessionProxy::uploadFileAtPath(const Value& fileURL, const Value& /*extensionToken*/,
                                          BoolCompletion completionHandler) {
  // The token is the descriptor of the file, opened here with the client's
  // own rights.
  callUploadFile(*connection_, fileURL,
                 [completion = std::move(completionHandler)](std::optional<Dictionary> reply, std::optional<Error>) {
                   if (completion) {
                     completion(reply && reply->get(kSuccess).boolValue());
                   }
                 });
}

void ClientSessionProxy::uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) {
  if (!completionHandler) {
    connection_->send(kUploadLogData, uploadLogDataArgs(logData));
    return;
  }
  connection_->call(kUploadLogData, uploadLogDataArgs(logData),
                    [completion = std::move(completionHandler)](std::optional<Dictionary> reply, std::optional<Error> error) {
                      if (!reply) {
                        completion(false, std::move(error));
                      } else {
                        completion(reply->get(kSuccess).boolValue(), errorArgument(*reply));
                      }
                    });
}

void ClientSessionProxy::sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo,
                                                    std::uint16_t category, std::uint16_t type, const Value& payload,
                                                    ValueCompletion reply) {
  callValue(kSendMessageWithSessionInfo, sendMessageWithSessionInfoArgs(sessionInfo, userInfo, category, type, payload),
            kResult, std::move(reply));
}

void ClientSessionProxy::updateSharedDataWithDictionary(const Value& dictionary) {
  connection_->send(kUpdateSharedData, updateSharedDataArgs(dictionary));
}

void ClientSessionProxy::updateSharedDataForKey(const Value& key, const Value& value) {
  connection_->send(kUpdateSharedDataForKey, updateSharedDataForKeyArgs(key, value));
}

void ClientSessionProxy::setDigestKey(const Value& digestKey, std::int32_t algorithm) {
  connection_->send(kSetDigestKey, setDigestKeyArgs(digestKey, algorithm));
}

}  // namespace zerith::ipc
