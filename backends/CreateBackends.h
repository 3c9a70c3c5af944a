#pragma once

// The backends of a session, built from its client type's storebag section.

#include <optional>

#include "backends/ZerithBackend.h"
#include "platform/Value.h"

namespace zerith {

// The framework version backends report when the installed framework has no
// "BundleVersion".
inline constexpr char kFallbackFrameworkVersion[] = "8.0";

// One backend per key of `storebagSection` that the factory knows, in the
// section's order, each filled with the session's identity and the device
// facts. nullopt (after an error line) when the section or the session info
// is nil; an empty dictionary when no key names a usable backend. `udid`
// stays the caller's.
std::optional<BackendDictionary> createBackends(const Value& storebagSection, const Value& sessionInfo,
                                                const Value& userInfo, const char* udid);

}  // namespace zerith
