#include "zerith/Zerith.h"

#include <gtest/gtest.h>

#include <regex>

#include "client/tests/TestDaemon.h"
#include "platform/Defaults.h"

namespace zerith::test {
namespace {

using namespace std::chrono_literals;
using ipc::test::Counter;

// 8-4-4-4-12 upper-case hexadecimal.
bool isUpperCaseUuid(const std::string& s) {
  return std::regex_match(s, std::regex("[0-9A-F]{8}(-[0-9A-F]{4}){3}-[0-9A-F]{12}"));
}

struct ZerithFixture : DaemonFixture {
  std::unique_ptr<Zerith> open() {
    Error error;
    auto z = Zerith::connect({}, &error);
    EXPECT_TRUE(z) << error.description;
    return z;
  }
};

// What the blocking calls return is checked by zerith's tests, whose steps print it.
TEST_F(ZerithFixture, BlockingCallsReturnOnceTheDaemonTookThemAndFailInsideACallback) {
  auto z = open();
  const Value info(Dictionary{{kZerithSessionInfoSessionID, 5}, {kZerithSessionInfoClientType, 7}});
  const auto set = z->setSessionInfo(info, Value(), Value(), false, 5s);
  ASSERT_TRUE(set) << set.error->description;
  // The blocking form returns only once the daemon has taken the call.
  auto client = daemon->waitForClient();
  ASSERT_EQ(client.session->log.size(), 1u);

  // Inside a callback of the same session a blocking call fails instead of deadlocking.
  ipc::test::Answer<ZerithReply> inner;
  z->fetchDisplayURL([&](Value) { inner.set(z->startConfig(5s)); });
  const auto innerReply = inner.get();
  ASSERT_TRUE(innerReply.error);
  EXPECT_EQ(innerReply.error->description, "startConfigWithCompletionHandler: cannot wait inside a callback of its own session");
  EXPECT_TRUE(z->finishSession(5s));
  EXPECT_EQ(client.session->log.calls().back().operation, "finishSession");
}

// The error of the time-out itself is checked by zerith's AStepThatTimesOutStopsTheScript.
TEST_F(ZerithFixture, TheLateAnswerToABlockingCallThatTimedOutGoesNowhereAndTheSessionGoesOn) {
  daemon->prepare = [](ipc::test::RecordingSession& s) { s.answer = false; };
  auto z = open();
  EXPECT_TRUE(z->fetchDisplayURL(50ms).error);
  auto client = daemon->waitForClient();
  for (auto& late : client.session->takeHeld()) {
    late();
  }
  EXPECT_TRUE(z->finishSession(5s));
}

// Each pending completion fails in its own way: nil, nil and the error,
// false; the session answering late, after its client is gone, harms
// nothing.
TEST_F(ZerithFixture, DaemonClosingTheSessionRunsTheInvalidationHandlerOnceAndFailsPendingCalls) {
  daemon->prepare = [](ipc::test::RecordingSession& s) { s.answer = false; };
  auto z = open();  // on the default socket, under the process's root
  ASSERT_TRUE(z);
  EXPECT_TRUE(z->isValid());
  Counter invalidated;
  z->setInvalidationHandler([&] { invalidated.hit(); });
  ipc::test::Answer<Value> url;
  ipc::test::Answer<std::pair<Value, std::optional<Error>>> flushed;
  ipc::test::Answer<bool> uploaded;
  z->fetchDisplayURL([&](Value v) { url.set(v); });
  z->flushMessagesWithCompletion([&](Value v, std::optional<Error> e) { flushed.set({v, e}); });
  z->uploadFileAtPath(Value("/dev/null"), Value(), [&](bool ok) { uploaded.set(ok); });
  auto client = daemon->waitForClient();
  ASSERT_TRUE(client.session->log.waitFor(3));
  client.connection->invalidate();
  EXPECT_EQ(url.get(), Value());
  EXPECT_EQ(flushed.get(),
            std::make_pair(Value(), std::optional<Error>(Error{kZerithErrorDomain, -1, "The connection was invalidated"})));
  EXPECT_FALSE(uploaded.get());
  for (auto& late : client.session->takeHeld(3)) {
    late();
  }
  ASSERT_TRUE(invalidated.waitFor(1));
  EXPECT_FALSE(z->isValid());
  const auto after = z->fetchDisplayURL(5s);
  ASSERT_TRUE(after.error);
  EXPECT_EQ(after.error->description, "The connection was invalidated");
  EXPECT_EQ(invalidated.count(), 1);
}

TEST_F(ZerithFixture, ClientGoingAwayMidCallEndsItsDaemonSideAndNoHandlerRunsAfterDestruction) {
  daemon->prepare = [](ipc::test::RecordingSession& s) { s.answer = false; };
  Counter invalidated;
  {
    auto z = open();
    z->setInvalidationHandler([&] { invalidated.hit(); });
    z->fetchDisplayURL([](Value) {});
    ASSERT_TRUE(daemon->waitForClient().session->log.waitFor(1));
  }
  ASSERT_TRUE(daemon->gone.waitFor(1));
  for (auto& late : daemon->waitForClient().session->takeHeld()) {
    late();  // answering a client that left
  }
  EXPECT_EQ(invalidated.count(), 0);
}

TEST(ZerithPersistentIdentifier, StableUpperCaseUuidsOnePerAnswerKeptInDefaultsReplacingWhatIsNotAString) {
  TempRoot root;
  const std::string yes = Zerith::getPersistentIdentifierForDNU(true);
  const std::string no = Zerith::getPersistentIdentifierForDNU(false);
  EXPECT_TRUE(isUpperCaseUuid(yes)) << yes;
  EXPECT_TRUE(isUpperCaseUuid(no)) << no;
  EXPECT_NE(yes, no);
  EXPECT_EQ(Zerith::getPersistentIdentifierForDNU(true), yes);
  EXPECT_EQ(Zerith::getPersistentIdentifierForDNU(false), no);
  const Defaults defaults("com.velmar.zerith");
  EXPECT_EQ(defaults.objectForKey("PersistentIdentifierForDNU"), Value(yes));
  EXPECT_EQ(defaults.objectForKey("PersistentIdentifier"), Value(no));
  ASSERT_TRUE(defaults.setObject(kZerithPersistentIdentifierKey, Value(42)));
  const std::string fresh = Zerith::getPersistentIdentifierForDNU(false);
  EXPECT_TRUE(isUpperCaseUuid(fresh)) << fresh;
  EXPECT_EQ(defaults.objectForKey(kZerithPersistentIdentifierKey), Value(fresh));
}

}  // namespace
}  // namespace zerith::test
