#include "daemon/StorebagCache.h"

#include <gtest/gtest.h>

#include <deque>
#include <map>

#include "config/StorebagVerify.h"
#include "platform/Log.h"

namespace zerith {
namespace {

using log::Level;

// What one call of the storebag fetch gives back.
struct FetchResult {
  Value storebag;
  std::int32_t maxAge = 0;
  Value version;
  bool unchanged = false;
};

Value section(const char* marker) { return Value(Dictionary{{"kovu", Value(Dictionary{{"marker", marker}})}}); }

// The agent's cache on a hand-driven clock, a scripted fetch and a settable
// disk cache date.
class StorebagCacheTest : public ::testing::Test {
 protected:
  StorebagCacheTest()
      : cache_([this] { return now_; },
               [this](std::int32_t clientType, std::int32_t& maxAge, Value& version, bool& unchanged) {
                 fetchedTypes_.push_back(clientType);
                 if (results_.empty()) {
                   ADD_FAILURE() << "unexpected fetch for client type " << clientType;
                   return Value();
                 }
                 FetchResult r = results_.front();
                 results_.pop_front();
                 if (r.storebag.isNil() && !cause_.empty()) {
                   noteStorebagFailure(cause_);
                 }
                 maxAge = r.maxAge;
                 version = r.version;
                 unchanged = r.unchanged;
                 return r.storebag;
               },
               [this](const std::string& name) -> std::optional<Date> {
                 const auto it = diskDates_.find(name);
                 return it == diskDates_.end() ? std::nullopt : std::optional<Date>(it->second);
               }) {}

  void advance(double seconds) { now_.secondsSince1970 += seconds; }
  Value entry(const std::string& name) const { return cache_.entries().get(name); }
  // An entry as a fetch at the current time records it.
  Value recorded(const Value& storebag, const char* version, const char* state, std::int32_t maxAge) const {
    return Value(Dictionary{{"StorebagData", storebag},
                            {"StorebagVersion", Value(version)},
                            {"StorebagFetchTime", Value(now_)},
                            {"StorebagFetchState", Value(state)},
                            {"StorebagMaxAge", Value(maxAge)}});
  }

  log::LogCapture logs_;
  Date now_{1700000000};  // 2023-11-14 22:13:20 UTC
  std::deque<FetchResult> results_;
  std::string cause_;  // what the scripted fetch notes as its failure
  std::vector<std::int32_t> fetchedTypes_;
  std::map<std::string, Date> diskDates_;
  StorebagCache cache_;
};

// (That the failure line ends with the fetch's cause is the end-to-end start test's.)
TEST_F(StorebagCacheTest, FailedFetchIsNotRetriedWithin900SecondsAndItsCauseIsNotRepeatedForTheNextOne) {
  results_ = {FetchResult{}, FetchResult{}, FetchResult{section("third"), 600, "2.0"}};
  cause_ = "HTTP status 404 from https://bags.example/ambrel?version=8.0";
  EXPECT_TRUE(cache_.storebagForClientType(5, 1).isNil());
  EXPECT_EQ(*entry("ambrel")["StorebagFetchState"].string(), "Fetch Failure");
  cause_.clear();

  advance(899);
  EXPECT_TRUE(cache_.storebagForClientType(5, 2).isNil());
  EXPECT_TRUE(logs_.has(Level::Default,
                        "storebagForSession: Not fetching storebag for client type 5 - must wait 900 seconds between "
                        "attempts"));
  EXPECT_EQ(fetchedTypes_.size(), 1u);

  logs_.clear();
  advance(1);  // 900 seconds: the wait is over; the second failure has no cause of its own
  EXPECT_TRUE(cache_.storebagForClientType(5, 3).isNil());
  EXPECT_TRUE(logs_.has(Level::Error, "fetchAndCacheStorebag: Unable to fetch storebag for client type 5"));
  advance(900);  // and is waited for in turn
  EXPECT_EQ(cache_.storebagForClientType(5, 4), section("third"));
  EXPECT_EQ(fetchedTypes_.size(), 3u);
  EXPECT_EQ(entry("ambrel"), recorded(section("third"), "2.0", "Fetch Successful", 600));
}

TEST_F(StorebagCacheTest, DropForgetsEntriesAndTheWaitAfterAFailure) {
  results_ = {FetchResult{}, FetchResult{section("good"), 86400, "1.0"}, FetchResult{section("newer"), 86400, "2.0"},
              FetchResult{section("other"), 86400, "3.0"}};
  EXPECT_TRUE(cache_.storebagForClientType(5, 1).isNil());
  EXPECT_EQ(cache_.drop(), 1u);
  EXPECT_EQ(cache_.count(), 0u);
  // At once, not 900 seconds later.
  EXPECT_EQ(cache_.storebagForClientType(5, 2), section("good"));
  EXPECT_EQ(cache_.storebagForClientType(13, 3), section("newer"));
  EXPECT_EQ(fetchedTypes_, (std::vector<std::int32_t>{5, 5, 13}));

  // A fresh entry is fetched again too; every name goes.
  EXPECT_EQ(cache_.drop(), 2u);
  EXPECT_TRUE(cache_.storebagVersionForClientType(5).isNil());
  EXPECT_EQ(cache_.storebagForClientType(5, 4), section("other"));
  EXPECT_EQ(*cache_.storebagVersionForClientType(5).string(), "3.0");
  EXPECT_EQ(cache_.drop(), 1u);
  EXPECT_EQ(cache_.drop(), 0u);
}

TEST_F(StorebagCacheTest, FailureAfterSuccessKeepsServingTheOlderStorebag) {
  results_ = {FetchResult{section("old"), 60, "1.0"}, FetchResult{}};
  EXPECT_EQ(cache_.storebagForClientType(5, 1), section("old"));
  advance(61);
  EXPECT_EQ(cache_.storebagForClientType(5, 2), section("old"));  // refetched, failed, old data kept
  EXPECT_EQ(fetchedTypes_.size(), 2u);
  EXPECT_EQ(entry("ambrel"), recorded(section("old"), "1.0", "Fetch Failure", 0));

  advance(100);  // within the wait after the failure
  EXPECT_EQ(cache_.storebagForClientType(5, 3), section("old"));
  EXPECT_EQ(fetchedTypes_.size(), 2u);
}

TEST_F(StorebagCacheTest, FreshEntryAnswersUntilItsMaxAgeAndIsSharedByClientTypesOfOneName) {
  results_ = {FetchResult{section("a"), 600, "1.0"}, FetchResult{section("b"), 600, "1.1"}};
  EXPECT_EQ(cache_.storebagForClientType(7, 1), section("a"));
  advance(599);
  EXPECT_EQ(cache_.storebagForClientType(11, 2), section("a"));  // 11 shares "dravon" with 7
  EXPECT_TRUE(logs_.has(Level::Debug, "storebagForSession: Cached storebag found for client type 11"));
  EXPECT_EQ(fetchedTypes_, std::vector<std::int32_t>{7});

  advance(1);  // age 600 is no longer below the max age
  EXPECT_EQ(cache_.storebagForClientType(20, 3), section("b"));
  EXPECT_EQ(fetchedTypes_, (std::vector<std::int32_t>{7, 20}));
  EXPECT_EQ(*cache_.storebagVersionForClientType(13).string(), "1.1");
  EXPECT_EQ(cache_.count(), 1u);
}

TEST_F(StorebagCacheTest, MaxAgeZeroFetchesOnEveryRequestAndAStorebagWithoutVersionClearsTheOlderOne) {
  results_ = {FetchResult{section("a"), 0, "1"}, FetchResult{section("b"), 0, "1"},
              FetchResult{section("c"), 0, Value()}};
  EXPECT_EQ(cache_.storebagForClientType(5, 1), section("a"));
  EXPECT_EQ(cache_.storebagForClientType(5, 1), section("b"));
  EXPECT_EQ(*cache_.storebagVersionForClientType(5).string(), "1");
  EXPECT_EQ(cache_.storebagForClientType(5, 1), section("c"));
  EXPECT_EQ(fetchedTypes_.size(), 3u);
  EXPECT_TRUE(cache_.storebagVersionForClientType(5).isNil());
}

TEST_F(StorebagCacheTest, UnchangedStorebagKeepsOlderDataAndCountsAsSuccess) {
  results_ = {FetchResult{section("a"), 10, "1.0"}, FetchResult{Value(), 300, Value(), true}};
  cache_.storebagForClientType(5, 1);
  advance(20);
  EXPECT_EQ(cache_.storebagForClientType(5, 2), section("a"));
  EXPECT_FALSE(logs_.contains("Unable to fetch storebag"));
  EXPECT_EQ(entry("ambrel"), recorded(section("a"), "1.0", "Fetch Successful", 300));

  advance(299);  // the unchanged answer's max age holds
  EXPECT_EQ(cache_.storebagForClientType(5, 3), section("a"));
  EXPECT_EQ(fetchedTypes_.size(), 2u);
}

TEST_F(StorebagCacheTest, NewerDiskCacheForcesAFetchWithinTheWaitAfterAFailureAndWithinTheMaxAge) {
  results_ = {FetchResult{}, FetchResult{section("a"), 3600, "1"}, FetchResult{section("b"), 3600, "2"}};
  cache_.storebagForClientType(5, 1);
  advance(30);
  diskDates_["ambrel"] = now_;
  EXPECT_EQ(cache_.storebagForClientType(5, 2), section("a"));
  const Date fetched = now_;
  advance(10);  // the disk cache dated the fetch's own second: not newer
  EXPECT_EQ(cache_.storebagForClientType(5, 3), section("a"));
  EXPECT_EQ(fetchedTypes_.size(), 2u);

  diskDates_["ambrel"] = Date{fetched.secondsSince1970 + 5};
  EXPECT_EQ(cache_.storebagForClientType(5, 4), section("b"));
  EXPECT_EQ(fetchedTypes_.size(), 3u);
  EXPECT_TRUE(logs_.has(Level::Default,
                        "storebagForSession: Override maxAge as disk cache for storebag 'ambrel' was updated: "
                        "modification time '2023-11-14 22:13:55 +0000' is greater than last fetch time "
                        "'2023-11-14 22:13:50 +0000"));
}

TEST_F(StorebagCacheTest, ClientTypeWithoutStorebagIsRejectedWithoutFetch) {
  for (std::int32_t type : {0, 3, 24, -1}) {
    EXPECT_TRUE(cache_.storebagForClientType(type, 9).isNil());
    EXPECT_TRUE(logs_.has(Level::Error, "fetchAndCacheStorebag: clientType " + std::to_string(type) + " is invalid"));
    EXPECT_TRUE(cache_.storebagVersionForClientType(type).isNil());
  }
  EXPECT_TRUE(fetchedTypes_.empty());
  EXPECT_EQ(cache_.count(), 0u);
}

TEST_F(StorebagCacheTest, FetchLogsItsStepsRecordsTheEntryAndGrowsTheEstimatedSize) {
  results_ = {FetchResult{section("a"), 1234, "3.1"}, FetchResult{section("b"), 60, "1"}};
  const std::size_t empty = cache_.estimatedSize();
  cache_.storebagForClientType(8, 4000000000u);
  EXPECT_TRUE(logs_.has(Level::Debug, "storebagForSession: Retrieving storebag for session 4000000000 with client type 8"));
  EXPECT_TRUE(logs_.has(Level::Debug, "fetchAndCacheStorebag: Fetching storebag for client type 8"));
  EXPECT_TRUE(logs_.has(Level::Debug, "fetchAndCacheStorebag: Storebag max age: 1234 seconds"));
  EXPECT_EQ(entry("elquin"), recorded(section("a"), "3.1", "Fetch Successful", 1234));

  const std::size_t one = cache_.estimatedSize();
  cache_.storebagForClientType(5, 1);
  EXPECT_LT(empty, one);
  EXPECT_LT(one, cache_.estimatedSize());
  EXPECT_EQ(cache_.count(), 2u);
}

}  // namespace
}  // namespace zerith
