#pragma once

// Client types and environments: which storebag a client type gets, which
// section of it an environment selects, and how the environment is read from
// the user defaults.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/DefaultsKeys.h"

namespace zerith {

// The process-wide settings domain of zerithd.
inline constexpr char kZerithDefaultsDomain[] = "com.velmar.zerith";
inline constexpr std::string_view kEnvironmentTypeKey = defaultsSetting("environmentType").key;

using ZerithClientType = std::uint32_t;
using ZerithEnvironmentType = std::uint32_t;

inline constexpr ZerithEnvironmentType kEnvironmentNone = 0;
inline constexpr ZerithEnvironmentType kEnvironmentDevelopment = 1;
inline constexpr ZerithEnvironmentType kEnvironmentInternal = 2;
inline constexpr ZerithEnvironmentType kEnvironmentSeed = 3;
inline constexpr ZerithEnvironmentType kEnvironmentRelease = 4;

// The storebag of a client type ("dravon" for 7, 11, 13 and 20, ...);
// nullopt for types without one (0 to 4, 24 and above).
std::optional<std::string> storebagNameForClientType(ZerithClientType clientType);

// The storebag section of an environment ("development", "velmar_internal",
// "seed", "release"); nullopt for 0 and anything above 4.
std::optional<std::string> environmentNameForType(ZerithEnvironmentType environmentType);

// Reads "environmentType" from the defaults at every call. Absent: 2 on an
// internal build, else 3. 5 and above (every negative number too) is logged
// as invalid and corrected to 2.
ZerithEnvironmentType userDefaultsEnvironment();

// The result of the most recent userDefaultsEnvironment() (0 before the first).
ZerithEnvironmentType lastResolvedEnvironmentType();

// True when the device's "ReleaseType" is "Internal". Computed at the first
// call and never again in this process.
bool isInternalBuild();

}  // namespace zerith
