#include "platform/Paths.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>

namespace zerith::paths {

namespace {
// Never destroyed: pool threads live until the process ends and may still
// resolve a path while a test process runs its static destructors.
std::mutex& gMutex = *new std::mutex;
fs::path& gRoot = *new fs::path("/");

fs::path homeFolder() {
  if (const char* home = std::getenv("HOME"); home && *home) {
    return home;
  }
  if (const passwd* pw = getpwuid(getuid()); pw && pw->pw_dir) {
    return pw->pw_dir;
  }
  return "/";
}
}  // namespace

void setRoot(const fs::path& root) {
  std::lock_guard lock(gMutex);
  gRoot = root.empty() ? fs::path("/") : fs::absolute(root).lexically_normal();
}

fs::path root() {
  std::lock_guard lock(gMutex);
  return gRoot;
}

bool relocated() { return root() != fs::path("/"); }

fs::path defaultRoot() {
  if (const char* env = std::getenv("ZERITHD_ROOT"); env && *env) {
    return env;
  }
  if (geteuid() == 0) {
    return "/";
  }
  return homeFolder() / ".local/share/zerithd/root";
}

fs::path resolve(std::string_view absolute) {
  std::string_view rel = absolute;
  while (!rel.empty() && rel.front() == '/') {
    rel.remove_prefix(1);
  }
  return root() / fs::path(rel);
}

fs::path socketPath() { return resolve("/run/zerithd/com.velmar.zerithd"); }
fs::path defaultsDir() { return resolve("/var/lib/zerithd/defaults"); }
fs::path spoolDir() { return resolve("/var/lib/zerithd/spool"); }
fs::path storebagCacheDir() {
  // Relocated: a folder of the root stands for the service user's home.
  if (relocated()) {
    return resolve("/var/cache/zerithd/storebags");
  }
  // The packaged service: systemd's CacheDirectory= (/var/cache/zerithd).
  if (const char* cache = std::getenv("CACHE_DIRECTORY"); cache && *cache == '/') {
    const std::string first(cache, std::strcspn(cache, ":"));
    return fs::path(first) / "storebags";
  }
  return homeFolder() / ".cache/zerithd/storebags";
}
fs::path messageLogDir() { return resolve("/var/log/faultkeep/retired"); }
fs::path uploadStorageDir() { return resolve("/tmp/zthstorage"); }
fs::path entitlementsDir() { return resolve("/etc/zerithd/entitlements.d"); }
fs::path deviceFile() { return resolve("/etc/zerithd/device.plist"); }
fs::path frameworkResourceDir() { return resolve("/usr/share/zerith"); }
fs::path adaptorPluginPath() { return resolve("/usr/lib/corvid/plugins/QPXPerformance.so"); }

}  // namespace zerith::paths
