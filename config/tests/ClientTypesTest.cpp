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

// Types without a storebag have no name; shared names point to one bag.
TEST(ClientTypesTest, StorebagNamesAndEnvironmentSectionsWithTheirGaps) {
  const std::pair<ZerithClientType, std::optional<std::string>> bags[] = {
      {0, {}},        {1, {}},        {2, {}},        {3, {}},        {4, {}},        {24, {}},
      {25, {}},       {~0u, {}},      {5, "ambrel"},  {6, "bostin"},  {7, "dravon"},  {8, "elquin"},
      {9, "farrow"},  {10, "gelmo"},  {11, "dravon"}, {12, "hestra"}, {13, "dravon"}, {14, "bostin"},
      {15, "bostin"}, {16, "ivolt"},  {17, "jarnel"}, {18, "kesto"},  {19, "lumira"}, {20, "dravon"},
      {21, "morvah"}, {22, "nelvin"}, {23, "orrin"},
  };
  for (const auto& [type, name] : bags) {
    EXPECT_EQ(storebagNameForClientType(type), name) << type;
  }
  const std::pair<ZerithEnvironmentType, std::optional<std::string>> sections[] = {
      {0, {}}, {1, "development"}, {2, "velmar_internal"}, {3, "seed"}, {4, "release"}, {5, {}}, {~0u, {}}};
  for (const auto& [type, name] : sections) {
    EXPECT_EQ(environmentNameForType(type), name) << type;
  }
}

class EnvironmentTest : public ::testing::Test {
 protected:
  void setStored(const Value& v) { ASSERT_TRUE(Defaults(kZerithDefaultsDomain).setObject(kEnvironmentTypeKey, v)); }

  test::TempRoot root_;
  log::LogCapture capture_;
};

// Stored values as read: out of range is corrected to internal and logged
// unsigned; zero is accepted and selects no section; a numeric string is
// its integer.
TEST_F(EnvironmentTest, StoredValuesResolveOrAreCorrected) {
  const struct {
    Value stored;
    ZerithEnvironmentType expected;
    const char* error;
  } rows[] = {
      {Value(5), kEnvironmentInternal, "userDefaultsEnvironment: Invalid environment type 5"},
      {Value(100), kEnvironmentInternal, "userDefaultsEnvironment: Invalid environment type 100"},
      {Value(-1), kEnvironmentInternal, "userDefaultsEnvironment: Invalid environment type 4294967295"},
      {Value(-4), kEnvironmentInternal, "userDefaultsEnvironment: Invalid environment type 4294967292"},
      {Value(0), kEnvironmentNone, nullptr},
      {Value("4"), kEnvironmentRelease, nullptr},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.stored.description());
    capture_.clear();
    setStored(row.stored);
    EXPECT_EQ(userDefaultsEnvironment(), row.expected);
    EXPECT_TRUE(
        capture_.has(Level::Default, "userDefaultsEnvironment: Environment type " + std::to_string(row.expected)));
    EXPECT_EQ(capture_.count("Invalid environment type"), row.error ? 1u : 0u);
    if (row.error) {
      EXPECT_TRUE(capture_.has(Level::Error, row.error));
    }
  }
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

void writeReleaseType(const test::TempRoot& root, const char* releaseType) {
  root.write("/etc/zerithd/device.plist",
             plist::encodeXml(Value(Dictionary{{"ReleaseType", Value(releaseType)}})));
}

// Only the exact text "Internal" makes an internal build, where an absent
// value resolves to internal; the flag stays as it was when the file changes.
// The flag is computed once per process: each case runs in a child of its own.
TEST(InternalBuildDeathTest, OnlyTheExactTextInternalCountsAndTheFlagIsKeptWhenTheDeviceFileChanges) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  for (const auto& [releaseType, internal] : {std::pair{"Internal", true}, std::pair{"internal", false}}) {
    // The root goes before the exit, which unwinds nothing.
    EXPECT_EXIT(
        {
          bool passed = false;
          {
            test::TempRoot root;
            writeReleaseType(root, releaseType);
            const bool resolved = userDefaultsEnvironment() == (internal ? kEnvironmentInternal : kEnvironmentSeed);
            writeReleaseType(root, internal ? "Customer" : "Internal");
            passed = resolved && isInternalBuild() == internal;
          }
          std::exit(passed ? 0 : 1);
        },
        ::testing::ExitedWithCode(0), "")
        << releaseType;
  }
}

}  // namespace
}  // namespace zerith
