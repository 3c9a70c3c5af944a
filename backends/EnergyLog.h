#pragma once

// The energy log: registered events with a category number, an event name
// and a dictionary. Under systemd (JOURNAL_STREAM set) an event is one
// journal entry with the fields ZERITH_ENERGY_CATEGORY, ZERITH_ENERGY_EVENT
// and ZERITH_ENERGY_PAYLOAD (the dictionary as JSON); otherwise, or when the
// journal refuses it, it is one JSON line
//   {"time":<seconds since 1970>,"category":28,"event":"...","payload":{...}}
// appended (one write, O_APPEND) to <root>/var/log/zerithd/energy.log.

#include <cstdint>
#include <filesystem>
#include <string_view>

#include "platform/Value.h"

namespace zerith::energy {

std::filesystem::path localLogPath();

// False when the event could be written nowhere (logged).
bool logRegisteredEvent(std::uint32_t category, std::string_view eventName, const Value& payload);

}  // namespace zerith::energy
