#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "backends/EnergyLog.h"
#include "backends/PellamBackend.h"
#include "backends/tests/BackendTestSupport.h"
#include "config/tests/ScopedEnv.h"
#include "platform/Value.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithConstants.h"

namespace zerith {
namespace {

class PellamBackendTest : public ::testing::Test {
 protected:
  test::TempRoot root_;
  test::ScopedEnv journal_{"JOURNAL_STREAM", nullptr};  // the local energy log
  PellamBackend backend_{kZerithBackendPellamlog, Value(Dictionary{}), std::string("family")};
  const timeval now_{1700000000, 0};
};

TEST_F(PellamBackendTest, MethodZeroOrEmptyPayloadWritesNothing) {
  EXPECT_EQ(backend_.sendMessage(Value(Dictionary{{"a", 1}}), now_, 0, 4, std::uint16_t{7}), std::nullopt);
  EXPECT_EQ(backend_.sendMessage(Value(Dictionary{}), now_, 3, 4, std::uint16_t{7}), std::nullopt);
  EXPECT_EQ(backend_.sendMessage(Value(), now_, 3, 4, std::uint16_t{7}), std::nullopt);
  EXPECT_FALSE(std::filesystem::exists(energy::localLogPath()));
  test::expectOnly(backend_.counters(), {{BackendCount::droppedFiltered, 3}});
}

TEST_F(PellamBackendTest, RegisteredEventCarriesNumbersOverPayloadKeys) {
  const Value payload(Dictionary{{"event", "client's own"}, {"watts", 2.5}, {"respCode", "old"}});
  EXPECT_EQ(backend_.sendMessage(payload, now_, 3, 4, std::uint16_t{65535}), std::nullopt);
  EXPECT_EQ(backend_.sendMessage(Value(Dictionary{{"b", true}}), now_, 9, 0, std::uint16_t{1}), std::nullopt);

  const auto lines = test::readLines(energy::localLogPath());
  ASSERT_EQ(lines.size(), 2u);
  test::expectOnly(backend_.counters(), {{BackendCount::sent, 2}});
  const auto first = nlohmann::ordered_json::parse(lines[0]);
  EXPECT_TRUE(first["time"].is_number_float());
  EXPECT_EQ(first["category"], 28);
  EXPECT_EQ(first["event"], "Hollond-ZTH");
  EXPECT_EQ(first["payload"].dump(), R"({"event":65535,"watts":2.5,"respCode":4,"method":3})");
  EXPECT_EQ(nlohmann::ordered_json::parse(lines[1])["payload"].dump(),
            R"({"b":true,"method":9,"respCode":0,"event":1})");
  // The caller's payload is not changed.
  EXPECT_EQ(payload["event"], Value("client's own"));
}

TEST_F(PellamBackendTest, SessionDispatchReachesTheBaseSendAndWritesNothing) {
  ZerithBackend& asSessionSeesIt = backend_;
  EXPECT_EQ(asSessionSeesIt.sendMessage(Value(Dictionary{{"a", 1}}), now_, 3, 4, 0), std::nullopt);
  EXPECT_EQ(asSessionSeesIt.sendMessage(Value(Dictionary{{"a", 1}}), now_, 3, 4, 7, 0), std::nullopt);
  EXPECT_FALSE(std::filesystem::exists(energy::localLogPath()));
  // Counted as what this kind does not carry, not as sent.
  test::expectOnly(backend_.counters(), {{BackendCount::droppedUnsupported, 2}});
}

TEST_F(PellamBackendTest, UnwritableEnergyLogIsReportedNotThrown) {
  // A folder where the log file should be.
  std::filesystem::create_directories(energy::localLogPath());
  EXPECT_FALSE(energy::logRegisteredEvent(28, "Hollond-ZTH", Value(Dictionary{{"a", 1}})));
  EXPECT_EQ(backend_.sendMessage(Value(Dictionary{{"a", 1}}), now_, 3, 4, std::uint16_t{1}), std::nullopt);
}

}  // namespace
}  // namespace zerith
