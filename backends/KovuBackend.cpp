#include "backends/KovuBackend.h"
#include "backends/BackendsLog.h"

#include "platform/Log.h"
#include "platform/Paths.h"

namespace zerith {

KovuBackend::KovuBackend(std::string name, Value profile, std::optional<std::string> productFamily)
    : ZerithBackend(std::move(name), std::move(profile), std::move(productFamily)) {}

std::shared_ptr<KovuBackend> KovuBackend::initWithName(std::string name, Value profile,
                                                       std::optional<std::string> productFamily,
                                                       std::int32_t clientType) {
  std::shared_ptr<KovuBackend> backend(new KovuBackend(std::move(name), std::move(profile), std::move(productFamily)));
  backendsLogger().info("KovuBackend(initWithName): Loading Kovu adaptor class for client type {}", clientType);
  if (!isClientTypeAllowed(clientType)) {
    backendsLogger().error("KovuBackend(initWithName): No matching bundle found for client type {}", clientType);
    return nullptr;
  }

  const std::string path = paths::adaptorPluginPath().string();
  // dlopen answers the loaded bundle again when it is loaded already.
  backend->clientBundle_.reset(::dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL));
  if (!backend->clientBundle_) {
    const char* why = ::dlerror();
    backendsLogger().error("KovuBackend(initWithName): Could not load adaptor plugin {}: {}", path, why ? why : "unknown error");
    return backend;
  }
  backend->kovuAdaptorClass_ =
      reinterpret_cast<KovuAdaptorFactory>(::dlsym(backend->clientBundle_.get(), kKovuAdaptorFactorySymbol));
  if (backend->kovuAdaptorClass_ == nullptr) {
    backendsLogger().error("KovuBackend(initWithName): Adaptor plugin {} has no {}", path, kKovuAdaptorFactorySymbol);
    return backend;
  }
  backend->kovuAdaptor_.reset(backend->kovuAdaptorClass_());
  if (backend->kovuAdaptor_ && backend->kovuAdaptor_->abiVersion() != kKovuAdaptorABIVersion) {
    backendsLogger().error("KovuBackend(initWithName): Adaptor plugin {} speaks interface version {}, not {}", path,
                   backend->kovuAdaptor_->abiVersion(), kKovuAdaptorABIVersion);
    backend->kovuAdaptor_.reset();
  }
  return backend;
}

std::shared_ptr<KovuBackend> KovuBackend::initWithName(std::string name, Value profile,
                                                       std::optional<std::string> productFamily) {
  return initWithName(std::move(name), std::move(profile), std::move(productFamily), 0);
}

bool KovuBackend::isClientTypeAllowed(std::int32_t clientType) {
  return clientType == 7 || clientType == 11 || clientType == 13;
}

KovuBackend::~KovuBackend() {
  kovuAdaptor_.reset();
  clientBundle_.reset();
}

std::optional<std::string> KovuBackend::sendMessage(const Value& message, const timeval&, std::uint16_t method,
                                                    std::uint16_t respCode, std::uint16_t, std::int32_t) {
  if (!kovuAdaptor_ || !kovuAdaptor_->respondsToSelector(kKovuForwardingSelector)) {
    backendsLogger().error("KovuBackend(sendMessage): Kovu adaptor {} does not respond to forwarding selector {}",
                   kovuAdaptor_ ? kovuAdaptor_->description() : std::string("(null)"), kKovuForwardingSelector);
    counters().add(BackendCount::droppedTransportError);
    return std::nullopt;
  }
  kovuAdaptor_->sendMessageWithMethod(method, respCode, message);
  counters().add(BackendCount::sent);
  return std::nullopt;
}

}  // namespace zerith
