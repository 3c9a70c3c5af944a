#pragma once

// Small helpers the HTTPS backend's source files share: internal to the
// backend, not part of its interface.

#include <algorithm>
#include <cctype>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace zerith::https_post_detail {

// Keys a record gains beyond its payload: the sixteen completeRecord sets
// and the four a session's stop message carries.
constexpr std::size_t kRecordKeys = 16;
constexpr std::size_t kStopMessageKeys = 4;

inline bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](unsigned char x, unsigned char y) {
           return std::tolower(x) == std::tolower(y);
         });
}

inline std::optional<std::string> stringOf(const Value& v) {
  if (const std::string* s = v.string()) {
    return *s;
  }
  return std::nullopt;
}

// "%@" of an optional object: nil prints as "(null)".
inline std::string orNull(const std::optional<std::string>& s) { return s ? *s : "(null)"; }

inline std::optional<std::int64_t> recordInteger(const Dictionary& record, std::string_view key) {
  if (const Value* v = record.find(key)) {
    return v->intValue();
  }
  return std::nullopt;
}

}  // namespace zerith::https_post_detail
