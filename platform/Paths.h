#pragma once

// Every file-system location of zerithd, relocated under one root folder so
// that tests and the demo run unprivileged in a folder of their own. The root
// is chosen once at start-up (option --root, environment ZERITHD_ROOT) and
// tests set it per fixture. An empty root or "/" means the real locations.

#include <filesystem>
#include <string_view>

namespace zerith::paths {

namespace fs = std::filesystem;

void setRoot(const fs::path& root);
fs::path root();
bool relocated();

// ZERITHD_ROOT when set; "/" for the superuser; otherwise a per-user folder
// (~/.local/share/zerithd/root).
fs::path defaultRoot();

// `absolute` (a path of the real system) moved under the root.
fs::path resolve(std::string_view absolute);

fs::path socketPath();          // /run/zerithd/com.velmar.zerithd
fs::path defaultsDir();         // /var/lib/zerithd/defaults
fs::path spoolDir();            // /var/lib/zerithd/spool
fs::path storebagCacheDir();    // ~/.cache/zerithd/storebags of the service user; $CACHE_DIRECTORY/storebags under systemd
fs::path messageLogDir();       // /var/log/faultkeep/retired
fs::path uploadStorageDir();    // /tmp/zthstorage
fs::path entitlementsDir();     // /etc/zerithd/entitlements.d
fs::path deviceFile();          // /etc/zerithd/device.plist
fs::path frameworkResourceDir();  // /usr/share/zerith (publicKey.der, Info.plist)
fs::path adaptorPluginPath();   // /usr/lib/corvid/plugins/QPXPerformance.so

}  // namespace zerith::paths
