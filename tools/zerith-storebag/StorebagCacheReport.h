#pragma once

// `zerith-storebag cached`: what the daemon would make of each storebag in
// its disk cache, for the operator asking why a client type did not get the
// configuration the server now serves. Per cached copy: when it was saved and
// whether its max age has passed (the next session's fetch then asks the
// server again), its signatures under the installed public keys, its version
// and issue time against the newest one the daemon accepted for the name,
// and the verdict: used, or refused and why. Issue times remembered for names
// that have no cached copy follow. Read only: no folder is made, no file
// changed, no time remembered.

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "platform/Value.h"

namespace zerith {

struct CachedStorebag {
  std::string name;
  std::vector<std::uint32_t> clientTypes;  // the client types whose storebag this is
  std::uint64_t bytes = 0;
  std::optional<Date> saved;           // the file's modification time
  std::int32_t maxAgeSeconds = 0;      // of the answer that saved it (0: none stored)
  std::optional<std::string> lastModified;
  std::string signature;               // "verified", "verified (RSA and Ed25519)" or the refusal
  std::optional<std::string> version;
  std::optional<Date> issued;
  std::optional<Date> newestAccepted;  // remembered for the name
  std::optional<std::string> refused;  // nullopt when the daemon uses this copy
};

struct StorebagCacheReport {
  std::filesystem::path folder;
  std::vector<CachedStorebag> cached;  // by name
  // Remembered issue times of names without a cached copy.
  std::vector<std::pair<std::string, Date>> rememberedOnly;
  // Why the remembered issue times cannot be read (the daemon then counts
  // none remembered), when they cannot.
  std::optional<std::string> issueTimesProblem;
};

// The report of a cache folder (the daemon's is paths::storebagCacheDir();
// the packaged service's is /var/cache/zerithd/storebags), with the public
// keys, defaults and issue times of the current root; nullopt with the reason
// when the folder exists but cannot be listed. A folder that does not exist
// is an empty cache.
std::optional<StorebagCacheReport> reportStorebagCache(const std::filesystem::path& folder, std::string* why);

// The readable form, ages counted back from `now`.
std::string describeStorebagCache(const StorebagCacheReport& report, Date now);

}  // namespace zerith
