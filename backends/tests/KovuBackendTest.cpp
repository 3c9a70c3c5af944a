#include <gtest/gtest.h>

#include <dlfcn.h>
#include <zlib.h>

#include <nlohmann/json.hpp>

#include "backends/KovuBackend.h"
#include "backends/tests/BackendTestSupport.h"
#include "config/tests/ScopedEnv.h"
#include "platform/Log.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithConstants.h"

namespace zerith {
namespace {

using log::Level;

class KovuBackendTest : public ::testing::Test {
 protected:
  std::shared_ptr<KovuBackend> make(std::int32_t clientType = 13) {
    return KovuBackend::initWithName(kZerithBackendKovu, Value(Dictionary{}), "family", clientType);
  }

  test::TempRoot root_;
  log::LogCapture capture_;
  const std::filesystem::path output_ = root_ / "/adaptor-output.jsonl";
  test::ScopedEnv outputEnv_{"KOVU_EXAMPLE_OUTPUT", output_.c_str()};
  const timeval now_{1700000000, 250000};
};

// Other client types log the loading, then that no bundle matches; the
// three-argument initialiser means client type 0.
TEST_F(KovuBackendTest, OnlyClientTypes7And11And13AreAllowed) {
  for (std::int32_t type : {-7, 0, 5, 7, 8, 11, 12, 13, 14, 20}) {
    EXPECT_EQ(KovuBackend::isClientTypeAllowed(type), type == 7 || type == 11 || type == 13) << type;
  }
  test::installAdaptorPlugin(ZERITH_KOVU_EXAMPLE_PLUGIN);
  EXPECT_EQ(make(8), nullptr);
  EXPECT_TRUE(capture_.has(Level::Default, "KovuBackend(initWithName): Loading Kovu adaptor class for client type 8"));
  EXPECT_EQ(KovuBackend::initWithName(kZerithBackendKovu, Value(), "family"), nullptr);
  EXPECT_TRUE(capture_.has(Level::Error, "KovuBackend(initWithName): No matching bundle found for client type 0"));
}

// A plugin without the forwarding operation, no plugin, and a shared object
// without the adaptor factory: the backend is made all the same and reports
// every event as not forwarded, counting it as lost.
TEST_F(KovuBackendTest, AdaptorThatCannotForwardIsReportedOnEveryEvent) {
  // zlib loads fine but has no "KovuAdaptor".
  Dl_info zlib{};
  ASSERT_NE(::dladdr(reinterpret_cast<void*>(&::deflate), &zlib), 0);
  struct Row {
    const char* label;
    const char* install;   // nullptr: no plugin
    const char* loadLine;  // before the plugin's path; nullptr: none
    const char* loadEnd;   // after it
    const char* adaptor;   // as the per-event line names it
  };
  const Row rows[] = {
      {"no forwarding operation", ZERITH_KOVU_NO_FORWARDING_PLUGIN, nullptr, "", "<NoForwardingAdaptor>"},
      {"no plugin", nullptr, "KovuBackend(initWithName): Could not load adaptor plugin ", "", "(null)"},
      {"no factory", zlib.dli_fname, "KovuBackend(initWithName): Adaptor plugin ", " has no KovuAdaptor", "(null)"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    test::TempRoot own;  // a plugin path of its own: never one the loader has seen
    capture_.clear();
    if (row.install) {
      test::installAdaptorPlugin(row.install);
    }
    auto backend = make(13);
    ASSERT_NE(backend, nullptr);
    if (row.loadLine) {
      EXPECT_TRUE(capture_.contains(row.loadLine + paths::adaptorPluginPath().string() + row.loadEnd));
    }
    for (int i = 0; i < 3; ++i) {
      EXPECT_EQ(backend->sendMessage(Value(Dictionary{{"a", 1}}), now_, 1, 1, 0), std::nullopt);
    }
    const std::string line = std::string("KovuBackend(sendMessage): Kovu adaptor ") + row.adaptor +
                             " does not respond to forwarding selector sendMessageWithMethod:respCode:dict:";
    EXPECT_TRUE(capture_.has(Level::Error, line));
    EXPECT_EQ(capture_.count(line), 3u);
    EXPECT_FALSE(std::filesystem::exists(output_));
    test::expectOnly(backend->counters(), {{BackendCount::droppedTransportError, 3}});
  }
}

TEST_F(KovuBackendTest, ReleasingOneBackendKeepsTheOthersPluginLoaded) {
  test::installAdaptorPlugin(ZERITH_KOVU_EXAMPLE_PLUGIN);
  auto first = make(13);
  auto second = make(13);
  ASSERT_TRUE(first && second);
  first.reset();
  second->sendMessage(Value(Dictionary{{"after", true}}), now_, 4, 5, 0);
  const auto lines = test::readLines(output_);
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(nlohmann::json::parse(lines[0]).dump(), R"({"dict":{"after":true},"method":4,"respCode":5})");
  test::expectOnly(second->counters(), {{BackendCount::sent, 1}});
}

}  // namespace
}  // namespace zerith
