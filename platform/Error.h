#pragma once

// An error object as completions carry it: a domain, an integer code and a
// localised description. Runtime paths report failures with these (or a
// nil/false result) instead of throwing across an interface.

#include <cstdint>
#include <string>

#include "platform/Value.h"

namespace zerith {

struct Error {
  std::string domain;
  std::int64_t code = 0;
  std::string description;

  bool operator==(const Error&) const = default;

  // {"domain": ..., "code": ..., "description": ...} for the wire, and back.
  Value toValue() const {
    return Value(Dictionary{{"domain", domain}, {"code", Value(static_cast<long long>(code))}, {"description", description}});
  }
  static Error fromValue(const Value& v) {
    return Error{v["domain"].string() ? *v["domain"].string() : std::string(), v["code"].intValue(),
                 v["description"].string() ? *v["description"].string() : std::string()};
  }
};

}  // namespace zerith
