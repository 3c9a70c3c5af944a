#pragma once

// Device facts, locale, time zone and diagnostics consent.
//
// The device-information service answers a string key with a string or with
// nothing. Every key is looked up in the operator's device file first
// (paths::deviceFile(), a property-list dictionary of these keys), then in
// the Linux sources:
//
//   "ProductVersion"  VERSION_ID of /etc/os-release (or /usr/lib/os-release)
//   "BuildVersion"    BUILD_ID, else IMAGE_VERSION of the same file
//   "ProductType"     /sys/class/dmi/id/product_name, else /proc/device-tree/model
//   "HardwareModel"   board vendor and board_name of /sys/class/dmi/id/, else
//                     the first entry of /proc/device-tree/compatible
//   "SerialNumber"    /sys/class/dmi/id/product_serial, else
//                     /proc/device-tree/serial-number
//   "DeviceName"      the host name
//   "UniqueDeviceID"  HMAC-SHA1 of /etc/machine-id under an application key of
//                     ours: 40 lower-case hex characters; never the raw id
//   "ReleaseType"     the device file only
//
// Every file is read under the paths root, so a relocated root (tests, the
// demo) sees only its own files. Nothing is cached across calls except
// parsed files, which are re-read whenever their identity (inode, size,
// modification time) changes; a device file that is unreadable or not a
// dictionary is logged once per version of the file and then ignored.

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/DefaultsKeys.h"
#include "platform/Value.h"

namespace zerith {

inline constexpr std::string_view kDeviceKeyProductVersion = "ProductVersion";
inline constexpr std::string_view kDeviceKeyBuildVersion = "BuildVersion";
inline constexpr std::string_view kDeviceKeyProductType = "ProductType";
inline constexpr std::string_view kDeviceKeyDeviceName = "DeviceName";
inline constexpr std::string_view kDeviceKeyHardwareModel = "HardwareModel";
inline constexpr std::string_view kDeviceKeySerialNumber = "SerialNumber";
inline constexpr std::string_view kDeviceKeyUniqueDeviceID = "UniqueDeviceID";
inline constexpr std::string_view kDeviceKeyReleaseType = "ReleaseType";

// The service's answer for `key`: a string Value, or nil when there is none.
Value deviceInformationValue(std::string_view key);

// Each queries its key afresh; nil when the device has no answer.
Value deviceProductVersion();
Value deviceBuildVersion();
Value deviceProductType();
Value deviceName();
Value deviceHardwareModel();
Value deviceSerialNumber();

// Writes the "UniqueDeviceID" answer as UTF-8 into `buffer` and a zero into
// buffer[size - 1]. When there is no answer, or the answer and its
// terminating zero do not fit into `size` bytes, the buffer is left as it was.
void copyUniqueDeviceID(char* buffer, std::size_t size);

// The country of the system locale (LC_ALL, LC_MESSAGES, LANG, then LANG of
// /etc/locale.conf or /etc/default/locale): "en_GB.UTF-8" gives "GB".
// nullopt for "C", "POSIX" or a locale without a territory.
std::optional<std::string> localeCountryCode();

// The local time zone's offset from GMT in seconds, east positive, now.
long timeZoneOffsetSeconds();

// The diagnostics-submission consent: the boolean
// "DiagnosticsSubmissionAllowed" of the defaults domain
// "com.velmar.zerith.consent". Absent means no consent.
inline constexpr char kConsentDefaultsDomain[] = "com.velmar.zerith.consent";
static_assert(kConsentDomain == kConsentDefaultsDomain);
inline constexpr std::string_view kConsentDefaultsKey = defaultsSetting("DiagnosticsSubmissionAllowed", kConsentDomain).key;
bool diagnosticsSubmissionAllowed();

// What keeps the device file from being used, read as the facts read it
// (`zerithd --check`); nullopt when there is none or it is used.
std::optional<std::string> deviceFileProblem();

// The parsers behind the facts, for tests and the fuzz target.
namespace device {

// The device file's dictionary; nullopt (with the reason in `why`) when the
// bytes are not a property-list dictionary.
std::optional<Value> parseDeviceFile(std::span<const std::uint8_t> bytes, std::string* why = nullptr);

// KEY=value lines of an os-release file, quotes and escapes removed.
std::map<std::string, std::string> parseOsRelease(std::string_view text);

// The territory of a locale name, upper-cased ("de_DE@euro" -> "DE").
std::optional<std::string> countryFromLocale(std::string_view locale);

// The device identifier for a machine-id file's contents; nullopt unless the
// contents are 32 hex characters (an "uninitialized" id has no answer).
std::optional<std::string> uniqueDeviceIDFromMachineID(std::string_view contents);

}  // namespace device

}  // namespace zerith
