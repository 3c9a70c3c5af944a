// An example diagnostics adaptor. Every forwarded event becomes one JSON line
//   {"method":<category>,"respCode":<type>,"dict":{...}}
// appended to the file named by the environment variable
// KOVU_EXAMPLE_OUTPUT, or written to standard error when it is not set.
// A real adaptor would hand the event to the wireless-diagnostics service.

#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "backends/KovuAdaptor.h"
#include "platform/Json.h"

namespace {

class KovuExampleAdaptor final : public zerith::KovuAdaptor {
 public:
  bool respondsToSelector(std::string_view selector) const override {
    return selector == zerith::kKovuForwardingSelector;
  }

  std::string description() const override { return "<KovuExampleAdaptor>"; }

  void sendMessageWithMethod(std::uint16_t method, std::uint16_t respCode, const zerith::Value& dict) override {
    nlohmann::ordered_json line;
    line["method"] = method;
    line["respCode"] = respCode;
    line["dict"] = zerith::json::toJson(dict);
    const std::string text = line.dump() + "\n";

    const char* output = std::getenv("KOVU_EXAMPLE_OUTPUT");
    if (output == nullptr || *output == '\0') {
      std::fwrite(text.data(), 1, text.size(), stderr);
      return;
    }
    const int fd = ::open(output, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (fd < 0) {
      return;
    }
    // One write per line, so that concurrent adaptors never interleave.
    [[maybe_unused]] const ssize_t written = ::write(fd, text.data(), text.size());
    ::close(fd);
  }
};

}  // namespace

extern "C" __attribute__((visibility("default"))) zerith::KovuAdaptor* KovuAdaptor() {
  return new KovuExampleAdaptor();
}
