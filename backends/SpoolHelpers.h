#pragma once

// Small helpers the spool's source files share: internal to the spool, not
// part of its interface.

#include <chrono>
#include <cstdint>

namespace zerith::spool_detail {

inline std::int64_t wallMillis() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::system_clock::now().time_since_epoch())
      .count();
}

}  // namespace zerith::spool_detail
