// Feeds one input to the collector's decoding of untrusted request bodies:
// as a body with and without "Content-Encoding: gzip", under small limits so
// that the size, inflation and depth checks are reached, and to the depth
// scan itself. Also replayed over its corpus by the collector tests.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "tools/zerith-collector/CollectorBody.h"

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
  (void)jsonNestingDepth(body, 16);
  return 0;
}
