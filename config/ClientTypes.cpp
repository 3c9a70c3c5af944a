#include "config/ClientTypes.h"

#include <array>
#include <atomic>
#include <mutex>
#include <utility>

#include "config/DeviceInfo.h"
#include "platform/Defaults.h"
#include "config/ConfigLog.h"

namespace zerith {

namespace {

// Indexed by client type; nullptr where a type has no storebag. Several
// types share one bag: the storebag is per product area, not per client.
constexpr std::array<const char*, 24> kStorebagNames = {
    nullptr,   nullptr,  nullptr,  nullptr,  nullptr,  "ambrel",  // 0-5
    "bostin",  "dravon", "elquin", "farrow", "gelmo",  "dravon",  // 6-11
    "hestra",  "dravon", "bostin", "bostin", "ivolt",  "jarnel",  // 12-17
    "kesto",   "lumira", "dravon", "morvah", "nelvin", "orrin",   // 18-23
};

constexpr std::array<const char*, 5> kEnvironmentNames = {
    nullptr, "development", "velmar_internal", "seed", "release",
};

// Only a copy of the last result; nothing reads it between calls.
std::atomic<ZerithEnvironmentType> gEnvironmentType{kEnvironmentNone};

}  // namespace

std::optional<std::string> storebagNameForClientType(ZerithClientType clientType) {
  if (clientType >= kStorebagNames.size() || kStorebagNames[clientType] == nullptr) {
    return std::nullopt;
  }
  return std::string(kStorebagNames[clientType]);
}

std::optional<std::string> environmentNameForType(ZerithEnvironmentType environmentType) {
  if (environmentType >= kEnvironmentNames.size() || kEnvironmentNames[environmentType] == nullptr) {
    return std::nullopt;
  }
  return std::string(kEnvironmentNames[environmentType]);
}

ZerithEnvironmentType userDefaultsEnvironment() {
  const Defaults defaults(kZerithDefaultsDomain);
  const Value stored = defaults.objectForKey(kEnvironmentTypeKey);
  ZerithEnvironmentType type;
  if (stored.isNil()) {
    type = isInternalBuild() ? kEnvironmentInternal : kEnvironmentSeed;
  } else {
    // Read as an integer and taken as unsigned: -1 is 4294967295.
    type = static_cast<ZerithEnvironmentType>(stored.intValue());
    if (type > kEnvironmentRelease) {
      configLogger().error("userDefaultsEnvironment: Invalid environment type {}", type);
      type = kEnvironmentInternal;
    }
  }
  gEnvironmentType.store(type, std::memory_order_relaxed);
  configLogger().info("userDefaultsEnvironment: Environment type {}", type);
  return type;
}

ZerithEnvironmentType lastResolvedEnvironmentType() { return gEnvironmentType.load(std::memory_order_relaxed); }

bool isInternalBuild() {
  static std::once_flag once;
  static bool internal = false;
  std::call_once(once, [] {
    const Value releaseType = deviceInformationValue(kDeviceKeyReleaseType);
    internal = releaseType.string() != nullptr && *releaseType.string() == "Internal";
  });
  return internal;
}

}  // namespace zerith
