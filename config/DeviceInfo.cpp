#include "config/DeviceInfo.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <chrono>
#include <climits>
#include <cstdlib>
#include <ctime>
#include <functional>
#include <mutex>
#include <string>

#include <fmt/format.h>

#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "platform/FileUtil.h"
#include "config/ConfigLog.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace zerith {

namespace {

namespace fs = std::filesystem;

// Fixed key of this application: device identifiers of zerithd cannot be
// correlated with the machine id or with other applications' derivations.
constexpr std::string_view kUniqueDeviceIDKey = "com.velmar.zerithd.UniqueDeviceID.v1";

constexpr plist::Limits kDeviceFileLimits{256u << 10, 8, 4096};
constexpr std::size_t kSmallFileLimit = 64u << 10;

// The identity of a file as far as "has it changed" goes; `exists` false for
// a file that cannot be stat'ed.
struct FileIdentity {
  bool exists = false;
  dev_t dev = 0;
  ino_t ino = 0;
  off_t size = 0;
  timespec mtime{};
  bool operator==(const FileIdentity& o) const {
    return exists == o.exists && dev == o.dev && ino == o.ino && size == o.size && mtime.tv_sec == o.mtime.tv_sec &&
           mtime.tv_nsec == o.mtime.tv_nsec;
  }
};

FileIdentity identityOf(const fs::path& path) {
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) {
    return {};
  }
  return {true, st.st_dev, st.st_ino, st.st_size, st.st_mtim};
}

// A parsed file, re-parsed only when the file's identity changes, so that a
// broken file is logged once per version and not at every query.
template <typename T>
class ParsedFile {
 public:
  using Parser = std::function<T(const fs::path& path, bool exists)>;
  explicit ParsedFile(Parser parser) : parser_(std::move(parser)) {}

  T get(const fs::path& path) {
    const FileIdentity id = identityOf(path);
    std::lock_guard lock(mutex_);
    if (!cached_ || path != path_ || !(id == identity_)) {
      cached_ = parser_(path, id.exists);
      path_ = path;
      identity_ = id;
    }
    return *cached_;
  }

 private:
  Parser parser_;
  std::mutex mutex_;
  fs::path path_;
  FileIdentity identity_;
  std::optional<T> cached_;
};

std::string trimmed(std::string_view s) {
  const auto isJunk = [](char c) { return c == '\0' || std::isspace(static_cast<unsigned char>(c)); };
  while (!s.empty() && isJunk(s.front())) {
    s.remove_prefix(1);
  }
  while (!s.empty() && isJunk(s.back())) {
    s.remove_suffix(1);
  }
  return std::string(s);
}

std::optional<std::string> readSmallFile(const fs::path& path) {
  auto bytes = file::readAll(path, kSmallFileLimit);
  if (!bytes) {
    return std::nullopt;
  }
  return std::string(bytes->begin(), bytes->end());
}

// A one-value file of sysfs or the device tree: trimmed, nullopt when empty.
std::optional<std::string> readFact(std::string_view absolute) {
  auto text = readSmallFile(paths::resolve(absolute));
  if (!text) {
    return std::nullopt;
  }
  std::string value = trimmed(*text);
  if (value.empty()) {
    return std::nullopt;
  }
  return value;
}

Value parseDeviceFileAt(const fs::path& path, bool exists) {
  if (!exists) {
    return Value();
  }
  auto bytes = file::readAll(path, kDeviceFileLimits.maxBytes);
  if (!bytes) {
    configLogger().error("Device facts: cannot read device file {}; using the system's own facts", path.string());
    return Value();
  }
  std::string why;
  auto facts = device::parseDeviceFile(plist::bytesOf(*bytes), &why);
  if (!facts) {
    configLogger().error("Device facts: ignoring device file {}: {}", path.string(), why);
    return Value();
  }
  return *facts;
}

ParsedFile<Value>& deviceFile() {
  static ParsedFile<Value> file(parseDeviceFileAt);
  return file;
}

std::map<std::string, std::string> osRelease() {
  static ParsedFile<std::map<std::string, std::string>> etc(
      [](const fs::path& path, bool exists) -> std::map<std::string, std::string> {
        if (!exists) {
          return {};
        }
        auto text = readSmallFile(path);
        return text ? device::parseOsRelease(*text) : std::map<std::string, std::string>{};
      });
  static ParsedFile<std::map<std::string, std::string>> lib(
      [](const fs::path& path, bool exists) -> std::map<std::string, std::string> {
        if (!exists) {
          return {};
        }
        auto text = readSmallFile(path);
        return text ? device::parseOsRelease(*text) : std::map<std::string, std::string>{};
      });
  // /etc/os-release wins; /usr/lib/os-release is the vendor's fallback.
  const fs::path etcPath = paths::resolve("/etc/os-release");
  if (::access(etcPath.c_str(), F_OK) == 0) {
    return etc.get(etcPath);
  }
  return lib.get(paths::resolve("/usr/lib/os-release"));
}

std::optional<std::string> osReleaseField(std::initializer_list<std::string_view> names) {
  const auto fields = osRelease();
  for (const auto name : names) {
    if (auto it = fields.find(std::string(name)); it != fields.end() && !it->second.empty()) {
      return it->second;
    }
  }
  return std::nullopt;
}

std::optional<std::string> uniqueDeviceID() {
  static ParsedFile<std::optional<std::string>> file(
      [](const fs::path& path, bool exists) -> std::optional<std::string> {
        if (!exists) {
          return std::nullopt;
        }
        auto text = readSmallFile(path);
        auto id = text ? device::uniqueDeviceIDFromMachineID(*text) : std::nullopt;
        if (!id) {
          configLogger().error("Device facts: {} holds no machine id; the device has no UniqueDeviceID", path.string());
        }
        return id;
      });
  fs::path path = paths::resolve("/etc/machine-id");
  if (::access(path.c_str(), F_OK) != 0) {
    path = paths::resolve("/var/lib/dbus/machine-id");
  }
  return file.get(path);
}

std::optional<std::string> hardwareModel() {
  if (auto board = readFact("/sys/class/dmi/id/board_name")) {
    auto vendor = readFact("/sys/class/dmi/id/board_vendor");
    if (!vendor) {
      vendor = readFact("/sys/class/dmi/id/sys_vendor");
    }
    return vendor ? *vendor + " " + *board : *board;
  }
  // A device tree's "compatible" is a list of NUL-separated strings, most
  // specific first.
  if (auto compatible = readSmallFile(paths::resolve("/proc/device-tree/compatible"))) {
    std::string first = trimmed(std::string_view(compatible->c_str()));
    if (!first.empty()) {
      return first;
    }
  }
  return std::nullopt;
}

std::optional<std::string> hostName() {
  char name[HOST_NAME_MAX + 1] = {};
  if (::gethostname(name, sizeof(name) - 1) != 0 || name[0] == '\0') {
    return std::nullopt;
  }
  return std::string(name);
}

std::optional<std::string> linuxFact(std::string_view key) {
  if (key == kDeviceKeyProductVersion) {
    return osReleaseField({"VERSION_ID"});
  }
  if (key == kDeviceKeyBuildVersion) {
    return osReleaseField({"BUILD_ID", "IMAGE_VERSION"});
  }
  if (key == kDeviceKeyProductType) {
    if (auto product = readFact("/sys/class/dmi/id/product_name")) {
      return product;
    }
    return readFact("/proc/device-tree/model");
  }
  if (key == kDeviceKeyHardwareModel) {
    return hardwareModel();
  }
  if (key == kDeviceKeySerialNumber) {
    if (auto serial = readFact("/sys/class/dmi/id/product_serial")) {
      return serial;
    }
    return readFact("/proc/device-tree/serial-number");
  }
  if (key == kDeviceKeyDeviceName) {
    return hostName();
  }
  if (key == kDeviceKeyUniqueDeviceID) {
    return uniqueDeviceID();
  }
  // "ReleaseType" and any other key: the operator file only.
  return std::nullopt;
}

std::optional<std::string> localeFromConfigFile(std::string_view absolute) {
  auto text = readSmallFile(paths::resolve(absolute));
  if (!text) {
    return std::nullopt;
  }
  const auto fields = device::parseOsRelease(*text);  // the same KEY=value shell syntax
  for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
    if (auto it = fields.find(name); it != fields.end() && !it->second.empty()) {
      return it->second;
    }
  }
  return std::nullopt;
}

}  // namespace

Value deviceInformationValue(std::string_view key) {
  const Value facts = deviceFile().get(paths::deviceFile());
  if (const Value answer = facts[key]; !answer.isNil()) {
    if (answer.isString()) {
      return answer;
    }
    configLogger().debug("Device facts: {} of the device file is not a string; ignored", key);
  }
  if (auto fact = linuxFact(key)) {
    return Value(std::move(*fact));
  }
  return Value();
}

Value deviceProductVersion() { return deviceInformationValue(kDeviceKeyProductVersion); }
Value deviceBuildVersion() { return deviceInformationValue(kDeviceKeyBuildVersion); }
Value deviceProductType() { return deviceInformationValue(kDeviceKeyProductType); }
Value deviceName() { return deviceInformationValue(kDeviceKeyDeviceName); }
Value deviceHardwareModel() { return deviceInformationValue(kDeviceKeyHardwareModel); }
Value deviceSerialNumber() { return deviceInformationValue(kDeviceKeySerialNumber); }

void copyUniqueDeviceID(char* buffer, std::size_t size) {
  const Value answer = deviceInformationValue(kDeviceKeyUniqueDeviceID);
  const std::string* id = answer.string();
  if (id == nullptr || buffer == nullptr || size == 0 || id->size() + 1 > size) {
    return;
  }
  std::copy(id->begin(), id->end(), buffer);
  buffer[id->size()] = '\0';
  buffer[size - 1] = '\0';
}

std::optional<std::string> localeCountryCode() {
  for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
    if (const char* value = std::getenv(name); value && *value) {
      return device::countryFromLocale(value);
    }
  }
  for (const char* file : {"/etc/locale.conf", "/etc/default/locale"}) {
    if (auto locale = localeFromConfigFile(file)) {
      return device::countryFromLocale(*locale);
    }
  }
  return std::nullopt;
}

long timeZoneOffsetSeconds() {
  // Every record asks, on whichever thread makes it (socket threads side by
  // side). tzset() stats the zone file and localtime_r takes the C
  // library's zone lock, so each thread keeps the offset of the current
  // second and works it out again, zone re-read first, once the second or TZ
  // has changed: an offset only changes on a second's boundary, a new zone
  // (TZ or the zone file) shows within a second, and the threads that send
  // share no lock.
  struct Cache {
    std::string tz;
    bool hadTZ = false;
    std::time_t second = -1;
    long offset = 0;
  };
  thread_local Cache cache;
  const std::time_t now = std::time(nullptr);
  const char* tz = std::getenv("TZ");
  const bool tzChanged = (tz != nullptr) != cache.hadTZ || (tz && cache.tz != tz);
  if (!tzChanged && now == cache.second) {
    return cache.offset;
  }
  ::tzset();
  cache.hadTZ = tz != nullptr;
  cache.tz = tz ? tz : "";
  std::tm local{};
  if (::localtime_r(&now, &local) == nullptr) {
    cache.second = -1;
    return 0;
  }
  cache.second = now;
  cache.offset = local.tm_gmtoff;
  return cache.offset;
}

bool diagnosticsSubmissionAllowed() {
  return Defaults(kConsentDefaultsDomain).objectForKey(kConsentDefaultsKey).boolValue();
}

std::optional<std::string> deviceFileProblem() {
  const fs::path path = paths::deviceFile();
  std::error_code ec;
  if (!fs::exists(path, ec)) {
    return std::nullopt;
  }
  const file::RegularFileRead read = file::readRegularFile(path, kDeviceFileLimits.maxBytes, file::Links::followed);
  std::string why = read.why;
  if (!read.bytes) {
    return fmt::format("the device file {} cannot be read: {}", path.string(), why);
  }
  if (!device::parseDeviceFile(*read.bytes, &why)) {
    return fmt::format("the device file {} is not used: {}", path.string(), why);
  }
  return std::nullopt;
}

namespace device {

std::optional<Value> parseDeviceFile(std::span<const std::uint8_t> bytes, std::string* why) {
  std::string reason;
  auto value = plist::decode(bytes, kDeviceFileLimits, &reason);
  if (!value) {
    if (why) {
      *why = reason;
    }
    return std::nullopt;
  }
  if (!value->isDict()) {
    if (why) {
      *why = "the root is not a dictionary";
    }
    return std::nullopt;
  }
  return value;
}

std::map<std::string, std::string> parseOsRelease(std::string_view text) {
  std::map<std::string, std::string> fields;
  while (!text.empty()) {
    const auto eol = text.find('\n');
    std::string_view line = text.substr(0, eol);
    text = eol == std::string_view::npos ? std::string_view() : text.substr(eol + 1);

    while (!line.empty() && std::isspace(static_cast<unsigned char>(line.front()))) {
      line.remove_prefix(1);
    }
    if (line.empty() || line.front() == '#') {
      continue;
    }
    const auto eq = line.find('=');
    if (eq == std::string_view::npos || eq == 0) {
      continue;
    }
    const std::string key = trimmed(line.substr(0, eq));
    std::string_view raw = line.substr(eq + 1);
    while (!raw.empty() && std::isspace(static_cast<unsigned char>(raw.back()))) {
      raw.remove_suffix(1);
    }
    std::string value;
    if (!raw.empty() && (raw.front() == '"' || raw.front() == '\'')) {
      const char quote = raw.front();
      raw.remove_prefix(1);
      for (std::size_t i = 0; i < raw.size() && raw[i] != quote; ++i) {
        // Inside double quotes a backslash escapes the next character.
        if (quote == '"' && raw[i] == '\\' && i + 1 < raw.size()) {
          ++i;
        }
        value.push_back(raw[i]);
      }
    } else {
      value = std::string(raw);
    }
    fields[key] = std::move(value);
  }
  return fields;
}

std::optional<std::string> countryFromLocale(std::string_view locale) {
  const auto underscore = locale.find('_');
  if (underscore == std::string_view::npos) {
    return std::nullopt;  // "C", "POSIX", "C.UTF-8", "en"
  }
  std::string_view territory = locale.substr(underscore + 1);
  territory = territory.substr(0, territory.find_first_of(".@"));
  if (territory.empty() || territory.size() > 3 ||
      !std::all_of(territory.begin(), territory.end(),
                   [](char c) { return std::isalnum(static_cast<unsigned char>(c)) != 0; })) {
    return std::nullopt;
  }
  std::string country(territory);
  std::transform(country.begin(), country.end(), country.begin(),
                 [](char c) { return static_cast<char>(std::toupper(static_cast<unsigned char>(c))); });
  return country;
}

std::optional<std::string> uniqueDeviceIDFromMachineID(std::string_view contents) {
  const std::string id = trimmed(contents);
  if (id.size() != 32 || !std::all_of(id.begin(), id.end(), [](char c) {
        return std::isxdigit(static_cast<unsigned char>(c)) != 0;
      })) {
    return std::nullopt;
  }
  std::string lower = id;
  std::transform(lower.begin(), lower.end(), lower.begin(),
                 [](char c) { return static_cast<char>(std::tolower(static_cast<unsigned char>(c))); });
  const auto digest = crypto::hmacSha1(crypto::bytesOf(kUniqueDeviceIDKey), crypto::bytesOf(lower));
  return crypto::hexLower(digest);
}

}  // namespace device

}  // namespace zerith
