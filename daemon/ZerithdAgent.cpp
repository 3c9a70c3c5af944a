#include "daemon/ZerithdAgent.h"

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <string_view>

#include <fmt/format.h>

#include "config/Conversions.h"
#include "config/SenderCodes.h"
#include "config/StorebagVerify.h"
#include "ipc/ClientSessionExporter.h"
#include "ipc/Connection.h"
#include "platform/Log.h"
#include "session/ZerithdSession.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* l = new log::Logger("daemon");
  return *l;
}

constexpr std::string_view kEntitlement = "com.velmar.private.zerithd";

// A nil string as the system's own logs print it.
std::string textOf(const Value& v) { return v.string() ? *v.string() : std::string("(null)"); }

template <typename Table>
auto* entryFor(Table& table, const std::string& token) {
  auto it = std::find_if(table.begin(), table.end(), [&](const auto& e) { return e.first == token; });
  return it == table.end() ? nullptr : &it->second;
}

bool holds(const ZerithdAgent::SessionList& list, const ZerithdSession& session) {
  return std::any_of(list.begin(), list.end(), [&](const auto& w) { return w.lock().get() == &session; });
}

// Removes the session and every entry whose session is gone.
void removeFrom(ZerithdAgent::SessionList& list, const ZerithdSession& session) {
  std::erase_if(list, [&](const auto& w) {
    const auto s = w.lock();
    return !s || s.get() == &session;
  });
}

}  // namespace

std::shared_ptr<ZerithdAgent> ZerithdAgent::create(std::shared_ptr<KeepAliveTransaction> transaction,
                                                   std::unique_ptr<StorebagCache> storebags) {
  return std::shared_ptr<ZerithdAgent>(new ZerithdAgent(std::move(transaction), std::move(storebags)));
}

ZerithdAgent::ZerithdAgent(std::shared_ptr<KeepAliveTransaction> transaction, std::unique_ptr<StorebagCache> storebags)
    : cachedStorebags_(std::move(storebags)), transaction_(std::move(transaction)) {
  if (!cachedStorebags_) {
    cachedStorebags_ = std::make_unique<StorebagCache>();
  }
}

ZerithdAgent::~ZerithdAgent() {
  // The containers go in this order: shared data, sessions, storebags, hierarchy.
  sharedData_.clear();
  sessionList_.clear();
  cachedStorebags_.reset();
  correlatedSessions_.clear();
}

std::string ZerithdAgent::description() const { return fmt::format("<ZerithdAgent: {}>", fmt::ptr(this)); }

// --- Connections -------------------------------------------------------------

bool ZerithdAgent::shouldAcceptNewConnection(ipc::Listener& /*listener*/, std::shared_ptr<ipc::Connection> connection) {
  const Value entitlement = connection->valueForEntitlement(std::string(kEntitlement));
  if (!(entitlement.isBool() && entitlement.boolValue())) {
    const ipc::PeerCredentials& peer = connection->peer();
    refusals_.log(peer.uid, "listener: refusing a client (uid {}, gid {}, pid {} at connect): it lacks the entitlement {}",
                  peer.uid, peer.gid, peer.pid, kEntitlement);
    return false;
  }

  std::size_t sessions = 0;
  std::size_t tokens = 0;
  {
    std::lock_guard lock(lock_);
    sessions = sessionList_.size();
    tokens = correlatedSessions_.size();
  }
  logger().debug("listener: Accepting new Vesk connection {} as it has proper entitlement, {}({}) connections.",
                 connection->description(), sessions, tokens);

  auto session = createReportingSessionWithDelegate(weak_from_this(), connection);
  if (!session) {
    logger().error("listener: Unable to create a session for connection {}. Closing connection...",
                   connection->description());
    return false;
  }
  auto exporter = std::make_shared<ipc::ClientSessionExporter>(session, connection->description(),
                                                                connection->peer().uid);
  // The status shows every client's sessions: it takes an entitlement of its
  // own, looked up now as the one that admitted the peer.
  const Value statusEntitlement = connection->valueForEntitlement(ipc::kDaemonStatusEntitlement);
  const bool mayReadStatus = statusEntitlement.isBool() && statusEntitlement.boolValue();
  exporter->setStatusHandler([weakAgent = weak_from_this(), weakSession = std::weak_ptr<ZerithdSession>(session),
                              mayReadStatus, peer = connection->description()](auto completion) {
    if (!mayReadStatus) {
      const std::string text = fmt::format("the daemon's status needs the entitlement {}", ipc::kDaemonStatusEntitlement);
      logger().error("listener: refusing the status to {}: {}", peer, text);
      completion(Value(), makeZerithError(text, -1));
      return;
    }
    const auto agent = weakAgent.lock();
    if (!agent) {
      completion(Value(), makeZerithError("the daemon is shutting down", -1));
      return;
    }
    const auto asking = weakSession.lock();
    completion(agent->daemonStatus(asking.get()).toValue(), std::nullopt);
  });
  connection->setExportedObject(std::move(exporter));

  connection->setInterruptionHandler([weakSession = std::weak_ptr<ZerithdSession>(session)] {
    const auto s = weakSession.lock();
    logger().debug("listener: Vesk connection to {} was interrupted", s ? s->description() : std::string("(null)"));
  });
  connection->setInvalidationHandler([agent = shared_from_this(), session] {
    logger().debug("listener: Vesk connection to {} was invalidated", session->description());
    agent->invalidateReportingSession(session);
  });
  connection->resume();
  return true;
}

std::shared_ptr<ZerithdSession> ZerithdAgent::createReportingSessionWithDelegate(
    std::weak_ptr<ZerithdSessionDelegate> delegate, std::shared_ptr<ipc::Connection> connection) {
  auto session = ZerithdSession::initWithSessionDelegate(std::move(delegate), std::move(connection));
  if (!session) {
    return nullptr;
  }
  std::lock_guard lock(lock_);
  std::lock_guard keepAlive(keepAliveLock_);
  if (sessionList_.empty()) {
    transaction_->begin();
    logger().debug("createReportingSessionWithDelegate: Vesk transaction started with session {}",
                   session->description());
  }
  sessionList_.push_back(session);
  ++VeskTransactionReference_;
  logger().info("createReportingSessionWithDelegate: retained VeskTransaction. Ref count is {}",
                VeskTransactionReference_);
  return session;
}

void ZerithdAgent::invalidateReportingSession(const std::shared_ptr<ZerithdSession>& session) {
  if (!session) {
    return;
  }
  std::shared_ptr<ZerithdSession> unlisted;
  {
    std::lock_guard lock(lock_);
    const Value token = session->hierarchyToken();
    if (token.string()) {
      if (auto* list = correlatedListFor(*token.string())) {
        removeFrom(*list, *session);
      }
      // Deliberately the whole table, not the token's list: a token's
      // (possibly empty) list and its shared data stay while other tokens
      // exist.
      if (correlatedSessions_.empty()) {
        std::erase_if(correlatedSessions_, [&](const auto& e) { return e.first == *token.string(); });
        std::erase_if(sharedData_, [&](const auto& e) { return e.first == *token.string(); });
      }
    }
    const auto it = std::find(sessionList_.begin(), sessionList_.end(), session);
    if (it != sessionList_.end()) {
      unlisted = std::move(*it);
      sessionList_.erase(it);
    }
    logger().debug("invalidateReportingSession: ZerithdSession {} was invalidated", session->description());
  }
  if (unlisted) {
    // The list's reference goes on a later turn, outside the caller's
    // callback and outside the lock.
    releaseQueue_.async([unlisted = std::move(unlisted)]() mutable { unlisted.reset(); });
  }
}

void ZerithdAgent::releaseVeskTransaction() {
  // The transport's queue calls this: it takes the keep-alive lock alone,
  // never the agent lock, whose holder may wait for that very queue.
  std::lock_guard lock(keepAliveLock_);
  --VeskTransactionReference_;
  logger().info("releaseVeskTransaction: Vesk transaction ref count is {}", VeskTransactionReference_);
  if (VeskTransactionReference_ == 0) {
    transaction_->end();
    logger().info("releaseVeskTransaction: Vesk transaction ended");
  }
}

// --- Storebags -----------------------------------------------------------------

Value ZerithdAgent::storebagForSession(ZerithdSession& session) {
  const auto clientType = static_cast<std::int32_t>(session.clientType());
  // The cache's own lock, let go during a fetch: a first fetch waits for the
  // storebag server without holding anything other sessions need.
  return cachedStorebags_->storebagForClientType(clientType, session.sessionID());
}

Value ZerithdAgent::storebagVersionForSession(ZerithdSession& session) {
  const auto clientType = static_cast<std::int32_t>(session.clientType());
  return cachedStorebags_->storebagVersionForClientType(clientType);
}

std::size_t ZerithdAgent::dropCachedStorebags() {
  return cachedStorebags_->drop();
}

// --- Hierarchy -----------------------------------------------------------------

ZerithdAgent::SessionList* ZerithdAgent::correlatedListFor(const std::string& token) {
  return entryFor(correlatedSessions_, token);
}

Dictionary* ZerithdAgent::sharedDataFor(const std::string& token) { return entryFor(sharedData_, token); }

std::shared_ptr<ZerithdSession> ZerithdAgent::getFirstSessionWithHierarchy(std::int64_t level, const SessionList& list) {
  for (const auto& w : list) {
    if (auto s = w.lock(); s && static_cast<std::int64_t>(s->hierarchyLevel()) == level) {
      return s;
    }
  }
  return nullptr;
}

void ZerithdAgent::updateCorrelatedSessions(ZerithdSession& session) {
  const Value token = session.hierarchyToken();
  if (!token.string()) {
    logger().info("updateCorrelatedSessions: Session {} has no correlated sessions as it is a standalone session",
                  session.sessionID());
    return;
  }
  std::lock_guard lock(lock_);
  for (auto& [t, list] : correlatedSessions_) {
    removeFrom(list, session);
  }
  auto* list = correlatedListFor(*token.string());
  if (!list) {
    correlatedSessions_.emplace_back(*token.string(), SessionList{});
    list = &correlatedSessions_.back().second;
  }
  if (!holds(*list, session)) {
    logger().debug("updateCorrelatedSessions: Adding session {} to list for hierarchyToken {} with hierarchyLevel {}",
                   session.sessionID(), *token.string(), session.hierarchyLevel());
    list->push_back(session.weak_from_this());
  }
}

Value ZerithdAgent::parentSessionIDStringForSession(ZerithdSession& session) {
  const Value token = session.hierarchyToken();
  const std::int64_t level = session.hierarchyLevel();
  if (level == 0 || !token.string()) {
    return {};
  }
  logger().debug("parentSessionIDStringForSession: Checking hierarchyToken '{}' for session {}", *token.string(),
                 session.sessionID());
  std::lock_guard lock(lock_);
  const auto* list = correlatedListFor(*token.string());
  if (!list || list->empty()) {
    logger().error("parentSessionIDStringForSession: ERROR: No sessions found for hierarchyToken {}", *token.string());
    return {};
  }
  if (!holds(*list, session)) {
    logger().info("parentSessionIDStringForSession: Session {} not found for hierarchyToken {}", session.sessionID(),
                  *token.string());
    return {};
  }
  Value parentID;
  for (std::int64_t l = level - 1; l >= 0; --l) {
    const auto ancestor = getFirstSessionWithHierarchy(l, *list);
    if (!ancestor) {
      logger().info(
          "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete "
          "parentSessionID is '{}'",
          textOf(parentID));
      break;
    }
    parentID = parentID.string() ? Value(fmt::format("{}.{}", ancestor->sessionIDString(), *parentID.string()))
                                 : Value(ancestor->sessionIDString());
  }
  return parentID;
}

std::shared_ptr<ZerithdSession> ZerithdAgent::parentSessionForChild(ZerithdSession& session) {
  const Value token = session.hierarchyToken();
  const std::int64_t level = session.hierarchyLevel();
  if (level == 0 || !token.string()) {
    return nullptr;
  }
  logger().debug("parentSessionForChild: Checking hierarchyToken '{}' for session {}", *token.string(),
                 session.sessionID());
  // Callers hold the lock already; taking it again (it is recursive) keeps
  // the table consistent for callers that do not.
  std::lock_guard lock(lock_);
  const auto* list = correlatedListFor(*token.string());
  if (!list || list->empty()) {
    logger().error("parentSessionForChild: ERROR: No sessions found for hierarchyToken {}", *token.string());
    return nullptr;
  }
  if (!holds(*list, session)) {
    logger().error("parentSessionForChild: ERROR: Session {} not found for hierarchyToken {}", session.sessionID(),
                   *token.string());
    return nullptr;
  }
  auto parent = getFirstSessionWithHierarchy(level - 1, *list);
  if (!parent) {
    logger().info("parentSessionForChild: Unable to find session with hierarchy of {} for hierarchyToken '{}'",
                  level - 1, *token.string());
  }
  return parent;
}

std::shared_ptr<ZerithdSession> ZerithdAgent::getAncestorWithAggregatorForSession(ZerithdSession& session) {
  const Value token = session.hierarchyToken();
  const std::int64_t level = session.hierarchyLevel();
  if (!token.string() || level < 1) {
    return nullptr;
  }
  std::lock_guard lock(lock_);
  const auto* list = correlatedListFor(*token.string());
  if (!list) {
    return nullptr;
  }
  // From the root down: the ancestor nearest the root wins. Only the first
  // session of a level counts. Levels nobody holds give nothing, so the walk
  // goes over the levels present in the list, not over every number below
  // the session's level (a client may claim a level in the billions).
  std::vector<std::int64_t> levels;
  for (const auto& w : *list) {
    if (const auto s = w.lock()) {
      if (const std::int64_t l = s->hierarchyLevel(); l < level) {
        levels.push_back(l);
      }
    }
  }
  std::sort(levels.begin(), levels.end());
  levels.erase(std::unique(levels.begin(), levels.end()), levels.end());
  for (const std::int64_t l : levels) {
    if (auto ancestor = getFirstSessionWithHierarchy(l, *list); ancestor && ancestor->hasAggregator()) {
      return ancestor;
    }
  }
  return nullptr;
}

void ZerithdAgent::updateDownstreamSessions(ZerithdSession& session) {
  const Value token = session.hierarchyToken();
  if (!token.string()) {
    return;
  }
  // The table is read under the lock; the backends are updated after it is
  // let go (their updates wait for the backends' queues). Each step below
  // takes the lock again for its own lookup.
  const std::uint32_t level = session.hierarchyLevel();
  bool hasAncestorAggregator = false;
  SessionList descendants;
  {
    std::lock_guard lock(lock_);
    hasAncestorAggregator = level >= 1 && getAncestorWithAggregatorForSession(session);
    if (const auto* list = correlatedListFor(*token.string())) {
      descendants = *list;
    }
  }
  session.updateCombinedSessionID();
  session.syncReportingStates();
  bool shutDown = false;
  if (hasAncestorAggregator) {
    session.shutdownSessionAggregation();
    shutDown = true;
  }
  const bool askingHasAggregator = session.hasAggregator();
  for (const auto& w : descendants) {
    const auto s = w.lock();
    if (!s || s->hierarchyLevel() <= level) {
      continue;
    }
    logger().debug("updateDownstreamSessions: Updating combined session ID and syncing reporting states for session {}",
                   s->sessionID());
    s->updateCombinedSessionID();
    s->syncReportingStates();
    if ((askingHasAggregator || shutDown) && s->hasAggregator()) {
      s->shutdownSessionAggregation();
    }
  }
}

// --- Shared data and health ----------------------------------------------------

void ZerithdAgent::updateSharedDataForSession(ZerithdSession& session, const Value& sharedData) {
  const Value token = session.hierarchyToken();
  if (!token.string()) {
    return;
  }
  const auto* entries = sharedData.dict();
  if (!entries) {
    logger().error("updateSharedDataForSession: Ignoring shared data of session {} as it is not a dictionary",
                   session.sessionID());
    return;
  }
  std::lock_guard lock(lock_);
  auto* data = sharedDataFor(*token.string());
  Dictionary merged = data ? *data : Dictionary{};
  for (const auto& [key, value] : *entries) {
    merged.set(key, value);
  }
  // Every event of the hierarchy carries a copy: the data stays small.
  if (const std::size_t size = estimatedPlistMemorySize(Value(merged)); size > kSharedDataSizeLimit) {
    logger().error(
        "updateSharedDataForSession: Refusing shared data of session {} for hierarchyToken {}: {} bytes exceed the "
        "limit of {}",
        session.sessionID(), *token.string(), size, kSharedDataSizeLimit);
    return;
  }
  if (!data) {
    sharedData_.emplace_back(*token.string(), Dictionary{});
    data = &sharedData_.back().second;
  }
  *data = std::move(merged);
}

void ZerithdAgent::removeObjectFromSharedDataForSession(ZerithdSession& session, const std::string& key) {
  const Value token = session.hierarchyToken();
  if (!token.string()) {
    return;
  }
  std::lock_guard lock(lock_);
  if (auto* data = sharedDataFor(*token.string())) {
    data->erase(key);
  }
}

Value ZerithdAgent::sharedDataForSession(ZerithdSession& session) {
  const Value token = session.hierarchyToken();
  if (!token.string()) {
    return {};
  }
  std::lock_guard lock(lock_);
  const auto* data = sharedDataFor(*token.string());
  return data ? Value(*data) : Value();
}

std::uint32_t ZerithdAgent::addSessionHealthInfo(ZerithdSession& session, Dictionary& healthReport) {
  const std::string code(healthSenderCode(session.clientType()));
  const std::string sessionsKey = fmt::format("{}_{}", "SessionsCount", code);
  healthReport.set(sessionsKey, Value(healthReport.get(sessionsKey).unsignedValue() + 1));
  const std::uint32_t size = session.batchedEventsSize();
  const std::string batchKey = fmt::format("{}_{}", "BatchSize", code);
  healthReport.set(batchKey, Value(static_cast<std::uint32_t>(healthReport.get(batchKey).unsignedValue() + size)));
  return size;
}

void ZerithdAgent::addAgentHealthInfoForSession(ZerithdSession& session, Dictionary& payload) {
  // The figures come from the backends' queues: gathered with no lock held,
  // from a copy of the list taken under the agent lock.
  lockrank::assertNoLockHeld("the health figures");
  std::vector<std::shared_ptr<ZerithdSession>> sessions;
  {
    std::lock_guard lock(lock_);
    sessions = sessionList_;
  }
  std::uint64_t batches = 0;
  for (const auto& s : sessions) {
    batches += addSessionHealthInfo(*s, payload);
  }
  batches += addSessionHealthInfo(session, payload);
  // A session that was unlisted meanwhile is let go on the release queue,
  // as every unlisted session is, not inside this caller.
  releaseQueue_.async([sessions = std::move(sessions)] {});
  const std::uint64_t storebagsSize = cachedStorebags_->estimatedSize();
  payload.set("StorebagsCount", Value(static_cast<std::uint64_t>(cachedStorebags_->count())));
  payload.set("StorebagsSize", Value(storebagsSize));
  payload.set("CalculatedMemoryUsage", Value(batches + storebagsSize));
  payload.set("ProcessMemoryUsage", Value(processMemoryUsage()));
}

void ZerithdAgent::backendsOfEndedSession(ZerithdSession& session, const BackendDictionary& backends) {
  const std::int64_t clientType = session.clientType();
  std::lock_guard lock(lock_);
  for (const auto& entry : backends) {
    const std::string& name = entry.first;
    auto total = std::find_if(endedTotals_.begin(), endedTotals_.end(),
                              [&](const EndedTotal& t) { return t.clientType == clientType && t.name == name; });
    if (total == endedTotals_.end()) {
      endedTotals_.push_back(EndedTotal{clientType, name, 0, {}});
      total = std::prev(endedTotals_.end());
    }
    ++total->sessions;
    endedBackends_.push_back(EndedBackend{clientType, name, entry.second->sharedCounters()});
  }
  foldEndedBackends();
}

void ZerithdAgent::foldEndedBackends() {
  std::lock_guard lock(lock_);
  // Held by nobody else: the backend has gone and its counts are final.
  std::erase_if(endedBackends_, [&](const EndedBackend& e) {
    if (e.counters.use_count() != 1) {
      return false;
    }
    auto total = std::find_if(endedTotals_.begin(), endedTotals_.end(),
                              [&](const EndedTotal& t) { return t.clientType == e.clientType && t.name == e.name; });
    if (total == endedTotals_.end()) {  // every ended backend has its total; kept safe all the same
      endedTotals_.push_back(EndedTotal{e.clientType, e.name, 0, {}});
      total = std::prev(endedTotals_.end());
    }
    const BackendCountsSnapshot counts = e.counters->snapshot();
    for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
      total->counts[i] += counts[i];
    }
    return true;
  });
}

namespace {

ipc::CountList countList(const BackendCountsSnapshot& counts) {
  ipc::CountList list;
  for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
    list.emplace_back(std::string(backendCountName(static_cast<BackendCount>(i))), counts[i]);
  }
  return list;
}

}  // namespace

ipc::DaemonStatus ZerithdAgent::daemonStatus(const ZerithdSession* asking) {
  ipc::DaemonStatus status;
  // A backend's state is a turn of its queue: read after the lock is let go.
  std::vector<std::shared_ptr<ZerithdSession>> sessions;
  {
    std::lock_guard lock(lock_);
    sessions = sessionList_;
  }
  for (const auto& session : sessions) {
    if (session.get() == asking) {
      continue;
    }
    ipc::SessionStatus entry;
    entry.sessionID = session->sessionID();
    entry.sessionIDString = session->sessionIDString();
    entry.clientType = session->clientType();
    if (const auto set = session->backends()) {
      for (const auto& [name, backend] : *set) {
        entry.backends.push_back(ipc::BackendStatus{name, backend->state(), countList(backend->counters().snapshot())});
      }
    }
    status.sessions.push_back(std::move(entry));
  }
  releaseQueue_.async([sessions = std::move(sessions)] {});
  std::lock_guard lock(lock_);
  foldEndedBackends();
  for (const EndedTotal& total : endedTotals_) {
    BackendCountsSnapshot counts = total.counts;
    // Backends still finishing count on: their counts so far.
    for (const EndedBackend& e : endedBackends_) {
      if (e.clientType == total.clientType && e.name == total.name) {
        const BackendCountsSnapshot more = e.counters->snapshot();
        for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
          counts[i] += more[i];
        }
      }
    }
    status.ended.push_back(ipc::EndedTotals{total.clientType, total.name, total.sessions, countList(counts)});
  }
  const StorebagRefusalCounts& refused = storebagRefusalCounts();
  status.storebags = {{"rollbacksRefused", refused.rollbacks.load()},
                      {"missingIssueTimeRefused", refused.missingIssueTime.load()},
                      {"unusableRefused", refused.unusable.load()}};
  return status;
}

std::uint32_t ZerithdAgent::processMemoryUsage() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    unsigned long long kib = 0;
    if (std::sscanf(line.c_str(), "RssAnon: %llu kB", &kib) == 1) {
      return static_cast<std::uint32_t>(kib * 1024);
    }
  }
  return 0;
}

// --- Observers -------------------------------------------------------------------

std::size_t ZerithdAgent::sessionCount() const {
  std::lock_guard lock(lock_);
  return sessionList_.size();
}

std::int32_t ZerithdAgent::veskTransactionReference() const {
  std::lock_guard lock(keepAliveLock_);
  return VeskTransactionReference_;
}

std::vector<std::string> ZerithdAgent::correlatedTokens() const {
  std::lock_guard lock(lock_);
  std::vector<std::string> tokens;
  for (const auto& e : correlatedSessions_) {
    tokens.push_back(e.first);
  }
  return tokens;
}

std::optional<std::vector<std::shared_ptr<ZerithdSession>>> ZerithdAgent::correlatedSessions(
    const std::string& token) const {
  std::lock_guard lock(lock_);
  const auto it =
      std::find_if(correlatedSessions_.begin(), correlatedSessions_.end(), [&](const auto& e) { return e.first == token; });
  if (it == correlatedSessions_.end()) {
    return std::nullopt;
  }
  std::vector<std::shared_ptr<ZerithdSession>> live;
  for (const auto& w : it->second) {
    if (auto s = w.lock()) {
      live.push_back(std::move(s));
    }
  }
  return live;
}

bool ZerithdAgent::hasSharedDataForToken(const std::string& token) const {
  std::lock_guard lock(lock_);
  return std::any_of(sharedData_.begin(), sharedData_.end(), [&](const auto& e) { return e.first == token; });
}

}  // namespace zerith
