#include <gtest/gtest.h>

#include <semaphore>
#include <vector>

#include "backends/ZerithBackend.h"
#include "backends/tests/BackendTestSupport.h"

namespace zerith {
namespace {

// A backend that records the event numbers reaching the dispatching send and
// opens up the fields concrete backends use.
class ProbeBackend : public ZerithBackend {
 public:
  ProbeBackend() : ZerithBackend("probe", Value(), std::nullopt) {}

  using ZerithBackend::sendMessage;
  std::optional<std::string> sendMessage(const Value&, const timeval&, std::uint16_t, std::uint16_t,
                                         std::uint16_t eventID, std::int32_t flag) override {
    seen.push_back(eventID);
    lastFlag = flag;
    return std::nullopt;
  }

  using ZerithBackend::setEventBlacklist;
  using ZerithBackend::setEventWhitelist;
  using ZerithBackend::stateQueue;

  std::vector<std::uint16_t> seen;
  std::int32_t lastFlag = 0;
};

TEST(ZerithBackendTest, SelfVersionSplitsIntoThreeTruncatedBytes) {
  const std::pair<const char*, const char*> versions[] = {
      {"3", "3.0.0"},     {"3.1", "3.1.0"}, {"3.1.4.1", "3.1.4"}, {"300.1", "44.1.0"},
      {"8.1.0", "8.1.0"}, {"", "0.0.0"},    {"2.x.7b", "2.0.7"},  {"-1.256.257", "255.0.1"}};
  for (const auto& [text, version] : versions) {
    ProbeBackend b;
    b.setSelfVersion(text);
    EXPECT_EQ(test::selfVersionOf(b), version) << '"' << text << '"';
  }
}

TEST(ZerithBackendTest, FirstEventIsNumberOneAndTheNumberWrapsAt16Bits) {
  auto b = std::make_shared<ProbeBackend>();
  const timeval now{1, 0};
  b->sendMessage(Value(), now, 1, 2, 9);
  ASSERT_EQ(b->seen, std::vector<std::uint16_t>{1});
  EXPECT_EQ(b->lastFlag, 9);
  for (int i = 1; i < 65536; ++i) {
    b->sendMessage(Value(), now, 1, 2, 0);
  }
  ASSERT_EQ(b->seen.size(), 65536u);
  EXPECT_EQ(b->seen[65534], 65535);
  EXPECT_EQ(b->seen[65535], 0);  // 65536 calls: back at the start value
  b->sendMessage(Value(), now, 1, 2, 0);
  EXPECT_EQ(b->seen.back(), 1);
}

// As many bytes as the text has UTF-16 units: a two-byte character is one
// unit (its first byte is hashed), one beyond the basic plane two (two of
// its four bytes).
TEST(ZerithBackendTest, Sha256HashesAsManyBytesAsUtf16Units) {
  const std::pair<const char*, const char*> rows[] = {
      {"abc", "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
      {"\xC3\xA9", "ae3f4619b0413d70d3004b9131c3752153074e45725be13b9a148978895e359e"},
      {"a\xC3\xA9", "7217e62bfcb0766e8cf1925411011bf777f48d9809bd30a7d7d4287a6daf9f78"},
      {"\xF0\x9F\x98\x80", "3c1c36c746e9b9106e77cfc2ede3374d38a883e23fbcd3b20023e326008c5434"},
      {"", "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855"}};
  for (const auto& [text, hash] : rows) {
    EXPECT_EQ(ZerithBackend::convertIntoSHA256(text), hash) << '"' << text << '"';
  }
}

// An absent whitelist admits all, an empty one none; an absent or empty
// blacklist refuses nothing. A category on the blacklist, or off a
// whitelist, is counted refused or filtered end to end (BackendCountsTest).
TEST(ZerithBackendTest, EventListsAdmitAndRefuseByCategory) {
  ProbeBackend b;
  EXPECT_TRUE(b.isWhitelistedEvent(0));
  EXPECT_TRUE(b.isWhitelistedEvent(65535));
  EXPECT_FALSE(b.isBlacklistedEvent(7));
  b.setEventWhitelist(Value(Array{}));
  b.setEventBlacklist(Value(Array{}));
  EXPECT_FALSE(b.isWhitelistedEvent(0));
  EXPECT_FALSE(b.isWhitelistedEvent(7));
  EXPECT_FALSE(b.isBlacklistedEvent(7));
  b.setEventWhitelist(Value(Array{Value(7), Value("9"), Value(65536 + 5)}));
  EXPECT_TRUE(b.isWhitelistedEvent(7));
  EXPECT_TRUE(b.isWhitelistedEvent(9));
  EXPECT_FALSE(b.isWhitelistedEvent(5));  // no 16-bit wrap of list entries
}

TEST(ZerithBackendTest, StateWriteIsSeenByTheNextReadAndUpdateEnables) {
  auto b = std::make_shared<ProbeBackend>();
  EXPECT_EQ(b->state(), kBackendStateUndecided);
  b->setState(kBackendStateDisabled);
  EXPECT_EQ(b->state(), kBackendStateDisabled);
  b->updateState();
  EXPECT_EQ(b->state(), kBackendStateEnabled);

  // Not owned by a shared pointer: the write happens in turn right away.
  ProbeBackend onStack;
  onStack.setState(kBackendStateSampledOut);
  EXPECT_EQ(onStack.state(), kBackendStateSampledOut);
}

TEST(ZerithBackendTest, QueuedStateWriteOutlivingItsBackendIsDropped) {
  auto b = std::make_shared<ProbeBackend>();
  const SerialQueue queue = b->stateQueue();
  std::binary_semaphore gate(0);
  queue.async([&] { gate.acquire(); });
  b->setState(kBackendStateDisabled);
  b.reset();  // the write is still queued behind the gate
  gate.release();
  queue.sync([] {});  // the write ran against a gone backend: no use after free
}

TEST(ZerithBackendDeathTest, ReadingTheStateFromItsOwnQueueAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        auto b = std::make_shared<ProbeBackend>();
        b->stateQueue().sync([&] { (void)b->state(); });
      },
      "would deadlock");
}

TEST(ZerithBackendTest, NoOpDefaultsAnswerNilAndNoAndCompleteTheFlushOnce) {
  ZerithBackend b("base", Value(), std::nullopt);
  const timeval now{5, 0};
  EXPECT_EQ(b.sendMessage(Value(Dictionary{{"a", 1}}), now, 1, 2, 3, 0), std::nullopt);
  EXPECT_EQ(b.sendMessage(Value(Dictionary{{"a", 1}}), now, 1, 2, 0), std::nullopt);
  int calls = 0;
  EXPECT_EQ(b.flushMessagesWithCompletion([&](const Value& result, const std::optional<Error>& error) {
    ++calls;
    EXPECT_TRUE(result.isNil());
    EXPECT_FALSE(error.has_value());
  }),
            std::nullopt);
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(b.flushMessagesWithCompletion(nullptr), std::nullopt);
  bool taken = true;
  b.uploadFileAtPath(UploadRequest{}, [&](bool t, bool) { taken = t; });
  EXPECT_FALSE(taken);
  EXPECT_FALSE(b.uploadLogData(Value(Array{Value("line")})));
  EXPECT_EQ(b.batchedEventsSize(), 0u);
  b.cleanup();
}

TEST(ZerithBackendTest, TransportReferenceIsWeak) {
  struct Transport : ReportingSessionConnectivityInterface {
    bool postURLRequestWithCompletionHandler(const URLRequest&, URLCompletion) override { return true; }
    void getURLRequestWithCompletionHandler(const URLRequest&, URLCompletion) override {}
  };
  ProbeBackend b;
  auto transport = std::make_shared<Transport>();
  b.setReportingSessionConnectivityDelegate(transport);
  EXPECT_EQ(b.reportingSessionConnectivityDelegate(), transport);
  transport.reset();
  EXPECT_EQ(b.reportingSessionConnectivityDelegate(), nullptr);
}

}  // namespace
}  // namespace zerith
