#pragma once

// Value <-> JSON through nlohmann-json. Kept apart from Value.h so that code
// that never writes JSON does not pay for the header.

#include <nlohmann/json.hpp>

#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace zerith::json {

// Data becomes base64 text, a date its seconds since 1970, nil null.
// Dictionaries keep their order (nlohmann::ordered_json).
nlohmann::ordered_json toJson(const Value& value);
Value fromJson(const nlohmann::ordered_json& json);

// Compact ("{\"a\":1}") or pretty (four-space indent) text.
std::string serialize(const Value& value, bool pretty = false);

// The deepest nesting of arrays and objects in JSON-like text, counting
// brackets outside strings; stops counting once it passes `limit`.
std::size_t nestingDepth(std::string_view text, std::size_t limit);

// As deep as a socket frame may nest its values.
inline constexpr std::size_t kMaxValueDepth = 32;

// JSON text from a caller (a payload, a command line, a script line) as a
// value: nullopt with the reason when it is not JSON or nests deeper than
// `maxDepth`, which is checked before the text is parsed, so that neither
// the parser nor the conversion goes deeper than that.
std::optional<Value> parseValue(std::string_view text, std::string* why = nullptr,
                                std::size_t maxDepth = kMaxValueDepth);

}  // namespace zerith::json
