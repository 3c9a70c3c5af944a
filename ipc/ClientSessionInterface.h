#pragma once

// The two interfaces of a reporting session, shared by the daemon (which
// carries out ClientSessionInterface and calls ClientSessionReplyInterface)
// and the client framework (which proxies the first and carries out the
// second). Operation names and argument names on the wire are the keyword
// names: "setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock:"
// with arguments "sessionInfo", "userInfo", "frameworksToCheck",
// "hasAggregationBlock".
//
// Arguments arrive already type-checked: a dictionary argument is a
// dictionary or nil, and so on (a wrong type is refused with an error reply
// before the implementation is called).

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "platform/Error.h"
#include "platform/FileUtil.h"
#include "platform/Value.h"

namespace zerith {

class ClientSessionInterface {
 public:
  virtual ~ClientSessionInterface() = default;

  using ValueCompletion = std::function<void(Value)>;
  using ValueErrorCompletion = std::function<void(Value, std::optional<Error>)>;
  using BoolCompletion = std::function<void(bool)>;
  using BoolErrorCompletion = std::function<void(bool, std::optional<Error>)>;

  virtual void setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                              bool hasAggregationBlock) = 0;
  // (array of backend names, or nil)
  virtual void startConfigWithCompletionHandler(ValueCompletion completion) = 0;
  virtual void fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completionHandler) = 0;
  // (string)
  virtual void fetchDisplayURL(ValueCompletion completion) = 0;
  // (string or nil)
  virtual void sendMessageWithDictionary(const Value& message, ValueCompletion reply) = 0;
  virtual void flushMessagesWithCompletion(ValueErrorCompletion completion) = 0;
  virtual void finishSessionGracefully() = 0;
  // fileURL: string (a file:// URL or a path); extensionToken: string or nil.
  // The client framework's proxy opens the file with the client's rights
  // and passes its descriptor with the call; the token string is not used.
  virtual void uploadFileAtPath(const Value& fileURL, const Value& extensionToken, BoolCompletion completionHandler) = 0;
  // The daemon's side of the same call: the descriptor that came with it
  // (nullptr when none did). `removeFile`: the server answered "success",
  // so the client framework deletes the file.
  using UploadCompletion = std::function<void(bool uploaded, bool removeFile)>;
  virtual void uploadFileWithDescriptor(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                        UploadCompletion completion) {
    (void)fileURL;
    (void)descriptor;
    if (completion) {
      completion(false, false);
    }
  }
  virtual void uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) = 0;
  virtual void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                          std::uint16_t type, const Value& payload, ValueCompletion reply) = 0;
  virtual void updateSharedDataWithDictionary(const Value& dictionary) = 0;
  virtual void updateSharedDataForKey(const Value& key, const Value& value) = 0;
  virtual void setDigestKey(const Value& digestKey, std::int32_t algorithm) = 0;
};

class ClientSessionReplyInterface {
 public:
  virtual ~ClientSessionReplyInterface() = default;
  virtual void sendMessageToClient(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                                   const Value& payload) = 0;
};

}  // namespace zerith
