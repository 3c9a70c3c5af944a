// The backend factory: which names make which kind, what the kinds' own
// initialisers refuse, and the device rule that hides the adaptor backend.

#include <gtest/gtest.h>

#include "backends/HTTPSPostBackend.h"
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
      {"https post", kZerithBackendHTTPPost, isA<HTTPSPostBackend>},
      {"https post 2", kZerithBackendHTTPPost2, isA<HTTPSPostBackend>},
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

}  // namespace
}  // namespace zerith
