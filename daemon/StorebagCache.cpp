#include "daemon/StorebagCache.h"

#include <cmath>
#include <utility>

#include <fmt/format.h>

#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/StorebagDiskCache.h"
#include "config/StorebagFetch.h"
#include "config/StorebagIssueTimes.h"
#include "config/StorebagVerify.h"
#include "platform/Log.h"
#include "platform/ThreadPools.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* l = new log::Logger("daemon");
  return *l;
}

constexpr const char* kStorebagData = "StorebagData";
constexpr const char* kStorebagVersion = "StorebagVersion";
constexpr const char* kStorebagFetchTime = "StorebagFetchTime";
constexpr const char* kStorebagFetchState = "StorebagFetchState";
constexpr const char* kStorebagMaxAge = "StorebagMaxAge";
constexpr const char* kFetchSuccessful = "Fetch Successful";
constexpr const char* kFetchFailure = "Fetch Failure";

// A failed storebag is not fetched again sooner than this.
constexpr int kRetryIntervalSeconds = 900;

// A date as the system log shows dates: "2024-05-01 12:00:00 +0000".
std::string describeDate(const std::optional<Date>& date) { return date ? describeIssueTime(*date) : "(null)"; }

std::optional<std::string> nameForClientType(std::int32_t clientType) {
  return storebagNameForClientType(static_cast<ZerithClientType>(clientType));
}

}  // namespace

StorebagCache::StorebagCache()
    : StorebagCache([] { return Date::now(); },
                    [](std::int32_t clientType, std::int32_t& maxAge, Value& version, bool& unchanged) {
                      return fetchStorebagForEnvironmentAndClientType(clientType, maxAge, version, unchanged);
                    },
                    [](const std::string& name) { return storebagCacheModificationDate(name); }) {}

StorebagCache::StorebagCache(Clock clock, Fetch fetch, DiskDate diskDate)
    : clock_(std::move(clock)), fetch_(std::move(fetch)), diskDate_(std::move(diskDate)) {}

Value StorebagCache::storebagForClientType(std::int32_t clientType, std::uint32_t sessionID) {
  lockrank::assertNoLockHeld("a storebag fetch");
  logger().debug("storebagForSession: Retrieving storebag for session {} with client type {}", sessionID, clientType);
  const auto name = nameForClientType(clientType);
  Lock lock(mutex_);
  if (name) {
    waitForFetchOf(lock, *name);
    if (const Value* entry = cachedStorebags_.find(*name)) {
      const auto fetchTime = (*entry)[kStorebagFetchTime].date();
      const Date now = clock_();
      // An entry always has a fetch time once created; treat one without as
      // infinitely old.
      const double age = fetchTime ? std::fabs(now.secondsSince1970 - fetchTime->secondsSince1970) : INFINITY;
      const bool successful = (*entry)[kStorebagFetchState] == Value(kFetchSuccessful);
      const std::int64_t maxAge = (*entry)[kStorebagMaxAge].intValue();
      const auto diskDate = diskDate_(*name);

      if (diskDate && fetchTime && *diskDate > *fetchTime) {
        logger().info(
            "storebagForSession: Override maxAge as disk cache for storebag '{}' was updated: modification time "
            "'{}' is greater than last fetch time '{}",
            *name, describeDate(diskDate), describeDate(fetchTime));
      } else if (age < static_cast<double>(maxAge) && successful) {
        logger().debug("storebagForSession: Cached storebag found for client type {}", clientType);
        return (*entry)[kStorebagData];
      } else if (age < kRetryIntervalSeconds && !successful) {
        logger().info("storebagForSession: Not fetching storebag for client type {} - must wait {} seconds between "
                      "attempts",
                      clientType, kRetryIntervalSeconds);
        return (*entry)[kStorebagData];
      }
    }
  }
  fetchAndCache(lock, clientType);
  if (name) {
    if (const Value* entry = cachedStorebags_.find(*name)) {
      return (*entry)[kStorebagData];
    }
  }
  return Value();
}

Value StorebagCache::storebagVersionForClientType(std::int32_t clientType) const {
  const auto name = nameForClientType(clientType);
  if (!name) {
    return Value();
  }
  Lock lock(mutex_);
  const Value* entry = cachedStorebags_.find(*name);
  return entry ? (*entry)[kStorebagVersion] : Value();
}

void StorebagCache::fetchAndCacheStorebag(std::int32_t clientType) {
  lockrank::assertNoLockHeld("a storebag fetch");
  Lock lock(mutex_);
  fetchAndCache(lock, clientType);
}

void StorebagCache::waitForFetchOf(Lock& lock, const std::string& name) {
  if (!fetching_.contains(name)) {
    return;
  }
  // Bounded by the fetch's own time-out; the fetch needs only the transport.
  const PoolWait wait;
  fetchEnded_.wait(lock, [&] { return !fetching_.contains(name); });
}

void StorebagCache::fetchAndCache(Lock& lock, std::int32_t clientType) {
  logger().debug("fetchAndCacheStorebag: Fetching storebag for client type {}", clientType);
  const auto name = nameForClientType(clientType);
  if (!name) {
    logger().error("fetchAndCacheStorebag: clientType {} is invalid", clientType);
    return;
  }
  waitForFetchOf(lock, *name);
  fetching_.insert(*name);

  std::int32_t maxAge = 0;
  Value version;
  bool unchanged = false;
  Value storebag;
  lock.unlock();
  {
    const PoolWait wait;
    clearStorebagFailure();
    storebag = fetch_(clientType, maxAge, version, unchanged);
  }
  lock.lock();
  fetching_.erase(*name);
  fetchEnded_.notify_all();
  logger().debug("fetchAndCacheStorebag: Storebag max age: {} seconds", maxAge);

  // Read after the fetch: a drop meanwhile leaves no entry to build on.
  const Value* existing = cachedStorebags_.find(*name);
  Dictionary entry = existing ? existing->dictCopy() : Dictionary();

  if (!storebag.isNil()) {
    entry.set(kStorebagData, storebag);
    if (version.isNil()) {
      entry.erase(kStorebagVersion);
    } else {
      entry.set(kStorebagVersion, version);
    }
  } else if (!unchanged) {
    // The fetch notes why on this thread; the operator reads it here.
    const std::string& why = lastStorebagFailure();
    logger().error("fetchAndCacheStorebag: Unable to fetch storebag for client type {}{}", clientType,
                   why.empty() ? "" : ": " + why);
  }
  entry.set(kStorebagFetchTime, clock_());
  entry.set(kStorebagFetchState, (!storebag.isNil() || unchanged) ? kFetchSuccessful : kFetchFailure);
  entry.set(kStorebagMaxAge, maxAge);
  cachedStorebags_.set(*name, Value(std::move(entry)));
}

std::size_t StorebagCache::drop() {
  Lock lock(mutex_);
  const std::size_t dropped = cachedStorebags_.size();
  cachedStorebags_ = Dictionary();
  return dropped;
}

std::size_t StorebagCache::count() const {
  Lock lock(mutex_);
  return cachedStorebags_.size();
}

std::size_t StorebagCache::estimatedSize() const {
  return estimatedPlistMemorySize(Value(entries()));
}

Dictionary StorebagCache::entries() const {
  Lock lock(mutex_);
  return cachedStorebags_;
}

}  // namespace zerith
