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

TEST_F(ZerithdAgentTest, InterruptionNeverEndsTheSession) {
  auto connection = FakeConnection::entitled();
  ASSERT_TRUE(accept(connection));
  connection->interrupt();
  EXPECT_TRUE(logs.contains("listener: Vesk connection to <ZerithdSession: "));
  EXPECT_TRUE(logs.contains(" was interrupted"));
  EXPECT_EQ(agent->sessionCount(), 1u);
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

  agent->invalidateReportingSession(b.session);
  b.session.reset();
  ASSERT_TRUE(logs.waitFor("releaseVeskTransaction: Vesk transaction ended"));
  EXPECT_EQ(agent->veskTransactionReference(), 0);
  EXPECT_EQ(transaction->endCount(), 1u);
}

// --- Hierarchy -----------------------------------------------------------------

TEST_F(ZerithdAgentTest, GapNearTheRootKeepsTheIdentifierBuiltSoFar) {
  auto one = newSession(hierarchyInfo(1, "call", 1));  // the root never connected
  auto two = newSession(hierarchyInfo(2, "call", 2));
  EXPECT_EQ(agent->parentSessionIDStringForSession(*two.session), Value(one.session->sessionIDString()));
  EXPECT_TRUE(logs.has(Level::Default,
                       "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete "
                       "parentSessionID is '" + one.session->sessionIDString() + "'"));
}

TEST_F(ZerithdAgentTest, FirstSessionAddedAtALevelIsTheParentOfTheNext) {
  auto first = newSession(hierarchyInfo(1, "call", 0));
  auto second = newSession(hierarchyInfo(2, "call", 0));
  auto child = newSession(hierarchyInfo(3, "call", 1));
  EXPECT_EQ(agent->parentSessionForChild(*child.session), first.session);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*child.session), Value(first.session->sessionIDString()));
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

TEST_F(ZerithdAgentTest, ReRegisteringUnderANewTokenLeavesTheOldListEmptyButPresent) {
  auto s = newSession(hierarchyInfo(1, "old", 0));
  s.session->setSessionInfo(hierarchyInfo(1, "new", 0), Value(), Value(), false);
  ASSERT_TRUE(agent->correlatedSessions("old").has_value());
  EXPECT_TRUE(agent->correlatedSessions("old")->empty());
  ASSERT_TRUE(agent->correlatedSessions("new").has_value());
  EXPECT_EQ(agent->correlatedSessions("new")->front(), s.session);
}

TEST_F(ZerithdAgentTest, StandaloneSessionIsNotCorrelated) {
  auto s = newSession(sessionInfo(5));
  EXPECT_TRUE(logs.has(Level::Default,
                       "updateCorrelatedSessions: Session 5 has no correlated sessions as it is a standalone session"));
  EXPECT_TRUE(agent->correlatedTokens().empty());
  EXPECT_TRUE(agent->parentSessionIDStringForSession(*s.session).isNil());
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*s.session), nullptr);
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
  EXPECT_EQ(healthSenderCode(0), "Unknown");
  EXPECT_EQ(healthSenderCode(4), "Unknown");
  EXPECT_EQ(healthSenderCode(5), "YF");
  EXPECT_EQ(healthSenderCode(14), "YH-QOB");
  EXPECT_EQ(healthSenderCode(23), "WB");
  EXPECT_EQ(healthSenderCode(24), "Unknown");
  EXPECT_EQ(healthSenderCode(-1), "Unknown");
  EXPECT_EQ(senderCode(0), "ZP");
  EXPECT_EQ(senderCode(16), "XMORDAL");
}

}  // namespace
}  // namespace zerith::test
