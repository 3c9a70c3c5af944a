// A session's messages: the road of one event through its backends, the
// aggregator, and one-shot messages sent without a session of their own.

#include "session/ZerithdSession.h"
#include "session/ZerithdSessionHelpers.h"

#include <sys/time.h>

#include <fmt/format.h>

#include "backends/CreateBackends.h"
#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "config/MessageLog.h"
#include "ipc/ClientSessionReplyProxy.h"
#include "ipc/ClientSessionWire.h"
#include "platform/Defaults.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

using session_detail::logger;
using session_detail::processLifetimeDeviceID;
using session_detail::textOrUnknown;

namespace {

constexpr char kNoBackends[] = "No backends available to send message";

// The join of one flush over a session's backends.
struct FlushJoin {
  std::size_t pending = 0;
  ClientSessionInterface::ValueErrorCompletion completion;
};

// Counts the event as accepted by `backend`, then whether its category lists
// let it through; a dropped event is counted and logged under `operation`.
bool acceptedByFilters(ZerithBackend& backend, std::uint16_t category, const char* operation) {
  backend.counters().add(BackendCount::accepted);
  if (!backend.isWhitelistedEvent(category)) {
    logger().debug("{}: Dropping event with category {} as it is not whitelisted for backend {}", operation, category,
                   backend.name());
    backend.counters().add(BackendCount::droppedFiltered);
    return false;
  }
  if (backend.isBlacklistedEvent(category)) {
    logger().debug("{}: Dropping event with category {} as it is blacklisted for backend {}", operation, category,
                   backend.name());
    backend.counters().add(BackendCount::droppedBlacklisted);
    return false;
  }
  return true;
}

}  // namespace

// --- Dispatch ------------------------------------------------------------------

void ZerithdSession::sendMessageWithDictionary(const Value& message, ValueCompletion reply) {
  logger().debug("sendMessageWithDictionary: Sending message for session {}", sessionID());
  Value result = sendMessageWithDictionary(message);
  if (reply) {
    reply(std::move(result));
  }
}

// The road of one event, all on the caller's thread: the checks, the
// aggregator, then every backend's send in the set's order. Nothing here
// waits for another thread; a backend that posts does so on its own queues.
Value ZerithdSession::sendMessageWithDictionary(const Value& message) {
  const auto set = backends();
  if (!set) {
    logger().debug("sendMessageWithDictionary: No backends available to send message");
    return {};
  }
  const Value categoryValue = message[kZerithMessageParametersCategory];
  if (categoryValue.isNil()) {
    logger().debug("sendMessageWithDictionary: Missing mandatory parameter 'category'");
    return {};
  }
  const Value typeValue = message[kZerithMessageParametersType];
  if (typeValue.isNil()) {
    logger().debug("sendMessageWithDictionary: Missing mandatory parameter 'type'");
    return {};
  }
  const auto category = static_cast<std::uint16_t>(categoryValue.unsignedValue());
  const auto type = static_cast<std::uint16_t>(typeValue.unsignedValue());
  const Value payload = message[kZerithMessageParametersPayload];
  if (!payload.isNil() && !payload.isDict()) {
    logger().error("sendMessageWithDictionary: Dropping event with category {} as its payload is not a dictionary",
                   category);
    return {};
  }
  const auto flag = static_cast<std::int32_t>(static_cast<std::uint32_t>(message[kZerithMessageParametersFlag].unsignedValue()));
  timeval now{};
  gettimeofday(&now, nullptr);

  aggregateMessage(sessionInfo(), timevalToSeconds(now), category, type, payload);

  Dictionary method;
  if (const auto d = delegate()) {
    std::lock_guard lock(d->agentLock());
    if (const Value shared = d->sharedDataForSession(*this); !shared.isNil()) {
      method.set("SharedData", shared);
    }
  }
  if (!payload.isNil()) {
    method.set("ClientData", payload);
  }
  if (set->empty()) {
    return {};
  }
  const Value methodDictionary(std::move(method));

  std::optional<std::string> chosen;
  for (const auto& [name, backend] : *set) {
    if (!acceptedByFilters(*backend, category, "sendMessageWithDictionary")) {
      continue;
    }
    auto result = backend->sendMessage(methodDictionary, now, category, type, flag);
    if (!result) {
      continue;
    }
    writeToLogFile("[{} -> sendMessageWithDictionary] {}", name, *result);
    // The last HTTPS result wins; the dashboard's shows only when no HTTPS
    // backend gave one before it; the others are never returned.
    if (name == kZerithBackendHTTPPost2 || name == kZerithBackendHTTPPost) {
      chosen = std::move(result);
    } else if (name == kZerithBackendDashboard && !chosen) {
      chosen = std::move(result);
    }
  }
  return chosen ? Value(std::move(*chosen)) : Value();
}

void ZerithdSession::internalSendMessage(const Value& payload, double /*timestamp*/, std::uint16_t method,
                                         std::uint16_t respCode) {
  Dictionary message;
  message.set(kZerithMessageParametersCategory, Value(static_cast<unsigned>(method)));
  message.set(kZerithMessageParametersType, Value(static_cast<unsigned>(respCode)));
  if (!payload.isNil()) {
    message.set(kZerithMessageParametersPayload, payload);
  }
  message.set(kZerithMessageParametersFlag, Value(0));
  sendMessageWithDictionary(Value(std::move(message)));
  logger().debug("internalSendMessage: Sent internal message (method:{} respCode:{})", method, respCode);
}

void ZerithdSession::flushMessagesWithCompletion(ValueErrorCompletion completion) {
  logger().debug("flushMessagesWithCompletion: Flushing messages for session {}", sessionID());
  internalFlushMessagesWithCompletion([completion = std::move(completion)](Value text, std::optional<Error> error) {
    if (completion) {
      completion(std::move(text), std::move(error));
    }
  });
}

void ZerithdSession::internalFlushMessagesWithCompletion(ValueErrorCompletion completion) {
  const auto set = backends();
  if (!set) {
    logger().debug("internalFlushMessagesWithCompletion: {}", kNoBackends);
    if (completion) {
      completion(Value(), makeZerithError(kNoBackends, -1));
    }
    return;
  }
  if (set->empty()) {
    // No backend will ever answer: the join is complete at once.
    if (completion) {
      completion(Value(), std::nullopt);
    }
    return;
  }
  auto join = std::make_shared<FlushJoin>();
  join->pending = set->size();
  join->completion = std::move(completion);
  for (const auto& [name, backend] : *set) {
    // The block holds the join and the backend's name, not the backend: a
    // backend keeps its pending completions, and a completion that held its
    // backend would keep both alive for ever if it never ran.
    backend->flushMessagesWithCompletion(
        [join, name = name](const Value& text, const std::optional<Error>& error) {
          logger().debug("internalFlushMessagesWithCompletion: {}", name);
          if (const auto* s = text.string()) {
            writeToLogFile("[{} -> flushMessages] {}", name, *s);
          } else if (!text.isNil()) {
            writeToLogFile("[{} -> flushMessages] {}", name, text.description());
          }
          ValueErrorCompletion done;
          {
            // The join is decided under the class-wide lock; the caller's
            // completion runs after it is left, so a completion that flushes
            // again cannot deadlock on it.
            std::lock_guard lock(classLock());
            --join->pending;
            if (join->completion && (error || join->pending == 0)) {
              done = std::move(join->completion);
              join->completion = nullptr;
            }
          }
          if (done) {
            done(text, error);
          }
        });
  }
}

// --- Aggregation -----------------------------------------------------------------

void ZerithdSession::aggregateMessage(const Value& sessionInfo, double timestamp, std::uint16_t category,
                                      std::uint16_t type, const Value& payload) {
  Value merged;
  if (const auto* entries = payload.dict()) {
    Dictionary combined = *entries;
    if (const Value user = userInfo(); user.dict()) {
      for (const auto& [key, value] : *user.dict()) {
        combined.set(key, value);
      }
    }
    merged = Value(std::move(combined));
  }
  const auto d = delegate();
  if (d) {
    std::unique_lock lock(d->agentLock());
    if (const auto ancestor = d->getAncestorWithAggregatorForSession(*this)) {
      ancestor->sendToAggregator(sessionInfo, timestamp, category, type, merged);
      return;
    }
  }
  if (hasAggregator()) {
    sendToAggregator(sessionInfo, timestamp, category, type, merged);
  }
}

void ZerithdSession::sendToAggregator(const Value& sessionInfo, double timestamp, std::uint16_t category,
                                      std::uint16_t type, const Value& payload) {
  const auto connection = connection_.lock();
  if (!connection) {
    logger().error("sendMessageWithDictionary: Failed to get remote object proxy: {}", "the connection is invalid");
    return;
  }
  ipc::ClientSessionReplyProxy(connection).sendMessageToClient(sessionInfo, timestamp, category, type, payload);
}

void ZerithdSession::shutdownSessionAggregation() {
  logger().debug("shutdownSessionAggregation: Disable aggregation module for session {}", sessionID());
  if (hasAggregator()) {
    // The empty event tells the client that aggregation ends.
    sendToAggregator(Value(), 0.0, 0, 0, Value());
  }
  setHasAggregator(false);
}

// --- One-shot messages -------------------------------------------------------------

void ZerithdSession::sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                                std::uint16_t type, const Value& payload, ValueCompletion reply) {
  const Value clientTypeValue = sessionInfo[kZerithSessionInfoClientType];
  const Value sessionIDValue = sessionInfo[kZerithSessionInfoSessionID];
  if (clientTypeValue.isNil() || sessionIDValue.isNil()) {
    logger().error("sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo");
    if (reply) {
      reply(Value("Could not retrieve identifiers from sessionInfo"));
    }
    return;
  }
  {
    std::lock_guard lock(fieldsMutex_);
    fields_.sessionID = static_cast<std::uint32_t>(sessionIDValue.unsignedValue());
    fields_.sessionInfo = sessionInfo;
    const Value hierarchy = sessionInfo[kZerithSessionInfoHierarchyToken];
    fields_.hierarchyDictionary = hierarchy.isDict() ? hierarchy : Value();
  }
  const auto d = delegate();
  if (d) {
    d->updateCorrelatedSessions(*this);
  }
  receivedUserInfo(userInfo);
  logger().debug("sendMessageWithSessionInfo: Sending message with session info for session {}", sessionID());
  const Value storebag = d ? d->storebagForSession(*this) : Value();
  if (!storebag.isNil()) {
    sendMessageWithSessionInfo(sessionInfo, userInfo, storebag, category, type, payload);
  }
  if (reply) {
    reply(Value(storebag.isNil() ? "storebag not available" : "finished"));
  }
}

std::shared_ptr<ReportingSessionConnectivityHelper> ZerithdSession::oneShotConnectivityHelper() {
  std::lock_guard lock(classLock());
  return oneShotHelperLocked();
}

// Kept for the life of the daemon: one-shot backends may still post through
// it after the sender has returned.
std::shared_ptr<ReportingSessionConnectivityHelper>& ZerithdSession::oneShotHelperLocked() {
  static auto* helper = new std::shared_ptr<ReportingSessionConnectivityHelper>();
  return *helper;
}

void ZerithdSession::sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& storebag,
                                                std::uint16_t category, std::uint16_t type, const Value& payload) {
  logger().debug("sendMessageWithSessionInfo: Sending single message with sessionID {}",
                 sessionInfo[kZerithSessionInfoSessionID].intValue());
  if (sessionInfo.isNil() || storebag.isNil()) {
    logger().error("RsendMessageWithSessionInfo: Attempted to send message with one or more nil parameters");
    return;
  }
  std::array<char, 41> udid{};
  copyUniqueDeviceID(udid.data(), udid.size());
  auto backends = createBackends(storebag, sessionInfo, userInfo, processLifetimeDeviceID(udid.data()));
  if (!backends) {
    logger().error("sendMessageWithSessionInfo: No backends available to send single message");
    return;
  }
  if (!userInfo.isNil() && !sessionInfo[kZerithSessionInfoRequireUserInfo].boolValue()) {
    logger().error("sendMessageWithSessionInfo: user info provided without requiring it.");
  }
  std::shared_ptr<ReportingSessionConnectivityHelper> helper;
  {
    std::lock_guard lock(classLock());
    auto& shared = oneShotHelperLocked();
    if (!shared) {
      shared = ReportingSessionConnectivityHelper::initWithDelegate(
          std::weak_ptr<ZerithdSessionDelegate>(), ReportingSessionConnectivityHelper::POSTRequestMode());
    }
    helper = shared;
  }
  timeval now{};
  gettimeofday(&now, nullptr);
  const bool internal = isInternalBuild();
  for (const auto& [name, backend] : *backends) {
    backend->updateState();
    backend->setReportingSessionConnectivityDelegate(helper);
    if (!acceptedByFilters(*backend, category, "sendMessageWithSessionInfo")) {
      continue;
    }
    // A copy of the client's payload itself (no "ClientData" wrapping); a
    // missing payload stays missing.
    Value event;
    if (payload.isDict()) {
      Dictionary copy = payload.dictCopy();
      if (internal) {
        copy.set("SerialNum", textOrUnknown(deviceSerialNumber()));
      }
      event = Value(std::move(copy));
    }
    if (auto result = backend->sendMessage(event, now, category, type, 0)) {
      writeToLogFile("[{} -> sendMessageWithSessionInfo] {}", name, *result);
    }
  }
  for (const auto& [name, backend] : *backends) {
    backend->cleanup();
  }
}

}  // namespace zerith
