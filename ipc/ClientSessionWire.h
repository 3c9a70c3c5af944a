#pragma once

// How ClientSessionInterface and ClientSessionReplyInterface travel over a
// Connection: operation names, argument names and types, and the names of
// the completion's arguments in a reply. Both ends use this one table.
//
// Operation names are the full keyword names; arguments are named after the
// interface's parameters. Completions answer in a reply whose arguments are
// named below ("backends", "url", "result", "success", "error"); an error a
// completion carries travels as {"domain", "code", "description"}.

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Value.h"

namespace zerith::ipc::wire {

// ClientSessionInterface
inline constexpr const char* kSetSessionInfo = "setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock:";
inline constexpr const char* kStartConfig = "startConfigWithCompletionHandler:";
inline constexpr const char* kFetchStates = "fetchStatesWithUserInfo:completionHandler:";
inline constexpr const char* kFetchDisplayURL = "fetchDisplayURL:";
inline constexpr const char* kSendMessage = "sendMessageWithDictionary:reply:";
inline constexpr const char* kFlushMessages = "flushMessagesWithCompletion:";
inline constexpr const char* kFinishSession = "finishSessionGracefully";
inline constexpr const char* kUploadFile = "uploadFileAtPath:extensionToken:completionHandler:";
inline constexpr const char* kUploadLogData = "uploadLogData:completionHandler:";
inline constexpr const char* kSendMessageWithSessionInfo = "sendMessageWithSessionInfo:userInfo:category:type:payload:reply:";
inline constexpr const char* kUpdateSharedData = "updateSharedDataWithDictionary:";
inline constexpr const char* kUpdateSharedDataForKey = "updateSharedDataForKey:value:";
inline constexpr const char* kSetDigestKey = "setDigestKey:algorithm:";
// ClientSessionReplyInterface
inline constexpr const char* kSendMessageToClient = "sendMessageToClient:timestamp:category:type:payload:";

// Completion arguments in replies.
inline constexpr const char* kBackends = "backends";  // array of strings, absent = nil
inline constexpr const char* kURL = "url";            // string
inline constexpr const char* kResult = "result";      // string, absent = nil
inline constexpr const char* kSuccess = "success";    // boolean
// In the reply to kUploadFile: true when the upload server answered
// "success"; the client framework then deletes the file, in the client's
// process (the daemon never touches it).
inline constexpr const char* kRemoveFile = "removeFile";  // boolean, absent = false
inline constexpr const char* kError = "error";        // error dictionary, absent = no error

enum class ArgType {
  Dictionary,  // dictionary or nil
  Array,       // array or nil
  String,      // string (required)
  OptString,   // string or nil
  OptData,     // data or nil
  Bool,        // boolean, nil = false
  UInt16,      // integer 0..65535 (required)
  Int32,       // integer in the signed 32-bit range (required)
  Number,      // integer or real (required)
  Any,         // anything, nil included
};

struct ArgSpec {
  const char* name;
  ArgType type;
};

struct OperationSpec {
  const char* name;
  std::span<const ArgSpec> args;
  bool hasCompletion;
};

// The operations of ClientSessionInterface (`sessionOperations`) and of
// ClientSessionReplyInterface (`replyOperations`); nullptr when unknown.
const OperationSpec* sessionOperation(std::string_view name);
const OperationSpec* replyOperation(std::string_view name);
std::span<const OperationSpec> sessionOperations();

// nullopt when the arguments fit the operation; otherwise a description of
// the first one that does not ("Argument \"category\" of <op> must be an
// unsigned 16-bit integer, not a string"). Arguments the operation does not
// know are ignored.
std::optional<std::string> checkArguments(const OperationSpec& op, const Dictionary& args);

Error unknownOperationError(std::string_view name);
Error argumentError(std::string description);

// Argument dictionaries, as the proxies send them.
Dictionary setSessionInfoArgs(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                              bool hasAggregationBlock);
Dictionary fetchStatesArgs(const Value& userInfo);
Dictionary sendMessageArgs(const Value& message);
Dictionary uploadFileArgs(const Value& fileURL, const Value& extensionToken);
Dictionary uploadLogDataArgs(const Value& logData);
Dictionary sendMessageWithSessionInfoArgs(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                          std::uint16_t type, const Value& payload);
Dictionary updateSharedDataArgs(const Value& dictionary);
Dictionary updateSharedDataForKeyArgs(const Value& key, const Value& value);
Dictionary setDigestKeyArgs(const Value& digestKey, std::int32_t algorithm);
Dictionary sendMessageToClientArgs(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                                   const Value& payload);

// The error a reply's arguments carry under "error", if any.
std::optional<Error> errorArgument(const Dictionary& replyArgs);

// The file-system path of a file URL ("file:///a%20b" -> "/a b", an
// optional "localhost" host); anything that is not a file URL is taken as
// a path as it stands.
std::string filePathOfURL(const std::string& url);
// The last component of a path ("/a/b.log/" -> "b.log").
std::string lastPathComponent(std::string path);

}  // namespace zerith::ipc::wire
