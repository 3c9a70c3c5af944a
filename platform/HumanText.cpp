#include "platform/HumanText.h"

#include <algorithm>
#include <cmath>
#include <iterator>

#include <fmt/format.h>

namespace zerith {

std::string describeDuration(double seconds) {
  const auto s = static_cast<std::int64_t>(std::max(0.0, std::floor(seconds)));
  if (s < 60) {
    return fmt::format("{} s", s);
  }
  if (s < 3600) {
    return fmt::format("{} min", s / 60);
  }
  if (s < 86400) {
    return s % 3600 >= 60 ? fmt::format("{} h {} min", s / 3600, s % 3600 / 60) : fmt::format("{} h", s / 3600);
  }
  return s % 86400 >= 3600 ? fmt::format("{} d {} h", s / 86400, s % 86400 / 3600) : fmt::format("{} d", s / 86400);
}

std::string describeByteCount(std::uint64_t bytes) {
  if (bytes < 1024) {
    return fmt::format("{} B", bytes);
  }
  constexpr const char* kUnits[] = {"KiB", "MiB", "GiB", "TiB"};
  double value = static_cast<double>(bytes) / 1024;
  std::size_t unit = 0;
  while (value >= 1024 && unit + 1 < std::size(kUnits)) {
    value /= 1024;
    ++unit;
  }
  return fmt::format("{:.1f} {}", value, kUnits[unit]);
}

}  // namespace zerith
