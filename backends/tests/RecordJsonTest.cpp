// The batch writer held to the nlohmann tree the backend dumped before: the
// same values read back, keys in the same order, the same entries dropped.

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include <fmt/format.h>

#include "backends/RecordJson.h"
#include "backends/tests/RecordJsonReference.h"

namespace zerith::test {
namespace {

using num = std::numeric_limits<double>;
using i64 = std::numeric_limits<std::int64_t>;

const std::vector<Dictionary> kRecords = {
    {{"flag", true}, {"off", false}, {"int", -42}, {"uint", 42u}, {"real", 0.5}, {"text", "ok"},
     {"when", Date{1234.5}}, {"nil", Value()}, {"blob", Data{1, 2}}, {"list", Array{Value(1)}},
     {"nested", Dictionary{{"a", Array{}}}}, {"empty list", Array{}}, {"empty dict", Dictionary{}}},
    {{"min", Value(static_cast<long long>(i64::min()))}, {"max", Value(static_cast<long long>(i64::max()))},
     {"umax", Value(std::numeric_limits<unsigned long long>::max())}, {"zero", 0}, {"-1", -1}},
    {{"a", 0.0}, {"b", -0.0}, {"c", 0.1}, {"d", 1e300}, {"e", -1e-300}, {"f", num::max()}, {"g", num::min()},
     {"h", num::denorm_min()}, {"i", 1e21}, {"j", 1e-7}, {"k", 9007199254740993.0}, {"l", -123456.789e-5},
     {"nan", num::quiet_NaN()}, {"inf", num::infinity()}, {"-inf", -num::infinity()}, {"date nan", Date{num::quiet_NaN()}},
     {"date inf", Date{num::infinity()}}, {"date old", Date{-1e10}}},
    {{"", ""}, {"unicode", "h\xC3\xA9llo \xE2\x9C\x93 \xF0\x9F\x98\x80"}, {"\xE2\x9C\x93 key\n", "v"},
     {"controls", std::string("\0\x01\x07\b\t\n\v\f\r\x1b\x1f\x7f \"\\/", 16)}},
    {{"lone", "a\xFF" "b"}, {"after eight", "ASCII first\xFF\xE2\x9C\x93"}, {"overlong", "\xC0\x80"},
     {"E0 80", "\xE0\x80x"}, {"surrogate", "\xED\xA0\x80"},
     {"cut at end", "ok\xE2\x82"}, {"cut by A", "\xF0\x9F\x98" "A"}, {"past U+10FFFF", "\xF4\x90\x80\x80"},
     {"continuation", "\x80\xBF"}, {"valid then not", "\xF0\x9F\x98\x80\xF8"}, {"key \xFE", 1}},
    // One character that needs escaping among plain text, in a whole word of
    // eight and in the few bytes after the last one.
    {{"quote in a word", "abc\"defghij"}, {"backslash after", "abcdefgh\\"}, {"tab after", "abcdefghi\t"},
     {"tail quote", "ab\"c"}, {"\"key\"", "plain text longer than two words, all of it"}, {"del", "\x7f"}},
    {},
    {{"_recordID", "from the payload"}, {"z", 1}, {"a", 2}},
};

TEST(RecordJsonTest, WritesWhatTheTreeDumpedWithKeysInOrder) {
  std::vector<std::vector<Dictionary>> batches = {{}, kRecords};
  for (const Dictionary& record : kRecords) {
    batches.push_back({record});
  }
  for (const auto& clientId : {std::optional<std::string>("client \xE2\x9C\x93"), std::optional<std::string>()}) {
    for (const bool ids : {true, false}) {
      const double postTime = ids ? 1.5e9 + 0.25 : num::quiet_NaN();
      for (const auto& batch : batches) {
        const auto written = [&](auto writer) {
          int n = 0;
          std::vector<std::string> dropped;
          const std::string text = writer(postTime, clientId, batch,
                                          ids ? std::function<std::string()>([&n] { return fmt::format("id{}", n++); }) : nullptr,
                                          [&](const std::string& key, const Value&) { dropped.push_back(key); });
          // A payload's own "_recordID" gives way to the spool's: one key per record, never two.
          std::size_t ids = 0;
          for (auto at = text.find("\"_recordID\""); at != std::string::npos; at = text.find("\"_recordID\"", at + 1)) {
            ++ids;
          }
          return std::tuple(nlohmann::ordered_json::parse(text), dropped, ids);
        };
        const auto [ours, oursDropped, oursIds] = written(envelopeJson);
        const auto [tree, treeDropped, treeIds] = written(treeEnvelopeJson);
        EXPECT_EQ(ours, tree) << "records " << batch.size() << ": " << ours.dump();
        EXPECT_EQ(oursDropped, treeDropped);
        if (ids && clientId) {
          EXPECT_EQ(oursIds, batch.size());
        }
      }
    }
  }
}

}  // namespace
}  // namespace zerith::test
