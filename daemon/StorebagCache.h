#pragma once

// The agent's storebag cache: one entry per storebag name, shared by every
// session whose client type maps to that name. Answers from the entry while
// it is fresh, refetches when it is stale or when the disk cache was
// refreshed behind its back, and refetches a failed storebag at most once
// every 900 seconds.
//
// Not thread-safe by itself: the agent calls it with its lock held, so only
// one fetch runs at a time and every session waits for it.

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "platform/Value.h"

namespace zerith {

class StorebagCache {
 public:
  using Clock = std::function<Date()>;
  // Fetches the environment section for a client type: returns it or nil,
  // and gives back the max age, the version (string or nil) and the
  // "unchanged" flag.
  using Fetch = std::function<Value(std::int32_t clientType, std::int32_t& maxAge, Value& version, bool& unchanged)>;
  // Modification date of a storebag name's disk cache file.
  using DiskDate = std::function<std::optional<Date>(const std::string& storebagName)>;

  // The real fetch, disk cache and wall clock.
  StorebagCache();
  StorebagCache(Clock clock, Fetch fetch, DiskDate diskDate);

  // storebagForSession: without the lock, which the caller holds.
  Value storebagForClientType(std::int32_t clientType, std::uint32_t sessionID);
  Value storebagVersionForClientType(std::int32_t clientType) const;
  void fetchAndCacheStorebag(std::int32_t clientType);

  // Forgets every entry: the in-memory storebags and the wait after a failed
  // fetch. The next session fetches again, and the disk cache, its metrics,
  // the public key and the server URL decide what that fetch does. Returns
  // how many entries there were.
  std::size_t drop();

  // For health reports: entries, and the estimated memory of the whole cache.
  std::size_t count() const;
  std::size_t estimatedSize() const;
  // The entries ("StorebagData", "StorebagVersion", "StorebagFetchTime",
  // "StorebagFetchState", "StorebagMaxAge") by storebag name.
  const Dictionary& entries() const { return cachedStorebags_; }

 private:
  Clock clock_;
  Fetch fetch_;
  DiskDate diskDate_;
  Dictionary cachedStorebags_;
};

}  // namespace zerith
