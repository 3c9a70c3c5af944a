#include <gtest/gtest.h>

#include <cstdlib>

#include "config/ClientTypes.h"
#include "platform/Defaults.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

using log::Level;

TEST(ClientTypesTest, TypesWithoutStorebagHaveNoName) {
  for (ZerithClientType type : {0u, 1u, 2u, 3u, 4u, 24u, 25u, 0xFFFFFFFFu}) {
    EXPECT_EQ(storebagNameForClientType(type), std::nullopt) << type;
  }
}

TEST(ClientTypesTest, SharedStorebagNamesPointToOneBag) {
  const std::pair<ZerithClientType, const char*> table[] = {
      {5, "ambrel"},  {6, "bostin"},  {7, "dravon"},  {8, "elquin"},  {9, "farrow"},  {10, "gelmo"},
      {11, "dravon"}, {12, "hestra"}, {13, "dravon"}, {14, "bostin"}, {15, "bostin"}, {16, "ivolt"},
      {17, "jarnel"}, {18, "kesto"},  {19, "lumira"}, {20, "dravon"}, {21, "morvah"}, {22, "nelvin"},
      {23, "orrin"},
  };
  for (const auto& [type, name] : table) {
    EXPECT_EQ(storebagNameForClientType(type), name) << type;
  }
}

TEST(ClientTypesTest, EnvironmentSectionNamesAndTheirGaps) {
  EXPECT_EQ(environmentNameForType(0), std::nullopt);
  EXPECT_EQ(environmentNameForType(1), "development");
  EXPECT_EQ(environmentNameForType(2), "velmar_internal");
  EXPECT_EQ(environmentNameForType(3), "seed");
  EXPECT_EQ(environmentNameForType(4), "release");
  EXPECT_EQ(environmentNameForType(5), std::nullopt);
  EXPECT_EQ(environmentNameForType(0xFFFFFFFFu), std::nullopt);
}

class EnvironmentTest : public ::testing::Test {
 protected:
  void setStored(const Value& v) { ASSERT_TRUE(Defaults(kZerithDefaultsDomain).setObject(kEnvironmentTypeKey, v)); }

  test::TempRoot root_;
  log::LogCapture capture_;
};

TEST_F(EnvironmentTest, AbsentValueOnACustomerBuildResolvesToSeed) {
  EXPECT_EQ(userDefaultsEnvironment(), kEnvironmentSeed);
  EXPECT_TRUE(capture_.has(Level::Default, "userDefaultsEnvironment: Environment type 3"));
  EXPECT_EQ(lastResolvedEnvironmentType(), kEnvironmentSeed);
}

TEST_F(EnvironmentTest, OutOfRangeValuesAreCorrectedToInternalAndLoggedUnsigned) {
  const std::pair<long long, const char*> cases[] = {
      {5, "userDefaultsEnvironment: Invalid environment type 5"},
      {100, "userDefaultsEnvironment: Invalid environment type 100"},
      {-1, "userDefaultsEnvironment: Invalid environment type 4294967295"},
      {-4, "userDefaultsEnvironment: Invalid environment type 4294967292"},
  };
  for (const auto& [stored, message] : cases) {
    capture_.clear();
    setStored(Value(stored));
    EXPECT_EQ(userDefaultsEnvironment(), kEnvironmentInternal) << stored;
    EXPECT_TRUE(capture_.has(Level::Error, message)) << message;
    EXPECT_TRUE(capture_.has(Level::Default, "userDefaultsEnvironment: Environment type 2"));
  }
}

TEST_F(EnvironmentTest, ZeroIsAcceptedAndSelectsNoSection) {
  setStored(Value(0));
  EXPECT_EQ(userDefaultsEnvironment(), kEnvironmentNone);
  EXPECT_EQ(capture_.count("Invalid environment type"), 0u);
  EXPECT_EQ(environmentNameForType(userDefaultsEnvironment()), std::nullopt);
}

TEST_F(EnvironmentTest, ChangedDefaultsTakeEffectAtTheNextCallWithoutRestart) {
  setStored(Value(1));
  EXPECT_EQ(userDefaultsEnvironment(), kEnvironmentDevelopment);
  // Another process (the defaults tool) rewrites the domain.
  root_.write("/var/lib/zerithd/defaults/com.velmar.zerith.plist",
              plist::encodeXml(Value(Dictionary{{"environmentType", Value(4)}})));
  EXPECT_EQ(userDefaultsEnvironment(), kEnvironmentRelease);
  EXPECT_EQ(lastResolvedEnvironmentType(), kEnvironmentRelease);
}

TEST_F(EnvironmentTest, NumericStringIsReadAsItsIntegerValue) {
  setStored(Value("4"));
  EXPECT_EQ(userDefaultsEnvironment(), kEnvironmentRelease);
}

TEST_F(EnvironmentTest, CorruptDefaultsFileCountsAsAbsent) {
  root_.write("/var/lib/zerithd/defaults/com.velmar.zerith.plist", "<plist><dict><key>environmentType</key>");
  EXPECT_EQ(userDefaultsEnvironment(), kEnvironmentSeed);
  EXPECT_TRUE(capture_.contains("ignoring corrupt defaults file"));
}

// The internal-build flag is computed once per process, so the internal
// cases run in a child process of their own.
class InternalBuildDeathTest : public ::testing::Test {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

void writeReleaseType(const test::TempRoot& root, const char* releaseType) {
  root.write("/etc/zerithd/device.plist",
             plist::encodeXml(Value(Dictionary{{"ReleaseType", Value(releaseType)}})));
}

TEST_F(InternalBuildDeathTest, AbsentValueOnAnInternalBuildResolvesToInternal) {
  EXPECT_EXIT(
      {
        test::TempRoot root;
        writeReleaseType(root, "Internal");
        std::exit(static_cast<int>(userDefaultsEnvironment()));
      },
      ::testing::ExitedWithCode(2), "");
}

TEST_F(InternalBuildDeathTest, FlagIsComputedOnceAndKeptWhenTheDeviceFileChanges) {
  EXPECT_EXIT(
      {
        test::TempRoot root;
        writeReleaseType(root, "Internal");
        const bool first = isInternalBuild();
        writeReleaseType(root, "Customer");
        const bool second = isInternalBuild();
        std::exit(first && second ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
}

TEST_F(InternalBuildDeathTest, OnlyTheExactTextInternalCounts) {
  EXPECT_EXIT(
      {
        test::TempRoot root;
        writeReleaseType(root, "internal");
        std::exit(isInternalBuild() ? 1 : 0);
      },
      ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace zerith
