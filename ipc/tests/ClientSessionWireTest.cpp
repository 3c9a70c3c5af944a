#include <gtest/gtest.h>

#include "ipc/ClientSessionExporter.h"
#include "ipc/ClientSessionProxy.h"
#include "ipc/ClientSessionReplyExporter.h"
#include "ipc/ClientSessionReplyProxy.h"
#include "ipc/ClientSessionWire.h"
#include "ipc/tests/IpcTestSupport.h"
#include "ipc/tests/RecordingSession.h"
#include "platform/Log.h"

namespace zerith::ipc::test {
namespace {

// A client proxy on one end of a real connection, the exporter and a
// recording session on the other; the reply direction the other way round.
struct SessionLink {
  ConnectedPair pair;
  std::shared_ptr<RecordingSession> session = std::make_shared<RecordingSession>();
  std::shared_ptr<RecordingReplyTarget> client = std::make_shared<RecordingReplyTarget>();
  ClientSessionProxy proxy{pair.a};
  ClientSessionReplyProxy toClient{pair.b};

  SessionLink() {
    pair.a->setExportedObject(std::make_shared<ClientSessionReplyExporter>(client));
    pair.b->setExportedObject(std::make_shared<ClientSessionExporter>(session, pair.b->description()));
    pair.a->resume();
    pair.b->resume();
  }
};

TEST(ClientSessionWire, NilArgumentsArriveAsNilAndBooleanDefaultsToFalse) {
  SessionLink link;
  link.proxy.setSessionInfo(Value(), Value(), Value(), false);
  link.proxy.fetchStatesWithUserInfo(Value(), nullptr);
  ASSERT_TRUE(link.session->log.waitFor(2));
  const auto calls = link.session->log.calls();
  EXPECT_EQ(Value(calls[0].args), Value(Dictionary{{"sessionInfo", Value()}, {"userInfo", Value()},
                                                   {"frameworksToCheck", Value()}, {"hasAggregationBlock", false}}));
  // No completion asked for: the session gets none and nothing is answered.
  EXPECT_FALSE(calls[1].hasCompletion);
}

TEST(ClientSessionWireRefusal, UnknownOperationIsLoggedAnsweredWithAnErrorAndTheConnectionGoesOn) {
  log::LogCapture capture;
  SessionLink link;
  const auto result = callAndWait(*link.pair.a, "bogus:", Dictionary{});
  ASSERT_TRUE(result.error);
  EXPECT_EQ(*result.error, (Error{"com.velmar.zerith.ErrorDomain", -1, "Unknown operation \"bogus:\""}));
  EXPECT_TRUE(capture.has(log::Level::Error,
                          "ClientSessionExporter: Unknown operation \"bogus:\" from " + link.pair.b->description()));
  // Without a call number there is nothing to answer, but it is still logged.
  link.pair.a->send("silent:", Dictionary{});
  Answer<Value> url;
  link.proxy.fetchDisplayURL([&](Value v) { url.set(v); });
  EXPECT_EQ(url.get(), Value("https://display.example/session"));
  EXPECT_EQ(capture.count("Unknown operation \"silent:\""), 1u);
  EXPECT_EQ(link.session->log.size(), 1u);
}

struct WrongArgs {
  const char* op;
  Dictionary args;
  std::string description;
};

TEST(ClientSessionWireRefusal, WrongArgumentTypesAreRefusedBeforeTheSessionSeesThem) {
  const std::string oneShot = wire::kSendMessageWithSessionInfo;
  const std::vector<WrongArgs> cases = {
      {wire::kSetSessionInfo, {{"sessionInfo", "not a dict"}},
       "Argument \"sessionInfo\" of setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock: must be a dictionary, not a string"},
      {wire::kSetSessionInfo, {{"hasAggregationBlock", 1}},
       "Argument \"hasAggregationBlock\" of setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock: must be a boolean, not 1"},
      {wire::kSetSessionInfo, {{"frameworksToCheck", Dictionary{}}},
       "Argument \"frameworksToCheck\" of setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock: must be an array, not a dictionary"},
      {wire::kSendMessageWithSessionInfo, {{"category", 65536}, {"type", 1}},
       "Argument \"category\" of " + oneShot + " must be an unsigned 16-bit integer, not 65536"},
      {wire::kSendMessageWithSessionInfo, {{"category", -1}, {"type", 1}},
       "Argument \"category\" of " + oneShot + " must be an unsigned 16-bit integer, not -1"},
      {wire::kSendMessageWithSessionInfo, {{"category", 1}},
       "Argument \"type\" of " + oneShot + " must be an unsigned 16-bit integer, not nil"},
      {wire::kSendMessageWithSessionInfo, {{"category", 1.0}, {"type", 1}},
       "Argument \"category\" of " + oneShot + " must be an unsigned 16-bit integer, not a real"},
      {wire::kSetDigestKey, {{"digestKey", "secret"}, {"algorithm", 1}},
       "Argument \"digestKey\" of setDigestKey:algorithm: must be data, not a string"},
      {wire::kSetDigestKey, {{"algorithm", 2147483648LL}},
       "Argument \"algorithm\" of setDigestKey:algorithm: must be a signed 32-bit integer, not 2147483648"},
      {wire::kUploadFile, {}, "Argument \"fileURL\" of uploadFileAtPath:extensionToken:completionHandler: must be a string, not nil"},
      {wire::kUpdateSharedDataForKey, {{"key", 5}}, "Argument \"key\" of updateSharedDataForKey:value: must be a string, not 5"},
      {wire::kSendMessage, {{"message", Array{}}}, "Argument \"message\" of sendMessageWithDictionary:reply: must be a dictionary, not an array"},
  };
  log::LogCapture capture;
  SessionLink link;
  for (const auto& c : cases) {
    SCOPED_TRACE(c.description);
    const auto result = callAndWait(*link.pair.a, c.op, c.args);
    ASSERT_TRUE(result.error) << "accepted";
    EXPECT_EQ(*result.error, (Error{"com.velmar.zerith.ErrorDomain", -1, c.description}));
    EXPECT_TRUE(capture.has(log::Level::Error, "ClientSessionExporter: " + c.description + " from " + link.pair.b->description()));
  }
  EXPECT_EQ(link.session->log.size(), 0u);
  // Edge values that are right pass.
  EXPECT_TRUE(callAndWait(*link.pair.a, wire::kSetDigestKey, {{"algorithm", -2147483648LL}}).args);
  EXPECT_TRUE(callAndWait(*link.pair.a, wire::kSendMessageWithSessionInfo, {{"category", 0}, {"type", 65535}}).args);
  EXPECT_EQ(link.session->log.size(), 2u);
}

TEST(ClientSessionWireRefusal, TheClientRefusesMalformedMessagesFromTheDaemon) {
  log::LogCapture capture;
  SessionLink link;
  const auto result = callAndWait(*link.pair.b, wire::kSendMessageToClient, {{"timestamp", 1.0}, {"category", "x"}, {"type", 1}});
  ASSERT_TRUE(result.error);
  EXPECT_EQ(result.error->description,
            "Argument \"category\" of sendMessageToClient:timestamp:category:type:payload: must be an unsigned 16-bit integer, not a string");
  const auto unknown = callAndWait(*link.pair.b, "other:", {});
  ASSERT_TRUE(unknown.error);
  EXPECT_TRUE(capture.has(log::Level::Error, "ClientSessionReplyExporter: Unknown operation \"other:\""));
  EXPECT_EQ(link.client->log.size(), 0u);
}

}  // namespace
}  // namespace zerith::ipc::test
