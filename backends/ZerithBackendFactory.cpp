// The backend factory: backend names to kinds.

#include <functional>
#include <mutex>
#include <utility>
#include <vector>
#include <string_view>

#include "backends/BackendsLog.h"
#include "backends/DashboardBackend.h"
#include "backends/HTTPSPostBackend.h"
#include "backends/KovuBackend.h"
#include "backends/PellamBackend.h"
#include "backends/UploadBackend.h"
#include "backends/ZerithBackend.h"
#include "config/DeviceInfo.h"
#include "platform/Log.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

namespace {

struct Kind {
  const char* const* name;
  // False when the kind does not exist on this device; the name then counts
  // as unknown.
  std::function<bool()> available;
  std::function<std::shared_ptr<ZerithBackend>(std::string_view name, const Value& profile,
                                               const std::optional<std::string>& productFamily,
                                               std::int32_t clientType)>
      make;
};

// Kinds made with the three-argument initialiser; the client type is not
// passed on.
template <typename Backend>
std::shared_ptr<ZerithBackend> makePlain(std::string_view name, const Value& profile,
                                         const std::optional<std::string>& productFamily, std::int32_t) {
  return std::make_shared<Backend>(std::string(name), profile, productFamily);
}

// Kinds whose initialiser may refuse the profile (nullptr).
template <typename Backend>
std::shared_ptr<ZerithBackend> makeChecked(std::string_view name, const Value& profile,
                                           const std::optional<std::string>& productFamily, std::int32_t) {
  return Backend::initWithName(std::string(name), profile, productFamily);
}

std::shared_ptr<ZerithBackend> makeKovu(std::string_view name, const Value& profile,
                                        const std::optional<std::string>& productFamily, std::int32_t clientType) {
  return KovuBackend::initWithName(std::string(name), profile, productFamily, clientType);
}

// The adaptor backend does not exist on "Tarvix" devices. The device's own
// product type decides, not the product family the caller passes.
bool adaptorAvailable() {
  const Value productType = deviceProductType();
  return !(productType.string() && *productType.string() == "Tarvix");
}

bool always() { return true; }

// Compared in this order; the first name that matches decides. The full
// order is dashboard, uploadServer, httpsPost, httpsPost2, pellamlog, qrs,
// kovu; a kind joins the table at its place with one line.
const std::vector<Kind>& kinds() {
  static const std::vector<Kind> table = {
      {&kZerithBackendDashboard, always, makeChecked<DashboardBackend>},
      {&kZerithBackendUploadServer, always, makeChecked<UploadBackend>},
      {&kZerithBackendHTTPPost, always, makeChecked<HTTPSPostBackend>},
      {&kZerithBackendHTTPPost2, always, makeChecked<HTTPSPostBackend>},
      {&kZerithBackendPellamlog, always, makePlain<PellamBackend>},
      {&kZerithBackendQRS, always, makeChecked<HTTPSPostBackend>},
      {&kZerithBackendKovu, adaptorAvailable, makeKovu},
  };
  return table;
}

struct Registered {
  std::mutex mutex;
  std::vector<std::pair<std::string, ZerithBackend::Maker>> kinds;
};

Registered& registered() {
  static Registered r;
  return r;
}

}  // namespace

void ZerithBackend::registerBackendKind(std::string name, Maker make) {
  auto& r = registered();
  std::lock_guard lock(r.mutex);
  std::erase_if(r.kinds, [&](const auto& k) { return k.first == name; });
  r.kinds.emplace_back(std::move(name), std::move(make));
}

std::shared_ptr<ZerithBackend> ZerithBackend::newBackendWithName(std::string_view name, const Value& profile,
                                                                 const std::optional<std::string>& productFamily,
                                                                 std::int32_t clientType) {
  Maker extra;
  {
    auto& r = registered();
    std::lock_guard lock(r.mutex);
    for (const auto& [n, make] : r.kinds) {
      if (n == name) {
        extra = make;
        break;
      }
    }
  }
  if (extra) {
    return extra(name, profile, productFamily, clientType);
  }
  for (const Kind& kind : kinds()) {
    if (name != *kind.name) {
      continue;
    }
    if (!kind.available()) {
      break;
    }
    return kind.make(name, profile, productFamily, clientType);
  }
  backendsLogger().error("ZerithBackend(newBackendWithName): {}", name);
  return nullptr;
}

}  // namespace zerith
