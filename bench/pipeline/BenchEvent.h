#pragma once

// The benchmark's event: ten keys, about 300 bytes of JSON, the same
// content for both pipelines. "zid" identifies it (client and sequence
// number folded into one dense range) so that the collector can tell a lost
// or doubled event.

#include <cstdint>
#include <string>

#include "platform/Value.h"

namespace zerith::bench {

inline constexpr std::uint16_t kEventCategory = 42;
inline constexpr std::uint16_t kEventType = 7;

// The payload dictionary (for the client framework).
Value eventPayload(std::uint64_t id);
// The same payload as one line of compact JSON ending in '\n' (for the
// peer's stream socket).
std::string eventJsonLine(std::uint64_t id);

}  // namespace zerith::bench
