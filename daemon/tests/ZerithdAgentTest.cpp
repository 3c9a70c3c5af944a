#include "daemon/ZerithdAgent.h"

#include <gtest/gtest.h>

#include <sys/mman.h>

#include <cstring>

#include "config/SenderCodes.h"
#include "daemon/tests/AgentFixture.h"
#include "ipc/Listener.h"

namespace zerith::test {
namespace {

using log::Level;

// The listener is not used by the agent's decision; any object will do.
class NoListener final : public ipc::Listener {
 public:
  void setDelegate(ipc::ListenerDelegate*) override {}
  void resume() override {}
  void stop() override {}
};

class ZerithdAgentTest : public AgentFixture {
 protected:
  bool accept(const std::shared_ptr<FakeConnection>& connection) {
    NoListener listener;
    return agent->shouldAcceptNewConnection(listener, connection);
  }
};

// --- Acceptance --------------------------------------------------------------

TEST_F(ZerithdAgentTest, RefusesEveryEntitlementThatIsNotExactlyTrue) {
  const std::vector<Dictionary> grants = {
      {},                                                       // missing
      {{"com.velmar.private.zerithd", Value(false)}},           // false
      {{"com.velmar.private.zerithd", Value("true")}},          // a string
      {{"com.velmar.private.zerithd", Value(1)}},               // a number
      {{"com.velmar.private.zerithdx", Value(true)}},           // another entitlement
  };
  for (const auto& grant : grants) {
    auto connection = std::make_shared<FakeConnection>(grant);
    EXPECT_FALSE(accept(connection));
    EXPECT_TRUE(logs.has(Level::Default, "listener: refusing a client (uid 0, gid 0, pid 0 at connect): it lacks the "
                                         "entitlement com.velmar.private.zerithd"));
    EXPECT_EQ(connection->exported(), nullptr);
    EXPECT_EQ(connection->resumed(), 0);
    EXPECT_FALSE(connection->hasInvalidationHandler());
  }
  EXPECT_EQ(agent->sessionCount(), 0u);
  EXPECT_EQ(agent->veskTransactionReference(), 0);
  EXPECT_EQ(transaction->beginCount(), 0u);
  EXPECT_FALSE(logs.contains("createReportingSessionWithDelegate"));
}

TEST_F(ZerithdAgentTest, AcceptedConnectionsAreSetUpListedAndCountedAndOutliveAnInterruption) {
  auto first = FakeConnection::entitled();
  auto second = FakeConnection::entitled();
  ASSERT_TRUE(accept(first));
  ASSERT_TRUE(accept(second));

  // The counts in the acceptance message are read before the session exists.
  EXPECT_TRUE(logs.has(Level::Debug, "listener: Accepting new Vesk connection " + first->description() +
                                         " as it has proper entitlement, 0(0) connections."));
  EXPECT_TRUE(logs.has(Level::Debug, "listener: Accepting new Vesk connection " + second->description() +
                                         " as it has proper entitlement, 1(0) connections."));
  for (const auto& c : {first, second}) {
    EXPECT_NE(c->exported(), nullptr);
    EXPECT_EQ(c->resumed(), 1);
    EXPECT_TRUE(c->hasInvalidationHandler());
    EXPECT_TRUE(c->hasInterruptionHandler());
  }
  EXPECT_EQ(agent->sessionCount(), 2u);
  EXPECT_EQ(agent->veskTransactionReference(), 2);
  EXPECT_TRUE(logs.has(Level::Default, "createReportingSessionWithDelegate: retained VeskTransaction. Ref count is 1"));
  EXPECT_TRUE(logs.has(Level::Default, "createReportingSessionWithDelegate: retained VeskTransaction. Ref count is 2"));
  // Only the first session, arriving at an empty list, begins a transaction.
  EXPECT_EQ(transaction->beginCount(), 1u);
  EXPECT_EQ(logs.count("createReportingSessionWithDelegate: Vesk transaction started with session <ZerithdSession: "),
            1u);

  // An interruption never ends the session.
  first->interrupt();
  EXPECT_TRUE(logs.contains("listener: Vesk connection to <ZerithdSession: "));
  EXPECT_TRUE(logs.contains(" was interrupted"));
  EXPECT_EQ(agent->sessionCount(), 2u);
  EXPECT_FALSE(logs.contains("was invalidated"));
}

// --- Keep-alive ----------------------------------------------------------------

TEST_F(ZerithdAgentTest, SessionArrivingBeforeThePreviousTransportClosedBeginsASecondTransaction) {
  auto a = newSession();
  agent->invalidateReportingSession(a.session);  // the list is empty; a's transport is still open
  EXPECT_EQ(agent->sessionCount(), 0u);
  EXPECT_EQ(agent->veskTransactionReference(), 1);

  auto b = newSession();
  EXPECT_EQ(transaction->beginCount(), 2u);
  EXPECT_EQ(agent->veskTransactionReference(), 2);

  a.session.reset();  // a's transport closes
  ASSERT_TRUE(logs.waitFor("releaseVeskTransaction: Vesk transaction ref count is 1"));
  EXPECT_EQ(transaction->endCount(), 0u);

  endSession(b);
  EXPECT_EQ(agent->veskTransactionReference(), 0);
  EXPECT_EQ(transaction->endCount(), 1u);
}

// --- Hierarchy -----------------------------------------------------------------

// Sessions of one token at the given levels, listed in that order; the last
// one asks for its parent and for its parent identifier.
TEST_F(ZerithdAgentTest, ParentIsTheFirstSessionOneLevelUpAndTheIdentifierJoinsAncestorsRootFirstUpToAGap) {
  const std::string gap =
      "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete parentSessionID "
      "is ";
  const struct {
    const char* name;
    std::vector<std::int64_t> levels;
    int parent;                   // the parent's index, or -1 for none
    std::vector<int> identifier;  // the ancestors (indices) the identifier joins; none: nil
    std::string logged;           // "#" stands for the identifier
    Level level = Level::Default;
  } rows[] = {
      {"chain", {0, 1, 2}, 1, {0, 1},
       "updateCorrelatedSessions: Adding session 3 to list for hierarchyToken call with hierarchyLevel 2",
       Level::Debug},
      {"child of the root", {0, 1}, 0, {0}, ""},
      {"the root itself", {0}, -1, {}, ""},
      {"two at the parent's level", {0, 0, 1}, 0, {0}, ""},
      {"no parent", {0, 2}, -1, {}, gap + "'(null)'"},
      {"no grandparent", {0, 1, 3}, -1, {},
       "parentSessionForChild: Unable to find session with hierarchy of 2 for hierarchyToken 'call'"},
      {"no root", {1, 2}, 0, {0}, gap + "'#'"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    logs.clear();
    std::vector<Client> sessions;
    for (const std::int64_t level : row.levels) {
      sessions.push_back(newSession(hierarchyInfo(static_cast<std::uint32_t>(sessions.size() + 1), "call", level)));
    }
    ZerithdSession& child = *sessions.back().session;
    EXPECT_EQ(agent->parentSessionForChild(child), row.parent < 0 ? nullptr : sessions[row.parent].session);
    std::string identifier;
    for (const int i : row.identifier) {
      identifier += (identifier.empty() ? "" : ".") + sessions[i].session->sessionIDString();
    }
    EXPECT_EQ(agent->parentSessionIDStringForSession(child), identifier.empty() ? Value() : Value(identifier));
    if (!row.logged.empty()) {
      std::string line = row.logged;
      if (const auto at = line.find('#'); at != std::string::npos) {
        line.replace(at, 1, identifier);
      }
      EXPECT_TRUE(logs.has(row.level, line)) << line;
    }
    for (const auto& c : sessions) {
      agent->invalidateReportingSession(c.session);
    }
  }
}

TEST_F(ZerithdAgentTest, UnlistedSessionFindsNoParent) {
  auto root0 = newSession(hierarchyInfo(1, "call", 0));
  auto child = newSession(hierarchyInfo(2, "call", 1));
  agent->invalidateReportingSession(child.session);  // the test still holds the session
  EXPECT_EQ(agent->parentSessionForChild(*child.session), nullptr);
  EXPECT_TRUE(logs.has(Level::Error, "parentSessionForChild: ERROR: Session 2 not found for hierarchyToken call"));
  EXPECT_TRUE(agent->parentSessionIDStringForSession(*child.session).isNil());
  EXPECT_TRUE(logs.has(Level::Default, "parentSessionIDStringForSession: Session 2 not found for hierarchyToken call"));

  agent->invalidateReportingSession(root0.session);  // the token's list is now empty
  EXPECT_EQ(agent->parentSessionForChild(*child.session), nullptr);
  EXPECT_TRUE(logs.has(Level::Error, "parentSessionForChild: ERROR: No sessions found for hierarchyToken call"));
  EXPECT_TRUE(agent->parentSessionIDStringForSession(*child.session).isNil());
  EXPECT_TRUE(
      logs.has(Level::Error, "parentSessionIDStringForSession: ERROR: No sessions found for hierarchyToken call"));
}

TEST_F(ZerithdAgentTest, StandaloneSessionIsNotCorrelated) {
  auto s = newSession(sessionInfo(5));
  EXPECT_TRUE(logs.has(Level::Default,
                       "updateCorrelatedSessions: Session 5 has no correlated sessions as it is a standalone session"));
  EXPECT_TRUE(agent->correlatedTokens().empty());
  EXPECT_TRUE(agent->parentSessionIDStringForSession(*s.session).isNil());
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*s.session), nullptr);
}

TEST_F(ZerithdAgentTest, AncestorWithAggregatorNearestTheRootWins) {
  auto root0 = newSession(hierarchyInfo(1, "call", 0), /*aggregator=*/true);
  auto mid = newSession(hierarchyInfo(2, "call", 1), /*aggregator=*/true);
  auto leaf = newSession(hierarchyInfo(3, "call", 2));
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*root0.session), nullptr);  // level 0 never has one
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*leaf.session), root0.session);

  auto other0 = newSession(hierarchyInfo(4, "media", 0));
  auto other1 = newSession(hierarchyInfo(5, "media", 1), /*aggregator=*/true);
  auto other2 = newSession(hierarchyInfo(6, "media", 2));
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*other2.session), other1.session);
}

TEST_F(ZerithdAgentTest, AggregatingAncestorShutsDownItsDescendantsAggregation) {
  auto root0 = newSession(hierarchyInfo(1, "call", 0), /*aggregator=*/true);
  // The child's own update already finds the aggregating root and ends its own aggregation.
  auto child = newSession(hierarchyInfo(2, "call", 1), /*aggregator=*/true);
  child.session->fetchStatesWithUserInfo(Value(Dictionary{{kZerithUserInfoClientName, Value("mail")}}), nullptr);
  EXPECT_FALSE(child.session->hasAggregator());
  ASSERT_EQ(aggregated(*child.connection).size(), 1u);
  EXPECT_EQ(aggregated(*child.connection)[0],
            (Dictionary{{"message", Value()}, {"timestamp", Value(0.0)}, {"category", Value(0u)}, {"type", Value(0u)},
                        {"payload", Value()}}));

  // A later descendant with an aggregator is shut down when the root updates.
  auto grandchild = newSession(hierarchyInfo(3, "call", 2), /*aggregator=*/true);
  root0.session->fetchStatesWithUserInfo(Value(Dictionary{{kZerithUserInfoClientName, Value("mail")}}), nullptr);
  EXPECT_TRUE(logs.has(Level::Debug,
                       "updateDownstreamSessions: Updating combined session ID and syncing reporting states for "
                       "session 3"));
  EXPECT_FALSE(grandchild.session->hasAggregator());
  EXPECT_EQ(aggregated(*grandchild.connection).size(), 1u);
  EXPECT_TRUE(root0.session->hasAggregator());
  EXPECT_TRUE(aggregated(*root0.connection).empty());
}

// A token's list stays, empty, when its last session leaves it: re-registered
// under another token or unlisted; its shared data stays too.
TEST_F(ZerithdAgentTest, LastSessionOfATokenLeavesItsEmptyListAndSharedDataInPlace) {
  auto s = newSession(hierarchyInfo(1, "old", 0));
  s.session->setSessionInfo(hierarchyInfo(1, "new", 0), Value(), Value(), false);
  ASSERT_TRUE(agent->correlatedSessions("new").has_value());
  EXPECT_EQ(agent->correlatedSessions("new")->front(), s.session);
  s.session->updateSharedDataForKey(Value("k"), Value("v"));
  agent->invalidateReportingSession(s.session);
  for (const char* token : {"old", "new"}) {
    ASSERT_TRUE(agent->correlatedSessions(token).has_value()) << token;
    EXPECT_TRUE(agent->correlatedSessions(token)->empty()) << token;
  }
  EXPECT_TRUE(agent->hasSharedDataForToken("new"));
  EXPECT_TRUE(logs.contains("invalidateReportingSession: ZerithdSession <ZerithdSession: "));
}

// --- Shared data -----------------------------------------------------------------

TEST_F(ZerithdAgentTest, SharedDataIsSeenAtOnceByEverySessionOfTheHierarchy) {
  auto a = newSession(hierarchyInfo(1, "call", 0));
  auto b = newSession(hierarchyInfo(2, "call", 1));
  auto loner = newSession(sessionInfo(3));
  // A token without data has nil shared data; removing an absent key keeps it so.
  EXPECT_TRUE(agent->sharedDataForSession(*a.session).isNil());
  agent->removeObjectFromSharedDataForSession(*a.session, "absent");
  EXPECT_TRUE(agent->sharedDataForSession(*a.session).isNil());

  a.session->updateSharedDataWithDictionary(Value(Dictionary{{"codec", Value("opus")}, {"rate", Value(48000)}}));
  EXPECT_EQ(agent->sharedDataForSession(*b.session),
            Value(Dictionary{{"codec", Value("opus")}, {"rate", Value(48000)}}));
  b.session->updateSharedDataForKey(Value("codec"), Value("aac"));  // overwrites in place
  EXPECT_EQ(agent->sharedDataForSession(*a.session), Value(Dictionary{{"codec", Value("aac")}, {"rate", Value(48000)}}));
  b.session->updateSharedDataForKey(Value("rate"), Value());  // nil removes the key
  EXPECT_EQ(agent->sharedDataForSession(*a.session), Value(Dictionary{{"codec", Value("aac")}}));

  loner.session->updateSharedDataWithDictionary(Value(Dictionary{{"x", Value(1)}}));
  EXPECT_TRUE(agent->sharedDataForSession(*loner.session).isNil());
  EXPECT_FALSE(agent->hasSharedDataForToken(""));
}

// --- Health ------------------------------------------------------------------------

TEST_F(ZerithdAgentTest, ProcessMemoryUsageIsAnonymousResidentBytes) {
  const std::uint32_t before = ZerithdAgent::processMemoryUsage();
  constexpr std::size_t kSize = 64u << 20;
  void* block = mmap(nullptr, kSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(block, MAP_FAILED);
  std::memset(block, 1, kSize);  // resident now
  const std::uint32_t after = ZerithdAgent::processMemoryUsage();
  munmap(block, kSize);
  // Bytes, not kilobytes: the 64 MiB touched show up (give or take what
  // other threads allocate or free meanwhile).
  EXPECT_GT(static_cast<std::int64_t>(after) - static_cast<std::int64_t>(before), static_cast<std::int64_t>(kSize / 2));
  EXPECT_LT(static_cast<std::int64_t>(after) - static_cast<std::int64_t>(before), static_cast<std::int64_t>(kSize * 2));
}

TEST(SenderCodes, HealthUsesTheTableOnlyForClientTypesFiveToTwentyThree) {
  const std::pair<std::int64_t, const char*> health[] = {
      {0, "Unknown"}, {4, "Unknown"}, {5, "YF"}, {14, "YH-QOB"}, {23, "WB"}, {24, "Unknown"}, {-1, "Unknown"}};
  for (const auto& [clientType, code] : health) {
    EXPECT_EQ(healthSenderCode(clientType), code) << "client type " << clientType;
  }
  EXPECT_EQ(senderCode(0), "ZP");
  EXPECT_EQ(senderCode(16), "XMORDAL");
}

}  // namespace
}  // namespace zerith::test
