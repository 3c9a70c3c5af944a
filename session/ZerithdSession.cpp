#include "session/ZerithdSession.h"

#include <sys/time.h>

#include <fmt/format.h>

#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "config/MessageLog.h"
#include "ipc/ClientSessionReplyProxy.h"
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
  static const log::Logger l("session");
  return l;
}

constexpr char kNoBackends[] = "No backends available to send message";

Value textOrUnknown(const Value& v) { return v.string() ? v : Value("Unknown"); }

// The file-system path of a file URL ("file:///a%20b" -> "/a b", an
// optional "localhost" host); anything that is not a file URL is taken as
// a path as it stands.
std::string filePathOfURL(const std::string& url) {
  if (!url.starts_with("file://")) {
    return url;
  }
  std::string rest = url.substr(7);
  if (rest.starts_with("localhost/")) {
    rest = rest.substr(9);
  }
  std::string path;
  for (std::size_t i = 0; i < rest.size(); ++i) {
    const auto hex = [](char c) -> int {
      if (c >= '0' && c <= '9') return c - '0';
      if (c >= 'a' && c <= 'f') return c - 'a' + 10;
      if (c >= 'A' && c <= 'F') return c - 'A' + 10;
      return -1;
    };
    if (rest[i] == '%' && i + 2 < rest.size() && hex(rest[i + 1]) >= 0 && hex(rest[i + 2]) >= 0) {
      path.push_back(static_cast<char>(hex(rest[i + 1]) * 16 + hex(rest[i + 2])));
      i += 2;
    } else {
      path.push_back(rest[i]);
    }
  }
  return path;
}

double secondsNow() {
  timeval tv{};
  gettimeofday(&tv, nullptr);
  return static_cast<double>(tv.tv_sec) + static_cast<double>(tv.tv_usec) / 1000000.0;
}

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
    std::lock_guard lock(d->agentLock());
    d->addAgentHealthInfoForSession(*this, payload);
  }
  if (hasBackendSet()) {
    internalSendMessage(Value(payload), now, 0, 1);
    internalFlushMessagesWithCompletion(nullptr);
  }
  shutdownSessionAggregation();

  {
    std::lock_guard lock(fieldsMutex_);
    fields_.sessionInfo = Value();
    fields_.userInfo = Value();
    fields_.frameworks = Value();
    fields_.backendNames.reset();
    fields_.hierarchyDictionary = Value();
    fields_.storebagVersion = Value();
    fields_.digestKey.clear();
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

bool ZerithdSession::hasBackendSet() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.backendNames.has_value();
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
  // The HTTPS backends' display URL first, then the dashboard's; no backend
  // kind exists yet that has one.
  if (completion) {
    completion(Value("URL not available"));
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

void ZerithdSession::createBackendsWithStorebag(const Value& /*storebag*/) {
  logger().debug("createBackendsWithStorebag: Creating backends for session {}", sessionID());
  // Seam: the backend kinds and their factory do not exist yet, so a storebag
  // yields an empty backend set. The session is then configured (a start
  // message and an end message are dispatched, flushes complete) but reports
  // no enabled backend. Once the factory lands, this builds the set from the
  // storebag's environment section and gives every backend the session's
  // connectivity helper and session ID string.
  std::lock_guard lock(fieldsMutex_);
  fields_.backendNames.emplace();
}

void ZerithdSession::updateUserInfoForBackends() {
  // Every backend receives the user info; the digest backend also the key.
}

void ZerithdSession::updateReportingStates() {
  // Every backend decides its state from the storebag.
}

void ZerithdSession::syncReportingStates() {
  const auto d = delegate();
  if (!d) {
    return;
  }
  std::lock_guard agentLock(d->agentLock());
  const auto parent = d->parentSessionForChild(*this);
  std::vector<std::string> names;
  {
    std::lock_guard lock(fieldsMutex_);
    if (fields_.backendNames) {
      names = *fields_.backendNames;
    }
  }
  const std::uint32_t level = hierarchyLevel();
  for (const auto& name : names) {
    if (!parent && level != 0) {
      logger().info("syncReportingStates: child session {} (backend {}) with hierarchy {} is missing its parent",
                    sessionID(), name, level);
    }
  }
}

Value ZerithdSession::fetchReportingStates() const {
  std::lock_guard lock(fieldsMutex_);
  if (!fields_.backendNames) {
    return {};
  }
  // Names of the backends in state 2 or 3.
  return Value(Array{});
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
  // Every backend takes the combined identifier (setCorrelatedSessionID:).
}

std::uint32_t ZerithdSession::batchedEventsSize() const { return 0; }

void ZerithdSession::setDigestKey(const Value& digestKey, std::int32_t /*algorithm*/) {
  std::lock_guard lock(fieldsMutex_);
  fields_.digestKey = digestKey.data() ? *digestKey.data() : Data{};
  // The algorithm goes to the digest backend only; it is not kept here.
}

// --- Dispatch ------------------------------------------------------------------

void ZerithdSession::sendMessageWithDictionary(const Value& message, ValueCompletion reply) {
  logger().debug("sendMessageWithDictionary: Sending message for session {}", sessionID());
  Value result = sendMessageWithDictionary(message);
  if (reply) {
    reply(std::move(result));
  }
}

Value ZerithdSession::sendMessageWithDictionary(const Value& message) {
  if (!hasBackendSet()) {
    logger().debug("sendMessageWithDictionary: No backends available to send message");
    return {};
  }
  if (message[kZerithMessageParametersCategory].isNil()) {
    logger().debug("sendMessageWithDictionary: Missing mandatory parameter 'category'");
    return {};
  }
  if (message[kZerithMessageParametersType].isNil()) {
    logger().debug("sendMessageWithDictionary: Missing mandatory parameter 'type'");
    return {};
  }
  const auto category = static_cast<std::uint16_t>(message[kZerithMessageParametersCategory].unsignedValue());
  const auto type = static_cast<std::uint16_t>(message[kZerithMessageParametersType].unsignedValue());
  const Value payload = message[kZerithMessageParametersPayload];
  const double now = secondsNow();

  aggregateMessage(sessionInfo(), now, category, type, payload);

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
  // Every backend of the set that passes its lists receives the event; the
  // set is empty until the backend kinds exist.
  return {};
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
  if (!hasBackendSet()) {
    logger().debug("internalFlushMessagesWithCompletion: {}", kNoBackends);
    if (completion) {
      completion(Value(), makeZerithError(kNoBackends, -1));
    }
    return;
  }
  // The join over the backends' flushes completes at the first error or at
  // the last backend. An empty set has no last backend: it completes at once
  // rather than never.
  if (completion) {
    completion(Value(), std::nullopt);
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

void ZerithdSession::sendMessageWithSessionInfo(const Value& sessionInfo, const Value& /*userInfo*/,
                                                const Value& storebag, std::uint16_t /*category*/,
                                                std::uint16_t /*type*/, const Value& /*payload*/) {
  logger().debug("sendMessageWithSessionInfo: Sending single message with sessionID {}",
                 sessionInfo[kZerithSessionInfoSessionID].intValue());
  if (sessionInfo.isNil() || storebag.isNil()) {
    logger().error("RsendMessageWithSessionInfo: Attempted to send message with one or more nil parameters");
    return;
  }
  // The throw-away backend set comes from the backend factory, which does
  // not exist yet: nothing can carry the event.
  logger().error("sendMessageWithSessionInfo: No backends available to send single message");
}

// --- Shared data -------------------------------------------------------------------

void ZerithdSession::updateSharedDataWithDictionary(const Value& dictionary) {
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

void ZerithdSession::uploadFileAtPath(const Value& fileURL, const Value& extensionToken,
                                      BoolCompletion completionHandler) {
  logger().debug("uploadFileAtPath: Uploading file for session {}", sessionID());
  uploadFileWithURL(fileURL, extensionToken, std::move(completionHandler));
}

void ZerithdSession::uploadFileWithURL(const Value& fileURL, const Value& /*extensionToken*/,
                                       BoolCompletion completionHandler) {
  const std::string url = fileURL.string() ? *fileURL.string() : std::string();
  const std::string path = filePathOfURL(url);
  const std::string absoluteURL = url.starts_with("file://") ? url : "file://" + path;

  // Linux has no sandbox extensions: the token the client sent proves
  // nothing. The daemon opens the file itself for the client's identity, as
  // the socket reported it at connect time, and hands its backends a token
  // of its own that stands for that opening; they read and delete only
  // through it.
  bool uploaded = false;
  std::string why;
  std::shared_ptr<sandbox::GrantedFile> file;
  if (const auto connection = connection_.lock()) {
    const ipc::PeerCredentials& peer = connection->peer();
    file = sandbox::GrantedFile::open(path, sandbox::Identity{peer.uid, peer.gid}, &why);
  } else {
    why = "the client has gone";
  }
  if (file) {
    const std::string token = sandbox::issueExtension(file);
    for (const auto& [name, backend] : backendsSnapshot()) {
      // Every backend is asked, also after one has taken the file.
      uploaded = backend->uploadFileAtPath(path, token.c_str()) || uploaded;
    }
    sandbox::revokeExtension(token);
  } else {
    logger().error("uploadFileWithURL: Refusing to upload {}: {}", path, why);
  }

  if (uploaded) {
    logger().debug("uploadFileWithURL: File upload successful for {}", path);
  } else {
    logger().error("uploadFileWithURL: File upload failed for {}", path);
  }
  writeToLogFile("[uploadFileWithURL] Upload {} for file {}", uploaded ? "succeeded" : "failed", absoluteURL);
  if (completionHandler) {
    completionHandler(uploaded);
  }
}

void ZerithdSession::uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) {
  bool uploaded = false;
  for (const auto& [name, backend] : backendsSnapshot()) {
    uploaded = backend->uploadLogData(logData) || uploaded;
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

BackendDictionary ZerithdSession::backendsSnapshot() const {
  // The session holds no backend objects yet; the backend set replaces this.
  return {};
}

}  // namespace zerith
