// The backend factory (which names make which kind, what the kinds' own
// initialisers refuse, the device rule that hides the adaptor backend) and
// the set a session makes from its storebag section.

#include <gtest/gtest.h>
#include <sys/time.h>

#include "backends/CreateBackends.h"
#include "backends/HTTPSPostBackend.h"
#include "backends/KovuBackend.h"
#include "backends/PellamBackend.h"
#include "backends/tests/BackendTestSupport.h"
#include "config/Conversions.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithConstants.h"

namespace zerith {
namespace {

using log::Level;

// Reads the start time a backend keeps for its subclasses.
struct Peek : ZerithBackend {
  using ZerithBackend::startTimeStamp;
};

double startOf(const ZerithBackend& b) { return (b.*&Peek::startTimeStamp)(); }

template <class Kind>
bool isA(const ZerithBackend& b) {
  return dynamic_cast<const Kind*>(&b) != nullptr;
}

TEST(BackendFactoryTest, NamesMakeTheirKindsAndEveryRefusalSaysWho) {
  struct Row {
    const char* label;
    std::string name;
    bool (*kind)(const ZerithBackend&);  // nullptr: no backend
    // The one error line of a refusal; empty: the factory's own line for an
    // unknown name ("ZerithBackend(newBackendWithName): <name>").
    std::string refusal = {};
    std::int32_t clientType = 13;
    const char* productType = nullptr;  // the device's, when given
    std::string family = "living-room";
    Value profile = Value(Dictionary{{"clients", Value(Array{})}});
  };
  const std::vector<Row> rows = {
      {"unknown name", "carrierPigeon", nullptr},
      {"empty name", "", nullptr},
      {"names compare exactly", "PellamLog", nullptr},
      {"no trailing space", std::string(kZerithBackendKovu) + " ", nullptr},
      {"energy log", kZerithBackendPellamlog, isA<PellamBackend>, {}, 8},
      {"adaptor with the client type", kZerithBackendKovu, isA<KovuBackend>},
      {"adaptor refusing the client type", kZerithBackendKovu, nullptr,
       "KovuBackend(initWithName): No matching bundle found for client type 8", 8},
      {"adaptor unknown on Tarvix devices", kZerithBackendKovu, nullptr, {}, 13, "Tarvix"},
      {"Tarvix rule reads the device, not the family", kZerithBackendKovu, isA<KovuBackend>, {}, 13, "Tarvix Mini",
       "Tarvix"},
      {"digest https post", kZerithBackendQRS, isA<HTTPSPostBackend>},
      {"https post without a client list", kZerithBackendHTTPPost, nullptr,
       "HTTPSPostBackend(initWithName): can't find the client list.", 7, nullptr, "F", Value(Dictionary{})},
      {"upload server without a post URL", kZerithBackendUploadServer, nullptr,
       "UploadBackend(initWithName): can't resolve upload post URL.", 0, nullptr, "F", Value(Dictionary{})},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    test::TempRoot root;
    log::LogCapture logs;
    test::installAdaptorPlugin(ZERITH_KOVU_EXAMPLE_PLUGIN);
    if (row.productType) {
      root.write("/etc/zerithd/device.plist", plist::encodeXml(Value(Dictionary{{"ProductType", row.productType}})));
    }
    const auto b = ZerithBackend::newBackendWithName(row.name, row.profile, row.family, row.clientType);
    if (row.kind) {
      ASSERT_NE(b, nullptr);
      EXPECT_TRUE(row.kind(*b));
      EXPECT_EQ(b->name(), row.name);
      EXPECT_EQ(b->productFamily(), row.family);
      EXPECT_EQ(logs.count("newBackendWithName"), 0u);
      continue;
    }
    EXPECT_EQ(b, nullptr);
    const bool unknown = row.refusal.empty();
    EXPECT_TRUE(logs.has(Level::Error, unknown ? "ZerithBackend(newBackendWithName): " + row.name : row.refusal));
    // Unknown to the factory: no kind's initialiser ran. Refused by its
    // initialiser: the factory knew the name.
    EXPECT_EQ(logs.count("ZerithBackend(newBackendWithName)"), unknown ? 1u : 0u);
    if (unknown) {
      EXPECT_EQ(logs.count("Backend(initWithName)"), 0u);
    }
  }
}

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

TEST_F(CreateBackendsTest, EveryBackendCarriesTheSessionIdentityAndDeviceFacts) {
  root_.write("/usr/share/zerith/Info.plist", plist::encodeXml(Value(Dictionary{{"BundleVersion", "2.5.3"}})));
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
    // The client version keeps its low 16 bits.
    EXPECT_EQ(std::tuple(b->sessionID(), b->compType(), b->clientVersion(), std::string(b->udid()), b->productVersion(),
                         b->buildVersion(), b->hardwareType(), b->productFamily(), b->isInternal(), b->requireUserInfo(),
                         b->batchEvents(), b->userInfoDict(), test::selfVersionOf(*b)),
              std::tuple(4242u, 13, 4464, std::string(udid_), "17.2", "21C52", "Velmar7,1", "kitchen", false, true,
                         true, userInfo_, "2.5.3"));
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
  EXPECT_EQ(std::tuple(b->productVersion(), b->hardwareType(), b->sessionID(), b->compType(), b->requireUserInfo(),
                       b->batchEvents(), b->userInfoDict(), b->udid()),
            std::tuple(std::nullopt, std::nullopt, 0u, 8, false, false, Value(), nullptr));
  // A framework bundle without a version reports 8.0.
  EXPECT_EQ(test::selfVersionOf(*b), "8.0.0");
}

}  // namespace
}  // namespace zerith
