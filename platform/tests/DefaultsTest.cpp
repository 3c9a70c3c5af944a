#include <gtest/gtest.h>

#include "platform/Defaults.h"
#include "platform/DefaultsKeys.h"
#include "platform/Log.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

// Writes, reads and deletes are checked through zerith-defaults
// (DefaultsToolTest); here what the tool cannot show: a reader that caches.
TEST(DefaultsTest, AFileAnotherProcessRewritesIsSeenByTheNextRead) {
  test::TempRoot root;
  Defaults d("com.velmar.zerith");
  ASSERT_TRUE(d.setObject("environmentType", 1));
  ASSERT_TRUE(d.setObject("zerith_storebag_url", "https://127.0.0.1:1/bags"));
  EXPECT_EQ(d.objectForKey("environmentType").intValue(), 1);
  root.write("/var/lib/zerithd/defaults/com.velmar.zerith.plist",
             "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>environmentType</key><integer>-1</integer></dict></plist>");
  EXPECT_EQ(d.objectForKey("environmentType").intValue(), -1);
  EXPECT_TRUE(d.objectForKey("zerith_storebag_url").isNil());
}

TEST(DefaultsTest, CorruptFileReadsEmptyAndIsMovedAsideOnWrite) {
  test::TempRoot root;
  log::LogCapture capture;
  root.write("/var/lib/zerithd/defaults/com.velmar.zerith.plist", "<plist><dict><key>a</key><array>");
  Defaults d("com.velmar.zerith");
  EXPECT_TRUE(d.objectForKey("a").isNil());
  EXPECT_TRUE(capture.contains("ignoring corrupt defaults file"));
  ASSERT_TRUE(d.setObject("b", "x"));
  EXPECT_EQ(d.objectForKey("b").description(), "x");
  EXPECT_TRUE(std::filesystem::exists(root / "/var/lib/zerithd/defaults/com.velmar.zerith.plist.corrupt"));
}

// Every number setting takes a number or a string that holds one, within its
// range (and whole for a count); every boolean the same six words in any case.
TEST(DefaultsSettingsTest, EveryReaderTakesTheSameFormsAndRefusesAlike) {
  struct Row {
    const DefaultsSetting& setting;
    Value value;
    std::optional<double> taken;
    std::string problem;
  };
  const Row rows[] = {
      {defaultsSetting("uploadsAtOnce"), Value(4), 4, ""},
      {defaultsSetting("uploadsAtOnce"), Value("4"), 4, ""},
      {defaultsSetting("uploadsAtOnce"), Value(64), 64, ""},
      {defaultsSetting("uploadsAtOnce"), Value(65), std::nullopt, "is 65, outside 1 to 64"},
      {defaultsSetting("uploadsAtOnce"), Value(0), std::nullopt, "is 0, outside 1 to 64"},
      {defaultsSetting("uploadsAtOnce"), Value(2.5), std::nullopt, "is 2.5, not a whole number"},
      {defaultsSetting("uploadsAtOnce"), Value("4 "), std::nullopt, "holds '4 ', not a number"},
      {defaultsSetting("uploadsAtOnce"), Value(""), std::nullopt, "holds '', not a number"},
      {defaultsSetting("uploadsAtOnce"), Value(Array{}), std::nullopt, "holds an array, not a number"},
      {defaultsSetting("uploadTimeoutSeconds"), Value("0.5"), 0.5, ""},
      {defaultsSetting("uploadTimeoutSeconds"), Value("nan"), std::nullopt, "is nan, outside 0.1 to 3600"},
      {defaultsSetting("spoolMaxBytes"), Value(1e300), std::nullopt, "is 1e+300, outside 4096 to 1099511627776"},
      {defaultsSetting("uploadsAtOnce"), Value(), std::nullopt, ""},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(std::string(row.setting.key) + " = " + row.value.description());
    std::string problem;
    EXPECT_EQ(defaultsNumber(row.setting, row.value, &problem), row.taken);
    EXPECT_EQ(problem, row.problem);
  }

  constexpr const DefaultsSetting& spoolEnabled = defaultsSetting("spoolEnabled");
  for (const Value& yes : {Value(true), Value(1), Value("YES"), Value("True"), Value("1")}) {
    std::string problem;
    EXPECT_EQ(defaultsBoolean(spoolEnabled, yes, &problem), true) << yes.description();
  }
  for (const Value& no : {Value(false), Value(0), Value("no"), Value("FALSE"), Value("0")}) {
    std::string problem;
    EXPECT_EQ(defaultsBoolean(spoolEnabled, no, &problem), false) << no.description();
  }
  EXPECT_EQ(defaultsValueProblem(spoolEnabled, Value("maybe")), "holds 'maybe', not a boolean");
  EXPECT_EQ(defaultsValueProblem(spoolEnabled, Value(2)), "holds an integer 2, not a boolean");
  EXPECT_EQ(defaultsValueProblem(defaultsSetting("httpsPostURL"), Value(8080)), std::nullopt) << "read as its text";
  EXPECT_EQ(defaultsValueProblem(defaultsSetting("httpsPostURL"), Value(Dictionary{})),
            "holds a dictionary, not a string");
}

}  // namespace
}  // namespace zerith
