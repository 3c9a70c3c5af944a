// The small parts under the session service: reading a response head line
// by line, and deciding whether the device runs on battery.

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>

#include "tests/support/TempRoot.h"
#include "transport/DeviceConditions.h"
#include "transport/ResponseHead.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace zerith::test {
namespace {

TEST(ResponseHead, FieldsAreTrimmedFoldedAndResetByEachNewResponse) {
  HTTPHeaders fields;
  EXPECT_EQ(parseResponseHeadLine("HTTP/1.1 100 Continue\r\n", fields), ResponseHeadLine::StatusLine);
  EXPECT_EQ(parseResponseHeadLine("X-Interim: 1\r\n", fields), ResponseHeadLine::Field);
  EXPECT_EQ(parseResponseHeadLine("\r\n", fields), ResponseHeadLine::End);
  // The final response's head replaces the interim one's.
  EXPECT_EQ(parseResponseHeadLine("HTTP/2 200\r\n", fields), ResponseHeadLine::StatusLine);
  EXPECT_TRUE(fields.empty());
  EXPECT_EQ(parseResponseHeadLine("Cache-Control:   max-age=600 \t\r\n", fields), ResponseHeadLine::Field);
  EXPECT_EQ(parseResponseHeadLine("Empty:\r\n", fields), ResponseHeadLine::Field);
  EXPECT_EQ(parseResponseHeadLine("X-Long: first\r\n", fields), ResponseHeadLine::Field);
  EXPECT_EQ(parseResponseHeadLine(" \t second part\r\n", fields), ResponseHeadLine::Field);
  EXPECT_EQ(parseResponseHeadLine("Last-Modified: Tue, 03 Nov 2026 10:00:00 GMT\n", fields), ResponseHeadLine::Field);
  EXPECT_EQ(fields, (HTTPHeaders{{"Cache-Control", "max-age=600"},
                                 {"Empty", ""},
                                 {"X-Long", "first second part"},
                                 {"Last-Modified", "Tue, 03 Nov 2026 10:00:00 GMT"}}));
}

TEST(ResponseHead, LinesThatAreNoFieldsAreIgnoredAndLineBreaksNeverReachAValue) {
  HTTPHeaders fields;
  EXPECT_EQ(parseResponseHeadLine(" folded before any field\r\n", fields), ResponseHeadLine::Ignored);
  EXPECT_EQ(parseResponseHeadLine("no colon here\r\n", fields), ResponseHeadLine::Ignored);
  EXPECT_EQ(parseResponseHeadLine(": no name\r\n", fields), ResponseHeadLine::Ignored);
  EXPECT_EQ(parseResponseHeadLine("Bad Name: x\r\n", fields), ResponseHeadLine::Ignored);
  EXPECT_EQ(parseResponseHeadLine("Name : x\r\n", fields), ResponseHeadLine::Ignored);
  EXPECT_TRUE(fields.empty());
  EXPECT_EQ(parseResponseHeadLine(std::string_view("X: a\rb\0c\r\n", 10), fields), ResponseHeadLine::Field);
  EXPECT_EQ(parseResponseHeadLine("X-Url: https://a:1/b?c=d\r\n", fields), ResponseHeadLine::Field);
  EXPECT_EQ(fields, (HTTPHeaders{{"X", "a b c"}, {"X-Url", "https://a:1/b?c=d"}}));
}

TEST(ResponseHead, KeptFuzzInputsStillPass) {
  const auto corpus = sourceDir() / "fuzz/corpus/response_head_fuzz";
  std::size_t replayed = 0;
  for (const auto& entry : std::filesystem::directory_iterator(corpus)) {
    std::ifstream in(entry.path(), std::ios::binary);
    const std::string input((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(input.data()), input.size());  // aborts on a broken rule
    ++replayed;
  }
  EXPECT_GE(replayed, 5u);
}

TEST(DeviceConditions, BatteryPowerOnlyWhenASystemBatteryDischargesWithoutExternalSupply) {
  struct Case {
    const char* name;
    std::vector<std::pair<std::string, std::string>> files;  // "<supply>/<attribute>" -> value
    bool onBattery;
  };
  const std::vector<Case> cases = {
      {"no supplies at all", {}, false},
      {"mains only", {{"AC/type", "Mains"}, {"AC/online", "1"}}, false},
      {"discharging, mains offline", {{"BAT0/type", "Battery"}, {"BAT0/status", "Discharging"}, {"AC/type", "Mains"}, {"AC/online", "0"}}, true},
      {"discharging, no mains entry", {{"BAT0/type", "Battery"}, {"BAT0/status", "Discharging"}}, true},
      {"battery, mains online", {{"BAT0/type", "Battery"}, {"BAT0/status", "Discharging"}, {"AC/type", "Mains"}, {"AC/online", "1"}}, false},
      {"battery, USB-C charger online", {{"BAT0/type", "Battery"}, {"BAT0/status", "Unknown"}, {"ucsi/type", "USB"}, {"ucsi/online", "1"}}, false},
      {"charging without a mains entry", {{"BAT0/type", "Battery"}, {"BAT0/status", "Charging"}}, false},
      {"full without a mains entry", {{"BAT0/type", "Battery"}, {"BAT0/status", "Full"}}, false},
      {"held at a charge limit", {{"BAT0/type", "Battery"}, {"BAT0/status", "Not charging"}}, false},
      {"only a mouse's battery", {{"hid/type", "Battery"}, {"hid/scope", "Device"}, {"hid/status", "Discharging"}}, false},
      {"a removed battery", {{"BAT1/type", "Battery"}, {"BAT1/present", "0"}, {"BAT1/status", "Discharging"}}, false},
      {"second battery discharging", {{"BAT0/type", "Battery"}, {"BAT0/status", "Full"}, {"BAT1/type", "Battery"}, {"BAT1/status", "Discharging"}}, false},
  };
  for (const auto& c : cases) {
    TempRoot root;
    std::filesystem::create_directories(root / "/sys/class/power_supply");
    for (const auto& [file, value] : c.files) {
      root.write("/sys/class/power_supply/" + file, value + "\n");
    }
    EXPECT_EQ(onBatteryPower(), c.onBattery) << c.name;
  }
  EXPECT_FALSE(onBatteryPower("/nonexistent/power_supply"));
}

}  // namespace
}  // namespace zerith::test
