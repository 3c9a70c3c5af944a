#include "session/ZerithdSession.h"

#include <gtest/gtest.h>

#include <cstdlib>

#include "daemon/tests/AgentFixture.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"

namespace zerith::test {
namespace {

using log::Level;

class ZerithdSessionTest : public AgentFixture {
 protected:
  ZerithdSessionTest() {
    storebag = Value(Dictionary{{"httpPost", Value(Dictionary{})}});
    storebagVersion = Value("42");
  }

  static std::optional<Value> oneShot(const Client& c, const Value& info, const Value& userInfo = Value()) {
    return answer([&](auto done) { c.session->sendMessageWithSessionInfo(info, userInfo, 1, 2, Value(), done); });
  }
};

// --- Birth ------------------------------------------------------------------------

TEST_F(ZerithdSessionTest, EverySessionGetsItsOwnBase64UUIDAndTheDeviceIdentifier) {
  auto a = newSession();
  auto b = newSession();
  const auto& id = a.session->sessionIDString();
  ASSERT_EQ(id.size(), 24u);
  const auto bytes = crypto::base64Decode(id);
  ASSERT_TRUE(bytes.has_value());
  ASSERT_EQ(bytes->size(), 16u);
  EXPECT_EQ((*bytes)[6] >> 4, 4);  // a random (version 4) UUID
  EXPECT_NE(id, b.session->sessionIDString());

  const std::string device = a.session->deviceID();
  EXPECT_EQ(device.size(), 40u);
  EXPECT_EQ(device.find_first_not_of("0123456789abcdef"), std::string::npos);
  EXPECT_TRUE(logs.has(Level::Debug, "initWithSessionDelegate: Initialized session with UUID " + id));
  EXPECT_TRUE(logs.has(Level::Debug, "initWithSessionDelegate: ZerithdSession initWithSessionDelegate:" +
                                         agent->description()));
}

// --- Configuration -------------------------------------------------------------------

TEST_F(ZerithdSessionTest, HierarchyTokenThatIsNotADictionaryMakesAStandaloneSession) {
  Dictionary info = sessionInfo(5).dictCopy();
  info.set(kZerithSessionInfoHierarchyToken, Value("call"));
  auto s = newSession(Value(info));
  EXPECT_EQ(s.session->sessionID(), 5u);
  EXPECT_TRUE(s.session->hierarchyToken().isNil());
  EXPECT_EQ(s.session->hierarchyLevel(), 0u);
  EXPECT_TRUE(logs.has(Level::Debug, "setSessionInfo: Configuring session 5"));
}

TEST_F(ZerithdSessionTest, UserInfoGivenWithoutBeingRequiredIsLoggedAndANilOneIsIgnoredWhileRequired) {
  auto s = newSession(sessionInfo(5), false, user("mail"));
  EXPECT_TRUE(logs.has(Level::Error, "setSessionInfo: Configure session: user info provided without requiring it"));
  EXPECT_EQ(s.session->userInfo(), user("mail"));
  logs.clear();
  Dictionary required = sessionInfo(6).dictCopy();
  required.set(kZerithSessionInfoRequireUserInfo, Value(true));
  s.session->setSessionInfo(Value(required), user("mail"), Value(), false);
  EXPECT_FALSE(logs.contains("user info provided without requiring it"));
  EXPECT_EQ(s.session->sessionID(), 6u);  // a second call overwrites
  s.session->receivedUserInfo(Value());
  EXPECT_EQ(s.session->userInfo(), user("mail"));
}

TEST_F(ZerithdSessionTest, OnlyANameChangeInUserInfoRerunsTheStateUpdate) {
  auto s = newSession(sessionInfo(5));
  const auto changes = [&] { return logs.count("receivedUserInfo: Received new user info for session 5"); };
  s.session->receivedUserInfo(Value());  // none before, none now: ignored
  EXPECT_EQ(changes(), 0u);
  s.session->receivedUserInfo(user("mail"));  // the first counts as changed
  EXPECT_EQ(changes(), 1u);
  Dictionary sameNames = user("mail").dictCopy();
  sameNames.set("extra", Value(1));
  s.session->receivedUserInfo(Value(sameNames));  // stored, but the names are the same
  EXPECT_EQ(changes(), 1u);
  EXPECT_EQ(s.session->userInfo(), Value(sameNames));
  s.session->receivedUserInfo(user("mail", "push"));
  EXPECT_EQ(changes(), 2u);
  s.session->receivedUserInfo(Value());  // not required: the names changed to none
  EXPECT_TRUE(s.session->userInfo().isNil());
  EXPECT_EQ(changes(), 3u);
}

TEST_F(ZerithdSessionTest, NoStorebagCompletesTheStartWithNilAndSendsNoEndMessage) {
  storebag = Value();
  auto s = newSession(sessionInfo(5), /*aggregator=*/true);
  EXPECT_EQ(answer([&](auto done) { s.session->startConfigWithCompletionHandler(done); }), Value());
  EXPECT_TRUE(s.session->storebagVersion().isNil());
  EXPECT_TRUE(logs.has(Level::Debug, "startConfigWithCompletionHandler: Starting configuration for session 5"));
  EXPECT_FALSE(logs.contains("createBackendsWithStorebag"));
  s.session->startConfigWithCompletionHandler(nullptr);  // a nil completion is allowed
  auto connection = s.connection;
  endSession(s);
  // Only the end of aggregation.
  const auto sent = aggregated(*connection);
  ASSERT_EQ(sent.size(), 1u);
  EXPECT_EQ(sent[0].get("payload"), Value());
  EXPECT_FALSE(logs.contains("internalSendMessage"));
}

TEST_F(ZerithdSessionTest, StorebagConfiguresTheSessionWithNoEnabledBackend) {
  auto s = newSession(sessionInfo(5));
  EXPECT_EQ(answer([&](auto done) { s.session->startConfigWithCompletionHandler(done); }), Value(Array{}));
  EXPECT_EQ(s.session->storebagVersion(), Value("42"));
  EXPECT_TRUE(logs.has(Level::Debug, "createBackendsWithStorebag: Creating backends for session 5"));
  EXPECT_TRUE(logs.has(Level::Debug, "internalSendMessage: Sent internal message (method:0 respCode:0)"));

  EXPECT_EQ(answer([&](auto done) { s.session->fetchStatesWithUserInfo(Value(), done); }), Value(Array{}));
  EXPECT_TRUE(logs.has(Level::Debug, "fetchStatesWithUserInfo: Fetching states for session 5"));
}

TEST_F(ZerithdSessionTest, StartMessageCarriesLocaleAndAutomaticTimeOnCustomerBuilds) {
  struct Row {
    const char* locale;
    std::optional<bool> automaticTime;  // the setting; absent: assumed on
    Dictionary payload;
  };
  const Row rows[] = {{"C", std::nullopt, {{"AutomaticTimeSet", Value(true)}, {"Locale", Value("Unknown")}}},
                      {"de_DE.UTF-8", false, {{"AutomaticTimeSet", Value(false)}, {"Locale", Value("DE")}}}};
  for (const Row& row : rows) {
    SCOPED_TRACE(row.locale);
    if (row.automaticTime) {
      Defaults("com.velmar.timed").setObject("AutomaticTimeZoneEnabled", Value(*row.automaticTime));
    }
    ::setenv("LC_ALL", row.locale, 1);
    auto s = started(sessionInfo(5), /*aggregator=*/true);
    ::unsetenv("LC_ALL");
    const auto sent = aggregated(*s.connection);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].get("message"), sessionInfo(5));
    EXPECT_EQ(sent[0].get("category"), Value(0u));
    EXPECT_EQ(sent[0].get("type"), Value(0u));
    EXPECT_EQ(sent[0].get("payload"), Value(row.payload));
  }
}

// --- Client operations without backends ---------------------------------------------

TEST_F(ZerithdSessionTest, FlushAndDisplayURLBeforeConfigurationFailWithoutBackends) {
  auto s = newSession(sessionInfo(5));
  EXPECT_EQ(answer([&](auto done) { s.session->fetchDisplayURL(done); }), Value("URL not available"));
  EXPECT_TRUE(logs.has(Level::Debug, "fetchDisplayURL: Fetching display URL for session 5"));
  EXPECT_EQ(flush(*s.session), (std::vector<FlushAnswer>{
                                   {Value(), Error{kZerithErrorDomain, -1, "No backends available to send message"}}}));
  EXPECT_TRUE(logs.has(Level::Debug, "flushMessagesWithCompletion: Flushing messages for session 5"));
  EXPECT_TRUE(logs.has(Level::Debug, "internalFlushMessagesWithCompletion: No backends available to send message"));

  // Configured with an empty backend set the flush completes at once, without an error.
  s.session->startConfigWithCompletionHandler(nullptr);
  EXPECT_EQ(flush(*s.session), (std::vector<FlushAnswer>{{Value(), std::nullopt}}));
}

TEST_F(ZerithdSessionTest, UploadsAreRefusedWithoutAnUploadBackend) {
  auto s = newSession(sessionInfo(5));
  std::optional<bool> uploaded;
  s.session->uploadFileAtPath(Value("file:///var/tmp/report.log"), Value(), [&](bool ok) { uploaded = ok; });
  EXPECT_EQ(uploaded, false);
  EXPECT_TRUE(logs.has(Level::Debug, "uploadFileAtPath: Uploading file for session 5"));
  EXPECT_TRUE(logs.has(Level::Error, "uploadFileWithURL: File upload failed for /var/tmp/report.log"));
  const std::string retired = messageLog();
  EXPECT_NE(retired.find(") [uploadFileWithURL] Upload failed for file file:///var/tmp/report.log\n"), std::string::npos)
      << retired;

  std::optional<std::pair<bool, std::optional<Error>>> logData;
  s.session->uploadLogData(Value(Array{Value("line")}), [&](bool ok, std::optional<Error> e) { logData = {ok, e}; });
  EXPECT_EQ(logData, (std::pair<bool, std::optional<Error>>{false, std::nullopt}));
  EXPECT_TRUE(logs.has(Level::Error, "uploadLogData: Log data array upload failed"));
}

TEST_F(ZerithdSessionTest, EndMessageSaysWhetherTheSessionFinishedGracefully) {
  for (const bool graceful : {true, false}) {
    SCOPED_TRACE(graceful ? "finished gracefully" : "ended without finishing");
    logs.clear();
    auto s = started(sessionInfo(5), /*aggregator=*/true);
    if (graceful) {
      s.session->finishSessionGracefully();
      EXPECT_TRUE(logs.has(Level::Debug, "finishSessionGracefully: Session 5 has been finished gracefully"));
    }
    auto connection = s.connection;
    endSession(s);

    // The start message, the end message with the health figures, then the end of aggregation.
    const auto sent = aggregated(*connection);
    ASSERT_EQ(sent.size(), 3u);
    EXPECT_EQ(sent[1].get("category"), Value(0u));
    EXPECT_EQ(sent[1].get("type"), Value(1u));
    const Value payload = sent[1].get("payload");
    EXPECT_EQ(payload["StorebagVersion"], Value("42"));
    EXPECT_EQ(payload["GracefulTermination"], Value(graceful));
    EXPECT_EQ(payload["SessionsCount_YJ"], Value(1ull));
    EXPECT_EQ(payload["StorebagsCount"], Value(1ull));
    EXPECT_FALSE(payload["ProcessMemoryUsage"].isNil());
    EXPECT_EQ(sent[2].get("payload"), Value());
    EXPECT_EQ(sent[2].get("category"), Value(0u));
    EXPECT_TRUE(logs.has(Level::Debug, "shutdownSessionAggregation: Disable aggregation module for session 5"));
  }
}

// --- Aggregation -------------------------------------------------------------------------

TEST_F(ZerithdSessionTest, UserInfoEntriesReplacePayloadEntriesOnTheWayToTheAggregator) {
  auto s = started(sessionInfo(5), /*aggregator=*/true, Value(Dictionary{{"a", Value(2)}}));
  send(s, event(3, 70000, Value(Dictionary{{"a", Value(1)}, {"b", Value(1)}})));  // the type narrowed to 16 bits
  send(s, event(3, 4));
  const auto sent = aggregated(*s.connection);
  ASSERT_EQ(sent.size(), 3u);  // the start message and the two events
  EXPECT_EQ(sent[1].get("payload"), Value(Dictionary{{"a", Value(2)}, {"b", Value(1)}}));
  EXPECT_EQ(sent[1].get("category"), Value(3u));
  EXPECT_EQ(sent[1].get("type"), Value(70000u & 0xffffu));
  EXPECT_TRUE(sent[2].get("payload").isNil());  // a nil payload stays nil
}

// --- One-shot messages -------------------------------------------------------------------

TEST_F(ZerithdSessionTest, OneShotWithoutIdentifiersIsRefusedBeforeAnyStorebagLookup) {
  auto s = newSession();
  for (const char* only : {kZerithSessionInfoClientType, kZerithSessionInfoSessionID}) {
    EXPECT_EQ(oneShot(s, Value(Dictionary{{only, Value(7)}})), Value("Could not retrieve identifiers from sessionInfo"))
        << only;
  }
  EXPECT_EQ(countExact(Level::Error, "sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo"),
            2u);
  EXPECT_TRUE(fetchedClientTypes.empty());
  EXPECT_EQ(s.session->sessionID(), 0u);
}

TEST_F(ZerithdSessionTest, OneShotConfiguresTheSessionAndAnswersByStorebag) {
  auto s = newSession();
  EXPECT_EQ(oneShot(s, hierarchyInfo(8, "call", 0), user("mail")), Value("finished"));
  EXPECT_EQ(s.session->sessionID(), 8u);
  EXPECT_EQ(s.session->hierarchyToken(), Value("call"));
  EXPECT_EQ(s.session->userInfo(), user("mail"));
  EXPECT_EQ(agent->correlatedSessions("call")->size(), 1u);
  EXPECT_TRUE(logs.has(Level::Debug, "sendMessageWithSessionInfo: Sending message with session info for session 8"));
  EXPECT_TRUE(logs.has(Level::Debug, "sendMessageWithSessionInfo: Sending single message with sessionID 8"));

  storebag = Value();
  auto other = newSession();
  EXPECT_EQ(oneShot(other, sessionInfo(9, 2)), Value("storebag not available"));
}

}  // namespace
}  // namespace zerith::test
