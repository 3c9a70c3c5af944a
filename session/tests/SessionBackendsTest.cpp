// A session's backend set under a real agent: built from the storebag
// through the real factory (recording backends registered under the names
// the storebag uses), the road of one event to every backend, the result
// the client gets, the joined flush, states and identifiers in a hierarchy,
// one-shot messages and the end of a session.

#include <gtest/gtest.h>

#include <map>
#include <thread>

#include "daemon/tests/AgentFixture.h"
#include "session/tests/RecordingBackend.h"
#include "transport/ReportingSessionConnectivityHelper.h"

namespace zerith::test {
namespace {

using log::Level;

class SessionBackendsTest : public AgentFixture {
 protected:
  SessionBackendsTest() {
    RecordingBackend::registerAs({"recA", "recB", "recC", kZerithBackendHTTPPost, kZerithBackendHTTPPost2,
                                  kZerithBackendDashboard, kZerithBackendQRS});
    storebagVersion = Value("7");
  }

  // A storebag of these backend sections, in this order.
  void useStorebag(std::initializer_list<std::pair<std::string, Dictionary>> sections) {
    Dictionary bag;
    for (const auto& [name, profile] : sections) {
      bag.set(name, Value(profile));
    }
    storebag = Value(std::move(bag));
  }

  static std::shared_ptr<RecordingBackend> rec(const Client& c, std::string_view name) {
    return RecordingBackend::of(c.session->backendNamed(name));
  }
};

// --- The set --------------------------------------------------------------------------

TEST_F(SessionBackendsTest, SetFollowsTheStorebagOrderAndEveryBackendGetsTheSessionsTransportAndIdentifier) {
  useStorebag({{"recB", {}}, {"noSuchKind", {}}, {"recA", {{"state", Value(1)}}}, {"recC", {{"state", Value(3)}}}});
  auto c = newSession(sessionInfo(5));
  // Disabled recA is not reporting; sampled-out-but-kept recC is.
  EXPECT_EQ(answer([&](auto done) { c.session->startConfigWithCompletionHandler(done); }),
            Value(Array{Value("recB"), Value("recC")}));
  EXPECT_TRUE(logs.has(Level::Error, "ZerithBackend(newBackendWithName): noSuchKind"));

  const auto set = c.session->backends();
  ASSERT_NE(set, nullptr);
  ASSERT_EQ(set->size(), 3u);
  EXPECT_EQ((*set)[0].first, "recB");
  EXPECT_EQ((*set)[1].first, "recA");
  for (const auto& [name, backend] : *set) {
    EXPECT_EQ(backend->reportingSessionConnectivityDelegate().get(),
              static_cast<ReportingSessionConnectivityInterface*>(c.session->connectivityHelper().get()))
        << name;
    EXPECT_EQ(backend->combinedSessionIDString(), c.session->sessionIDString());
    EXPECT_EQ(backend->sessionID(), 5u);
    // The start message went to every backend, state or not: a backend's
    // own send decides what its state means.
    ASSERT_EQ(rec(c, name)->events().size(), 1u) << name;
    EXPECT_EQ(rec(c, name)->events()[0].method, 0u);
    EXPECT_EQ(rec(c, name)->events()[0].respCode, 0u);
  }
}

TEST_F(SessionBackendsTest, NewStorebagReplacesTheSetAndCleansUpTheOldOne) {
  useStorebag({{"recA", {}}});
  auto c = started(sessionInfo(5));
  const auto first = rec(c, "recA");
  useStorebag({{"recB", {}}});
  fetchedClientTypes.clear();
  // The agent's cache still answers with the first storebag for type 7; a
  // new session info under type 8 (another storebag name) fetches the second.
  Dictionary info = sessionInfo(5, 8).dictCopy();
  c.session->setSessionInfo(Value(info), Value(), Value(), false);
  c.session->startConfigWithCompletionHandler(nullptr);
  EXPECT_EQ(first->cleanups(), 1);
  EXPECT_EQ(c.session->backendNamed("recA"), nullptr);
  EXPECT_NE(rec(c, "recB"), nullptr);
}

// --- One event ------------------------------------------------------------------------

TEST_F(SessionBackendsTest, EveryBackendGetsClientDataSharedDataTheNumbersAndTheFlag) {
  useStorebag({{"recA", {}}, {"recB", {}}});
  auto c = started(hierarchyInfo(5, "call", 0));
  c.session->updateSharedDataWithDictionary(Value(Dictionary{{"room", Value("blue")}}));
  const Value payload(Dictionary{{"rtt", Value(12)}});
  EXPECT_TRUE(send(c, event(3, 70004, payload, Value(0x1'0000'0009ull))).isNil());

  for (const char* name : {"recA", "recB"}) {
    const auto events = rec(c, name)->events();
    ASSERT_EQ(events.size(), 2u) << name;  // the start message, then this one
    // The type narrowed to 16 bits, the flag read as 32; events numbered
    // per backend, the start message was 1.
    const Value message(
        Dictionary{{"SharedData", Value(Dictionary{{"room", Value("blue")}})}, {"ClientData", payload}});
    EXPECT_EQ(events[1], (RecordingBackend::Event{message, 3, 70004 & 0xffff, 2, 9}));
  }
  // Without a payload and without shared data the dictionary is empty.
  auto standalone = started(sessionInfo(6));
  send(standalone, event(4, 1));
  EXPECT_EQ(rec(standalone, "recA")->events()[1], (RecordingBackend::Event{Value(Dictionary{}), 4, 1, 2, 0}));
}

TEST_F(SessionBackendsTest, LastHttpsResultWinsAndTheDashboardsShowsOnlyWithoutOne) {
  const std::map<std::string, std::string> results = {{kZerithBackendHTTPPost, "post#"},
                                                      {kZerithBackendHTTPPost2, "post2#"},
                                                      {kZerithBackendDashboard, "dash#"},
                                                      {"recA", "other#"}};
  // Each set under a client type with a storebag name of its own, so that
  // none is served from the agent's cache.
  const struct {
    std::int64_t clientType;
    std::vector<std::string> set;
    Value result;
  } rows[] = {
      {12, {kZerithBackendHTTPPost2, kZerithBackendHTTPPost}, Value("post#2")},
      {16, {kZerithBackendHTTPPost, kZerithBackendHTTPPost2}, Value("post2#2")},
      {17, {"recA", kZerithBackendDashboard}, Value("dash#2")},
      {18, {kZerithBackendDashboard, kZerithBackendHTTPPost}, Value("post#2")},
      {19, {kZerithBackendHTTPPost, kZerithBackendDashboard}, Value("post#2")},
      {21, {"recA"}, Value()},  // other kinds' results are logged, never returned
  };
  for (const auto& row : rows) {
    Dictionary bag;
    for (const auto& name : row.set) {
      bag.set(name, Value(Dictionary{{"result", Value(results.at(name))}}));
    }
    storebag = Value(std::move(bag));
    auto c = started(sessionInfo(5, row.clientType));
    EXPECT_EQ(send(c, event(3, 1)), row.result) << "client type " << row.clientType;
  }
  const std::string log = messageLog();
  EXPECT_NE(log.find(") [recA -> sendMessageWithDictionary] other#2\n"), std::string::npos) << log;
  EXPECT_NE(log.find(") [dashboard -> sendMessageWithDictionary] dash#2\n"), std::string::npos) << log;
}

TEST_F(SessionBackendsTest, SharedDataIsPerTokenAndBadOrOversizedUpdatesChangeNothing) {
  useStorebag({{"recA", {}}});
  auto a = started(hierarchyInfo(1, "call", 0));
  auto b = started(hierarchyInfo(2, "call", 1));
  auto other = started(hierarchyInfo(3, "meeting", 0));
  auto alone = started(sessionInfo(4));
  a.session->updateSharedDataForKey(Value("room"), Value("blue"));
  alone.session->updateSharedDataForKey(Value("room"), Value("red"));  // no token: nothing happens
  b.session->updateSharedDataWithDictionary(Value("not a dictionary"));
  EXPECT_TRUE(logs.has(Level::Error,
                       "updateSharedDataWithDictionary: Ignoring shared data of session 2 as it is not a dictionary"));
  a.session->updateSharedDataForKey(Value("blob"), Value(Data(kSharedDataSizeLimit, 0x41)));
  EXPECT_TRUE(logs.contains("updateSharedDataForSession: Refusing shared data of session 1 for hierarchyToken call"));
  a.session->updateSharedDataForKey(Value(7), Value("x"));  // a key that is not a string
  EXPECT_TRUE(logs.has(Level::Error, "updateSharedDataForKey: Ignoring shared data without a string key for session 1"));

  std::vector<Value> seen;
  for (const auto* c : {&a, &b, &other, &alone}) {
    send(*c, event(9, 9));
    seen.push_back(rec(*c, "recA")->events().back().message);
  }
  const Value shared(Dictionary{{"SharedData", Value(Dictionary{{"room", Value("blue")}})}});
  EXPECT_EQ(seen, (std::vector<Value>{shared, shared, Value(Dictionary{}), Value(Dictionary{})}));
}

TEST_F(SessionBackendsTest, LevelsFarAboveTheOthersOrNegativeFindTheAggregatorWithoutWalkingEveryLevel) {
  useStorebag({{"recA", {}}});
  auto root = started(hierarchyInfo(1, "call", 0), /*aggregator=*/true);
  auto far = started(hierarchyInfo(2, "call", 4'000'000'000ll));
  auto negative = started(hierarchyInfo(3, "call", -1));
  EXPECT_TRUE(logs.has(Level::Error, "setSessionInfo: Session 3 has the negative hierarchy level -1, taken as 4294967295"));
  EXPECT_EQ(negative.session->hierarchyLevel(), 4294967295u);
  send(far, event(5, 1));
  send(negative, event(6, 1));
  std::vector<unsigned> atRoot;
  for (const auto& m : aggregated(*root.connection)) {
    atRoot.push_back(static_cast<unsigned>(m.get("category").unsignedValue()));
  }
  // Both start messages and both events reach the root's aggregator.
  EXPECT_EQ(std::count(atRoot.begin(), atRoot.end(), 5u), 1);
  EXPECT_EQ(std::count(atRoot.begin(), atRoot.end(), 6u), 1);
  // Neither has a parent one level up: a gap, so no combined identifier.
  EXPECT_EQ(rec(far, "recA")->combinedSessionIDString(), far.session->sessionIDString());
  EXPECT_TRUE(logs.contains("parentSessionIDStringForSession: Found a gap in hierarchy"));
}

// --- Flush --------------------------------------------------------------------------------

TEST_F(SessionBackendsTest, FlushCompletesOnceAtTheFirstErrorOrAfterTheLastBackend) {
  useStorebag({{"recA", {{"flushResult", Value("a flushed")}}},
               {"recB", {{"flushError", Value("b failed")}, {"flushResult", Value("b text")}}},
               {"recC", {{"flushResult", Value("c flushed")}}}});
  auto c = started(sessionInfo(5));
  EXPECT_EQ(flush(*c.session),
            (std::vector<FlushAnswer>{{Value("b text"), Error{"com.velmar.zerith.test", 7, "b failed"}}}));
  EXPECT_EQ(rec(c, "recC")->flushes(), 1);  // every backend was asked all the same
  for (const char* name : {"recA", "recB", "recC"}) {
    EXPECT_TRUE(logs.has(Level::Debug, std::string("internalFlushMessagesWithCompletion: ") + name));
  }
  const std::string log = messageLog();
  EXPECT_NE(log.find(") [recA -> flushMessages] a flushed\n"), std::string::npos) << log;
  EXPECT_NE(log.find(") [recC -> flushMessages] c flushed\n"), std::string::npos) << log;

  // Without errors: the last backend's text, no error.
  useStorebag({{"recA", {{"flushResult", Value("a")}}}, {"recB", {{"flushResult", Value("b")}}}});
  auto quiet = started(sessionInfo(6, 8));
  EXPECT_EQ(flush(*quiet.session), (std::vector<FlushAnswer>{{Value("b"), std::nullopt}}));
}

TEST_F(SessionBackendsTest, DeferredFlushesJoinAcrossThreadsAndAnErrorArrivingFirstWins) {
  useStorebag({{"recA", {{"flushDeferred", Value(true)}, {"flushResult", Value("a")}}},
               {"recB", {{"flushDeferred", Value(true)}, {"flushError", Value("b failed")}}},
               {"recC", {{"flushDeferred", Value(true)}, {"flushResult", Value("c")}}}});
  auto c = started(sessionInfo(5));
  std::atomic<int> calls{0};
  std::optional<Error> seen;
  c.session->flushMessagesWithCompletion([&](Value, std::optional<Error> e) {
    seen = e;
    ++calls;
  });
  EXPECT_EQ(calls, 0);  // nothing has answered yet
  // The error arrives first, on another thread; the two others follow on
  // two more threads at once.
  std::thread([&] { rec(c, "recB")->completeFlush(); }).join();
  EXPECT_EQ(calls, 1);
  ASSERT_TRUE(seen.has_value());
  EXPECT_EQ(seen->description, "b failed");
  std::thread a([&] { rec(c, "recA")->completeFlush(); });
  std::thread cc([&] { rec(c, "recC")->completeFlush(); });
  a.join();
  cc.join();
  EXPECT_EQ(calls, 1);

  // Two sessions flushing at once from two threads each get their own join.
  auto other = started(sessionInfo(6, 11));
  std::atomic<int> first{0};
  std::atomic<int> second{0};
  c.session->flushMessagesWithCompletion([&](Value, std::optional<Error>) { ++first; });
  other.session->flushMessagesWithCompletion([&](Value, std::optional<Error>) { ++second; });
  std::vector<std::thread> threads;
  for (const auto* s : {&c, &other}) {
    for (const char* name : {"recA", "recC", "recB"}) {
      threads.emplace_back([s, name] { rec(*s, name)->completeFlush(); });
    }
  }
  for (auto& t : threads) {
    t.join();
  }
  EXPECT_EQ(first, 1);
  EXPECT_EQ(second, 1);
}

TEST_F(SessionBackendsTest, SessionEndingMidFlushLetsTheLateCompletionsFinishSafely) {
  useStorebag({{"recA", {{"flushDeferred", Value(true)}}}});
  auto c = started(sessionInfo(5));
  const auto a = rec(c, "recA");
  const std::string device = c.session->deviceID();
  ASSERT_EQ(device.size(), 40u);
  int calls = 0;
  c.session->flushMessagesWithCompletion([&](Value, std::optional<Error>) { ++calls; });
  endSession(c);
  EXPECT_EQ(a->cleanups(), 1);
  // The backend outlives its session: the device identifier it points at
  // must too.
  EXPECT_EQ(std::string(a->udid()), device);
  // The client's flush and the end-of-session flush both still wait.
  EXPECT_TRUE(a->completeFlush());
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(a->completeFlush());
  EXPECT_FALSE(a->completeFlush());
}

// --- States and identifiers in a hierarchy ---------------------------------------------------

TEST_F(SessionBackendsTest, ChildrenTakeTheParentsStatesExceptAKeptOneAndCarryTheCombinedIdentifierOrphansTheirOwn) {
  useStorebag({{"recA", {{"state", Value(2)}, {"threshold", Value(0.25)}}}, {"recB", {{"state", Value(1)}}}});
  auto root = started(hierarchyInfo(1, "call", 0));
  // The child's storebag disagrees with its parent (a client type with
  // another storebag name).
  useStorebag({{"recA", {{"state", Value(1)}}}, {"recB", {{"state", Value(3)}}}, {"recC", {{"state", Value(2)}}}});
  auto child = started(hierarchyInfo(2, "call", 1, 8));
  // recA copied from the parent, recB kept (state 3), recC missing at the parent.
  EXPECT_EQ(answer([&](auto done) { child.session->fetchStatesWithUserInfo(Value(), done); }),
            Value(Array{Value("recA"), Value("recB")}));
  EXPECT_EQ(rec(child, "recA")->samplingThreshold(), Value(0.25));
  EXPECT_EQ(rec(child, "recC")->state(), kBackendStateDisabled);
  EXPECT_TRUE(logs.has(Level::Debug,
                       "HTTPSPostBackend(syncReportingStates): recA: state and sampling rate updated to 2, 0.25%"));

  auto grandchild = started(hierarchyInfo(3, "call", 2, 8));
  const std::string combined = root.session->sessionIDString() + "." + child.session->sessionIDString() + "." +
                               grandchild.session->sessionIDString();
  for (const auto& [name, backend] : *grandchild.session->backends()) {
    EXPECT_EQ(backend->combinedSessionIDString(), combined) << name;
  }
  EXPECT_TRUE(logs.has(Level::Debug, "updateCombinedSessionID: Updating combined session ID '" + combined +
                                         "' for session 3 backends"));
  // The root keeps its own identifier and states.
  EXPECT_EQ(rec(root, "recA")->combinedSessionIDString(), root.session->sessionIDString());

  // A child without its parent keeps its own states and identifier, and says so.
  auto orphan = started(hierarchyInfo(4, "orphan", 1));
  EXPECT_EQ(rec(orphan, "recA")->state(), kBackendStateEnabled);
  EXPECT_TRUE(logs.has(Level::Default,
                       "syncReportingStates: child session 4 (backend recA) with hierarchy 1 is missing its parent"));
  EXPECT_EQ(rec(orphan, "recA")->combinedSessionIDString(), orphan.session->sessionIDString());
}

TEST_F(SessionBackendsTest, UserInfoReachesEveryBackendAndTheDigestKeyOnlyTheDigestBackend) {
  useStorebag({{"recA", {}}, {kZerithBackendQRS, {}}});
  auto c = started(sessionInfo(5));
  const Value key(Data{1, 2, 3});
  c.session->setDigestKey(key, 4);
  EXPECT_EQ(rec(c, kZerithBackendQRS)->digestKey(), Data({1, 2, 3}));
  EXPECT_EQ(rec(c, kZerithBackendQRS)->digestAlgorithm(), 4);
  EXPECT_EQ(rec(c, "recA")->digestKey(), std::nullopt);

  c.session->fetchStatesWithUserInfo(user("mail"), nullptr);
  EXPECT_EQ(rec(c, "recA")->userInfoDict(), user("mail"));
  EXPECT_EQ(rec(c, kZerithBackendQRS)->userInfoDict(), user("mail"));
  // The user-info update hands the session's key on again, with the
  // algorithm the session keeps (never the one setDigestKey was given).
  EXPECT_EQ(rec(c, kZerithBackendQRS)->digestKey(), Data({1, 2, 3}));
  EXPECT_EQ(rec(c, kZerithBackendQRS)->digestAlgorithm(), 0);
}

TEST_F(SessionBackendsTest, DisplayURLComesFromTheFirstHttpsBackendThatHasOneThenTheDashboard) {
  useStorebag({{kZerithBackendDashboard, {{"displayURL", Value("https://dash/1")}}},
               {kZerithBackendHTTPPost, {}},
               {kZerithBackendHTTPPost2, {{"displayURL", Value("https://post2/1")}}}});
  auto c = started(sessionInfo(5));
  EXPECT_EQ(answer([&](auto done) { c.session->fetchDisplayURL(done); }), Value("https://post2/1"));

  useStorebag({{kZerithBackendDashboard, {{"displayURL", Value("https://dash/1")}}}});
  auto d = started(sessionInfo(6, 8));
  EXPECT_EQ(answer([&](auto done) { d.session->fetchDisplayURL(done); }), Value("https://dash/1"));
}

TEST_F(SessionBackendsTest, DispatchFlushesAndHierarchyChangesFromManyThreadsFinishTogether) {
  // Every lock of the event's road taken at once from several threads: a
  // child dispatching and flushing while its root changes user info (which
  // walks the hierarchy under the agent lock and reads the child's backend
  // states), shares data, and a third session joins and leaves the token.
  useStorebag({{"recA", {{"flushDeferred", Value(false)}}}, {"recB", {}}});
  auto root = started(hierarchyInfo(1, "busy", 0), /*aggregator=*/true);
  auto child = started(hierarchyInfo(2, "busy", 1));
  constexpr int kRounds = 300;
  std::atomic<int> flushed{0};
  std::thread sender([&] {
    for (int i = 0; i < kRounds; ++i) {
      child.session->sendMessageWithDictionary(event(5, static_cast<unsigned>(i)), nullptr);
      child.session->flushMessagesWithCompletion([&](Value, std::optional<Error>) { ++flushed; });
    }
  });
  std::thread changer([&] {
    for (int i = 0; i < kRounds; ++i) {
      root.session->fetchStatesWithUserInfo(
          Value(Dictionary{{kZerithUserInfoClientName, Value("n" + std::to_string(i))}}), nullptr);
      root.session->updateSharedDataForKey(Value("round"), Value(i));
    }
  });
  std::thread joiner([&] {
    for (int i = 0; i < kRounds / 10; ++i) {
      auto passing = started(hierarchyInfo(static_cast<std::uint32_t>(100 + i), "busy", 2, 8));
      passing.session->sendMessageWithDictionary(event(6, 1), nullptr);
      agent->invalidateReportingSession(passing.session);
    }
  });
  sender.join();
  changer.join();
  joiner.join();
  EXPECT_EQ(flushed, kRounds);
  EXPECT_EQ(rec(child, "recA")->count(), static_cast<std::size_t>(kRounds) + 1);  // and the start message
  std::size_t atRoot = 0;
  for (const auto& m : aggregated(*root.connection)) {
    atRoot += m.get("category") == Value(5u) ? 1 : 0;
  }
  EXPECT_EQ(atRoot, static_cast<std::size_t>(kRounds));
}

// --- Health and the end of a session -------------------------------------------------------------

TEST_F(SessionBackendsTest, EndMessageCarriesHealthAndEachBackendsCountsAndTheAgentKeepsTheTotalsOfEndedSessions) {
  useStorebag({{"recA", {{"batchedBytes", Value(300)}, {"whitelist", Value(Array{Value(0), Value(3)})}}},
               {"recB", {{"batchedBytes", Value(45)}, {"blacklist", Value(Array{Value(4)})}}}});
  auto other = started(sessionInfo(6));  // another type-7 session, still live
  auto unknown = newSession(sessionInfo(7, 2));  // a type outside the sender table
  auto c = started(sessionInfo(5));
  EXPECT_EQ(c.session->batchedEventsSize(), 345u);
  for (const unsigned category : {3u, 4u, 5u}) {
    send(c, event(category, 1));
  }
  auto a = rec(c, "recA");
  auto b = rec(c, "recB");
  endSession(c, "dealloc: ZerithdSession dealloc: 5");
  ASSERT_TRUE(a->waitForCleanups(1));
  ASSERT_TRUE(b->waitForCleanups(1));
  EXPECT_EQ(a->cleanups(), 1);
  EXPECT_EQ(b->cleanups(), 1);
  EXPECT_GE(a->flushes(), 1);
  agent->invalidateReportingSession(unknown.session);  // only session 6 stays live

  const auto end = a->events().back();
  EXPECT_EQ(end.method, 0u);
  EXPECT_EQ(end.respCode, 1u);
  const Value health = end.message["ClientData"];
  EXPECT_EQ(health["SessionsCount_YJ"], Value(2ull));
  EXPECT_EQ(health["SessionsCount_Unknown"], Value(1ull));
  EXPECT_EQ(health["BatchSize_YJ"], Value(690u));
  EXPECT_EQ(health["CalculatedMemoryUsage"].unsignedValue(), 690u + health["StorebagsSize"].unsignedValue());
  EXPECT_GT(health["StorebagsSize"].unsignedValue(), 0u);
  EXPECT_GT(health["ProcessMemoryUsage"].unsignedValue(), 0u);
  // The start message and category 3 went to recA, 4 and 5 were not on its
  // list; recB took all but the blacklisted 4. The end message counts what
  // came before it; a count of 0 is left out.
  EXPECT_EQ(health["BackendCounts_recA_sent"], Value(2ull));
  EXPECT_EQ(health["BackendCounts_recA_droppedFiltered"], Value(2ull));
  EXPECT_EQ(health["BackendCounts_recB_sent"], Value(3ull));
  EXPECT_EQ(health["BackendCounts_recB_droppedBlacklisted"], Value(1ull));
  EXPECT_TRUE(health["BackendCounts_recA_batched"].isNil());
  EXPECT_TRUE(health["BackendCounts_recB_droppedFiltered"].isNil());
  EXPECT_TRUE(logs.has(Level::Debug,
                       "sendMessageWithDictionary: Dropping event with category 5 as it is not whitelisted for backend recA"));
  EXPECT_TRUE(
      logs.has(Level::Debug, "sendMessageWithDictionary: Dropping event with category 4 as it is blacklisted for backend recB"));

  const auto expectStatus = [&](const char* when) {
    SCOPED_TRACE(when);
    const ipc::DaemonStatus status = agent->daemonStatus(nullptr);
    ASSERT_EQ(status.sessions.size(), 1u);
    EXPECT_EQ(status.sessions[0].sessionID, 6u);
    EXPECT_EQ(status.sessions[0].clientType, 7);
    ASSERT_EQ(status.sessions[0].backends.size(), 2u);
    EXPECT_EQ(status.sessions[0].backends[0].name, "recA");
    EXPECT_EQ(status.sessions[0].backends[0].state, kBackendStateEnabled);
    EXPECT_EQ(ipc::countOf(status.sessions[0].backends[0].counts, "sent"), 1u);  // its start message
    ASSERT_EQ(status.ended.size(), 2u);
    EXPECT_EQ(status.ended[0].clientType, 7);
    EXPECT_EQ(status.ended[0].backend, "recA");
    EXPECT_EQ(status.ended[0].sessions, 1u);
    EXPECT_EQ(ipc::countOf(status.ended[0].counts, "sent"), 3u);  // with the end message
    EXPECT_EQ(ipc::countOf(status.ended[0].counts, "droppedFiltered"), 2u);
    EXPECT_EQ(status.ended[1].backend, "recB");
    EXPECT_EQ(ipc::countOf(status.ended[1].counts, "sent"), 4u);
    EXPECT_EQ(ipc::countOf(status.ended[1].counts, "droppedBlacklisted"), 1u);
    EXPECT_EQ(status.ended[1].counts.size(), kBackendCountKinds);
  };
  expectStatus("backends still held");
  a.reset();
  b.reset();
  expectStatus("backends gone, their counts folded into the totals");
  // The session that asks is left out of the live ones.
  EXPECT_TRUE(agent->daemonStatus(other.session.get()).sessions.empty());
}

// --- One-shot messages ------------------------------------------------------------------------------

TEST_F(SessionBackendsTest, OneShotHandsThePayloadItselfToAThrowAwaySet) {
  useStorebag({{"recA", {{"result", Value("one#")}}}, {"recB", {{"whitelist", Value(Array{Value(9)})}}}});
  std::vector<std::shared_ptr<RecordingBackend>> made;
  RecordingBackend::registerBackendKind("recA", [&](std::string_view n, const Value& p,
                                                    const std::optional<std::string>& f, std::int32_t) {
    made.push_back(std::make_shared<RecordingBackend>(std::string(n), p, f));
    return made.back();
  });
  auto c = newSession();
  const Value payload(Dictionary{{"k", Value("v")}});
  const auto reply =
      answer([&](auto done) { c.session->sendMessageWithSessionInfo(sessionInfo(8), user("x"), 4, 2, payload, done); });
  EXPECT_EQ(reply, Value("finished"));
  ASSERT_EQ(made.size(), 1u);
  const auto events = made[0]->events();
  ASSERT_EQ(events.size(), 1u);
  // No ClientData wrapping on a customer build.
  EXPECT_EQ(events[0], (RecordingBackend::Event{payload, 4, 2, 1, 0}));
  EXPECT_EQ(made[0]->cleanups(), 1);
  EXPECT_EQ(made[0]->state(), kBackendStateEnabled);
  EXPECT_NE(made[0]->reportingSessionConnectivityDelegate(), nullptr);
  EXPECT_EQ(made[0]->reportingSessionConnectivityDelegate().get(),
            static_cast<ReportingSessionConnectivityInterface*>(ZerithdSession::oneShotConnectivityHelper().get()));
  EXPECT_TRUE(logs.has(Level::Debug,
                       "sendMessageWithSessionInfo: Dropping event with category 4 as it is not whitelisted for backend recB"));
  EXPECT_TRUE(logs.has(Level::Error, "sendMessageWithSessionInfo: user info provided without requiring it."));
  EXPECT_NE(messageLog().find(") [recA -> sendMessageWithSessionInfo] one#1\n"), std::string::npos);
  // The one-shot set is not the session's: the session still has none.
  EXPECT_EQ(c.session->backends(), nullptr);
  RecordingBackend::registerAs({"recA"});
}

TEST_F(SessionBackendsTest, OneShotSenderRefusesANilSessionInfoOrStorebag) {
  ZerithdSession::sendMessageWithSessionInfo(Value(), Value(), Value(Dictionary{}), 1, 1, Value());
  ZerithdSession::sendMessageWithSessionInfo(sessionInfo(3), Value(), Value(), 1, 1, Value());
  EXPECT_EQ(countExact(Level::Error,
                       "RsendMessageWithSessionInfo: Attempted to send message with one or more nil parameters"),
            2u);
}

}  // namespace
}  // namespace zerith::test
