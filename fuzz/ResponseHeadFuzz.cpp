// libFuzzer target: response head lines from a server, fed line by line as
// the transport receives them. Beyond not crashing, no field may come out
// with an empty name or with a line break in its name or value.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "transport/ResponseHead.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view input(reinterpret_cast<const char*>(data), size);
  zerith::HTTPHeaders fields;
  std::size_t start = 0;
  while (start < input.size()) {
    const std::size_t end = input.find('\n', start);
    const std::size_t stop = end == std::string_view::npos ? input.size() : end + 1;
    zerith::parseResponseHeadLine(input.substr(start, stop - start), fields);
    start = stop;
  }
  for (const auto& [name, value] : fields) {
    if (name.empty() || name.find_first_of("\r\n \t") != std::string_view::npos ||
        value.find_first_of(std::string_view("\r\n\0", 3)) != std::string_view::npos) {
      std::abort();
    }
  }
  return 0;
}
