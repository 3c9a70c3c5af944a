#pragma once

// The Zerith client framework: one `Zerith` object is one reporting session
// with the zerithd daemon, over one connection to its socket. The session
// lives as long as the connection: destroying the object (or invalidate())
// ends it.
//
//   auto session = zerith::Zerith::connect();              // nullptr: daemon unreachable
//   session->setSessionInfo(info, nil, nil, false, 5s);    // blocking form, with a time-out
//   auto started = session->startConfig(5s);               // started["backends"]
//   session->sendMessageWithDictionary(event, [](Value result) { ... });   // asynchronous form
//
// Every operation of the daemon's client interface exists in two forms:
// - asynchronous, named and shaped as the interface (`fetchDisplayURL(completion)`):
//   the completion runs once on the connection's queue; when the call fails
//   (connection gone, call refused) it gets what failure looks like for its
//   shape: nil, false, or nil/false with the error. An empty completion asks
//   for no answer.
// - blocking with a time-out (`fetchDisplayURL(timeout)`): returns the
//   completion's arguments by name, or the error that kept them from
//   arriving (time-out, connection gone, call refused). A blocking call made
//   from a callback of this session (its queue) fails at once instead of
//   deadlocking.
//
// Backpressure: an asynchronous call returns once its message is queued for
// the daemon, and a one-way message (sendMessageWithDictionary(message,
// nullptr), no completion) gets no answer at all. A thread that sends faster
// than the daemon reads would only grow the session's outbox, and a session
// whose outbox passes 64 MiB is closed with its messages. So once more than
// 1 MiB waits for the daemon, the thread that sends the next message waits
// until less than 256 KiB does, as a blocking socket write would; the end of
// the session releases it at once (its message is then dropped, as every
// message after the end is). Callbacks of the session (its queue) never wait
// this way: their messages are queued.
//
// Completion argument names: startConfig/fetchStates "backends" (array of
// backend names or absent), fetchDisplayURL "url", sendMessage and
// sendMessageWithSessionInfo "result", flushMessages "result" and "error",
// uploadFile "success" and "removeFile", uploadLogData "success" and "error"; an error
// argument is a dictionary {"domain", "code", "description"}.

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Value.h"
#include "zerith/ZerithBundle.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

// The outcome of a blocking call.
struct ZerithReply {
  Dictionary arguments;        // the completion's arguments by name
  std::optional<Error> error;  // why there are none

  explicit operator bool() const { return !error; }
  Value operator[](std::string_view name) const { return arguments.get(name); }
};

class ZERITH_EXPORT Zerith {
 public:
  using Timeout = std::chrono::milliseconds;
  static constexpr Timeout kDefaultTimeout{30000};

  using ValueCompletion = std::function<void(Value)>;
  using ValueErrorCompletion = std::function<void(Value, std::optional<Error>)>;
  using BoolCompletion = std::function<void(bool)>;
  using BoolErrorCompletion = std::function<void(bool, std::optional<Error>)>;
  // The daemon's messages to this client (sendMessageToClient:timestamp:category:type:payload:).
  using MessageHandler = std::function<void(const Value& message, double timestamp, std::uint16_t category,
                                            std::uint16_t type, const Value& payload)>;

  // <root>/run/zerithd/com.velmar.zerithd. The root is the process's
  // (paths::setRoot); a process that never chose one uses ZERITHD_ROOT, "/"
  // for the superuser, or the per-user root, as the daemon does.
  static std::filesystem::path defaultSocketPath();

  // Opens a session with the daemon listening at `socketPath` (default:
  // defaultSocketPath()). nullptr, with `error`, when nothing listens there.
  // A daemon that refuses the client closes the connection: the first call
  // then fails and the invalidation handler runs.
  static std::unique_ptr<Zerith> connect(const std::filesystem::path& socketPath = {}, Error* error = nullptr);

  ~Zerith();
  Zerith(const Zerith&) = delete;
  Zerith& operator=(const Zerith&) = delete;

  // Set before the calls whose messages or end you care about. Neither runs
  // after the object is destroyed.
  void setMessageHandler(MessageHandler handler);
  void setInvalidationHandler(std::function<void()> handler);
  bool isValid() const;
  // Ends the session: the daemon sees the connection close.
  void invalidate();
  // "<connection pid=.. uid=.. fd=..>" of the daemon end.
  std::string description() const;

  // ---- asynchronous ------------------------------------------------------------
  void setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                      bool hasAggregationBlock);
  void startConfigWithCompletionHandler(ValueCompletion completion);
  void fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completionHandler);
  void fetchDisplayURL(ValueCompletion completion);
  void sendMessageWithDictionary(const Value& message, ValueCompletion reply);
  void flushMessagesWithCompletion(ValueErrorCompletion completion);
  void finishSessionGracefully();
  void uploadFileAtPath(const Value& fileURL, const Value& extensionToken, BoolCompletion completionHandler);
  void uploadLogData(const Value& logData, BoolErrorCompletion completionHandler);
  void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                  std::uint16_t type, const Value& payload, ValueCompletion reply);
  void updateSharedDataWithDictionary(const Value& dictionary);
  void updateSharedDataForKey(const Value& key, const Value& value);
  void setDigestKey(const Value& digestKey, std::int32_t algorithm);

  // The generic form: any operation by its wire name; the completion gets
  // the reply (empty arguments for operations without a completion).
  // An upload (by either form) opens the file here, with this process's
  // rights, and passes its descriptor with the call; the extension token
  // argument is not used. When the reply carries "removeFile" (the server
  // answered "success") the file is deleted here, before the reply is handed
  // on. A file this process cannot open fails the call without reaching the
  // daemon.
  void call(const std::string& operation, Dictionary args, std::function<void(ZerithReply)> completion);
  void uploadFile(const Value& fileURL, std::function<void(ZerithReply)> completion);

  // ---- blocking, with a time-out ---------------------------------------------
  // Operations without a completion return once the daemon has taken them.
  ZerithReply setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                             bool hasAggregationBlock, Timeout timeout);
  ZerithReply startConfig(Timeout timeout = kDefaultTimeout);
  ZerithReply fetchStates(const Value& userInfo, Timeout timeout = kDefaultTimeout);
  ZerithReply fetchDisplayURL(Timeout timeout = kDefaultTimeout);
  ZerithReply sendMessage(const Value& message, Timeout timeout = kDefaultTimeout);
  ZerithReply flushMessages(Timeout timeout = kDefaultTimeout);
  ZerithReply finishSession(Timeout timeout = kDefaultTimeout);
  ZerithReply uploadFile(const Value& fileURL, const Value& extensionToken, Timeout timeout = kDefaultTimeout);
  ZerithReply uploadLogData(const Value& logData, Timeout timeout);
  ZerithReply sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                         std::uint16_t type, const Value& payload, Timeout timeout);
  ZerithReply updateSharedData(const Value& dictionary, Timeout timeout = kDefaultTimeout);
  ZerithReply updateSharedDataForKey(const Value& key, const Value& value, Timeout timeout);
  ZerithReply setDigestKey(const Value& digestKey, std::int32_t algorithm, Timeout timeout);
  ZerithReply callAndWait(const std::string& operation, Dictionary args, Timeout timeout = kDefaultTimeout);

  // ---- the framework ------------------------------------------------------------
  // "BundleVersion" of the installed framework, "8.0" when it has none.
  static std::string frameworkVersion();
  static std::filesystem::path publicKeyPath();

  // A stable identifier of this device for reporting: an upper-case UUID
  // kept in the defaults domain "com.velmar.zerith", one for each answer of
  // `dnu`, under the keys kZerithPersistentIdentifierDNUKey (true) and
  // kZerithPersistentIdentifierKey (false). Created on first use.
  static std::string getPersistentIdentifierForDNU(bool dnu);

 private:
  struct Impl;
  explicit Zerith(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

// Defaults keys of the persistent identifiers.
inline constexpr const char* kZerithPersistentIdentifierDNUKey = "PersistentIdentifierForDNU";
inline constexpr const char* kZerithPersistentIdentifierKey = "PersistentIdentifier";

}  // namespace zerith
