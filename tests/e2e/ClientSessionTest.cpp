// The real daemon and the real client framework over the real socket: a
// session's lifecycle, the keep-alive count across sessions, and messages
// from the daemon to its clients.

#include <atomic>
#include <future>

#include "tests/e2e/E2eFixture.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

using log::Level;

class ClientSessionTest : public E2eTest {
 protected:
  void SetUp() override {
    grant(Value(true));
    DaemonProcess::Options options;
    options.arguments = {"--stop-timeout", "10"};
    startDaemon(options);
  }
};

TEST_F(ClientSessionTest, LifecycleOperationsAnswerAsASessionWithoutBackends) {
  auto client = connect();
  ASSERT_TRUE(client);
  ASSERT_TRUE(client->setSessionInfo(sessionInfo(42), Value(), Value(), false, 10s));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "setSessionInfo: Configuring session 42"));

  // No storebag server answers: the start completes with nil.
  const auto started = client->startConfig(20s);
  ASSERT_TRUE(started) << started.error->description;
  EXPECT_TRUE(started["backends"].isNil());
  // The error line ends with the cause (the storebag server is unreachable).
  EXPECT_TRUE(daemon->waitFor("fetchAndCacheStorebag: Unable to fetch storebag for client type 7: "));

  const auto states = client->fetchStates(Value(Dictionary{{kZerithUserInfoClientName, Value("mail")}}), 10s);
  ASSERT_TRUE(states);
  EXPECT_TRUE(states["backends"].isNil());
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "receivedUserInfo: Received new user info for session 42"));

  const auto url = client->fetchDisplayURL(10s);
  ASSERT_TRUE(url);
  EXPECT_EQ(url["url"], Value("URL not available"));

  const auto sent = client->sendMessage(event(1, 2), 10s);
  ASSERT_TRUE(sent);
  EXPECT_TRUE(sent["result"].isNil());
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "sendMessageWithDictionary: No backends available to send message"));

  const auto flushed = client->flushMessages(10s);
  ASSERT_TRUE(flushed);
  EXPECT_TRUE(flushed["result"].isNil());
  EXPECT_EQ(flushed["error"], (Error{kZerithErrorDomain, -1, "No backends available to send message"}).toValue());

  const auto upload = client->uploadFile(Value("file:///dev/null"), Value(), 10s);
  ASSERT_TRUE(upload);
  EXPECT_EQ(upload["success"], Value(false));
  const auto logData = client->uploadLogData(Value(Array{Value("a")}), 10s);
  ASSERT_TRUE(logData);
  EXPECT_EQ(logData["success"], Value(false));
  EXPECT_TRUE(logData["error"].isNil());

  const auto oneShot = client->sendMessageWithSessionInfo(Value(Dictionary{}), Value(), 1, 2, Value(), 10s);
  ASSERT_TRUE(oneShot);
  EXPECT_EQ(oneShot["result"], Value("Could not retrieve identifiers from sessionInfo"));

  ASSERT_TRUE(client->finishSession(10s));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "finishSessionGracefully: Session 42 has been finished gracefully"));

  client->invalidate();
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "dealloc: ZerithdSession dealloc: 42"));
  EXPECT_TRUE(daemon->waitForExact(Level::Default, kTransactionEnded));
}

TEST_F(ClientSessionTest, KeepAliveCountFollowsBothTransportsAndEndsOnce) {
  auto first = connect();
  auto second = connect();
  ASSERT_TRUE(first && second);
  ASSERT_TRUE(first->fetchDisplayURL(10s));
  ASSERT_TRUE(second->fetchDisplayURL(10s));
  EXPECT_TRUE(daemon->waitForExact(Level::Default,
                                   "createReportingSessionWithDelegate: "
                                   "retained VeskTransaction. Ref count is 1"));
  EXPECT_TRUE(daemon->waitForExact(Level::Default,
                                   "createReportingSessionWithDelegate: "
                                   "retained VeskTransaction. Ref count is 2"));
  EXPECT_TRUE(daemon->waitFor("as it has proper entitlement, 1(0) connections."));
  EXPECT_EQ(daemon->count("createReportingSessionWithDelegate: Vesk "
                          "transaction started with session"),
            1u);

  first.reset();
  ASSERT_TRUE(daemon->waitForExact(Level::Default, "releaseVeskTransaction: Vesk transaction ref count is 1"));
  EXPECT_EQ(daemon->count(kTransactionEnded), 0u);
  ASSERT_TRUE(second->fetchDisplayURL(10s));  // the other session goes on

  second.reset();
  ASSERT_TRUE(daemon->waitForExact(Level::Default, kTransactionEnded));
  EXPECT_TRUE(daemon->has(Level::Default, "releaseVeskTransaction: Vesk transaction ref count is 0"));
  EXPECT_EQ(daemon->count(kTransactionEnded), 1u);
  const auto notes = daemon->notifications();
  EXPECT_NE(std::find(notes.begin(), notes.end(), "STATUS=Idle (no keep-alive transaction)"), notes.end());
}

TEST_F(ClientSessionTest, SessionsArrivingWhileAnEndedTransportClosesKeepThePairing) {
  // A session that arrives after the list became empty but before the
  // previous transport closed begins a second transaction; the count then
  // needs both releases. Whether a round hits that window depends on timing
  // (the agent's unit tests force it), so every round checks the pairing:
  // each session releases once, and there is one end each time the count
  // reaches 0.
  constexpr const char* kRelease = "releaseVeskTransaction: Vesk transaction ref count is ";
  constexpr const char* kBegin =
      "createReportingSessionWithDelegate: Vesk "
      "transaction started with session";
  int secondTransactions = 0;
  for (std::size_t round = 1; round <= 20; ++round) {
    const std::size_t beginsBefore = daemon->count(kBegin);
    const std::size_t zerosBefore = daemon->countExact(Level::Default, std::string(kRelease) + "0");
    auto a = connect();
    ASSERT_TRUE(a && a->fetchDisplayURL(10s));
    a.reset();
    auto b = connect();
    ASSERT_TRUE(b && b->fetchDisplayURL(10s));
    b.reset();
    ASSERT_TRUE(daemon->waitFor(kRelease, 2 * round)) << daemon->output();
    const std::size_t allZeros = daemon->countExact(Level::Default, std::string(kRelease) + "0");
    // The end follows its "ref count is 0" line.
    ASSERT_TRUE(daemon->waitForExact(Level::Default, kTransactionEnded, allZeros));
    const std::size_t begins = daemon->count(kBegin) - beginsBefore;
    const std::size_t zeros = allZeros - zerosBefore;
    EXPECT_GE(zeros, 1u);
    if (begins == 2 && zeros == 1) {
      ++secondTransactions;  // b began a transaction while a's was still counted
    }
    EXPECT_EQ(daemon->countExact(Level::Default, kTransactionEnded), allZeros);
    EXPECT_EQ(daemon->count(std::string(kRelease) + "-"), 0u);
  }
  RecordProperty("second_transactions", secondTransactions);
}

TEST_F(ClientSessionTest, AggregatingRootEndsItsChildsAggregationOverTheChildsConnection) {
  // What the message handler touches outlives the clients: a message may
  // arrive while they are being torn down.
  std::promise<Dictionary> received;
  std::atomic<int> messages{0};
  auto root = connect();
  auto child = connect();
  ASSERT_TRUE(root && child);
  child->setMessageHandler(
      [&](const Value& message, double timestamp, std::uint16_t category, std::uint16_t type, const Value& payload) {
        if (messages++ == 0) {
          received.set_value(Dictionary{{"message", message},
                                        {"timestamp", Value(timestamp)},
                                        {"category", Value(unsigned{category})},
                                        {"type", Value(unsigned{type})},
                                        {"payload", payload}});
        }
      });
  ASSERT_TRUE(root->setSessionInfo(hierarchy(1, "call-1", 0), Value(), Value(), true, 10s));
  ASSERT_TRUE(child->setSessionInfo(hierarchy(2, "call-1", 1), Value(), Value(), true, 10s));
  // New user info makes the child re-derive its place below the aggregating
  // root.
  ASSERT_TRUE(child->fetchStates(Value(Dictionary{{kZerithUserInfoClientName, Value("facetime")}}), 10s));

  auto future = received.get_future();
  ASSERT_EQ(future.wait_for(10s), std::future_status::ready);
  EXPECT_EQ(future.get(), (Dictionary{{"message", Value()},
                                      {"timestamp", Value(0.0)},
                                      {"category", Value(0u)},
                                      {"type", Value(0u)},
                                      {"payload", Value()}}));
  // The daemon's log arrives through a pipe of its own, maybe after the
  // message.
  EXPECT_TRUE(
      daemon->waitForExact(Level::Debug, "shutdownSessionAggregation: Disable aggregation module for session 2"));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug,
                                   "updateCorrelatedSessions: Adding session 2 to list for hierarchyToken "
                                   "call-1 with hierarchyLevel 1"));
}

TEST_F(ClientSessionTest, SharedDataOfAHierarchyOutlivesItsLastSession) {
  auto client = connect();
  ASSERT_TRUE(client);
  ASSERT_TRUE(client->setSessionInfo(hierarchy(1, "call-1", 0), Value(), Value(), false, 10s));
  ASSERT_TRUE(client->updateSharedData(Value(Dictionary{{"codec", Value("opus")}}), 10s));
  ASSERT_TRUE(client->updateSharedDataForKey(Value("codec"), Value(), 10s));
  client.reset();
  ASSERT_TRUE(daemon->waitForExact(Level::Default, kTransactionEnded));

  // The token's (now empty) list stays: the next acceptance counts it.
  auto next = connect();
  ASSERT_TRUE(next && next->fetchDisplayURL(10s));
  EXPECT_TRUE(daemon->waitFor("as it has proper entitlement, 0(1) connections."));
}

}  // namespace
}  // namespace zerith::test
