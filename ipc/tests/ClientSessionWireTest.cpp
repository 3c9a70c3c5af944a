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

TEST(ClientSessionWire, EveryOperationCarriesItsArgumentsNilsIncludedAndCompletionBothWays) {
  SessionLink link;
  const Value sessionInfo(Dictionary{{"sessionID", 3}, {"clientType", 7}});
  const Value userInfo(Dictionary{{"clientName", "mail"}});
  const Value frameworks(Array{Value("Foo")});
  const Value message(Dictionary{{"category", 1}, {"type", 2}, {"payload", Dictionary{{"k", "v"}}}});
  const Value payload(Dictionary{{"p", 1.5}});

  link.proxy.setSessionInfo(sessionInfo, userInfo, frameworks, true);

  Answer<Value> started, states, url, sent, oneShot;
  Answer<std::pair<Value, std::optional<Error>>> flushed;
  Answer<bool> uploaded;
  Answer<std::pair<bool, std::optional<Error>>> logUploaded;
  link.proxy.startConfigWithCompletionHandler([&](Value v) { started.set(v); });
  link.proxy.fetchStatesWithUserInfo(userInfo, [&](Value v) { states.set(v); });
  link.proxy.fetchDisplayURL([&](Value v) { url.set(v); });
  link.proxy.sendMessageWithDictionary(message, [&](Value v) { sent.set(v); });
  link.proxy.flushMessagesWithCompletion([&](Value v, std::optional<Error> e) { flushed.set({v, e}); });
  link.proxy.finishSessionGracefully();
  link.proxy.uploadFileAtPath(Value("file:///dev/null"), Value("token"), [&](bool ok) { uploaded.set(ok); });
  link.proxy.uploadLogData(Value(Array{Value("line")}), [&](bool ok, std::optional<Error> e) { logUploaded.set({ok, e}); });
  link.proxy.sendMessageWithSessionInfo(sessionInfo, userInfo, 65535, 9, payload, [&](Value v) { oneShot.set(v); });
  link.proxy.updateSharedDataWithDictionary(Value(Dictionary{{"shared", 1}}));
  link.proxy.updateSharedDataForKey(Value("key"), Value(Array{Value(1)}));
  link.proxy.setDigestKey(Value(Data{1, 2, 3}), -7);
  link.proxy.setSessionInfo(Value(), Value(), Value(), false);
  link.proxy.fetchStatesWithUserInfo(Value(), nullptr);

  EXPECT_EQ(started.get(), link.session->backends);
  EXPECT_EQ(states.get(), link.session->backends);
  EXPECT_EQ(url.get(), Value("https://display.example/session"));
  EXPECT_EQ(sent.get(), Value("sent"));
  EXPECT_EQ(flushed.get(), std::make_pair(Value("flushed"), std::optional<Error>()));
  EXPECT_TRUE(uploaded.get());
  EXPECT_EQ(logUploaded.get(),
            std::make_pair(false, std::optional<Error>(Error{"com.velmar.zerith.ErrorDomain", -1, "no upload backend"})));
  EXPECT_EQ(oneShot.get(), Value("one-shot"));

  ASSERT_TRUE(link.session->log.waitFor(15));
  const auto calls = link.session->log.calls();
  const std::vector<std::pair<std::string, Dictionary>> expected = {
      {"setSessionInfo", {{"sessionInfo", sessionInfo}, {"userInfo", userInfo}, {"frameworksToCheck", frameworks},
                          {"hasAggregationBlock", true}}},
      {"startConfig", {}},
      {"fetchStates", {{"userInfo", userInfo}}},
      {"fetchDisplayURL", {}},
      {"sendMessage", {{"message", message}}},
      {"flushMessages", {}},
      {"finishSession", {}},
      {"uploadFile", {{"fileURL", "file:///dev/null"}, {"descriptor", true}}},
      {"uploadLogData", {{"logData", Array{Value("line")}}}},
      {"sendMessageWithSessionInfo", {{"sessionInfo", sessionInfo}, {"userInfo", userInfo}, {"category", 65535u},
                                      {"type", 9u}, {"payload", payload}}},
      {"updateSharedData", {{"dictionary", Dictionary{{"shared", 1}}}}},
      {"updateSharedDataForKey", {{"key", "key"}, {"value", Array{Value(1)}}}},
      {"setDigestKey", {{"digestKey", Data{1, 2, 3}}, {"algorithm", -7}}},
      {"setSessionInfo", {{"sessionInfo", Value()}, {"userInfo", Value()}, {"frameworksToCheck", Value()},
                          {"hasAggregationBlock", false}}},
      {"fetchStates", {{"userInfo", Value()}}},
  };
  ASSERT_EQ(calls.size(), expected.size());
  for (std::size_t i = 0; i < expected.size(); ++i) {
    EXPECT_EQ(calls[i].operation, expected[i].first);
    EXPECT_EQ(Value(calls[i].args), Value(expected[i].second)) << expected[i].first << ": " << Value(calls[i].args).description();
  }
  // No completion asked for: the session gets none and nothing is answered.
  EXPECT_FALSE(calls.back().hasCompletion);

  link.toClient.sendMessageToClient(Value(Dictionary{{"m", 1}}), 1234.5, 3, 4, Value(Dictionary{{"x", "y"}}));
  ASSERT_TRUE(link.client->log.waitFor(1));
  EXPECT_EQ(Value(link.client->log.calls()[0].args),
            Value(Dictionary{{"message", Dictionary{{"m", 1}}}, {"timestamp", 1234.5}, {"category", 3u}, {"type", 4u},
                             {"payload", Dictionary{{"x", "y"}}}}));
}

TEST(ClientSessionWireRefusal, UnknownOperationIsLoggedAnsweredWithAnErrorAndTheConnectionGoesOn) {
  log::LogCapture capture;
  SessionLink link;
  const auto result = link.pair.a->callAndWait("bogus:", Dictionary{}, kWait);
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
  const char* argument;
  const char* wanted;  // what the argument must be, and what it is
};

TEST(ClientSessionWireRefusal, WrongArgumentTypesAreRefusedBeforeTheSessionSeesThem) {
  const char* setInfo = "setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock:";
  const char* oneShot = "sendMessageWithSessionInfo:userInfo:category:type:payload:reply:";
  const char* digest = "setDigestKey:algorithm:";
  const WrongArgs cases[] = {
      {setInfo, {{"sessionInfo", "not a dict"}}, "sessionInfo", "a dictionary, not a string"},
      {setInfo, {{"hasAggregationBlock", 1}}, "hasAggregationBlock", "a boolean, not 1"},
      {setInfo, {{"frameworksToCheck", Dictionary{}}}, "frameworksToCheck", "an array, not a dictionary"},
      {oneShot, {{"category", 65536}, {"type", 1}}, "category", "an unsigned 16-bit integer, not 65536"},
      {oneShot, {{"category", -1}, {"type", 1}}, "category", "an unsigned 16-bit integer, not -1"},
      {oneShot, {{"category", 1}}, "type", "an unsigned 16-bit integer, not nil"},
      {oneShot, {{"category", 1.0}, {"type", 1}}, "category", "an unsigned 16-bit integer, not a real"},
      {digest, {{"digestKey", "secret"}, {"algorithm", 1}}, "digestKey", "data, not a string"},
      {digest, {{"algorithm", 2147483648LL}}, "algorithm", "a signed 32-bit integer, not 2147483648"},
      {"uploadFileAtPath:extensionToken:completionHandler:", {}, "fileURL", "a string, not nil"},
      {"updateSharedDataWithDictionary:", {{"dictionary", Array{Value(1)}}}, "dictionary", "a dictionary, not an array"},
      {"updateSharedDataForKey:value:", {{"key", 5}}, "key", "a string, not 5"},
      {"sendMessageWithDictionary:reply:", {{"message", Array{}}}, "message", "a dictionary, not an array"},
  };
  log::LogCapture capture;
  SessionLink link;
  for (const auto& c : cases) {
    const std::string description = "Argument \"" + std::string(c.argument) + "\" of " + c.op + " must be " + c.wanted;
    SCOPED_TRACE(description);
    const auto result = link.pair.a->callAndWait(c.op, c.args, kWait);
    ASSERT_TRUE(result.error) << "accepted";
    EXPECT_EQ(*result.error, (Error{"com.velmar.zerith.ErrorDomain", -1, description}));
    EXPECT_TRUE(capture.has(log::Level::Error, "ClientSessionExporter: " + description + " from " + link.pair.b->description()));
  }
  EXPECT_EQ(link.session->log.size(), 0u);
  // Edge values that are right pass.
  EXPECT_TRUE(link.pair.a->callAndWait(wire::kSetDigestKey, {{"algorithm", -2147483648LL}}, kWait).args);
  EXPECT_TRUE(link.pair.a->callAndWait(wire::kSendMessageWithSessionInfo, {{"category", 0}, {"type", 65535}}, kWait).args);
  EXPECT_EQ(link.session->log.size(), 2u);
}

TEST(ClientSessionWireRefusal, TheClientRefusesMalformedMessagesFromTheDaemon) {
  log::LogCapture capture;
  SessionLink link;
  const auto result =
      link.pair.b->callAndWait(wire::kSendMessageToClient, {{"timestamp", 1.0}, {"category", "x"}, {"type", 1}}, kWait);
  ASSERT_TRUE(result.error);
  EXPECT_EQ(result.error->description,
            "Argument \"category\" of sendMessageToClient:timestamp:category:type:payload: must be an unsigned 16-bit integer, not a string");
  const auto unknown = link.pair.b->callAndWait("other:", {}, kWait);
  ASSERT_TRUE(unknown.error);
  EXPECT_TRUE(capture.has(log::Level::Error, "ClientSessionReplyExporter: Unknown operation \"other:\""));
  EXPECT_EQ(link.client->log.size(), 0u);
}

}  // namespace
}  // namespace zerith::ipc::test
