#pragma once

// Durations and sizes as the operator's tools print them.

#include <cstdint>
#include <string>

namespace zerith {

// "45 s", "12 min", "2 h 5 min", "3 d 4 h"; a negative duration is "0 s".
std::string describeDuration(double seconds);

// "512 B", "1.2 KiB", "64.0 MiB".
std::string describeByteCount(std::uint64_t bytes);

}  // namespace zerith
