#pragma once

// The diagnostics-adaptor backend: forwards every event to the adaptor
// object of a plugin (backends/KovuAdaptor.h) loaded from
// paths::adaptorPluginPath(). Only client types 7, 11 and 13 get one.

#include <dlfcn.h>

#include <memory>

#include "backends/KovuAdaptor.h"
#include "backends/ZerithBackend.h"

namespace zerith {

class KovuBackend : public ZerithBackend {
 public:
  // nullptr (after an error line) for a client type that is not allowed.
  // A plugin that does not load or has no factory is not checked here: the
  // backend then has an adaptor that answers nothing, which every event
  // reports.
  static std::shared_ptr<KovuBackend> initWithName(std::string name, Value profile,
                                                   std::optional<std::string> productFamily, std::int32_t clientType);
  // Client type 0, which is never allowed: always nullptr.
  static std::shared_ptr<KovuBackend> initWithName(std::string name, Value profile,
                                                   std::optional<std::string> productFamily);

  static bool isClientTypeAllowed(std::int32_t clientType);

  ~KovuBackend() override;

  using ZerithBackend::sendMessage;
  // Forwards method, respCode and the event dictionary; returns nil. The
  // time, event number and flag are not passed on.
  std::optional<std::string> sendMessage(const Value& message, const timeval& timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID, std::int32_t flag) override;

 private:
  KovuBackend(std::string name, Value profile, std::optional<std::string> productFamily);

  struct BundleCloser {
    void operator()(void* handle) const {
      if (handle != nullptr) {
        ::dlclose(handle);
      }
    }
  };

  // Declared before the adaptor, so the adaptor (whose code lives in the
  // bundle) is destroyed first.
  std::unique_ptr<void, BundleCloser> clientBundle_;
  KovuAdaptorFactory kovuAdaptorClass_ = nullptr;
  std::unique_ptr<KovuAdaptor> kovuAdaptor_;
};

}  // namespace zerith
