#pragma once

// The client framework's bundle: its resource folder
// (<root>/usr/share/zerith) holds "Info.plist" with the framework version
// under "BundleVersion", and the storebag public key "publicKey.der".

#include <filesystem>
#include <optional>
#include <string>

#include "zerith/ZerithConstants.h"

namespace zerith {

// The "BundleVersion" of the installed framework, nullopt when the bundle has
// no Info.plist or no such entry (callers fall back to "8.0").
ZERITH_EXPORT std::optional<std::string> frameworkBundleVersion();
// Location of the resource named "publicKey" of type "der".
ZERITH_EXPORT std::filesystem::path frameworkPublicKeyPath();

}  // namespace zerith
