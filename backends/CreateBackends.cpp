#include "backends/CreateBackends.h"
#include "backends/BackendsLog.h"

#include <sys/time.h>

#include "config/ClientTypes.h"
#include "config/DeviceInfo.h"
#include "platform/Log.h"
#include "zerith/ZerithBundle.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

namespace {

std::optional<std::string> stringOf(const Value& v) {
  return v.string() ? std::optional<std::string>(*v.string()) : std::nullopt;
}

}  // namespace

std::optional<BackendDictionary> createBackends(const Value& storebagSection, const Value& sessionInfo,
                                                const Value& userInfo, const char* udid) {
  if (storebagSection.isNil()) {
    backendsLogger().error("createBackends: Attempted to create backends with nil storebag");
    return std::nullopt;
  }
  if (sessionInfo.isNil()) {
    backendsLogger().error("createBackends: Attempted to create backends with nil session info");
    return std::nullopt;
  }

  // One start time for every backend of the session.
  timeval start{};
  ::gettimeofday(&start, nullptr);

  const auto productVersion = stringOf(deviceProductVersion());
  const auto buildVersion = stringOf(deviceBuildVersion());
  const auto productType = stringOf(deviceProductType());
  const auto productFamily = stringOf(deviceName());
  const bool internal = isInternalBuild();

  const std::string frameworkVersion = frameworkBundleVersion().value_or(kFallbackFrameworkVersion);

  const auto sessionID = static_cast<std::uint32_t>(sessionInfo[kZerithSessionInfoSessionID].intValue());
  const auto clientType = static_cast<std::int32_t>(sessionInfo[kZerithSessionInfoClientType].intValue());
  const auto clientVersion = static_cast<std::uint16_t>(sessionInfo[kZerithSessionInfoClientVersion].intValue());
  const bool requireUserInfo = sessionInfo[kZerithSessionInfoRequireUserInfo].boolValue();
  const bool batchEvents = sessionInfo[kZerithSessionInfoBatchEvent].boolValue();

  BackendDictionary backends;
  if (const Dictionary* section = storebagSection.dict()) {
    for (const auto& [name, profile] : *section) {
      // An unknown kind is skipped here; the factory has logged it.
      auto backend = ZerithBackend::newBackendWithName(name, profile, productFamily, clientType);
      if (!backend) {
        continue;
      }
      backend->setSessionID(sessionID);
      backend->setCompType(clientType);
      backend->setClientVersion(clientVersion);
      backend->setUdid(udid);
      backend->setProductVersion(productVersion);
      backend->setBuildVersion(buildVersion);
      backend->setHardwareType(productType);
      backend->setIsInternal(internal);
      backend->setRequireUserInfo(requireUserInfo);
      backend->setBatchEvents(batchEvents);
      backend->setUserInfoDict(userInfo);
      backend->setSelfVersion(frameworkVersion);
      backend->setStartTimestamp(start);
      backends.emplace_back(name, std::move(backend));
    }
  }
  return backends;
}

}  // namespace zerith
