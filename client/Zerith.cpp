#include "zerith/Zerith.h"

#include <fmt/format.h>

#include <future>
#include <mutex>

#include "ipc/ClientSessionProxy.h"
#include "ipc/ClientSessionReplyExporter.h"
#include "ipc/ClientSessionWire.h"
#include "ipc/ClientUploadFile.h"
#include "ipc/SocketConnection.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "platform/DefaultsKeys.h"
#include "platform/Log.h"
#include "platform/Paths.h"

namespace zerith {

namespace {

using namespace ipc::wire;

// A process that never chose a root takes the daemon's default one once.
void adoptDefaultRoot() {
  static std::once_flag once;
  std::call_once(once, [] {
    if (!paths::relocated()) {
      paths::setRoot(paths::defaultRoot());
    }
  });
}

// Receives the daemon's messages and the end of the connection, and hands
// them to the application's handlers until the session object goes.
class Dispatcher final : public ClientSessionReplyInterface {
 public:
  void sendMessageToClient(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                           const Value& payload) override {
    std::lock_guard lock(mutex_);
    if (messageHandler_) {
      messageHandler_(message, timestamp, category, type, payload);
    }
  }
  // The end of the connection reaches a handler once, however it is told:
  // the connection's own end, or a handler set after the end began (which
  // can race with the connection's end being delivered).
  void invalidated() {
    std::lock_guard lock(mutex_);
    if (invalidationHandler_ && !endDelivered_) {
      endDelivered_ = true;
      invalidationHandler_();
    }
  }
  void setMessageHandler(Zerith::MessageHandler handler) {
    std::lock_guard lock(mutex_);
    messageHandler_ = std::move(handler);
  }
  void setInvalidationHandler(std::function<void()> handler) {
    std::lock_guard lock(mutex_);
    invalidationHandler_ = std::move(handler);
    endDelivered_ = false;
  }
  // Waits for a handler that is running (unless the caller is that
  // handler) and drops both.
  void clear() {
    std::lock_guard lock(mutex_);
    messageHandler_ = nullptr;
    invalidationHandler_ = nullptr;
  }

 private:
  std::recursive_mutex mutex_;
  Zerith::MessageHandler messageHandler_;
  std::function<void()> invalidationHandler_;
  bool endDelivered_ = false;  // to the handler set now
};

}  // namespace

struct Zerith::Impl {
  std::shared_ptr<ipc::SocketConnection> connection;
  std::shared_ptr<Dispatcher> dispatcher = std::make_shared<Dispatcher>();
  std::unique_ptr<ipc::ClientSessionProxy> proxy;

  ZerithReply wait(const std::string& operation, Dictionary args, Timeout timeout) {
    if (connection->queue().isCurrent()) {
      return ZerithReply{{}, Error{kZerithErrorDomain, -1,
                                   fmt::format("{} cannot wait inside a callback of its own session", operation)}};
    }
    auto answer = connection->callAndWait(operation, std::move(args), timeout);
    if (answer.timedOut) {
      return ZerithReply{{}, Error{kZerithErrorDomain, -1,
                                   fmt::format("No answer to {} within {} ms", operation, timeout.count())}};
    }
    return ZerithReply{answer.args ? std::move(*answer.args) : Dictionary(), std::move(answer.error)};
  }
};

std::filesystem::path Zerith::defaultSocketPath() {
  adoptDefaultRoot();
  return paths::socketPath();
}

std::unique_ptr<Zerith> Zerith::connect(const std::filesystem::path& socketPath, Error* error) {
  const auto path = socketPath.empty() ? defaultSocketPath() : socketPath;
  Error failure;
  auto connection = ipc::SocketConnection::connect(path, &failure);
  if (!connection) {
    if (error) {
      *error = Error{kZerithErrorDomain, -1, failure.description};
    }
    return nullptr;
  }
  auto impl = std::make_unique<Impl>();
  impl->connection = connection;
  impl->proxy = std::make_unique<ipc::ClientSessionProxy>(connection);
  connection->setExportedObject(std::make_shared<ipc::ClientSessionReplyExporter>(impl->dispatcher));
  connection->setInvalidationHandler([dispatcher = impl->dispatcher] { dispatcher->invalidated(); });
  connection->resume();
  return std::unique_ptr<Zerith>(new Zerith(std::move(impl)));
}

Zerith::Zerith(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}

Zerith::~Zerith() {
  impl_->dispatcher->clear();
  impl_->connection->invalidate();
}

void Zerith::setMessageHandler(MessageHandler handler) { impl_->dispatcher->setMessageHandler(std::move(handler)); }

void Zerith::setInvalidationHandler(std::function<void()> handler) {
  impl_->dispatcher->setInvalidationHandler(std::move(handler));
  if (impl_->connection->isInvalidated()) {
    // Already over: the handler still runs once, on the queue.
    impl_->connection->queue().async([dispatcher = impl_->dispatcher] { dispatcher->invalidated(); });
  }
}

bool Zerith::isValid() const { return !impl_->connection->isInvalidated(); }

void Zerith::invalidate() { impl_->connection->invalidate(); }

std::string Zerith::description() const { return impl_->connection->description(); }

// ---- asynchronous -------------------------------------------------------------------

void Zerith::setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                            bool hasAggregationBlock) {
  impl_->proxy->setSessionInfo(sessionInfo, userInfo, frameworksToCheck, hasAggregationBlock);
}
void Zerith::startConfigWithCompletionHandler(ValueCompletion completion) {
  impl_->proxy->startConfigWithCompletionHandler(std::move(completion));
}
void Zerith::fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completionHandler) {
  impl_->proxy->fetchStatesWithUserInfo(userInfo, std::move(completionHandler));
}
void Zerith::fetchDisplayURL(ValueCompletion completion) { impl_->proxy->fetchDisplayURL(std::move(completion)); }
void Zerith::sendMessageWithDictionary(const Value& message, ValueCompletion reply) {
  impl_->proxy->sendMessageWithDictionary(message, std::move(reply));
}
void Zerith::flushMessagesWithCompletion(ValueErrorCompletion completion) {
  impl_->proxy->flushMessagesWithCompletion(std::move(completion));
}
void Zerith::finishSessionGracefully() { impl_->proxy->finishSessionGracefully(); }
void Zerith::uploadFileAtPath(const Value& fileURL, const Value& extensionToken, BoolCompletion completionHandler) {
  impl_->proxy->uploadFileAtPath(fileURL, extensionToken, std::move(completionHandler));
}
void Zerith::uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) {
  impl_->proxy->uploadLogData(logData, std::move(completionHandler));
}
void Zerith::sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                        std::uint16_t type, const Value& payload, ValueCompletion reply) {
  impl_->proxy->sendMessageWithSessionInfo(sessionInfo, userInfo, category, type, payload, std::move(reply));
}
void Zerith::updateSharedDataWithDictionary(const Value& dictionary) {
  impl_->proxy->updateSharedDataWithDictionary(dictionary);
}
void Zerith::updateSharedDataForKey(const Value& key, const Value& value) {
  impl_->proxy->updateSharedDataForKey(key, value);
}
void Zerith::setDigestKey(const Value& digestKey, std::int32_t algorithm) {
  impl_->proxy->setDigestKey(digestKey, algorithm);
}

void Zerith::call(const std::string& operation, Dictionary args, std::function<void(ZerithReply)> completion) {
  if (operation == kUploadFile) {
    uploadFile(args.get("fileURL"), std::move(completion));
    return;
  }
  if (!completion) {
    impl_->connection->send(operation, std::move(args));
    return;
  }
  impl_->connection->call(operation, std::move(args),
                          [completion = std::move(completion)](std::optional<Dictionary> a, std::optional<Error> e) {
                            completion(ZerithReply{a ? std::move(*a) : Dictionary(), std::move(e)});
                          });
}

// ---- blocking ------------------------------------------------------------------------

ZerithReply Zerith::setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                                   bool hasAggregationBlock, Timeout timeout) {
  return impl_->wait(kSetSessionInfo, setSessionInfoArgs(sessionInfo, userInfo, frameworksToCheck, hasAggregationBlock),
                     timeout);
}
ZerithReply Zerith::startConfig(Timeout timeout) { return impl_->wait(kStartConfig, {}, timeout); }
ZerithReply Zerith::fetchStates(const Value& userInfo, Timeout timeout) {
  return impl_->wait(kFetchStates, fetchStatesArgs(userInfo), timeout);
}
ZerithReply Zerith::fetchDisplayURL(Timeout timeout) { return impl_->wait(kFetchDisplayURL, {}, timeout); }
ZerithReply Zerith::sendMessage(const Value& message, Timeout timeout) {
  return impl_->wait(kSendMessage, sendMessageArgs(message), timeout);
}
ZerithReply Zerith::flushMessages(Timeout timeout) { return impl_->wait(kFlushMessages, {}, timeout); }
ZerithReply Zerith::finishSession(Timeout timeout) { return impl_->wait(kFinishSession, {}, timeout); }
ZerithReply Zerith::uploadFile(const Value& fileURL, const Value& /*extensionToken*/, Timeout timeout) {
  if (impl_->connection->queue().isCurrent()) {
    return ZerithReply{{}, Error{kZerithErrorDomain, -1,
                                 fmt::format("{} cannot wait inside a callback of its own session", kUploadFile)}};
  }
  auto answer = std::make_shared<std::promise<ZerithReply>>();
  auto reply = answer->get_future();
  uploadFile(fileURL, [answer](ZerithReply r) { answer->set_value(std::move(r)); });
  if (reply.wait_for(timeout) != std::future_status::ready) {
    return ZerithReply{{}, Error{kZerithErrorDomain, -1,
                                 fmt::format("No answer to {} within {} ms", kUploadFile, timeout.count())}};
  }
  return reply.get();
}
void Zerith::uploadFile(const Value& fileURL, std::function<void(ZerithReply)> completion) {
  // The file is opened here, with this process's rights; its descriptor is
  // the extension token. The file is deleted here too, on the daemon's word.
  ipc::callUploadFile(*impl_->connection, fileURL,
                      [completion = std::move(completion)](std::optional<Dictionary> a, std::optional<Error> e) {
                        if (completion) {
                          completion(ZerithReply{a ? std::move(*a) : Dictionary(), std::move(e)});
                        }
                      });
}
ZerithReply Zerith::uploadLogData(const Value& logData, Timeout timeout) {
  return impl_->wait(kUploadLogData, uploadLogDataArgs(logData), timeout);
}
ZerithReply Zerith::sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                               std::uint16_t type, const Value& payload, Timeout timeout) {
  return impl_->wait(kSendMessageWithSessionInfo,
                     sendMessageWithSessionInfoArgs(sessionInfo, userInfo, category, type, payload), timeout);
}
ZerithReply Zerith::updateSharedData(const Value& dictionary, Timeout timeout) {
  return impl_->wait(kUpdateSharedData, updateSharedDataArgs(dictionary), timeout);
}
ZerithReply Zerith::updateSharedDataForKey(const Value& key, const Value& value, Timeout timeout) {
  return impl_->wait(kUpdateSharedDataForKey, updateSharedDataForKeyArgs(key, value), timeout);
}
ZerithReply Zerith::setDigestKey(const Value& digestKey, std::int32_t algorithm, Timeout timeout) {
  return impl_->wait(kSetDigestKey, setDigestKeyArgs(digestKey, algorithm), timeout);
}
ZerithReply Zerith::callAndWait(const std::string& operation, Dictionary args, Timeout timeout) {
  if (operation == kUploadFile) {
    return uploadFile(args.get("fileURL"), Value(), timeout);
  }
  return impl_->wait(operation, std::move(args), timeout);
}

// ---- the framework -------------------------------------------------------------------

std::string Zerith::frameworkVersion() {
  adoptDefaultRoot();
  return frameworkBundleVersion().value_or("8.0");
}

std::filesystem::path Zerith::publicKeyPath() {
  adoptDefaultRoot();
  return frameworkPublicKeyPath();
}

std::string Zerith::getPersistentIdentifierForDNU(bool dnu) {
  adoptDefaultRoot();
  // One process creates an identifier at a time; Defaults serialises the
  // write against other processes.
  static std::mutex creating;
  std::lock_guard lock(creating);
  const Defaults defaults{std::string(kZerithDomain)};
  const std::string_view key =
      dnu ? defaultsSetting(kZerithPersistentIdentifierDNUKey).key : defaultsSetting(kZerithPersistentIdentifierKey).key;
  const Value stored = defaults.objectForKey(key);
  if (const auto* text = stored.string(); text && !text->empty()) {
    return *text;
  }
  std::string identifier = crypto::newUUIDString();
  if (!defaults.setObject(key, Value(identifier))) {
    log::Logger("client").error("getPersistentIdentifierForDNU: cannot keep the identifier under {}", key);
  }
  return identifier;
}

}  // namespace zerith
