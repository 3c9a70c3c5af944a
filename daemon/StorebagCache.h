#pragma once

// The agent's storebag cache: one entry per storebag name, shared by every
// session whose client type maps to that name. Answers from the entry while
// it is fresh, refetches when it is stale or when the disk cache was
// refreshed behind its back, and refetches a failed storebag at most once
// every 900 seconds.
//
// Thread-safe: its own lock guards the entries and is never held during a
// fetch. One fetch per storebag name runs at a time; sessions that need the
// same name wait for it (their pool counts them as waiting and grows), while
// sessions of other names are answered from their entries meanwhile. The
// caller holds no ranked lock (the agent lock above all): the fetch waits for
// the transport, whose completions never wait on the agent.

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "platform/LockRank.h"

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
  // A copy of the entries ("StorebagData", "StorebagVersion",
  // "StorebagFetchTime", "StorebagFetchState", "StorebagMaxAge") by storebag
  // name.
  Dictionary entries() const;

 private:
  using Lock = std::unique_lock<RankedMutex<std::mutex>>;
  // Waits (the lock let go meanwhile) until no fetch of `name` is under way.
  void waitForFetchOf(Lock& lock, const std::string& name);
  // Fetches with the lock let go and stores the answer; `lock` is held on
  // entry and on return.
  void fetchAndCache(Lock& lock, std::int32_t clientType);

  Clock clock_;
  Fetch fetch_;
  DiskDate diskDate_;
  mutable RankedMutex<std::mutex> mutex_{LockRank::StorebagCache, "the storebag cache lock"};
  std::condition_variable_any fetchEnded_;
  std::set<std::string> fetching_;  // names whose fetch is under way
  Dictionary cachedStorebags_;
};

}  // namespace zerith
