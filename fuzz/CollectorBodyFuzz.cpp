// Feeds one input to the collector's decoding of untrusted request bodies:
// as a body with and without "Content-Encoding: gzip", under small limits so
// that the size, inflation and depth checks are reached, to the depth scan
// itself, and as the text of a behaviour file. Also replayed over its corpus
// by the collector tests.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/Json.h"
#include "tools/zerith-collector/CollectorBody.h"
#include "tools/zerith-collector/CollectorServer.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace zerith::collector;
  const std::string_view body(reinterpret_cast<const char*>(data), size);
  const BodyLimits small{.maxBodyBytes = 1 << 16, .maxInflatedBytes = 1 << 18, .maxJsonDepth = 16};
  for (const char* encoding : {"", "gzip", "br"}) {
    const DecodedBody decoded = decodeRequestBody(encoding, body, small);
    if (decoded.ok && decoded.bytes.size() > small.maxInflatedBytes) {
      std::abort();  // the inflation limit did not hold
    }
    if (decoded.envelope && !decoded.envelope->contains("postTime")) {
      std::abort();
    }
    if (decoded.envelope) {
      (void)decoded.envelope->dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    }
  }
  (void)zerith::json::nestingDepth(body, 16);
  // Only the four behaviours, each with a number in its range.
  if (const auto behaviour = Behaviour::parse(body)) {
    const int n = behaviour->value;
    const bool sane = behaviour->kind == Behaviour::Kind::status  ? n >= 100 && n <= 599
                      : behaviour->kind == Behaviour::Kind::stall ? n >= 0 && n <= 600000
                                                                  : n == 0;
    if (!sane) {
      std::abort();
    }
  }
  return 0;
}
