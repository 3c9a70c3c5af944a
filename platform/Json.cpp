#include "platform/Json.h"

#include <algorithm>
#include <cmath>

#include "platform/Crypto.h"

namespace zerith::json {

nlohmann::ordered_json toJson(const Value& value) {
  switch (value.type()) {
    case Value::Type::Nil: return nullptr;
    case Value::Type::Bool: return value.boolValue();
    case Value::Type::Int: return value.intValue();
    case Value::Type::UInt: return value.unsignedValue();
    case Value::Type::Real: {
      const double d = value.doubleValue();
      // JSON has no NaN or infinity; callers sanitise first, this is the last guard.
      return std::isfinite(d) ? nlohmann::ordered_json(d) : nlohmann::ordered_json(nullptr);
    }
    case Value::Type::String: return *value.string();
    case Value::Type::Data: return crypto::base64Encode(*value.data());
    case Value::Type::Date: return value.date()->secondsSince1970;
    case Value::Type::Array: {
      auto out = nlohmann::ordered_json::array();
      for (const auto& e : *value.array()) {
        out.push_back(toJson(e));
      }
      return out;
    }
    case Value::Type::Dict: {
      auto out = nlohmann::ordered_json::object();
      for (const auto& [k, e] : *value.dict()) {
        out[k] = toJson(e);
      }
      return out;
    }
  }
  return nullptr;
}

Value fromJson(const nlohmann::ordered_json& j) {
  switch (j.type()) {
    case nlohmann::json::value_t::boolean: return Value(j.get<bool>());
    case nlohmann::json::value_t::number_integer: return Value(j.get<long long>());
    case nlohmann::json::value_t::number_unsigned: return Value(j.get<unsigned long long>());
    case nlohmann::json::value_t::number_float: return Value(j.get<double>());
    case nlohmann::json::value_t::string: return Value(j.get<std::string>());
    case nlohmann::json::value_t::array: {
      Array out;
      for (const auto& e : j) {
        out.push_back(fromJson(e));
      }
      return Value(std::move(out));
    }
    case nlohmann::json::value_t::object: {
      Dictionary out;
      for (const auto& [k, e] : j.items()) {
        out.set(k, fromJson(e));
      }
      return Value(std::move(out));
    }
    default: return {};
  }
}

std::string serialize(const Value& value, bool pretty) {
  return pretty ? toJson(value).dump(4) : toJson(value).dump();
}

std::size_t nestingDepth(std::string_view text, std::size_t limit) {
  std::size_t depth = 0;
  std::size_t deepest = 0;
  bool inString = false;
  bool escaped = false;
  for (const char c : text) {
    if (inString) {
      if (escaped) {
        escaped = false;
      } else if (c == '\\') {
        escaped = true;
      } else if (c == '"') {
        inString = false;
      }
      continue;
    }
    if (c == '"') {
      inString = true;
    } else if (c == '[' || c == '{') {
      deepest = std::max(deepest, ++depth);
      if (deepest > limit) {
        return deepest;
      }
    } else if ((c == ']' || c == '}') && depth > 0) {
      --depth;
    }
  }
  return deepest;
}

std::optional<Value> parseValue(std::string_view text, std::string* why, std::size_t maxDepth) {
  const auto refuse = [why](std::string reason) -> std::optional<Value> {
    if (why) {
      *why = std::move(reason);
    }
    return std::nullopt;
  };
  if (nestingDepth(text, maxDepth) > maxDepth) {
    return refuse("nests deeper than " + std::to_string(maxDepth) + " levels");
  }
  const auto parsed = nlohmann::ordered_json::parse(text, nullptr, /*allow_exceptions=*/false);
  if (parsed.is_discarded()) {
    return refuse("is not valid JSON");
  }
  return fromJson(parsed);
}

}  // namespace zerith::json
