#pragma once

// How a reporting session reaches the agent: storebags, the hierarchy table,
// shared data, health figures and the keep-alive release. The agent
// implements it; sessions and connectivity helpers hold it weakly or by
// reference, never owning the agent.
//
// The agent is also a recursive lock (agentLock) for its tables; callers that
// must hold it across several calls take it themselves. It is held only for
// table work: never while waiting for a queue's turn, a storebag fetch or any
// HTTP answer (the lock rank check aborts a debug build that tries).

#include <memory>
#include <mutex>
#include <string>

#include "backends/ZerithBackend.h"
#include "platform/LockRank.h"
#include "platform/Value.h"
#include "transport/ConnectivityHelperDelegate.h"

namespace zerith {

class ZerithdSession;

using AgentLock = RankedMutex<std::recursive_mutex>;

class ZerithdSessionDelegate : public ConnectivityHelperDelegate {
 public:
  ~ZerithdSessionDelegate() override = default;

  virtual AgentLock& agentLock() = 0;

  // For logs.
  virtual std::string description() const { return "<ZerithdSessionDelegate>"; }

  // Keep-alive: called by a connectivity helper once its HTTP session has
  // become invalid, on the transport's queue: it takes only the keep-alive
  // count's own lock, never the agent lock.
  void releaseVeskTransaction() override = 0;

  // Storebag cache.
  virtual Value storebagForSession(ZerithdSession& session) = 0;
  virtual Value storebagVersionForSession(ZerithdSession& session) = 0;

  // Hierarchy.
  virtual void updateCorrelatedSessions(ZerithdSession& session) = 0;
  virtual Value parentSessionIDStringForSession(ZerithdSession& session) = 0;
  virtual std::shared_ptr<ZerithdSession> parentSessionForChild(ZerithdSession& session) = 0;
  virtual std::shared_ptr<ZerithdSession> getAncestorWithAggregatorForSession(ZerithdSession& session) = 0;
  virtual void updateDownstreamSessions(ZerithdSession& session) = 0;

  // Shared data and health.
  virtual void updateSharedDataForSession(ZerithdSession& session, const Value& sharedData) = 0;
  virtual void removeObjectFromSharedDataForSession(ZerithdSession& session, const std::string& key) = 0;
  virtual Value sharedDataForSession(ZerithdSession& session) = 0;
  virtual void addAgentHealthInfoForSession(ZerithdSession& session, Dictionary& payload) = 0;

  // A session that ends hands over its backends after its final report and
  // flush, for the totals of ended sessions; their counters go on counting
  // what completes later.
  virtual void backendsOfEndedSession(ZerithdSession& /*session*/, const BackendDictionary& /*backends*/) {}
};

}  // namespace zerith
