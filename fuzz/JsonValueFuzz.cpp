// Feeds one input to the reading of JSON text that callers hand the
// framework and the command line (payloads, session info, script lines) as
// a value. Whatever is taken nests no deeper than a frame may, and comes
// back unchanged through its JSON text; whatever is refused says why.
// Also replayed over its corpus in the normal test run.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/Json.h"

namespace {

std::size_t depthOf(const zerith::Value& value) {
  std::size_t deepest = 0;
  if (const auto* array = value.array()) {
    for (const auto& e : *array) {
      deepest = std::max(deepest, depthOf(e));
    }
    return deepest + 1;
  }
  if (const auto* dict = value.dict()) {
    for (const auto& [key, e] : *dict) {
      deepest = std::max(deepest, depthOf(e));
    }
    return deepest + 1;
  }
  return 0;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace zerith;
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  std::string why;
  const auto value = json::parseValue(text, &why);
  if (!value) {
    if (why.empty()) {
      std::abort();  // every refusal says why
    }
    return 0;
  }
  if (depthOf(*value) > json::kMaxValueDepth) {
    std::abort();
  }
  const auto again = json::parseValue(json::serialize(*value));
  if (!again || *again != *value) {
    std::abort();
  }
  return 0;
}
