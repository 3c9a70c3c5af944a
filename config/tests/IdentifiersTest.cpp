#include <gtest/gtest.h>

#include <regex>
#include <set>
#include <thread>
#include <vector>

#include "config/ClientTypes.h"
#include "config/Identifiers.h"
#include "platform/Defaults.h"
#include "platform/Log.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithConstants.h"

namespace zerith {
namespace {

using log::Level;

class IdentifiersTest : public ::testing::Test {
 protected:
  Defaults defaults_{kZerithDefaultsDomain};
  test::TempRoot root_;
  log::LogCapture capture_;
};

TEST_F(IdentifiersTest, PersistentIdentifierWithNilPartsIsStoredAndStable) {
  const std::string id = getPersistentIdentifierForCustomClientIDSuffix(std::nullopt, std::nullopt);
  EXPECT_TRUE(std::regex_match(id, std::regex("[0-9A-F]{8}-[0-9A-F]{4}-[0-9A-F]{4}-[0-9A-F]{4}-[0-9A-F]{12}"))) << id;
  EXPECT_EQ(defaults_.objectForKey("uuid::"), Value(id));
  EXPECT_TRUE(capture_.has(Level::Default, "getPersistentIdentifierForCustomClientIDSuffix: The value for uuid::: " + id));
  EXPECT_EQ(getPersistentIdentifierForCustomClientIDSuffix(std::nullopt, std::nullopt), id);
  EXPECT_EQ(getPersistentIdentifierForCustomClientIDSuffix(std::string(), std::string()), id);
}

TEST_F(IdentifiersTest, EachSuffixHasItsOwnIdentifier) {
  const std::string a = getPersistentIdentifierForCustomClientIDSuffix("mail", "sync");
  const std::string b = getPersistentIdentifierForCustomClientIDSuffix("mail", "fetch");
  EXPECT_NE(a, b);
  EXPECT_EQ(defaults_.objectForKey("uuid:mail:sync"), Value(a));
  EXPECT_EQ(defaults_.objectForKey("uuid:mail:fetch"), Value(b));
  // A stored value that is no string is replaced.
  ASSERT_TRUE(defaults_.setObject("uuid:x:y", Value(5)));
  const std::string id = getPersistentIdentifierForCustomClientIDSuffix("x", "y");
  EXPECT_EQ(id.size(), 36u);
  EXPECT_EQ(defaults_.objectForKey("uuid:x:y"), Value(id));
}

TEST_F(IdentifiersTest, ConcurrentFirstRequestsAgreeOnOneIdentifier) {
  std::vector<std::string> seen(16);
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < seen.size(); ++i) {
    threads.emplace_back([&, i] { seen[i] = getPersistentIdentifierForCustomClientIDSuffix("a", "b"); });
  }
  for (auto& t : threads) {
    t.join();
  }
  EXPECT_EQ(std::set<std::string>(seen.begin(), seen.end()).size(), 1u);
  EXPECT_EQ(defaults_.objectForKey("uuid:a:b"), Value(seen[0]));
}

TEST_F(IdentifiersTest, DefaultsStringsForEachKindOfValue) {
  EXPECT_EQ(defaultsStringForKey("httpsPostURL"), std::nullopt);
  ASSERT_TRUE(defaults_.setObject("httpsPostURL", Value("https://127.0.0.1:9/post")));
  ASSERT_TRUE(defaults_.setObject("forceEventLogging", Value(true)));
  ASSERT_TRUE(defaults_.setObject("count", Value(-12)));
  ASSERT_TRUE(defaults_.setObject("list", Value(Array{Value(1)})));
  EXPECT_EQ(defaultsStringForKey("httpsPostURL"), "https://127.0.0.1:9/post");
  EXPECT_EQ(defaultsStringForKey("forceEventLogging"), "1");
  EXPECT_EQ(defaultsStringForKey("count"), "-12");
  EXPECT_EQ(defaultsStringForKey("list"), std::nullopt);
}

TEST(ClientServiceKeyTest, LowerCasedNamesWithEmptyPartsForMissingOnes) {
  EXPECT_EQ(clientServiceKey(Value(Dictionary{{kZerithUserInfoClientName, "Mail"},
                                              {kZerithUserInfoServiceName, "SYNC"}})),
            "mail:sync");
  EXPECT_EQ(clientServiceKey(Value(Dictionary{{kZerithUserInfoServiceName, "haptics"}})), ":haptics");
  EXPECT_EQ(clientServiceKey(Value(Dictionary{{kZerithUserInfoClientName, Value(3)}})), ":");
  EXPECT_EQ(clientServiceKey(Value()), ":");
}

}  // namespace
}  // namespace zerith
