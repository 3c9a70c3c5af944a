#pragma once

// The storebag disk cache and its freshness metrics.
//
// The cache keeps one file per storebag name in paths::storebagCacheDir(),
// holding the signed container exactly as the server sent it; the file's
// modification date is the time of its last successful save. The metrics
// ("CACHED_<name>_max-age", "CACHED_<name>_Last-Modified") live in the
// defaults domain "com.velmar.zerith".
//
// Every read or write of the cache files and the metrics happens under
// ZerithdUtil's process-wide recursive lock; the functions below take it
// themselves, so callers only hold it to make several steps atomic.

#include <cstdint>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "config/ClientTypes.h"
#include "platform/LockRank.h"
#include "platform/Value.h"
#include "transport/ReportingSessionConnectivityInterface.h"

namespace zerith {

// The process-wide recursive lock of the storebag cache and metrics (and of
// the storebag fetch's HTTP helper).
class ZerithdUtil {
 public:
  static RankedMutex<std::recursive_mutex>& lock();
};

// Reads an object of the "com.velmar.zerith" domain (nil when absent).
Value defaultsObjectForKey(std::string_view key);
// Stores an object in the "com.velmar.zerith" domain; nil removes the key.
void setDefaultsObjectForKey(std::string_view key, const Value& object);

// "CACHED_<name>_<field>".
std::string storebagMetricsKey(std::string_view name, std::string_view field);

// The cache file of a storebag name; creates the cache folder (with its
// parents) whenever it is asked for.
std::filesystem::path storebagCacheFileURL(const std::string& name);
// The modification date of the cache file, nullopt when there is none.
std::optional<Date> storebagCacheModificationDate(const std::string& name);
// Atomic save of the signed container; false (logged) on failure.
bool saveStorebagToDisk(const std::string& name, const Data& data);
// The signed container from disk, nullopt (logged) when it cannot be read.
std::optional<Data> loadStorebagFromDisk(const std::string& name);

// Largest cache file read back (a container of a few hundred kilobytes is
// usual; anything beyond this is not a storebag).
inline constexpr std::size_t kMaxStorebagContainerBytes = 4u << 20;

// Reads the stored max age (0 when none) into `maxAgeOut`; compares the
// stored Last-Modified with `lastModifiedInOut`: a different one replaces it,
// an equal one sets `unchangedOut`. Null pointers skip their part.
void getLastLoadedStorebagMetricsWithName(const std::string& name, std::int32_t* maxAgeOut, bool* unchangedOut,
                                          std::optional<std::string>* lastModifiedInOut);
// Stores the max age of the answer's "Cache-Control" (86400 without one) and
// its "Last-Modified" (removed when the answer has none).
void saveLastLoadedStorebagMetricsWithName(const std::string& name, const HTTPURLResponse& response);

// The max age a "Cache-Control" value grants: the component after "max-age"
// when the value is split at every '=' and space, 86400 otherwise.
std::int32_t storebagMaxAgeFromCacheControl(const std::optional<std::string>& cacheControl);

}  // namespace zerith
