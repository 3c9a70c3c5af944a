#include "config/Identifiers.h"

#include <fmt/format.h>

#include <algorithm>
#include <cctype>
#include <mutex>

#include "config/ClientTypes.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "config/ConfigLog.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

namespace {

std::string lowercased(std::string s) {
  std::transform(s.begin(), s.end(), s.begin(),
                 [](char c) { return static_cast<char>(std::tolower(static_cast<unsigned char>(c))); });
  return s;
}

}  // namespace

std::string getPersistentIdentifierForCustomClientIDSuffix(const std::optional<std::string>& first,
                                                           const std::optional<std::string>& second) {
  const std::string key = fmt::format("uuid:{}:{}", first.value_or(""), second.value_or(""));
  const Defaults defaults(kZerithDefaultsDomain);
  // Two sessions asking for a new key at once must both get the one that
  // is stored.
  static std::mutex creation;
  std::lock_guard lock(creation);
  std::string value;
  if (const Value stored = defaults.objectForKey(key); stored.isString()) {
    value = *stored.string();
  } else {
    value = crypto::newUUIDString();
    defaults.setObject(key, Value(value));
  }
  configLogger().info("getPersistentIdentifierForCustomClientIDSuffix: The value for {}: {}", key, value);
  return value;
}

std::optional<std::string> defaultsStringForKey(std::string_view key) {
  return Defaults(kZerithDefaultsDomain).objectForKey(key).scalarText();
}

std::string clientServiceKey(const Value& userInfo) {
  const auto field = [&](const char* key) {
    const Value value = userInfo[key];
    const std::string* s = value.string();
    return s ? lowercased(*s) : std::string();
  };
  return fmt::format("{}:{}", field(kZerithUserInfoClientName), field(kZerithUserInfoServiceName));
}

}  // namespace zerith
