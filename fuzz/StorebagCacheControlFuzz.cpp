// libFuzzer target: the "Cache-Control" value of a storebag answer, split at
// every '=' and space to find the max age.

#include <cstddef>
#include <cstdint>
#include <string>

#include "config/StorebagDiskCache.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string value(reinterpret_cast<const char*>(data), size);
  (void)zerith::storebagMaxAgeFromCacheControl(value);
  return 0;
}
