#pragma once

// Value <-> JSON through nlohmann-json. Kept apart from Value.h so that code
// that never writes JSON does not pay for the header.

#include <nlohmann/json.hpp>

#include "platform/Value.h"

namespace zerith::json {

// Data becomes base64 text, a date its seconds since 1970, nil null.
// Dictionaries keep their order (nlohmann::ordered_json).
nlohmann::ordered_json toJson(const Value& value);
Value fromJson(const nlohmann::ordered_json& json);

// Compact ("{\"a\":1}") or pretty (four-space indent) text.
std::string serialize(const Value& value, bool pretty = false);

}  // namespace zerith::json
