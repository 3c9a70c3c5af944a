#pragma once

// The agent: decides which connecting processes may use the service, creates
// one ZerithdSession per accepted connection and keeps the list of live
// sessions, holds the keep-alive transaction while any session (or its
// transport) is alive, and answers the sessions' questions about storebags,
// their hierarchy, shared data and health figures.
//
// One recursive lock (agentLock) guards the session list, the hierarchy
// table and the shared data; sessions take the same lock when they call in.
// It is only ever held for work on those tables: the storebag cache has its
// own lock (a fetch waits under neither), the keep-alive count has its own
// leaf lock (the transport's release takes only that one), and health
// figures are gathered from the backends after the lock is let go. The agent is owned by a
// shared_ptr: sessions and connectivity helpers hold it weakly.

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "daemon/KeepAliveTransaction.h"
#include "daemon/StorebagCache.h"
#include "ipc/DaemonStatus.h"
#include "ipc/Listener.h"
#include "platform/RateLimitedLog.h"
#include "platform/SerialQueue.h"
#include "platform/Value.h"
#include "session/ZerithdSessionDelegate.h"

namespace zerith {

class ZerithdSession;

// The most shared data one hierarchy token may hold, by the property-list
// memory estimate; an update that would pass it is refused whole.
inline constexpr std::size_t kSharedDataSizeLimit = 64 * 1024;

class ZerithdAgent final : public ZerithdSessionDelegate,
                           public ipc::ListenerDelegate,
                           public std::enable_shared_from_this<ZerithdAgent> {
 public:
  static std::shared_ptr<ZerithdAgent> create(std::shared_ptr<KeepAliveTransaction> transaction,
                                              std::unique_ptr<StorebagCache> storebags);
  ~ZerithdAgent() override;

  ZerithdAgent(const ZerithdAgent&) = delete;
  ZerithdAgent& operator=(const ZerithdAgent&) = delete;

  // Listener delegate.
  bool shouldAcceptNewConnection(ipc::Listener& listener, std::shared_ptr<ipc::Connection> connection) override;

  // The new session, or nullptr when it could not be made. The session list
  // holds the only reference the agent keeps.
  std::shared_ptr<ZerithdSession> createReportingSessionWithDelegate(std::weak_ptr<ZerithdSessionDelegate> delegate,
                                                                     std::shared_ptr<ipc::Connection> connection);
  void invalidateReportingSession(const std::shared_ptr<ZerithdSession>& session);

  // ZerithdSessionDelegate.
  AgentLock& agentLock() override { return lock_; }
  void releaseVeskTransaction() override;

  Value storebagForSession(ZerithdSession& session) override;
  Value storebagVersionForSession(ZerithdSession& session) override;
  // Forgets the cached storebags and the waits after failed fetches (the
  // operator's SIGHUP); sessions already started keep their backends.
  std::size_t dropCachedStorebags();

  void updateCorrelatedSessions(ZerithdSession& session) override;
  Value parentSessionIDStringForSession(ZerithdSession& session) override;
  std::shared_ptr<ZerithdSession> parentSessionForChild(ZerithdSession& session) override;
  std::shared_ptr<ZerithdSession> getAncestorWithAggregatorForSession(ZerithdSession& session) override;
  void updateDownstreamSessions(ZerithdSession& session) override;

  void updateSharedDataForSession(ZerithdSession& session, const Value& sharedData) override;
  void removeObjectFromSharedDataForSession(ZerithdSession& session, const std::string& key) override;
  Value sharedDataForSession(ZerithdSession& session) override;
  void addAgentHealthInfoForSession(ZerithdSession& session, Dictionary& payload) override;
  void backendsOfEndedSession(ZerithdSession& session, const BackendDictionary& backends) override;

  // The status call's answer: per live session (all but `asking`, the
  // session that asks) and backend what became of its events, and the
  // totals of ended sessions per client type and backend.
  ipc::DaemonStatus daemonStatus(const ZerithdSession* asking);

  // Adds one session's per-sender figures to a health report and returns its
  // batch size.
  std::uint32_t addSessionHealthInfo(ZerithdSession& session, Dictionary& healthReport);

  using SessionList = std::vector<std::weak_ptr<ZerithdSession>>;
  // The first live session of `list` at `level`, or nullptr.
  static std::shared_ptr<ZerithdSession> getFirstSessionWithHierarchy(std::int64_t level, const SessionList& list);

  // Observers, each taking the lock.
  std::size_t sessionCount() const;
  std::int32_t veskTransactionReference() const;
  // Hierarchy tokens in the table, in order of first use.
  std::vector<std::string> correlatedTokens() const;
  // Live sessions registered under a token (nullopt when the token has no
  // entry).
  std::optional<std::vector<std::shared_ptr<ZerithdSession>>> correlatedSessions(const std::string& token) const;
  bool hasSharedDataForToken(const std::string& token) const;
  std::string description() const override;

  // The process's anonymous resident memory in bytes (RssAnon), truncated to
  // 32 bits; 0 when it cannot be read.
  static std::uint32_t processMemoryUsage();

 private:
  ZerithdAgent(std::shared_ptr<KeepAliveTransaction> transaction, std::unique_ptr<StorebagCache> storebags);

  // Entry of a token in the hierarchy table, nullptr when absent.
  SessionList* correlatedListFor(const std::string& token);
  Dictionary* sharedDataFor(const std::string& token);

  // Folds the counters of ended sessions' backends that have gone into
  // endedTotals_ (under the lock).
  void foldEndedBackends();

  // Refused clients: one line per uid and interval, with a count of the rest.
  log::RateLimitedLog refusals_{"daemon", log::Level::Default, std::chrono::seconds(10)};

  mutable AgentLock lock_{LockRank::Agent, "the agent lock"};
  // The keep-alive count and the transaction's begin and end: a leaf.
  mutable RankedMutex<std::mutex> keepAliveLock_{LockRank::KeepAlive, "the keep-alive lock"};
  std::vector<std::shared_ptr<ZerithdSession>> sessionList_;
  std::unique_ptr<StorebagCache> cachedStorebags_;
  // Hierarchy token -> sessions, in order of first use. The session list owns
  // the sessions; the table only refers to them.
  std::vector<std::pair<std::string, SessionList>> correlatedSessions_;
  // Hierarchy token -> shared key/value data.
  std::vector<std::pair<std::string, Dictionary>> sharedData_;
  std::int32_t VeskTransactionReference_ = 0;
  // Ended sessions' counters: those whose backend may still count (a post
  // in flight), and the totals they are folded into once it has gone.
  struct EndedBackend {
    std::int64_t clientType = 0;
    std::string name;
    std::shared_ptr<const BackendCounters> counters;
  };
  struct EndedTotal {
    std::int64_t clientType = 0;
    std::string name;
    std::uint64_t sessions = 0;
    BackendCountsSnapshot counts{};
  };
  std::vector<EndedBackend> endedBackends_;
  std::vector<EndedTotal> endedTotals_;  // in order of first end

  const std::shared_ptr<KeepAliveTransaction> transaction_;
  // Unlisted sessions are let go on a later turn of this queue, never inside
  // the callback that unlisted them.
  SerialQueue releaseQueue_{"com.velmar.zerithd.agent.release"};
};

}  // namespace zerith
