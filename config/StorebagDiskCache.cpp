#include "config/StorebagDiskCache.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <system_error>
#include <vector>

#include <fmt/format.h>

#include "platform/Defaults.h"
#include "platform/FileUtil.h"
#include "config/ConfigLog.h"
#include "platform/Paths.h"

namespace zerith {

namespace {

constexpr std::int32_t kDefaultMaxAge = 86400;

std::string describe(const std::optional<std::string>& s) { return s ? *s : std::string("(null)"); }

}  // namespace

RankedMutex<std::recursive_mutex>& ZerithdUtil::lock() {
  // Process-wide by design: the disk cache and the metrics are shared by every
  // caller in the process, and so is the lock that guards them. Never
  // destroyed: transport completions may still take it while the process exits.
  static auto* mutex = new RankedMutex<std::recursive_mutex>(LockRank::StorebagDisk, "the storebag disk cache lock");
  return *mutex;
}

Value defaultsObjectForKey(std::string_view key) { return Defaults(kZerithDefaultsDomain).objectForKey(key); }

void setDefaultsObjectForKey(std::string_view key, const Value& object) {
  Defaults(kZerithDefaultsDomain).setObject(key, object);
}

std::string storebagMetricsKey(std::string_view name, std::string_view field) {
  return fmt::format("CACHED_{}_{}", name, field);
}

std::filesystem::path storebagCacheFileURL(const std::string& name) {
  const auto dir = paths::storebagCacheDir();
  std::error_code ec;
  std::filesystem::create_directories(dir, ec);  // a failure shows when the file is used
  return dir / name;
}

std::optional<Date> storebagCacheModificationDate(const std::string& name) {
  std::lock_guard lock(ZerithdUtil::lock());
  struct stat st {};
  if (::stat(storebagCacheFileURL(name).c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
    return std::nullopt;
  }
  return Date{static_cast<double>(st.st_mtim.tv_sec) + static_cast<double>(st.st_mtim.tv_nsec) / 1e9};
}

bool saveStorebagToDisk(const std::string& name, const Data& data) {
  std::lock_guard lock(ZerithdUtil::lock());
  const auto path = storebagCacheFileURL(name);
  errno = 0;
  if (file::writeAtomically(path, data)) {
    return true;
  }
  const int err = errno;
  configLogger().error("saveStorebagToDisk: could not save storebag '{}' to file '{}'. Error is '{}'", name, path.string(),
                 err ? std::strerror(err) : "write failed");
  return false;
}

std::optional<Data> loadStorebagFromDisk(const std::string& name) {
  std::lock_guard lock(ZerithdUtil::lock());
  const auto path = storebagCacheFileURL(name);
  std::string why;
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) {
    why = std::strerror(errno);
  } else if (!S_ISREG(st.st_mode)) {
    why = "not a regular file";
  } else if (static_cast<std::uint64_t>(st.st_size) > kMaxStorebagContainerBytes) {
    why = fmt::format("file of {} bytes is larger than {} bytes", st.st_size, kMaxStorebagContainerBytes);
  } else {
    errno = 0;
    if (auto bytes = file::readAll(path, kMaxStorebagContainerBytes)) {
      return bytes;
    }
    why = errno ? std::strerror(errno) : "read failed";
  }
  configLogger().error("loadStorebagFromDisk: could not load storebag '{}' from file '{}'. Error is '{}'", name,
                 path.string(), why);
  return std::nullopt;
}

void getLastLoadedStorebagMetricsWithName(const std::string& name, std::int32_t* maxAgeOut, bool* unchangedOut,
                                          std::optional<std::string>* lastModifiedInOut) {
  std::lock_guard lock(ZerithdUtil::lock());
  if (maxAgeOut) {
    const std::int64_t stored = defaultsObjectForKey(storebagMetricsKey(name, "max-age")).intValue();
    *maxAgeOut = static_cast<std::int32_t>(std::clamp<std::int64_t>(stored, INT32_MIN, INT32_MAX));
    configLogger().debug("getLastLoadedStorebagMetricsWithName: maxAge is {} for storebag {}", *maxAgeOut, name);
  }
  if (lastModifiedInOut) {
    const Value stored = defaultsObjectForKey(storebagMetricsKey(name, "Last-Modified"));
    if (const auto* s = stored.string()) {
      if (*lastModifiedInOut != *s) {
        *lastModifiedInOut = *s;
        configLogger().debug("getLastLoadedStorebagMetricsWithName: 'Last-Modified' has changed to '{}' for storebag '{}'",
                       *s, name);
      } else {
        configLogger().debug("getLastLoadedStorebagMetricsWithName: 'Last-Modified' has not changed for storebag '{}': '{}'",
                       name, *s);
        if (unchangedOut) {
          *unchangedOut = true;
        }
      }
    }
  }
}

std::int32_t storebagMaxAgeFromCacheControl(const std::optional<std::string>& cacheControl) {
  if (!cacheControl) {
    return kDefaultMaxAge;
  }
  // Every '=' and every space separates, so "a  b" has an empty component
  // between the two spaces.
  std::vector<std::string_view> components;
  std::string_view rest = *cacheControl;
  for (;;) {
    const auto cut = rest.find_first_of("= ");
    components.push_back(rest.substr(0, cut));
    if (cut == std::string_view::npos) {
      break;
    }
    rest.remove_prefix(cut + 1);
  }
  for (std::size_t i = 0; i < components.size(); ++i) {
    if (components[i] == "max-age") {
      if (i + 1 >= components.size()) {
        return kDefaultMaxAge;
      }
      const std::int64_t value = Value(std::string(components[i + 1])).intValue();
      return static_cast<std::int32_t>(std::clamp<std::int64_t>(value, INT32_MIN, INT32_MAX));
    }
  }
  return kDefaultMaxAge;
}

void saveLastLoadedStorebagMetricsWithName(const std::string& name, const HTTPURLResponse& response) {
  std::lock_guard lock(ZerithdUtil::lock());
  const std::int32_t maxAge = storebagMaxAgeFromCacheControl(response.valueForHTTPHeaderField("Cache-Control"));
  const auto lastModified = response.valueForHTTPHeaderField("Last-Modified");
  setDefaultsObjectForKey(storebagMetricsKey(name, "max-age"), Value(maxAge));
  setDefaultsObjectForKey(storebagMetricsKey(name, "Last-Modified"), lastModified ? Value(*lastModified) : Value());
  configLogger().debug("saveLastLoadedStorebagMetricsWithName: New storebag '{}' received: maxAge {}, Last-Modified '{}'",
                 name, maxAge, describe(lastModified));
}

}  // namespace zerith
