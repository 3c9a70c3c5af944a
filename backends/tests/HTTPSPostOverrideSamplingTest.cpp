// The sampling decision (a draw below the threshold enables, the threshold
// itself is out; an override decides what is not below it) and the end
// report's "OverrideSampling": the override value only when the draw was not
// below the threshold (so the override decided), -1 otherwise, whichever
// path set the threshold.

#include "backends/tests/HTTPSPostBackendTestSupport.h"

namespace zerith::test {
namespace {

struct OverrideRow {
  const char* name;
  double factor;
  Value threshold;          // "sampling_threshold"; nil: absent
  Value perCountryGB;       // a per-country threshold for GB; nil: none
  Value override;           // "override_sampling"; nil: absent
  std::int32_t state;
  Value reported;           // what the end report carries
};

class OverrideSamplingTest : public HTTPSBackendTest, public ::testing::WithParamInterface<OverrideRow> {};

TEST_P(OverrideSamplingTest, ReportsTheOverrideOnlyWhenItDecided) {
  const OverrideRow& row = GetParam();
  auto client = enablingClient(server.url("/post"));
  client.erase("sampling_threshold");
  if (!row.threshold.isNil()) {
    client.set("sampling_threshold", row.threshold);
  }
  if (!row.perCountryGB.isNil()) {
    client.set("per_country_sampling_thresholds",
               Array{Value(Dictionary{{"country", Array{Value("GB")}}, {"threshold", row.perCountryGB}})});
  }
  if (!row.override.isNil()) {
    client.set("override_sampling", row.override);
  }
  auto b = backend(profileWith({client}));
  b->setSamplingFactor(row.factor);
  b->updateState();
  EXPECT_EQ(b->state(), row.state);
  EXPECT_EQ(b->overrideSampling().isNil() ? Value(-1) : b->overrideSampling(), row.reported);
}

INSTANTIATE_TEST_SUITE_P(
    Paths, OverrideSamplingTest,
    ::testing::Values(
        OverrideRow{"DrawBelowThresholdEnables", 0.1, Value(0.25), Value(), Value(), kBackendStateEnabled, Value(-1)},
        OverrideRow{"DrawAboveThresholdSamplesOut", 0.3, Value(0.25), Value(), Value(), kBackendStateSampledOut,
                    Value(-1)},
        OverrideRow{"DrawAtThresholdSamplesOut", 0.25, Value(0.25), Value(), Value(), kBackendStateSampledOut,
                    Value(-1)},
        OverrideRow{"DrawPastThresholdBelowOverrideSamplesOut", 0.3, Value(0.25), Value(), Value(0.5),
                    kBackendStateSampledOut, Value(0.5)},
        OverrideRow{"PlainThresholdEnables", 0.3, Value(1.0), Value(), Value(0.5), kBackendStateEnabled, Value(-1)},
        OverrideRow{"PlainDrawAtThresholdKeptByOverride", 0.5, Value(0.5), Value(), Value(0.9), kBackendStateSampledOut,
                    Value(0.9)},
        OverrideRow{"PlainDrawPastOverrideDisables", 0.95, Value(0.5), Value(), Value(0.9), kBackendStateDisabled,
                    Value(0.9)},
        OverrideRow{"NoThresholdDisablesWithoutOverride", 0.1, Value(), Value(), Value(0.5), kBackendStateDisabled,
                    Value(-1)},
        OverrideRow{"PerCountryThresholdEnables", 0.3, Value(0.0), Value(1.0), Value(0.0), kBackendStateEnabled, Value(-1)},
        OverrideRow{"PerCountryThresholdSamplesOut", 0.6, Value(1.0), Value(0.5), Value(0.8), kBackendStateSampledOut,
                    Value(0.8)}),
    [](const ::testing::TestParamInfo<OverrideRow>& info) { return std::string(info.param.name); });

// A later decision that ends before the sampling step (here the locale)
// leaves no override from the earlier one.
TEST_F(HTTPSBackendTest, LocaleRefusalAfterAnOverrideDecisionReportsNone) {
  auto client = enablingClient(server.url("/post"));
  client.set("sampling_threshold", 0.5);
  client.set("override_sampling", 0.9);
  auto b = backend(profileWith({client}));
  b->setSamplingFactor(0.6);
  b->updateState();
  ASSERT_EQ(b->state(), kBackendStateSampledOut);
  ASSERT_EQ(b->overrideSampling(), Value(0.9));
  ScopedEnv france{"LC_ALL", "fr_FR.UTF-8"};
  b->updateState();
  EXPECT_EQ(b->state(), kBackendStateDisabled);
  EXPECT_TRUE(b->overrideSampling().isNil());
}

}  // namespace
}  // namespace zerith::test
