#include "session/ZerithdSession.h"
#include "session/ZerithdSessionHelpers.h"

#include <sys/time.h>

#include <fmt/format.h>

#include "backends/CreateBackends.h"
#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "ipc/ClientSessionReplyProxy.h"
#include "ipc/Connection.h"
#include "platform/DefaultsKeys.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "platform/Log.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "zerith/ZerithBundle.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

using session_detail::logger;
using session_detail::processLifetimeDeviceID;
using session_detail::textOrUnknown;

namespace {

double secondsNow() {
  timeval tv{};
  gettimeofday(&tv, nullptr);
  return timevalToSeconds(tv);
}

// The reporting states: 2 enabled, 3 sampled out but kept by an override.
bool isReporting(std::int32_t state) { return state == kBackendStateEnabled || state == kBackendStateSampledOut; }

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
  constexpr const DefaultsSetting& automaticSetting = defaultsSetting("AutomaticTimeZoneEnabled", kTimedDomain);
  const Value automatic = Defaults(std::string(kTimedDomain)).objectForKey(automaticSetting.key);
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

}  // namespace zerith
