// The HTTPS backend's records, envelope, state decision and filters.

#include <algorithm>
#include <cmath>
#include <limits>

#include "backends/tests/HTTPSPostBackendTestSupport.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

class HTTPSRecordTest : public HTTPSBackendTest {};

TEST_F(HTTPSRecordTest, RecordCountsFromTheStartMinuteAndCarriesEveryKeyInOrder) {
  auto b = immediate(server.url("/post"));
  ASSERT_TRUE(b);
  const Dictionary payload{{"_method", "overwritten"}, {"bytes", 17}};
  const Dictionary record = b->newEventDictfromPayload(Value(payload), at(1010, 250000), 5, 6, 99);
  // Payload keys keep their place; the backend's keys follow in their order.
  // The event number is the backend's counter, not the argument.
  const Dictionary expected{{"_method", 5u},
                            {"bytes", 17},
                            {"_startTS", 960},
                            {"_sender", "YJ"},
                            {"_clientVersion", 12u},
                            {"_sessionID", 42u},
                            {"_eventNumber", 0u},
                            {"_status", 6u},
                            {"_clientTS", 969.75},
                            {"eventTime", 969.75},
                            {"_productFamily", "TestFamily"},
                            {"_productModel", "Board9,1"},
                            {"_osVersion", "12.4"},
                            {"_build", "Z1234"},
                            {"_internal", 2u},
                            {"_reportVers", "8.1"},
                            {"_timezoneOffset", static_cast<long long>(timeZoneOffsetSeconds())}};
  EXPECT_EQ(record.entries(), expected.entries());
}

TEST_F(HTTPSRecordTest, AbsentHardwareTypeLeavesNoModelEvenWhenThePayloadNamedOne) {
  auto b = immediate(server.url("/post"));
  ASSERT_TRUE(b);
  b->setHardwareType(std::nullopt);
  // A payload past the dictionary's index threshold, so that the removal
  // goes through the index too.
  Dictionary payload{{"_productModel", "client-said"}, {"first", 1}};
  for (int i = 0; i < 20; ++i) {
    payload.set("k" + std::to_string(i), i);
  }
  const Dictionary record = b->newEventDictfromPayload(Value(payload), at(1010), 5, 6, 99);
  EXPECT_FALSE(record.contains("_productModel"));
  EXPECT_EQ(record.get("_productFamily"), Value("TestFamily"));
  EXPECT_EQ(record.size(), payload.size() - 1 + 15);
  EXPECT_EQ(record.entries()[0].first, "first");
  EXPECT_EQ(record.get("k19"), Value(19));
  EXPECT_EQ(record.get("_timezoneOffset"), Value(static_cast<long long>(timeZoneOffsetSeconds())));
}

TEST_F(HTTPSRecordTest, SessionIdentifierFormDependsOnComponentTypeAndInternalFlag) {
  auto b = immediate(server.url("/post"));
  b->setCombinedSessionIDString("AAA.BBB");
  const auto sessionOf = [&](int type, bool internal) {
    b->setCompType(type);
    b->setIsInternal(internal);
    return b->newEventDictfromPayload(Value(Dictionary{}), at(1001), 1, 1, 1).get("_sessionID");
  };
  EXPECT_EQ(sessionOf(7, false), Value(42u));
  EXPECT_EQ(sessionOf(11, false), Value("AAA.BBB"));
  EXPECT_EQ(sessionOf(11, true), Value(42u));
  EXPECT_EQ(sessionOf(13, true), Value(42u));
  EXPECT_EQ(sessionOf(3, true), Value("AAA.BBB"));
  b->setCombinedSessionIDString(std::nullopt);
  EXPECT_TRUE(sessionOf(3, false).isNil());

  b->setSelfVersion("2.5.3");
  EXPECT_EQ(b->newEventDictfromPayload(Value(Dictionary{}), at(1001), 1, 1, 1).get("_reportVers"), Value("2.5.3"));
}

// What the batch writer keeps, escapes and drops, and the envelope's key
// order, are RecordJsonTest's; here what the backend adds: a line for each
// dropped entry, the identifier it chose, and no printable copy.
TEST_F(HTTPSRecordTest, EnvelopeNamesEachDroppedEntryAndCarriesTheOverridingIdentifier) {
  auto b = immediate(server.url("/post"));
  const Dictionary record{{"inf", std::numeric_limits<double>::infinity()},
                          {"nan", std::numeric_limits<double>::quiet_NaN()},
                          {"list", Array{Value(1)}},
                          {"nested", Dictionary{{"a", 1}}},
                          {"blob", Data{1, 2}},
                          {"flag", true}};
  std::optional<std::string> pretty;
  const auto body = b->createMessageForPostAndLogging({record}, &pretty);
  ASSERT_TRUE(body);
  for (const char* dropped : {"inf", "nan", "list", "nested", "blob"}) {
    EXPECT_TRUE(logs.contains(std::string("HTTPSPostBackend(createMessageForPostAndLogging): QFJSONSerialization unable "
                                          "to handle key: ") + dropped))
        << dropped;
  }
  const auto envelope = nlohmann::ordered_json::parse(*body);
  EXPECT_EQ(envelope["events"], nlohmann::ordered_json::parse(R"([{"flag":true}])"));
  EXPECT_EQ(envelope["clientId"], Zerith::getPersistentIdentifierForDNU(false));  // override_dnu 1
  // Consent given but overridden: no printable copy.
  EXPECT_FALSE(pretty);
}

TEST_F(HTTPSRecordTest, EnvelopeWithoutClientIdentifierHoldsOnlyPostTime) {
  auto b = immediate(server.url("/post"), {{"extras_on_internal", 1}});
  b->setIsInternal(true);  // identified by the device identifier, which is absent
  const auto body = b->createMessageForPostAndLogging({Dictionary{{"a", 1}}}, nullptr);
  ASSERT_TRUE(body);
  const auto envelope = nlohmann::ordered_json::parse(*body);
  EXPECT_EQ(envelope.size(), 1u);
  EXPECT_TRUE(envelope.contains("postTime"));

  const char udid[] = "00112233445566778899aabbccddeeff00112233";
  b->setUdid(udid);
  EXPECT_EQ(nlohmann::ordered_json::parse(*b->createMessageForPostAndLogging({}, nullptr))["clientId"], udid);
}

TEST_F(HTTPSRecordTest, PrintableCopyOnlyWhenConsentIsRespectedOrLoggingIsForced) {
  auto b = immediate(server.url("/post"), {{"override_dnu", nullptr}});
  ASSERT_EQ(b->state(), kBackendStateEnabled);
  ASSERT_EQ(b->dnuType(), 0);
  std::optional<std::string> pretty;
  const auto body = b->createMessageForPostAndLogging({Dictionary{{"a", 1}}}, &pretty);
  ASSERT_TRUE(pretty);
  EXPECT_EQ(nlohmann::ordered_json::parse(*pretty), nlohmann::ordered_json::parse(*body));
  EXPECT_NE(pretty->find("\n    \"clientId\""), std::string::npos);
  EXPECT_EQ(nlohmann::ordered_json::parse(*body)["clientId"], Zerith::getPersistentIdentifierForDNU(true));
}

class HTTPSStateTest : public HTTPSBackendTest {};

TEST_F(HTTPSStateTest, ClientNamesMatchExactlyAndServicesBySubstringIgnoringCase) {
  auto b = immediate("https://x/");
  Dictionary entry{{"client", "mail,Demo"}, {"service", "Sync,CL"}};
  EXPECT_TRUE(b->matchClientNameAndServiceID(Value(entry), "DEMO", "the-cli-service"));
  EXPECT_TRUE(b->matchClientNameAndServiceID(Value(entry), "mail", "sync"));
  EXPECT_FALSE(b->matchClientNameAndServiceID(Value(entry), "dem", "cli"));
  EXPECT_FALSE(b->matchClientNameAndServiceID(Value(entry), "demo", "other"));
  EXPECT_FALSE(b->matchClientNameAndServiceID(Value(entry), std::nullopt, "cli"));
  EXPECT_TRUE(b->matchClientNameAndServiceID(Value(Dictionary{}), std::nullopt, std::nullopt));

  EXPECT_TRUE(HTTPSPostBackend::matchStringWithList(Value(Array{}), std::nullopt, true));
  EXPECT_FALSE(HTTPSPostBackend::matchStringWithList(Value(Array{}), "x", false));
  EXPECT_TRUE(HTTPSPostBackend::matchStringWithList(Value(Array{Value("a")}), std::nullopt, false));
}

TEST_F(HTTPSStateTest, FrameworkVersionGateComparesMajorMiddleMinor) {
  auto b = immediate("https://x/");  // framework 8.1.0
  EXPECT_TRUE(b->isFrameworkEnabledForClient(Value(Dictionary{})));
  EXPECT_TRUE(b->isFrameworkEnabledForClient(Value(Dictionary{{"enabledSince", "8.1"}})));
  EXPECT_TRUE(b->isFrameworkEnabledForClient(Value(Dictionary{{"enabledSince", "7.9.9"}})));
  EXPECT_FALSE(b->isFrameworkEnabledForClient(Value(Dictionary{{"enabledSince", "8.1.1"}})));
  EXPECT_FALSE(b->isFrameworkEnabledForClient(Value(Dictionary{{"enabledSince", "9"}})));
}

TEST_F(HTTPSStateTest, EachRefusalDisablesWithItsOwnLine) {
  struct Case {
    const char* name;
    Dictionary change;
    const char* line;
  };
  Defaults(kConsentDefaultsDomain).setObject(kConsentDefaultsKey, Value(false));
  const Case cases[] = {
      {"no consent", {{"override_dnu", nullptr}},
       "HTTPSPostBackend(updateBackendState): reporting disabled by DNU: 0."},
      {"no locale list", {{"locale_whitelist", nullptr}},
       "HTTPSPostBackend(updateBackendState): (GB) isn't in country code list"},
      {"other country", {{"locale_whitelist", Array{Value("fr")}}},
       "HTTPSPostBackend(updateBackendState): (GB) isn't in country code list"},
      {"device whitelist", {{"device_whitelist", Array{Value("Other")}}},
       "HTTPSPostBackend(updateBackendState): (TestFamily) isn't in device whitelist"},
      {"device blacklist", {{"device_blacklist", Array{Value("board9")}}},
       "HTTPSPostBackend(updateBackendState): (Board9,1) is in device blacklist"},
      {"no filters", {{"filters", nullptr}}, "HTTPSPostBackend(updateBackendState): filters are required."},
  };
  for (const auto& c : cases) {
    logs.clear();
    auto b = immediate("https://x/", c.change);
    EXPECT_EQ(b->state(), kBackendStateDisabled) << c.name;
    EXPECT_TRUE(logs.contains(c.line)) << c.name;
  }
}

TEST_F(HTTPSStateTest, SamplingDrawOverManyBackendsStaysWithinBinomialBounds) {
  const Value profile =
      profileWith({enablingClient("https://x/", {{"sampling_threshold", 0.25}, {"override_sampling", 0.5}})});
  constexpr int kBackends = 1000;
  int enabled = 0;
  int sampledOut = 0;
  double sum = 0, lowest = 1, highest = 0;
  for (int i = 0; i < kBackends; ++i) {
    auto b = backend(profile);
    const double f = b->samplingFactor();
    ASSERT_GE(f, 0.0);
    ASSERT_LE(f, 0.9999);
    ASSERT_NEAR(f * 10000, std::round(f * 10000), 1e-6) << f;  // a multiple of 1/10000
    sum += f;
    lowest = std::min(lowest, f);
    highest = std::max(highest, f);
    enabled += b->state() == kBackendStateEnabled;
    sampledOut += b->state() == kBackendStateSampledOut;
  }
  // 250 and 250 expected, standard deviation about 13.7: five of them each way.
  EXPECT_NEAR(enabled, 250, 69);
  EXPECT_NEAR(sampledOut, 250, 69);
  EXPECT_NEAR(sum / kBackends, 0.5, 0.05);
  // The draw spans its range: 1000 uniform draws all above 0.1 (or all
  // below 0.9) would be 0.9^1000.
  EXPECT_LT(lowest, 0.1);
  EXPECT_GT(highest, 0.9);
}

TEST_F(HTTPSStateTest, WrongTypesInEveryProfileKeyAreLoggedAndNeverCrash) {
  Dictionary client{{"client", 5},
                    {"service", Array{}},
                    {"expedite", "yes"},
                    {"enabledSince", 8},
                    {"override_dnu", "1"},
                    {"locale_whitelist", "GB"},
                    {"device_whitelist", 3},
                    {"device_blacklist", Dictionary{}},
                    {"filters", "udid"},
                    {"sampling_threshold", "0.5"},
                    {"per_country_sampling_thresholds", "GB"},
                    {"override_sampling", Array{}},
                    {"event_threshold", "many"},
                    {"extras_on_internal", Array{}},
                    {"custom_clientId", 12},
                    {"post_url", 1},
                    {"realtime_post_url", Dictionary{}},
                    {"event_whitelist", 1},
                    {"event_blacklist", "2"},
                    {"use_wifi_only", "x"}};
  // As the only entry, unnamed (a name list of the wrong kind matches nobody).
  auto named = backend(profileWith({client}));
  EXPECT_EQ(named->state(), kBackendStateDisabled);
  EXPECT_TRUE(logs.contains("\"client\" holds an integer, not a string of names"));
  // Named properly, every other key still of the wrong kind.
  client.set("client", "demo");
  client.set("service", "cli");
  for (bool require : {true, false}) {
    auto b = backend(profileWith({client}), userInfo(), require);
    EXPECT_EQ(b->state(), require ? kBackendStateDisabled : kBackendStateEnabled);
    EXPECT_FALSE(b->postURL());
    EXPECT_EQ(b->eventThreshold(), HTTPSPostBackend::kDefaultEventThreshold);
  }
  EXPECT_TRUE(logs.contains("\"locale_whitelist\" holds a string, not a list; ignored"));
  // Entries that are not dictionaries, and a "clients" that is not a list.
  EXPECT_EQ(backend(Value(Dictionary{{"clients", Array{Value(1), Value("x")}}}))->state(), kBackendStateDisabled);
  EXPECT_EQ(backend(Value(Dictionary{{"clients", "all"}}))->state(), kBackendStateDisabled);
  // No product family: no backend (no client list is a row of BackendFactoryTest).
  EXPECT_FALSE(HTTPSPostBackend::initWithName("httpsPost", profileWith({}), std::nullopt));
}

// A threshold below zero, or a number written as a string (logged and read
// as absent, 0), makes each batched event flush what came before it.
TEST_F(HTTPSStateTest, NegativeAndStringThresholdsFlushBeforeEachBatchedEvent) {
  const std::tuple<Value, std::int32_t, const char*> rows[] = {
      {Value(-3), -3, "resetBackendStateWithClient: event_threshold -3 is negative"},
      {Value("10"), 0, "\"event_threshold\" holds a string, not a number; ignored"}};
  for (const auto& [value, threshold, line] : rows) {
    SCOPED_TRACE(line);
    const std::size_t before = server.requestCount();
    auto b = batching(server.url("/post"), {{"event_threshold", value}});
    ASSERT_EQ(b->eventThreshold(), threshold);
    EXPECT_TRUE(logs.contains(line));
    b->sendMessage(clientEvent(1), at(1001), 1, 1, 0);
    b->sendMessage(clientEvent(2), at(1002), 1, 1, 0);
    ASSERT_TRUE(server.waitForRequests(before + 1));
    const auto events = envelopeOf(server.requests()[before])["events"];
    ASSERT_EQ(events.size(), 1u);
    EXPECT_EQ(events[0]["n"], 1);
    EXPECT_EQ(b->batchedEventCount(), 1u);
  }
}

TEST_F(HTTPSStateTest, FiltersRemoveOrHashTopLevelEntriesOfRecordsSharedDataAndUserInfo) {
  auto b = batching(server.url("/post"),
                    {{"filters", Array{Value(Dictionary{{"key", "UDID"}, {"action", "sha256"}}),
                                       Value(Dictionary{{"key", "secret"}, {"method", 5}, {"action", "remove"}}),
                                       Value(Dictionary{{"key", "account"}, {"status", 9}, {"action", "sha256"}}),
                                       Value(Dictionary{{"key", "clientName"}, {"action", "sha256"}}),
                                       Value(Dictionary{{"key", "bytes"}, {"action", "shred"}}),
                                       Value("not a filter")}}});
  ASSERT_EQ(b->state(), kBackendStateEnabled);
  EXPECT_EQ(b->numberOfFilters(), 6);

  const Value sharedData(Dictionary{{"udid", "device-1"}, {"session", Dictionary{{"udid", "inner"}}}});
  const Value payload(Dictionary{{"secret", "s"}, {"account", "a"}, {"bytes", 3}, {"number", 77},
                                 {"nested", Dictionary{{"udid", "deep"}, {"secret", "deep"}}}});
  b->sendMessage(Value(Dictionary{{"ClientData", payload}, {"SharedData", sharedData}}), at(1001), 5, 9, 0);
  b->sendMessage(Value(Dictionary{{"ClientData", payload}, {"SharedData", sharedData}}), at(1001), 6, 1, 0);
  b->flushMessagesWithCompletion(nullptr);
  ASSERT_TRUE(server.waitForRequests(1));
  const auto events = envelopeOf(server.requests()[0])["events"];
  ASSERT_EQ(events.size(), 2u);
  // The filtered keys of a record (nested containers never reach the wire,
  // so nothing under them leaks).
  const auto filtered = [](const nlohmann::ordered_json& event) {
    nlohmann::ordered_json out = nlohmann::ordered_json::object();
    for (const char* key : {"udid", "secret", "account", "bytes", "clientName", "nested", "session"}) {
      if (event.contains(key)) {
        out[key] = event[key];
      }
    }
    return out;
  };
  const auto sha = [](const char* s) { return ZerithBackend::convertIntoSHA256(s); };
  // Method 5, status 9: everything applies; an unknown action keeps.
  EXPECT_EQ(filtered(events[0]), (nlohmann::ordered_json{{"udid", sha("device-1")}, {"account", sha("a")}, {"bytes", 3},
                                                          {"clientName", sha("demo")}}));
  // Method 6, status 1: only the unconditional filters.
  EXPECT_EQ(filtered(events[1]), (nlohmann::ordered_json{{"udid", sha("device-1")}, {"secret", "s"}, {"account", "a"},
                                                          {"bytes", 3}, {"clientName", sha("demo")}}));
  const std::string wire = jsonOf(server.requests()[0]);
  EXPECT_EQ(wire.find("device-1"), std::string::npos);
  EXPECT_EQ(wire.find("deep"), std::string::npos);
  EXPECT_EQ(wire.find("inner"), std::string::npos);

  // An empty filter list keeps the old filters.
  b->createFiltersFromArray(Value(Array{}));
  EXPECT_EQ(b->numberOfFilters(), 6);
}

// The sampling decision (a draw below the threshold enables, the threshold
// itself is out; an override decides what is not below it) and the end
// report's "OverrideSampling": the override value only when the draw was not
// below the threshold (so the override decided), -1 otherwise, whichever
// path set the threshold.
struct OverrideRow {
  const char* name;
  double factor;
  std::optional<double> threshold;     // "sampling_threshold"
  std::optional<double> perCountryGB;  // a per-country threshold for GB
  std::optional<double> override;      // "override_sampling"
  std::int32_t state;
  std::optional<double> reported;  // what the end report carries; nullopt: -1
};

const OverrideRow kOverrideRows[] = {
    {"DrawBelowThresholdEnables", 0.1, 0.25, {}, {}, kBackendStateEnabled, {}},
    {"DrawAboveThresholdSamplesOut", 0.3, 0.25, {}, {}, kBackendStateSampledOut, {}},
    {"DrawAtThresholdSamplesOut", 0.25, 0.25, {}, {}, kBackendStateSampledOut, {}},
    {"DrawPastThresholdBelowOverrideSamplesOut", 0.3, 0.25, {}, 0.5, kBackendStateSampledOut, 0.5},
    {"PlainThresholdEnables", 0.3, 1.0, {}, 0.5, kBackendStateEnabled, {}},
    {"PlainDrawAtThresholdKeptByOverride", 0.5, 0.5, {}, 0.9, kBackendStateSampledOut, 0.9},
    {"PlainDrawPastOverrideDisables", 0.95, 0.5, {}, 0.9, kBackendStateDisabled, 0.9},
    {"NoThresholdDisablesWithoutOverride", 0.1, {}, {}, 0.5, kBackendStateDisabled, {}},
    {"PerCountryThresholdEnables", 0.3, 0.0, 1.0, 0.0, kBackendStateEnabled, {}},
    {"PerCountryThresholdSamplesOut", 0.6, 1.0, 0.5, 0.8, kBackendStateSampledOut, 0.8},
};

class OverrideSamplingTest : public HTTPSBackendTest, public ::testing::WithParamInterface<OverrideRow> {};

TEST_P(OverrideSamplingTest, ReportsTheOverrideOnlyWhenItDecided) {
  const OverrideRow& row = GetParam();
  Dictionary changes{{"sampling_threshold", row.threshold ? Value(*row.threshold) : Value()},
                     {"override_sampling", row.override ? Value(*row.override) : Value()}};
  if (row.perCountryGB) {
    // Another country's entry first: only the device's own applies.
    const Value gb(Dictionary{{"country", Array{Value("FR"), Value("GB")}}, {"threshold", *row.perCountryGB}});
    changes.set("per_country_sampling_thresholds",
                Array{Value(Dictionary{{"country", Array{Value("US")}}, {"threshold", 0.0}}), gb});
  }
  auto b = immediate(server.url("/post"), changes);
  b->setSamplingFactor(row.factor);
  b->updateState();
  EXPECT_EQ(b->state(), row.state);
  EXPECT_EQ(b->overrideSampling().isNil() ? Value(-1) : b->overrideSampling(),
            row.reported ? Value(*row.reported) : Value(-1));
}

INSTANTIATE_TEST_SUITE_P(Paths, OverrideSamplingTest, ::testing::ValuesIn(kOverrideRows),
                         [](const auto& info) { return std::string(info.param.name); });

// A later decision that ends before the sampling step (here the locale)
// leaves no override from the earlier one.
TEST_F(HTTPSBackendTest, LocaleRefusalAfterAnOverrideDecisionReportsNone) {
  auto b = immediate(server.url("/post"), {{"sampling_threshold", 0.5}, {"override_sampling", 0.9}});
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
