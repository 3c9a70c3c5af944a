#pragma once

// The client's side of the client interface: ClientSessionInterface over a
// connection to the daemon. Operations without a completion, and operations
// called with an empty completion, are sent without asking for a reply.
//
// When a call fails (the connection went away, or the daemon refused the
// call) the completion still runs, on the connection's queue, with what a
// failure looks like for its shape: nil, false, or nil/false with the error.
// `invoke` gives callers that must tell a failed call from a nil answer the
// reply itself.

#include <memory>

#include "ipc/ClientSessionInterface.h"
#include "ipc/Connection.h"

namespace zerith::ipc {

class ClientSessionProxy final : public ClientSessionInterface {
 public:
  explicit ClientSessionProxy(std::shared_ptr<Connection> connection);

  void setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                      bool hasAggregationBlock) override;
  void startConfigWithCompletionHandler(ValueCompletion completion) override;
  void fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completionHandler) override;
  void fetchDisplayURL(ValueCompletion completion) override;
  void sendMessageWithDictionary(const Value& message, ValueCompletion reply) override;
  void flushMessagesWithCompletion(ValueErrorCompletion completion) override;
  void finishSessionGracefully() override;
  void uploadFileAtPath(const Value& fileURL, const Value& extensionToken, BoolCompletion completionHandler) override;
  void uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) override;
  void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                  std::uint16_t type, const Value& payload, ValueCompletion reply) override;
  void updateSharedDataWithDictionary(const Value& dictionary) override;
  void updateSharedDataForKey(const Value& key, const Value& value) override;
  void setDigestKey(const Value& digestKey, std::int32_t algorithm) override;

  // Calls `operation` and hands over the reply (arguments, or the error).
  void invoke(const char* operation, Dictionary args, Connection::ReplyHandler handler);

  const std::shared_ptr<Connection>& connection() const { return connection_; }

 private:
  void callValue(const std::string& operation, Dictionary args, const char* key, ValueCompletion completion);

  std::shared_ptr<Connection> connection_;
};

}  // namespace zerith::ipc
