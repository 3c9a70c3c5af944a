#include <gtest/gtest.h>

#include "backends/KovuBackend.h"
#include "backends/PellamBackend.h"
#include "backends/ZerithBackend.h"
#include "backends/tests/BackendTestSupport.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithConstants.h"

namespace zerith {
namespace {

using log::Level;

class BackendFactoryTest : public ::testing::Test {
 protected:
  void SetUp() override { test::installAdaptorPlugin(ZERITH_KOVU_EXAMPLE_PLUGIN); }
  void setDeviceProductType(const char* type) {
    root_.write("/etc/zerithd/device.plist", plist::encodeXml(Value(Dictionary{{"ProductType", type}})));
  }

  test::TempRoot root_;
  log::LogCapture capture_;
  const Value profile_{Dictionary{{"clients", Value(Array{})}}};
};

TEST_F(BackendFactoryTest, UnknownOrEmptyNameGivesNilAndOneErrorLine) {
  EXPECT_EQ(ZerithBackend::newBackendWithName("carrierPigeon", profile_, "family", 7), nullptr);
  EXPECT_EQ(ZerithBackend::newBackendWithName("", profile_, "family", 7), nullptr);
  EXPECT_TRUE(capture_.has(Level::Error, "ZerithBackend(newBackendWithName): carrierPigeon"));
  EXPECT_TRUE(capture_.has(Level::Error, "ZerithBackend(newBackendWithName): "));
  EXPECT_EQ(capture_.count("ZerithBackend(newBackendWithName)"), 2u);
}

TEST_F(BackendFactoryTest, NamesCompareExactly) {
  EXPECT_EQ(ZerithBackend::newBackendWithName("PellamLog", profile_, "family", 7), nullptr);
  EXPECT_EQ(ZerithBackend::newBackendWithName(std::string(kZerithBackendKovu) + " ", profile_, "family", 7), nullptr);
}

TEST_F(BackendFactoryTest, EnergyLogBackendGetsNameProfileAndFamily) {
  auto backend = ZerithBackend::newBackendWithName(kZerithBackendPellamlog, profile_, "living-room", 8);
  ASSERT_NE(std::dynamic_pointer_cast<PellamBackend>(backend), nullptr);
  EXPECT_EQ(backend->name(), kZerithBackendPellamlog);
  EXPECT_EQ(backend->productFamily(), "living-room");
  EXPECT_EQ(capture_.count("newBackendWithName"), 0u);
}

TEST_F(BackendFactoryTest, AdaptorBackendReceivesTheClientType) {
  EXPECT_NE(std::dynamic_pointer_cast<KovuBackend>(
                ZerithBackend::newBackendWithName(kZerithBackendKovu, profile_, "family", 13)),
            nullptr);
  EXPECT_EQ(ZerithBackend::newBackendWithName(kZerithBackendKovu, profile_, "family", 8), nullptr);
  EXPECT_TRUE(capture_.has(Level::Error, "KovuBackend(initWithName): No matching bundle found for client type 8"));
  // Refused by its own initialiser, not unknown to the factory.
  EXPECT_EQ(capture_.count("ZerithBackend(newBackendWithName)"), 0u);
}

TEST_F(BackendFactoryTest, AdaptorBackendIsUnknownOnTarvixDevices) {
  setDeviceProductType("Tarvix");
  EXPECT_EQ(ZerithBackend::newBackendWithName(kZerithBackendKovu, profile_, "family", 13), nullptr);
  EXPECT_TRUE(capture_.has(Level::Error, "ZerithBackend(newBackendWithName): kovu"));
  EXPECT_EQ(capture_.count("KovuBackend(initWithName)"), 0u);
}

TEST_F(BackendFactoryTest, TarvixRuleLooksAtTheDeviceNotTheProductFamily) {
  setDeviceProductType("Tarvix Mini");
  EXPECT_NE(ZerithBackend::newBackendWithName(kZerithBackendKovu, profile_, "Tarvix", 13), nullptr);
}

}  // namespace
}  // namespace zerith
