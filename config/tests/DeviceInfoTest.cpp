#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "config/DeviceInfo.h"
#include "platform/Defaults.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "config/tests/ScopedEnv.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

using log::Level;

constexpr char kMachineID[] = "0123456789abcdef0123456789abcdef\n";
using Answers = std::vector<std::optional<std::string>>;

class DeviceInfoTest : public ::testing::Test {
 protected:
  void writeDeviceFile(Dictionary facts) {
    root_.write("/etc/zerithd/device.plist", plist::encodeXml(Value(std::move(facts))));
  }
  std::optional<std::string> answer(std::string_view key) {
    const Value v = deviceInformationValue(key);
    return v.string() ? std::optional<std::string>(*v.string()) : std::nullopt;
  }
  // Product version, build, type, serial number and hardware model.
  Answers systemAnswers() {
    return {answer(kDeviceKeyProductVersion), answer(kDeviceKeyBuildVersion), answer(kDeviceKeyProductType),
            answer(kDeviceKeySerialNumber), answer(kDeviceKeyHardwareModel)};
  }

  test::TempRoot root_;
  log::LogCapture capture_;
};

TEST_F(DeviceInfoTest, BareRootHasNoAnswersButTheHostName) {
  EXPECT_EQ((std::vector<Value>{deviceProductVersion(), deviceBuildVersion(), deviceProductType(),
                                 deviceHardwareModel(), deviceSerialNumber(),
                                 deviceInformationValue(kDeviceKeyUniqueDeviceID),
                                 deviceInformationValue(kDeviceKeyReleaseType)}),
            std::vector<Value>(7));
  char host[HOST_NAME_MAX + 1] = {};
  ASSERT_EQ(::gethostname(host, sizeof(host) - 1), 0);
  EXPECT_EQ(answer(kDeviceKeyDeviceName), std::string(host));
  // A missing device file is the normal case, not an error.
  EXPECT_EQ(capture_.count("Device facts"), 0u);
}

TEST_F(DeviceInfoTest, LinuxSourcesAnswerWithTrimmedValues) {
  root_.write("/etc/os-release",
              "NAME=\"Debian GNU/Linux\"\n# comment\nVERSION_ID=\"12\"\nBUILD_ID='20240601.1'\n");
  root_.write("/sys/class/dmi/id/product_name", "Tarvix\n");
  root_.write("/sys/class/dmi/id/product_serial", "  SN-42 \n");
  root_.write("/sys/class/dmi/id/board_vendor", "Velmar\n");
  root_.write("/sys/class/dmi/id/board_name", "B-7\n");
  EXPECT_EQ(systemAnswers(), (Answers{"12", "20240601.1", "Tarvix", "SN-42", "Velmar B-7"}));
}

TEST_F(DeviceInfoTest, DeviceTreeAnswersWhereThereIsNoDmi) {
  root_.write("/proc/device-tree/model", std::string("Velmar Board Rev 2\0", 19));
  root_.write("/proc/device-tree/compatible", std::string("velmar,b2\0brcm,bcm2711\0", 23));
  root_.write("/proc/device-tree/serial-number", std::string("00000000abcd\0", 13));
  root_.write("/usr/lib/os-release", "VERSION_ID=3.19\nIMAGE_VERSION=7\n");
  EXPECT_EQ(systemAnswers(), (Answers{"3.19", "7", "Velmar Board Rev 2", "00000000abcd", "velmar,b2"}));
}

TEST_F(DeviceInfoTest, OperatorFileWinsOverLinuxSourcesAndIsReReadWhenChanged) {
  root_.write("/etc/os-release", "VERSION_ID=12\n");
  root_.write("/sys/class/dmi/id/product_name", "Generic\n");
  // Product version and type, release type and device name.
  const auto shown = [&] {
    return Answers{answer(kDeviceKeyProductVersion), answer(kDeviceKeyProductType), answer(kDeviceKeyReleaseType),
                   answer(kDeviceKeyDeviceName)};
  };
  writeDeviceFile({{"ProductVersion", "17.2"}, {"DeviceName", "kitchen"}, {"ReleaseType", "Internal"}});
  EXPECT_EQ(shown(), (Answers{"17.2", "Generic", "Internal", "kitchen"}));  // no type in the file: Linux answers

  writeDeviceFile({{"DeviceName", "hall"}, {"ProductType", "Tarvix"}});
  EXPECT_EQ(shown(), (Answers{"12", "Tarvix", std::nullopt, "hall"}));

  // An entry that is not a string falls back to Linux.
  writeDeviceFile({{"ProductVersion", Value(17)}});
  EXPECT_EQ(answer(kDeviceKeyProductVersion), "12");
}

// A device file that cannot be used leaves the system's own facts and is
// logged once for each version of it: a root that is not a dictionary, XML
// cut short, a binary list with a NUL inside a string (which libplist would
// abort the process on), and a folder in its place (which not even the
// superuser can read).
TEST_F(DeviceInfoTest, UnusableDeviceFileIsLoggedOncePerVersionAndIgnored) {
  // {"ProductVersion": "a\0b"}
  const std::uint8_t nul[] = {
      0x62, 0x70, 0x6c, 0x69, 0x73, 0x74, 0x30, 0x30, 0xd1, 0x01, 0x02, 0x5e, 0x50, 0x72, 0x6f, 0x64, 0x75,
      0x63, 0x74, 0x56, 0x65, 0x72, 0x73, 0x69, 0x6f, 0x6e, 0x53, 0x61, 0x00, 0x62, 0x08, 0x0b, 0x1a, 0x00,
      0x00, 0x00, 0x00, 0x00, 0x00, 0x01, 0x01, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x03, 0x00, 0x00,
      0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x1e};
  const std::string path = (root_ / "/etc/zerithd/device.plist").string();
  const std::string ignoring = "Device facts: ignoring device file " + path + ": ";
  // Each of another length: a new version of the file.
  const std::pair<std::string, const char*> versions[] = {
      {plist::encodeXml(Value(Array{Value("ProductVersion")})), "the root is not a dictionary"},
      {"<plist><dict><key>ProductVersion</key>", ""},
      {std::string(reinterpret_cast<const char*>(nul), sizeof(nul)), "string holds a NUL character"},
  };
  root_.write("/etc/os-release", "VERSION_ID=12\n");
  for (std::size_t i = 0; i < std::size(versions); ++i) {
    root_.write("/etc/zerithd/device.plist", versions[i].first);
    EXPECT_EQ(answer(kDeviceKeyProductVersion), "12");
    EXPECT_EQ(answer(kDeviceKeyProductVersion), "12");
    EXPECT_TRUE(capture_.contains(ignoring + versions[i].second)) << i;
    EXPECT_EQ(capture_.count("Device facts: ignoring device file"), i + 1);
  }
  EXPECT_TRUE(capture_.has(Level::Error, ignoring + "the root is not a dictionary"));

  std::filesystem::remove(path);
  std::filesystem::create_directories(path);
  EXPECT_EQ(answer(kDeviceKeyProductVersion), "12");
  EXPECT_TRUE(capture_.has(Level::Error,
                           "Device facts: cannot read device file " + path + "; using the system's own facts"));
}

TEST_F(DeviceInfoTest, UniqueDeviceIDIsKeyedAndNeverTheRawMachineID) {
  root_.write("/etc/machine-id", kMachineID);
  const auto id = answer(kDeviceKeyUniqueDeviceID);
  ASSERT_TRUE(id);
  EXPECT_EQ(id->size(), 40u);
  EXPECT_EQ(id->find_first_not_of("0123456789abcdef"), std::string::npos) << *id;
  EXPECT_EQ(id->find("0123456789abcdef"), std::string::npos);
  // Stable, independent of the id's letter case, different for another machine.
  EXPECT_EQ(device::uniqueDeviceIDFromMachineID("0123456789ABCDEF0123456789ABCDEF"), id);
  EXPECT_NE(device::uniqueDeviceIDFromMachineID("fedcba9876543210fedcba9876543210"), id);
}

TEST_F(DeviceInfoTest, UninitialisedMachineIDGivesNoIdentifier) {
  root_.write("/etc/machine-id", "uninitialized\n");
  EXPECT_TRUE(deviceInformationValue(kDeviceKeyUniqueDeviceID).isNil());
  EXPECT_TRUE(capture_.contains("holds no machine id"));
  EXPECT_EQ(device::uniqueDeviceIDFromMachineID(""), std::nullopt);
  EXPECT_EQ(device::uniqueDeviceIDFromMachineID("0123456789abcdef0123456789abcdeg"), std::nullopt);
  // The D-Bus copy stands in when /etc has none.
  std::filesystem::remove(root_ / "/etc/machine-id");
  root_.write("/var/lib/dbus/machine-id", kMachineID);
  EXPECT_EQ(deviceInformationValue(kDeviceKeyUniqueDeviceID),
            Value(*device::uniqueDeviceIDFromMachineID(kMachineID)));
}

// The 40 characters and their NUL go only into a buffer that holds them
// (a wider one also gets a NUL at its end); without an answer the buffer
// is left alone.
TEST_F(DeviceInfoTest, CopyUniqueDeviceIDFillsOnlyABufferThatHoldsIt) {
  const std::string id = *device::uniqueDeviceIDFromMachineID(kMachineID);
  const std::string none(48, 'x');
  const struct {
    bool machineID;
    std::size_t size;
    std::string expected;
  } rows[] = {
      {false, 41, none},
      {true, 41, id + '\0' + std::string(7, 'x')},
      {true, 48, id + '\0' + std::string(6, 'x') + '\0'},
      {true, 40, none},
      {true, 0, none},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(testing::Message() << row.size << (row.machineID ? " with" : " without") << " a machine id");
    if (row.machineID) root_.write("/etc/machine-id", kMachineID);
    char buffer[48];
    std::memset(buffer, 'x', sizeof(buffer));
    copyUniqueDeviceID(buffer, row.size);
    EXPECT_EQ(std::string(buffer, sizeof(buffer)), row.expected);
  }
  copyUniqueDeviceID(nullptr, 41);
}

TEST(DeviceParsersTest, OsReleaseQuotingEscapesAndJunkLines) {
  const auto fields = device::parseOsRelease(
      "NAME=\"Debian \\\"GNU\\\"/Linux\"\n"
      "  PRETTY='single $quoted'\n"
      "EMPTY=\n"
      "=novalue\n"
      "no equals sign\n"
      "#VERSION_ID=1\n"
      "VERSION_ID=12   \n"
      "UNTERMINATED=\"abc");
  EXPECT_EQ(fields, (decltype(fields){{"NAME", "Debian \"GNU\"/Linux"}, {"PRETTY", "single $quoted"}, {"EMPTY", ""},
                                     {"VERSION_ID", "12"}, {"UNTERMINATED", "abc"}}));
}

TEST(DeviceParsersTest, CountryOfLocaleNames) {
  Answers countries;
  for (const char* locale : {"en_GB.UTF-8", "de_DE@euro", "pt_br", "es_419.UTF-8", "C", "C.UTF-8", "POSIX", "en_.UTF-8",
                             "en_G/B"}) {
    countries.push_back(device::countryFromLocale(locale));
  }
  EXPECT_EQ(countries, (Answers{"GB", "DE", "BR", "419", {}, {}, {}, {}, {}}));
}

using test::ScopedEnv;

TEST_F(DeviceInfoTest, LocaleCountryFollowsTheLocalePrecedence) {
  ScopedEnv all("LC_ALL", nullptr), messages("LC_MESSAGES", nullptr), lang("LANG", nullptr);
  EXPECT_EQ(localeCountryCode(), std::nullopt);
  root_.write("/etc/default/locale", "LANG=\"fr_CA.UTF-8\"\n");
  EXPECT_EQ(localeCountryCode(), "CA");
  root_.write("/etc/locale.conf", "LANG=nl_BE.UTF-8\n");
  EXPECT_EQ(localeCountryCode(), "BE");
  ::setenv("LANG", "en_GB.UTF-8", 1);
  EXPECT_EQ(localeCountryCode(), "GB");
  ::setenv("LC_MESSAGES", "de_AT.UTF-8", 1);
  EXPECT_EQ(localeCountryCode(), "AT");
  ::setenv("LC_ALL", "", 1);  // set but empty: skipped
  EXPECT_EQ(localeCountryCode(), "AT");
  ::setenv("LC_ALL", "C", 1);
  EXPECT_EQ(localeCountryCode(), std::nullopt);
}

TEST(TimeZoneTest, OffsetIsEastPositiveSeconds) {
  ScopedEnv tz("TZ", "EST5");
  EXPECT_EQ(timeZoneOffsetSeconds(), -5 * 3600);
  ::setenv("TZ", "IST-5:30", 1);
  EXPECT_EQ(timeZoneOffsetSeconds(), 5 * 3600 + 1800);
  ::setenv("TZ", "UTC0", 1);
  EXPECT_EQ(timeZoneOffsetSeconds(), 0);
}

TEST_F(DeviceInfoTest, ConsentIsAbsentUntilGranted) {
  EXPECT_FALSE(diagnosticsSubmissionAllowed());
  ASSERT_TRUE(Defaults(kConsentDefaultsDomain).setObject(kConsentDefaultsKey, Value(true)));
  EXPECT_TRUE(diagnosticsSubmissionAllowed());
  ASSERT_TRUE(Defaults(kConsentDefaultsDomain).setObject(kConsentDefaultsKey, Value(false)));
  EXPECT_FALSE(diagnosticsSubmissionAllowed());
  // The setting lives in its own domain, not in com.velmar.zerith.
  ASSERT_TRUE(Defaults("com.velmar.zerith").setObject(kConsentDefaultsKey, Value(true)));
  EXPECT_FALSE(diagnosticsSubmissionAllowed());
}

}  // namespace
}  // namespace zerith
