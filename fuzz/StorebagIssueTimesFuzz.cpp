// libFuzzer target: the daemon's file of remembered storebag issue times,
// read back from its state folder at every storebag check.

#include <cstddef>
#include <cstdint>

#include "config/StorebagIssueTimes.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string why;
  if (const auto times = zerith::decodeStorebagIssueTimes({data, size}, &why)) {
    // What was read is written back the same way.
    (void)zerith::encodeStorebagIssueTimes(*times);
  }
  return 0;
}
