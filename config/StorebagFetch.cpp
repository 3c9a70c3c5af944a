#include "config/StorebagFetch.h"

#include <cmath>
#include <memory>
#include <mutex>
#include <semaphore>

#include <fmt/format.h>

#include "config/ClientTypes.h"
#include "config/StorebagDiskCache.h"
#include "config/StorebagServers.h"
#include "config/StorebagVerify.h"
#include "config/ConfigLog.h"
#include "platform/DefaultsKeys.h"
#include "platform/LockRank.h"
#include "platform/PropertyList.h"
#include "platform/ThreadPools.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "zerith/ZerithBundle.h"

namespace zerith {

namespace {

constexpr std::int32_t kMaxRefreshCycle = 86400;
constexpr double kStorebagRequestTimeout = 15;
// The storebag whose fetch falls back to the built-in copy when the server
// cannot be reached.
constexpr const char* kFallbackStorebagName = "dravon";

// The process-wide GET-mode helper of the storebag fetch, created on first
// use under ZerithdUtil's lock. Never destroyed: completions may still be
// delivered while the process exits.
std::shared_ptr<ReportingSessionConnectivityInterface> storebagHTTPHelper() {
  static auto* helper = new std::shared_ptr<ReportingSessionConnectivityInterface>();
  std::lock_guard lock(ZerithdUtil::lock());
  if (!*helper) {
    *helper = ReportingSessionConnectivityHelper::initWithDelegate({}, ReportingSessionConnectivityHelper::GETRequestMode());
  }
  return *helper;
}

// What a synchronous fetch waits for.
struct SynchronousFetch {
  std::binary_semaphore done{0};
  Data body;
  std::optional<Error> error;
  long statusCode = 0;
};

}  // namespace

std::string storebagServerURL() {
  const Value configured = defaultsObjectForKey(defaultsSetting("zerith_storebag_url").key);
  if (const auto* url = configured.string()) {
    return *url;
  }
  return isInternalBuild() ? kZerithInternalStorebagURL : kZerithDefaultStorebagURL;
}

std::string storebagRequestURL(const std::string& name) {
  return fmt::format("{}/{}?version={}", storebagServerURL(), name, frameworkBundleVersion().value_or("8.0"));
}

Data buildFallbackStorebag() {
  const auto section = [] { return Value(Dictionary{{"kovu", Value(Dictionary{{"active", true}})}}); };
  return plist::encodeBinary(Value(Dictionary{
      {"velmar_internal", section()},
      {"development", section()},
      {"release", section()},
      {"version", "1.0.0-Corvid-Fallback"},
      {"refresh_cycle", 3600},
  }));
}

std::optional<Data> fetchNetworkStorebag(const std::string& name, bool synchronous,
                                         const std::optional<std::string>& lastModified) {
  const std::string url = storebagRequestURL(name);
  configLogger().debug("fetchNetworkStorebag: Storebag Server URL: {}", url);

  URLRequest request;
  request.httpMethod = "GET";
  request.url = url;
  request.ignoreLocalCache = true;
  request.timeoutSeconds = kStorebagRequestTimeout;
  // A larger storebag would be refused anyway; the download stops there.
  request.maxResponseBytes = kMaxStorebagContainerBytes;
  if (lastModified) {
    configLogger().debug("fetchNetworkStorebag: Adding 'Last-Modified: {}' to the header", *lastModified);
    request.setValue(*lastModified, "If-Modified-Since");
  }

  const auto helper = storebagHTTPHelper();
  const auto wait = synchronous ? std::make_shared<SynchronousFetch>() : nullptr;
  helper->getURLRequestWithCompletionHandler(
      request, [name, url, wait](const Data& body, const std::optional<HTTPURLResponse>& response,
                            const std::optional<Error>& error) {
        // This runs on the helper's queue: what the verification below notes
        // belongs to no caller.
        clearStorebagFailure();
        const long statusCode = response ? response->statusCode : 0;
        if (!error && statusCode == 200) {
          {
            std::lock_guard lock(ZerithdUtil::lock());
            saveLastLoadedStorebagMetricsWithName(name, *response);
          }
          if (!body.empty()) {
            parseAndVerifyStorebag(name, body, true, StorebagSource{url});  // saves a verified copy; the caller reads it from disk
          } else {
            configLogger().debug("fetchNetworkStorebag: received zero-length storebag for '{}\u2018, treat as unchanged",
                           name);
          }
        } else {
          configLogger().debug(
              "fetchNetworkStorebag: storebag '{}' does not need update as its content has not changed on the server",
              name);
        }
        if (wait) {
          wait->error = error;
          wait->statusCode = statusCode;
          wait->body = body;
          wait->done.release();
        }
      });
  if (!wait) {
    return std::nullopt;
  }

  // The completion runs on the helper's own transport queue and takes
  // ZerithdUtil's lock, which the caller does not hold here.
  lockrank::assertNoLockHeld("an HTTP answer");
  {
    const PoolWait poolWait;
    wait->done.acquire();
  }
  if (wait->error || wait->statusCode != 200) {
    // An answer other than 200 has no error of its own: its status is the cause.
    const std::string cause =
        wait->error ? wait->error->description : fmt::format("HTTP status {}", wait->statusCode);
    configLogger().info("fetchNetworkStorebag: Error resolving with lookup server {}, sendSynchronousRequest error {}", url,
                        cause);
    noteStorebagFailure(cause + " from " + url);
    if (name == kFallbackStorebagName) {
      configLogger().info("fetchNetworkStorebag: Loading default storebag '{}'", name);
      noteStorebagFailure("the built-in fallback storebag was loaded");
      return buildFallbackStorebag();
    }
    return std::nullopt;
  }
  return std::move(wait->body);
}

Value fetchStorebagWithName(const std::string& name, std::int32_t& maxAgeOut, bool& unchangedOut) {
  maxAgeOut = 0;
  unchangedOut = false;
  std::optional<std::string> lastModified;

  std::unique_lock lock(ZerithdUtil::lock());
  std::optional<Data> data = loadStorebagFromDisk(name);
  // A body fetched here was checked (and counted) when it arrived.
  StorebagSource source;
  if (!data) {
    lock.unlock();
    data = fetchNetworkStorebag(name, true, std::nullopt);
    source = StorebagSource{storebagRequestURL(name), false};
  } else {
    getLastLoadedStorebagMetricsWithName(name, &maxAgeOut, &unchangedOut, &lastModified);
    const auto modified = storebagCacheModificationDate(name);
    const double age =
        modified ? std::fabs(Date::now().secondsSince1970 - modified->secondsSince1970) : static_cast<double>(INFINITY);
    const bool expired = age > static_cast<double>(maxAgeOut);
    configLogger().info("fetchStorebagWithName: storebag '{}' loaded from disk cache. Disk cache {} refreshed", name,
                  expired ? "expired and will be" : "is valid and will not be");
    lock.unlock();
    if (expired) {
      // The cached copy serves this call; the answer is saved when it comes.
      fetchNetworkStorebag(name, false, lastModified);
    }
  }

  lock.lock();
  // A synchronous fetch may have stored a new max age.
  getLastLoadedStorebagMetricsWithName(name, &maxAgeOut, nullptr, nullptr);
  if (unchangedOut || !data) {
    return Value();
  }
  return parseAndVerifyStorebag(name, *data, false, source);
}

Value fetchStorebagForEnvironmentAndClientType(std::int32_t clientType, std::int32_t& maxAgeOut, Value& versionOut,
                                               bool& unchangedOut) {
  clearStorebagFailure();
  const auto name = storebagNameForClientType(static_cast<ZerithClientType>(clientType));
  if (!name) {
    configLogger().error("fetchStorebagForEnvironmentAndClientType: Could not find storebag name for client type {}",
                   clientType);
    return Value();
  }
  const Value storebag = fetchStorebagWithName(*name, maxAgeOut, unchangedOut);
  if (storebag.isNil()) {
    if (!unchangedOut) {
      const std::string& why = lastStorebagFailure();
      configLogger().error("fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type {}{}",
                           clientType, why.empty() ? "" : ": " + why);
    }
    return Value();
  }

  const auto environment = userDefaultsEnvironment();
  std::optional<std::string> sectionName = environmentNameForType(environment);
  Value section = sectionName ? storebag[*sectionName] : Value();
  if (!section.isDict()) {
    section = Value();
    if (environment == kEnvironmentSeed) {
      configLogger().error("fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag.");
      sectionName = "release";
      if (Value release = storebag["release"]; release.isDict()) {
        section = release;
      }
    }
    if (section.isNil()) {
      configLogger().error("fetchStorebagForEnvironmentAndClientType: Could not find storebag for client type {} with {} "
                     "environment",
                     clientType, sectionName.value_or("(null)"));
      return Value();
    }
  }

  const Value version = storebag["version"];
  versionOut = version.isString() ? version : Value();

  if (const Value refreshCycle = storebag["refresh_cycle"]; !refreshCycle.isNil()) {
    const std::int64_t cycle = refreshCycle.intValue();
    maxAgeOut = cycle < kMaxRefreshCycle ? static_cast<std::int32_t>(std::max<std::int64_t>(cycle, INT32_MIN))
                                         : kMaxRefreshCycle;
    configLogger().info("fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge={}", maxAgeOut);
  }
  return section;
}

}  // namespace zerith
