#include "platform/DefaultsKeys.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdlib>

#include <fmt/format.h>

#include "platform/Defaults.h"
#include "platform/Spelling.h"

namespace zerith {

namespace {

std::vector<std::string_view> domainNames() {
  std::vector<std::string_view> names;
  for (const DefaultsSetting& s : kDefaultsSettings) {
    if (std::find(names.begin(), names.end(), s.domain) == names.end()) {
      names.push_back(s.domain);
    }
  }
  return names;
}

std::vector<std::string_view> keysOf(std::string_view domain) {
  std::vector<std::string_view> keys;
  for (const DefaultsSetting& s : kDefaultsSettings) {
    if (s.domain == domain) {
      keys.push_back(s.key);
    }
  }
  return keys;
}

const DefaultsSetting* find(std::string_view domain, std::string_view key) {
  const auto it = std::find_if(kDefaultsSettings.begin(), kDefaultsSettings.end(),
                               [&](const DefaultsSetting& s) { return s.domain == domain && s.key == key; });
  return it == kDefaultsSettings.end() ? nullptr : &*it;
}

std::string didYouMean(const std::optional<std::string>& nearest) {
  return nearest ? " (did you mean \"" + *nearest + "\"?)" : "";
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::tolower(static_cast<unsigned char>(x)) == std::tolower(static_cast<unsigned char>(y));
         });
}

}  // namespace

std::optional<bool> defaultsBoolean(const DefaultsSetting& setting, const Value& value, std::string* problem) {
  (void)setting;
  if (value.isNil()) {
    return std::nullopt;
  }
  if (value.isBool()) {
    return value.boolValue();
  }
  if (value.isNumber() && (value.doubleValue() == 0 || value.doubleValue() == 1)) {
    return value.doubleValue() == 1;
  }
  if (const std::string* text = value.string()) {
    for (const char* yes : {"true", "yes", "1"}) {
      if (equalsIgnoringCase(*text, yes)) {
        return true;
      }
    }
    for (const char* no : {"false", "no", "0"}) {
      if (equalsIgnoringCase(*text, no)) {
        return false;
      }
    }
    *problem = fmt::format("holds '{}', not a boolean", *text);
    return std::nullopt;
  }
  *problem = fmt::format("holds {} {}, not a boolean", value.kindName(), value.description());
  return std::nullopt;
}

std::optional<double> defaultsNumber(const DefaultsSetting& setting, const Value& value, std::string* problem) {
  if (value.isNil()) {
    return std::nullopt;
  }
  double d = 0;
  if (value.isNumber()) {
    d = value.doubleValue();
  } else if (const std::string* text = value.string()) {
    char* end = nullptr;
    errno = 0;
    d = std::strtod(text->c_str(), &end);
    if (text->empty() || *end != '\0' || errno != 0) {
      *problem = fmt::format("holds '{}', not a number", *text);
      return std::nullopt;
    }
  } else {
    *problem = fmt::format("holds {}, not a number", value.kindName());
    return std::nullopt;
  }
  if (!std::isfinite(d) || d < setting.low || d > setting.high) {
    *problem = fmt::format("is {}, outside {} to {}", d, setting.low, setting.high);
    return std::nullopt;
  }
  if (setting.kind == DK::Integer && d != std::floor(d)) {
    *problem = fmt::format("is {}, not a whole number", d);
    return std::nullopt;
  }
  return d;
}

std::optional<std::string> defaultsValueProblem(const DefaultsSetting& setting, const Value& value) {
  std::string problem;
  switch (setting.kind) {
    case DK::Boolean: defaultsBoolean(setting, value, &problem); break;
    case DK::Number:
    case DK::Integer: defaultsNumber(setting, value, &problem); break;
    case DK::String:
      // Readers take a number or a boolean as its text.
      if (!value.isNil() && !value.scalarText()) {
        problem = fmt::format("holds {}, not a string", value.kindName());
      }
      break;
  }
  return problem.empty() ? std::nullopt : std::optional<std::string>(problem);
}

std::optional<std::string> unreadDefaultsKey(std::string_view domain, std::string_view key) {
  const std::vector<std::string_view> keys = keysOf(domain);
  if (keys.empty() || find(domain, key) ||
      (domain == kZerithDomain && std::any_of(kDaemonMadeKeyPrefixes.begin(), kDaemonMadeKeyPrefixes.end(),
                                              [key](std::string_view p) { return key.starts_with(p); }))) {
    return std::nullopt;
  }
  return "zerithd does not read \"" + std::string(key) + "\" in " + std::string(domain) +
         didYouMean(nearestSpelling(key, keys));
}

std::optional<std::string> unreadDefaultsDomain(std::string_view domain) {
  const std::vector<std::string_view> names = domainNames();
  if (std::find(names.begin(), names.end(), domain) != names.end()) {
    return std::nullopt;
  }
  return "zerithd reads no domain " + std::string(domain) + didYouMean(nearestSpelling(domain, names));
}

std::vector<std::string> defaultsDomainProblems(std::string_view domain) {
  std::vector<std::string> problems;
  const Value values = Defaults(std::string(domain)).dictionary();
  if (const Dictionary* dict = values.dict()) {
    for (const auto& [key, value] : dict->entries()) {
      if (auto why = unreadDefaultsKey(domain, key)) {
        problems.push_back(*why + "; it is ignored");
      } else if (const DefaultsSetting* setting = find(domain, key)) {
        if (auto problem = defaultsValueProblem(*setting, value)) {
          problems.push_back(fmt::format("\"{}\" in {} {}; zerithd does not use this value", key, domain, *problem));
        }
      }
    }
  }
  return problems;
}

}  // namespace zerith
