#include "session/ZerithdSession.h"

#include <sys/time.h>

#include <set>

#include <fmt/format.h>

#include "backends/CreateBackends.h"
#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "config/MessageLog.h"
#include "backends/UploadBackend.h"
#include "ipc/ClientSessionReplyProxy.h"
#include "ipc/ClientSessionWire.h"
#include "ipc/Connection.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "platform/Log.h"
#include "platform/SandboxExtension.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "zerith/ZerithBundle.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* l = new log::Logger("session");
  return *l;
}

constexpr char kNoBackends[] = "No backends available to send message";

Value textOrUnknown(const Value& v) { return v.string() ? v : Value("Unknown"); }


double secondsNow() {
  timeval tv{};
  gettimeofday(&tv, nullptr);
  return timevalToSeconds(tv);
}

// The reporting states: 2 enabled, 3 sampled out but kept by an override.
bool isReporting(std::int32_t state) { return state == kBackendStateEnabled || state == kBackendStateSampledOut; }

// Backends keep the device identifier as a pointer they do not own, and a
// backend may outlive its session (a flush completion holds it; a one-shot
// backend may still be posting). Every backend therefore gets a copy that
// lives as long as the process; there is one per distinct identifier, in
// practice one.
const char* processLifetimeDeviceID(const char* deviceID) {
  static std::mutex mutex;
  static auto* interned = new std::set<std::string>();
  std::lock_guard lock(mutex);
  return interned->insert(deviceID).first->c_str();
}

// The join of one flush over a session's backends.
struct FlushJoin {
  std::size_t pending = 0;
  ClientSessionInterface::ValueErrorCompletion completion;
};

}  // namespace

// --- Birth and death ---------------------------------------------------------

ZerithdSession::ZerithdSession(std::weak_ptr<ZerithdSessionDelegate> delegate, std::shared_ptr<ipc::Connection> connection)
    : sessionDelegate_(std::move(delegate)), connection_(connection) {}

std::shared_ptr<ZerithdSession> ZerithdSession::initWithSessionDelegate(std::weak_ptr<ZerithdSessionDelegate> delegate,
                                                                        std::shared_ptr<ipc::Connection> connection) {
  {
    const auto d = delegate.lock();
    logger().debug("initWithSessionDelegate: ZerithdSession initWithSessionDelegate:{}",
                   d ? d->description() : std::string("(null)"));
  }
  std::shared_ptr<ZerithdSession> session(new ZerithdSession(delegate, std::move(connection)));
  copyUniqueDeviceID(session->deviceid_.data(), session->deviceid_.size());
  const auto uuid = crypto::uuidBytes();
  session->sessionIDString_ = crypto::base64Encode(uuid);
  session->connectivityHelper_ = ReportingSessionConnectivityHelper::initWithDelegate(
      std::move(delegate), ReportingSessionConnectivityHelper::POSTRequestMode());
  if (!session->connectivityHelper_) {
    logger().error("initWithSessionDelegate: Unable to create the connectivity helper for session {}",
                   session->sessionIDString_);
    session->initialised_ = false;
    return nullptr;
  }
  logger().debug("initWithSessionDelegate: Initialized session with UUID {}", session->sessionIDString_);
  return session;
}

ZerithdSession::~ZerithdSession() {
  if (!initialised_) {
    return;
  }
  logger().debug("dealloc: ZerithdSession dealloc: {}", sessionID());
  const double now = secondsNow();

  Dictionary payload;
  if (const Value version = storebagVersion(); !version.isNil()) {
    payload.set("StorebagVersion", version);
    payload.set("GracefulTermination", Value(hasFinishedGracefully()));
  }
  if (const auto d = delegate()) {
    d->addAgentHealthInfoForSession(*this, payload);
  }
  addBackendCounts(payload);
  if (hasBackendSet()) {
    internalSendMessage(Value(payload), now, 0, 1);
    internalFlushMessagesWithCompletion(nullptr);
  }
  shutdownSessionAggregation();
  if (const auto set = backends()) {
    if (const auto d = delegate()) {
      d->backendsOfEndedSession(*this, *set);
    }
  }

  std::shared_ptr<const BackendDictionary> backends;
  {
    std::lock_guard lock(fieldsMutex_);
    backends = std::move(fields_.backends);
    fields_.sessionInfo = Value();
    fields_.userInfo = Value();
    fields_.frameworks = Value();
    fields_.hierarchyDictionary = Value();
    fields_.storebagVersion = Value();
    fields_.digestKey.clear();
  }
  if (backends) {
    for (const auto& [name, backend] : *backends) {
      backend->cleanup();
    }
    // A backend still flushing is held by its completion until it is done.
    backends.reset();
  }
  periodicServices_.clear();

  // Last: its HTTP session reports invalidation later, which releases the
  // agent's keep-alive count.
  if (connectivityHelper_) {
    connectivityHelper_->invalidate();
    connectivityHelper_.reset();
  }
}

// --- Properties --------------------------------------------------------------

std::uint32_t ZerithdSession::sessionID() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.sessionID;
}

void ZerithdSession::setSessionID(std::uint32_t sessionID) {
  std::lock_guard lock(fieldsMutex_);
  fields_.sessionID = sessionID;
}

Value ZerithdSession::storebagVersion() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.storebagVersion;
}

void ZerithdSession::setStorebagVersion(const Value& version) {
  std::lock_guard lock(fieldsMutex_);
  fields_.storebagVersion = version;
}

Value ZerithdSession::userInfo() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.userInfo;
}

Value ZerithdSession::sessionInfo() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.sessionInfo;
}

bool ZerithdSession::hasAggregator() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.hasAggregator;
}

void ZerithdSession::setHasAggregator(bool hasAggregator) {
  std::lock_guard lock(fieldsMutex_);
  fields_.hasAggregator = hasAggregator;
}

bool ZerithdSession::hasFinishedGracefully() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.hasFinishedGracefully;
}

std::uint32_t ZerithdSession::hierarchyLevel() const {
  std::lock_guard lock(fieldsMutex_);
  return static_cast<std::uint32_t>(fields_.hierarchyDictionary[kZerithHierarchyTokenLevel].intValue());
}

Value ZerithdSession::hierarchyToken() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.hierarchyDictionary[kZerithHierarchyTokenTokenID];
}

std::int64_t ZerithdSession::clientType() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.sessionInfo[kZerithSessionInfoClientType].intValue();
}

std::string ZerithdSession::deviceID() const { return std::string(deviceid_.data()); }

Value ZerithdSession::digestKey() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.digestKey.empty() ? Value() : Value(fields_.digestKey);
}

std::string ZerithdSession::description() const {
  return fmt::format("<ZerithdSession: {} sessionID={}>", sessionIDString_, sessionID());
}

bool ZerithdSession::hasBackendSet() const { return backends() != nullptr; }

std::shared_ptr<const BackendDictionary> ZerithdSession::backends() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.backends;
}

std::shared_ptr<ZerithBackend> ZerithdSession::backendNamed(std::string_view name) const {
  if (const auto set = backends()) {
    for (const auto& [n, backend] : *set) {
      if (n == name) {
        return backend;
      }
    }
  }
  return nullptr;
}

RankedMutex<std::mutex>& ZerithdSession::classLock() {
  static auto* lock = new RankedMutex<std::mutex>(LockRank::SessionClass, "the session class lock");
  return *lock;
}

// --- Configuration -----------------------------------------------------------

void ZerithdSession::setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                                    bool hasAggregationBlock) {
  const auto id = static_cast<std::uint32_t>(sessionInfo[kZerithSessionInfoSessionID].unsignedValue());
  setSessionID(id);
  logger().debug("setSessionInfo: Configuring session {}", id);
  if (!userInfo.isNil() && !sessionInfo[kZerithSessionInfoRequireUserInfo].boolValue()) {
    logger().error("setSessionInfo: Configure session: user info provided without requiring it");
  }
  {
    std::lock_guard lock(fieldsMutex_);
    fields_.sessionInfo = sessionInfo;
    const Value hierarchy = sessionInfo[kZerithSessionInfoHierarchyToken];
    fields_.hierarchyDictionary = hierarchy.isDict() ? hierarchy : Value();
  }
  // The level is read as unsigned: a negative one lands far above every
  // other level and finds no parent.
  if (const std::int64_t level = sessionInfo[kZerithSessionInfoHierarchyToken][kZerithHierarchyTokenLevel].intValue();
      level < 0) {
    logger().error("setSessionInfo: Session {} has the negative hierarchy level {}, taken as {}", id, level,
                   static_cast<std::uint32_t>(level));
  }
  if (const auto d = delegate()) {
    d->updateCorrelatedSessions(*this);
  }
  std::lock_guard lock(fieldsMutex_);
  fields_.frameworks = frameworksToCheck;
  fields_.userInfo = userInfo;
  fields_.hasAggregator = hasAggregationBlock;
}

void ZerithdSession::startConfigWithCompletionHandler(ValueCompletion completion) {
  logger().debug("startConfigWithCompletionHandler: Starting configuration for session {}", sessionID());
  const auto d = delegate();
  const Value storebag = d ? d->storebagForSession(*this) : Value();
  if (storebag.isNil()) {
    if (completion) {
      completion(Value());
    }
    return;
  }
  setStorebagVersion(d->storebagVersionForSession(*this));
  createBackendsWithStorebag(storebag);
  updateSessionWithDefaultSessionInfo();
  sendStartMessage();
  if (completion) {
    completion(fetchReportingStates());
  }
}

void ZerithdSession::fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completionHandler) {
  logger().debug("fetchStatesWithUserInfo: Fetching states for session {}", sessionID());
  receivedUserInfo(userInfo);
  if (completionHandler) {
    completionHandler(fetchReportingStates());
  }
}

void ZerithdSession::receivedUserInfo(const Value& userInfo) {
  bool changed = false;
  {
    std::lock_guard lock(fieldsMutex_);
    const Value& stored = fields_.userInfo;
    if (!stored.isNil()) {
      if (userInfo.isNil() && fields_.sessionInfo[kZerithSessionInfoRequireUserInfo].boolValue()) {
        return;
      }
      changed = stored[kZerithUserInfoClientName] != userInfo[kZerithUserInfoClientName] ||
                stored[kZerithUserInfoServiceName] != userInfo[kZerithUserInfoServiceName];
    } else {
      if (userInfo.isNil()) {
        return;
      }
      changed = true;
    }
    fields_.userInfo = userInfo;
  }
  updateUserInfoForBackends();
  if (changed) {
    logger().debug("receivedUserInfo: Received new user info for session {}", sessionID());
    updateSessionWithDefaultSessionInfo();
  }
}

void ZerithdSession::updateSessionWithDefaultSessionInfo() {
  updateReportingStates();
  if (const auto d = delegate()) {
    d->updateDownstreamSessions(*this);
  }
}

void ZerithdSession::sendStartMessage() {
  const double now = secondsNow();
  const Value locale = [] {
    const auto country = localeCountryCode();
    return country ? Value(*country) : Value("Unknown");
  }();
  const Value reportVersion = Value(frameworkBundleVersion().value_or("8.0"));
  const Value automatic = Defaults("com.velmar.timed").objectForKey("AutomaticTimeZoneEnabled");
  const bool automaticTimeSet = automatic.isNil() ? true : automatic.boolValue();

  Dictionary payload;
  if (isInternalBuild()) {
    payload.set("SerialNum", textOrUnknown(deviceSerialNumber()));
    payload.set("Version", textOrUnknown(deviceProductVersion()));
    payload.set("Build", textOrUnknown(deviceBuildVersion()));
    payload.set("Hardware", textOrUnknown(deviceHardwareModel()));
    payload.set("Product", textOrUnknown(deviceName()));
    payload.set("ReportVers", reportVersion);
    payload.set("Locale", locale);
    payload.set("AutomaticTimeSet", Value(automaticTimeSet));
  } else {
    payload.set("AutomaticTimeSet", Value(automaticTimeSet));
    payload.set("Locale", locale);
  }
  internalSendMessage(Value(std::move(payload)), now, 0, 0);
}

void ZerithdSession::fetchDisplayURL(ValueCompletion completion) {
  logger().debug("fetchDisplayURL: Fetching display URL for session {}", sessionID());
  // The HTTPS backends' display URL first, then the dashboard's.
  std::optional<std::string> url;
  for (const char* name : {kZerithBackendHTTPPost, kZerithBackendHTTPPost2}) {
    if (const auto backend = backendNamed(name); backend && (url = backend->displayURL())) {
      break;
    }
  }
  if (!url) {
    if (const auto dashboard = backendNamed(kZerithBackendDashboard)) {
      url = dashboard->displayURL();
    }
  }
  if (completion) {
    completion(Value(url.value_or("URL not available")));
  }
}

void ZerithdSession::finishSessionGracefully() {
  {
    std::lock_guard lock(fieldsMutex_);
    fields_.hasFinishedGracefully = true;
  }
  logger().debug("finishSessionGracefully: Session {} has been finished gracefully", sessionID());
}

// --- Backend set ---------------------------------------------------------------

void ZerithdSession::createBackendsWithStorebag(const Value& storebag) {
  logger().debug("createBackendsWithStorebag: Creating backends for session {}", sessionID());
  auto made = createBackends(storebag, sessionInfo(), userInfo(), processLifetimeDeviceID(deviceid_.data()));
  std::shared_ptr<const BackendDictionary> set;
  if (made) {
    for (const auto& [name, backend] : *made) {
      backend->setReportingSessionConnectivityDelegate(connectivityHelper_);
      backend->setCombinedSessionIDString(sessionIDString_);
    }
    set = std::make_shared<const BackendDictionary>(std::move(*made));
  }
  std::shared_ptr<const BackendDictionary> previous;
  {
    std::lock_guard lock(fieldsMutex_);
    previous = std::exchange(fields_.backends, std::move(set));
  }
  // A second configuration replaces the set; the old one finishes its work.
  if (previous) {
    for (const auto& [name, backend] : *previous) {
      backend->cleanup();
    }
  }
}

void ZerithdSession::updateUserInfoForBackends() {
  const auto set = backends();
  if (!set) {
    return;
  }
  Value user;
  Data key;
  std::int32_t algorithm = 0;
  {
    std::lock_guard lock(fieldsMutex_);
    user = fields_.userInfo;
    key = fields_.digestKey;
    algorithm = fields_.digestAlgorithm;
  }
  for (const auto& [name, backend] : *set) {
    backend->setUserInfoDict(user);
    if (name == kZerithBackendQRS) {
      backend->setDigestKey(key.empty() ? std::nullopt : std::optional<Data>(key));
      backend->setDigestAlgorithm(algorithm);
    }
  }
}

void ZerithdSession::updateReportingStates() {
  if (const auto set = backends()) {
    for (const auto& [name, backend] : *set) {
      backend->updateState();
    }
  }
}

void ZerithdSession::syncReportingStates() {
  const auto d = delegate();
  if (!d) {
    return;
  }
  // The parent is looked up under the agent lock; the states are read and
  // written after it is let go (each is a turn of a backend's queue).
  std::shared_ptr<ZerithdSession> parent;
  {
    std::lock_guard agentLock(d->agentLock());
    parent = d->parentSessionForChild(*this);
  }
  const auto set = backends();
  if (!set) {
    return;
  }
  const std::uint32_t level = hierarchyLevel();
  for (const auto& [name, backend] : *set) {
    if (!parent) {
      if (level != 0) {
        logger().info("syncReportingStates: child session {} (backend {}) with hierarchy {} is missing its parent",
                      sessionID(), name, level);
      }
      continue;
    }
    // A backend kept by its override threshold keeps its own decision.
    if (backend->state() == kBackendStateSampledOut) {
      continue;
    }
    const auto parentBackend = parent->backendNamed(name);
    if (!parentBackend) {
      backend->setState(kBackendStateDisabled);
      continue;
    }
    const std::int32_t state = parentBackend->state();
    const Value threshold = parentBackend->samplingThreshold();
    backend->setState(state);
    backend->setSamplingThreshold(threshold);
    logger().debug("HTTPSPostBackend(syncReportingStates): {}: state and sampling rate updated to {}, {:.02f}%", name,
                   state, threshold.doubleValue());
  }
}

Value ZerithdSession::fetchReportingStates() const {
  const auto set = backends();
  if (!set) {
    return {};
  }
  Array names;
  for (const auto& [name, backend] : *set) {
    if (isReporting(backend->state())) {
      names.emplace_back(name);
    }
  }
  return Value(std::move(names));
}

void ZerithdSession::updateCombinedSessionID() {
  const auto d = delegate();
  if (!d) {
    return;
  }
  const Value parentID = d->parentSessionIDStringForSession(*this);
  if (!parentID.string()) {
    return;
  }
  const std::string combined = fmt::format("{}.{}", *parentID.string(), sessionIDString_);
  logger().debug("updateCombinedSessionID: Updating combined session ID '{}' for session {} backends", combined,
                 sessionID());
  if (const auto set = backends()) {
    for (const auto& [name, backend] : *set) {
      backend->setCorrelatedSessionID(combined);
    }
  }
}

void ZerithdSession::addBackendCounts(Dictionary& payload) const {
  const auto set = backends();
  if (!set) {
    return;
  }
  // Flat keys, as the health figures: the HTTPS records carry no nested
  // dictionaries. A count of 0 is left out.
  for (const auto& [name, backend] : *set) {
    const BackendCountsSnapshot counts = backend->counters().snapshot();
    for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
      if (counts[i] != 0) {
        payload.set(fmt::format("{}_{}_{}", kBackendCountsKey, name, backendCountName(static_cast<BackendCount>(i))),
                    Value(counts[i]));
      }
    }
  }
}

std::uint32_t ZerithdSession::batchedEventsSize() const {
  std::uint32_t size = 0;
  if (const auto set = backends()) {
    for (const auto& [name, backend] : *set) {
      size += backend->batchedEventsSize();
    }
  }
  return size;
}

void ZerithdSession::setDigestKey(const Value& digestKey, std::int32_t algorithm) {
  const Data key = digestKey.data() ? *digestKey.data() : Data{};
  {
    std::lock_guard lock(fieldsMutex_);
    fields_.digestKey = key;
    // The algorithm goes to the digest backend only; it is not kept here.
  }
  if (const auto qrs = backendNamed(kZerithBackendQRS)) {
    qrs->setDigestKey(key.empty() ? std::nullopt : std::optional<Data>(key));
    qrs->setDigestAlgorithm(algorithm);
  }
}

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
    backend->counters().add(BackendCount::accepted);
    if (!backend->isWhitelistedEvent(category)) {
      logger().debug("sendMessageWithDictionary: Dropping event with category {} as it is not whitelisted for backend {}",
                     category, backend->name());
      backend->counters().add(BackendCount::droppedFiltered);
      continue;
    }
    if (backend->isBlacklistedEvent(category)) {
      logger().debug("sendMessageWithDictionary: Dropping event with category {} as it is blacklisted for backend {}",
                     category, backend->name());
      backend->counters().add(BackendCount::droppedBlacklisted);
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
    backend->counters().add(BackendCount::accepted);
    if (!backend->isWhitelistedEvent(category)) {
      logger().debug("sendMessageWithSessionInfo: Dropping event with category {} as it is not whitelisted for backend {}",
                     category, backend->name());
      backend->counters().add(BackendCount::droppedFiltered);
      continue;
    }
    if (backend->isBlacklistedEvent(category)) {
      logger().debug("sendMessageWithSessionInfo: Dropping event with category {} as it is blacklisted for backend {}",
                     category, backend->name());
      backend->counters().add(BackendCount::droppedBlacklisted);
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

// --- Shared data -------------------------------------------------------------------

void ZerithdSession::updateSharedDataWithDictionary(const Value& dictionary) {
  if (!dictionary.isDict()) {
    logger().error("updateSharedDataWithDictionary: Ignoring shared data of session {} as it is not a dictionary",
                   sessionID());
    return;
  }
  if (const auto d = delegate()) {
    std::lock_guard lock(d->agentLock());
    d->updateSharedDataForSession(*this, dictionary);
  }
}

void ZerithdSession::updateSharedDataForKey(const Value& key, const Value& value) {
  if (!key.string()) {
    logger().error("updateSharedDataForKey: Ignoring shared data without a string key for session {}", sessionID());
    return;
  }
  const auto d = delegate();
  if (!d) {
    return;
  }
  std::lock_guard lock(d->agentLock());
  if (value.isNil()) {
    d->removeObjectFromSharedDataForSession(*this, *key.string());
  } else {
    d->updateSharedDataForSession(*this, Value(Dictionary{{*key.string(), value}}));
  }
}

// --- Uploads -------------------------------------------------------------------------

void ZerithdSession::uploadFileAtPath(const Value& fileURL, const Value& /*extensionToken*/,
                                      BoolCompletion completionHandler) {
  // Without the descriptor (the token a client framework passes with the
  // call) there is nothing the daemon may read.
  uploadFileWithDescriptor(fileURL, nullptr, [completionHandler = std::move(completionHandler)](bool ok, bool) {
    if (completionHandler) {
      completionHandler(ok);
    }
  });
}

void ZerithdSession::uploadFileWithDescriptor(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                              UploadCompletion completion) {
  logger().debug("uploadFileAtPath: Uploading file for session {}", sessionID());
  uploadFileWithURL(fileURL, std::move(descriptor), std::move(completion));
}

void ZerithdSession::uploadFileWithURL(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                       UploadCompletion completion) {
  const std::string url = fileURL.string() ? *fileURL.string() : std::string();
  const std::string path = ipc::wire::filePathOfURL(url);
  const std::string shownPath = log::escaped(path);
  const std::string absoluteURL = log::escaped(url.starts_with("file://") ? url : "file://" + path);

  // What the backends hear about once all have answered.
  struct Answers {
    std::mutex mutex;
    std::size_t outstanding = 0;
    bool uploaded = false;
    bool removeFile = false;
  };
  auto answers = std::make_shared<Answers>();
  const auto done = [answers, shownPath, absoluteURL, completion = std::move(completion)]() {
    const bool uploaded = answers->uploaded;
    if (uploaded) {
      logger().debug("uploadFileWithURL: File upload successful for {}", shownPath);
    } else {
      logger().error("uploadFileWithURL: File upload failed for {}", shownPath);
    }
    writeToLogFile("[uploadFileWithURL] Upload {} for file {}", uploaded ? "succeeded" : "failed", absoluteURL);
    if (completion) {
      completion(uploaded, uploaded && answers->removeFile);
    }
  };

  // The file is read only through the descriptor the client passed; the
  // path is the file's name, nothing more.
  std::string why;
  UploadRequest request;
  request.name = ipc::wire::lastPathComponent(path);
  request.deadline = std::chrono::steady_clock::now() + UploadLimits::fromDefaults().timeLimit;
  request.file = sandbox::GrantedFile::adopt(std::move(descriptor), request.name, &why);
  if (const auto connection = connection_.lock()) {
    request.client = connection->peer().uid;
  }
  const auto set = backends();
  if (!request.file) {
    logger().error("uploadFileWithURL: Refusing to upload {}: {}", shownPath, why);
  }
  if (!request.file || !set || set->empty()) {
    done();
    return;
  }
  answers->outstanding = set->size();
  for (const auto& [name, backend] : *set) {
    // Every backend is asked, also after one has taken the file; the answer
    // leaves once all have answered, from whichever thread answered last.
    backend->uploadFileAtPath(request, [answers, done](bool taken, bool serverSucceeded) {
      {
        std::lock_guard lock(answers->mutex);
        answers->uploaded = answers->uploaded || taken;
        answers->removeFile = answers->removeFile || serverSucceeded;
        if (--answers->outstanding > 0) {
          return;
        }
      }
      done();
    });
  }
}

void ZerithdSession::uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) {
  bool uploaded = false;
  if (const auto set = backends()) {
    for (const auto& [name, backend] : *set) {
      uploaded = backend->uploadLogData(logData) || uploaded;
    }
  }
  if (uploaded) {
    logger().debug("uploadLogData: Log data array upload successful");
  } else {
    logger().error("uploadLogData: Log data array upload failed");
  }
  // No error object is ever passed: the reasons stay in the backends' logs.
  if (completionHandler) {
    completionHandler(uploaded, std::nullopt);
  }
}

}  // namespace zerith
