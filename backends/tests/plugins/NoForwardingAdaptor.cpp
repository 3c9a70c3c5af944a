// A test adaptor that offers no forwarding operation: the adaptor backend
// must report every event it cannot hand over.

#include "backends/KovuAdaptor.h"

namespace {

class NoForwardingAdaptor final : public zerith::KovuAdaptor {
 public:
  bool respondsToSelector(std::string_view) const override { return false; }
  std::string description() const override { return "<NoForwardingAdaptor>"; }
};

}  // namespace

extern "C" __attribute__((visibility("default"))) zerith::KovuAdaptor* KovuAdaptor() {
  return new NoForwardingAdaptor();
}
