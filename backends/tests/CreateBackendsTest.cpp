#include <gtest/gtest.h>
#include <sys/time.h>

#include "backends/KovuBackend.h"
#include "backends/PellamBackend.h"
#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "backends/CreateBackends.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithConstants.h"

namespace zerith {
namespace {

using log::Level;

// Reads the fields a backend keeps for its subclasses.
struct Peek : ZerithBackend {
  using ZerithBackend::selfVersionMajor;
  using ZerithBackend::selfVersionMiddle;
  using ZerithBackend::selfVersionMinor;
  using ZerithBackend::startTimeStamp;
};

std::string selfVersionOf(const ZerithBackend& b) {
  return std::to_string((b.*&Peek::selfVersionMajor)()) + "." + std::to_string((b.*&Peek::selfVersionMiddle)()) +
         "." + std::to_string((b.*&Peek::selfVersionMinor)());
}

double startOf(const ZerithBackend& b) { return (b.*&Peek::startTimeStamp)(); }

class CreateBackendsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // The adaptor plugin is optional here: without it the adaptor backend
    // still exists and reports its events as not forwarded.
    root_.write("/etc/zerithd/device.plist",
                plist::encodeXml(Value(Dictionary{{"ProductVersion", "17.2"},
                                                  {"BuildVersion", "21C52"},
                                                  {"ProductType", "Velmar7,1"},
                                                  {"DeviceName", "kitchen"}})));
  }
  void setFrameworkVersion(const char* version) {
    root_.write("/usr/share/zerith/Info.plist",
                plist::encodeXml(Value(Dictionary{{"BundleVersion", version}})));
  }

  test::TempRoot root_;
  log::LogCapture capture_;
  const char udid_[41] = "0123456789012345678901234567890123456789";
  const Value userInfo_{Dictionary{{kZerithUserInfoClientName, "mail"}}};
  const Value sessionInfo_{Dictionary{{kZerithSessionInfoSessionID, Value(4242)},
                                      {kZerithSessionInfoClientType, Value(13)},
                                      {kZerithSessionInfoClientVersion, Value(70000)},
                                      {kZerithSessionInfoRequireUserInfo, Value(true)},
                                      {kZerithSessionInfoBatchEvent, Value(true)}}};
};

TEST_F(CreateBackendsTest, NilSectionOrSessionInfoGivesNilWithItsErrorAndAnEmptySectionNoBackends) {
  EXPECT_EQ(createBackends(Value(), sessionInfo_, userInfo_, udid_), std::nullopt);
  EXPECT_TRUE(capture_.has(Level::Error, "createBackends: Attempted to create backends with nil storebag"));
  EXPECT_EQ(createBackends(Value(Dictionary{}), Value(), userInfo_, udid_), std::nullopt);
  EXPECT_TRUE(capture_.has(Level::Error, "createBackends: Attempted to create backends with nil session info"));
  // An empty section gives an empty set, not nil.
  const auto none = createBackends(Value(Dictionary{}), sessionInfo_, userInfo_, udid_);
  ASSERT_TRUE(none);
  EXPECT_TRUE(none->empty());
}

TEST_F(CreateBackendsTest, UnknownKindsAreSkippedAndKnownOnesKeepTheSectionOrder) {
  const Value section(Dictionary{{"carrierPigeon", Value(Dictionary{})},
                                 {kZerithBackendKovu, Value(Dictionary{{"x", 1}})},
                                 {"smokeSignal", Value(Dictionary{})},
                                 {kZerithBackendPellamlog, Value(Dictionary{})}});
  const auto backends = createBackends(section, sessionInfo_, userInfo_, udid_);
  ASSERT_TRUE(backends);
  ASSERT_EQ(backends->size(), 2u);
  EXPECT_EQ((*backends)[0].first, kZerithBackendKovu);
  EXPECT_NE(std::dynamic_pointer_cast<KovuBackend>((*backends)[0].second), nullptr);
  EXPECT_EQ((*backends)[1].first, kZerithBackendPellamlog);
  EXPECT_NE(std::dynamic_pointer_cast<PellamBackend>((*backends)[1].second), nullptr);
  EXPECT_TRUE(capture_.has(Level::Error, "ZerithBackend(newBackendWithName): carrierPigeon"));
  EXPECT_TRUE(capture_.has(Level::Error, "ZerithBackend(newBackendWithName): smokeSignal"));
}

TEST_F(CreateBackendsTest, EveryBackendCarriesTheSessionIdentityAndDeviceFacts) {
  setFrameworkVersion("2.5.3");
  timeval before{};
  ::gettimeofday(&before, nullptr);
  const Value section(Dictionary{{kZerithBackendPellamlog, Value(Dictionary{})}, {kZerithBackendKovu, Value()}});
  const auto backends = createBackends(section, sessionInfo_, userInfo_, udid_);
  timeval after{};
  ::gettimeofday(&after, nullptr);
  ASSERT_TRUE(backends);
  ASSERT_EQ(backends->size(), 2u);
  for (const auto& [name, b] : *backends) {
    SCOPED_TRACE(name);
    EXPECT_EQ(b->sessionID(), 4242u);
    EXPECT_EQ(b->compType(), 13);
    EXPECT_EQ(b->clientVersion(), 4464);  // 70000 keeps its low 16 bits
    EXPECT_EQ(b->udid(), udid_);
    EXPECT_EQ(b->productVersion(), "17.2");
    EXPECT_EQ(b->buildVersion(), "21C52");
    EXPECT_EQ(b->hardwareType(), "Velmar7,1");
    EXPECT_EQ(b->productFamily(), "kitchen");
    EXPECT_FALSE(b->isInternal());
    EXPECT_TRUE(b->requireUserInfo());
    EXPECT_TRUE(b->batchEvents());
    EXPECT_EQ(b->userInfoDict(), userInfo_);
    EXPECT_EQ(selfVersionOf(*b), "2.5.3");
    EXPECT_GE(startOf(*b), timevalToSeconds(before));
    EXPECT_LE(startOf(*b), timevalToSeconds(after));
  }
  // One start time for the whole set.
  EXPECT_EQ(startOf(*(*backends)[0].second), startOf(*(*backends)[1].second));
}

TEST_F(CreateBackendsTest, MissingDeviceFactsFlagsAndFrameworkVersionStayEmptyOrDefault) {
  std::filesystem::remove(root_ / "/etc/zerithd/device.plist");
  const Value sparse(Dictionary{{kZerithSessionInfoClientType, Value(8)}});
  const auto backends = createBackends(Value(Dictionary{{kZerithBackendPellamlog, Value()}}), sparse, Value(), nullptr);
  ASSERT_TRUE(backends && backends->size() == 1);
  const auto& b = (*backends)[0].second;
  EXPECT_EQ(b->productVersion(), std::nullopt);
  EXPECT_EQ(b->hardwareType(), std::nullopt);
  EXPECT_EQ(b->sessionID(), 0u);
  EXPECT_EQ(b->compType(), 8);
  EXPECT_FALSE(b->requireUserInfo());
  EXPECT_FALSE(b->batchEvents());
  EXPECT_TRUE(b->userInfoDict().isNil());
  EXPECT_EQ(b->udid(), nullptr);
  // A framework bundle without a version reports 8.0.
  EXPECT_EQ(selfVersionOf(*b), "8.0.0");
}

}  // namespace
}  // namespace zerith
