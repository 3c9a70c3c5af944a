#include "zerith/ZerithBundle.h"

#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace zerith {

std::optional<std::string> frameworkBundleVersion() {
  const auto bytes = file::readAll(paths::frameworkResourceDir() / "Info.plist", 1u << 20);
  if (!bytes) {
    return std::nullopt;
  }
  const auto info = plist::decode(plist::bytesOf(*bytes), plist::Limits{1u << 20, 16, 10000});
  if (!info) {
    return std::nullopt;
  }
  const Value version = (*info)["BundleVersion"];
  if (const auto* text = version.string()) {
    return *text;
  }
  return std::nullopt;
}

std::filesystem::path frameworkPublicKeyPath() { return paths::frameworkResourceDir() / "publicKey.der"; }

}  // namespace zerith
