// The HTTPS backend's storebag-driven state: its client entry decides the
// reporting state, the post URLs, the event lists and the filters applied
// to each record.

#include "backends/HTTPSPostBackend.h"
#include "backends/BackendsLog.h"
#include "backends/HTTPSPostBackendHelpers.h"

#include <algorithm>
#include <cctype>
#include <cstdint>
#include <mutex>
#include <utility>

#include <fmt/format.h>

#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "config/Identifiers.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "zerith/Zerith.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

using https_post_detail::equalsIgnoringCase;
using https_post_detail::orNull;
using https_post_detail::recordInteger;
using https_post_detail::stringOf;

namespace {

std::string lowered(std::string_view s) {
  std::string out(s);
  std::transform(out.begin(), out.end(), out.begin(), [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return out;
}

bool containsIgnoringCase(std::string_view haystack, std::string_view needle) {
  return lowered(haystack).find(lowered(needle)) != std::string::npos;
}

std::vector<std::string> split(std::string_view text, char separator) {
  std::vector<std::string> pieces;
  while (true) {
    const auto at = text.find(separator);
    pieces.emplace_back(text.substr(0, at));
    if (at == std::string_view::npos) {
      return pieces;
    }
    text.remove_prefix(at + 1);
  }
}

// A comma-separated name list of a client entry as a list Value.
Value nameList(const Value& client, std::string_view key) {
  const Value names = client[key];
  if (names.isNil()) {
    return {};
  }
  Array list;
  if (const std::string* s = names.string()) {
    for (auto& piece : split(*s, ',')) {
      list.emplace_back(std::move(piece));
    }
  } else {
    backendsLogger().error("HTTPSPostBackend(updateBackendState): \"{}\" holds {}, not a string of names", key,
                   names.kindName());
    list.emplace_back(std::string());  // matches no name: the entry is not ours
  }
  return Value(std::move(list));
}

// A number-valued profile key; a value of another kind is logged and read
// as absent.
Value numberOf(const Value& client, std::string_view key) {
  const Value v = client[key];
  if (v.isNil() || v.isNumber() || v.isBool()) {
    return v;
  }
  backendsLogger().error("HTTPSPostBackend(updateBackendState): \"{}\" holds {}, not a number; ignored", key, v.kindName());
  return {};
}

// A list-valued profile key; another kind is logged and read as absent.
Value listOf(const Value& client, std::string_view key) {
  const Value v = client[key];
  if (v.isNil() || v.isArray()) {
    return v;
  }
  backendsLogger().error("HTTPSPostBackend(updateBackendState): \"{}\" holds {}, not a list; ignored", key, v.kindName());
  return {};
}

std::optional<std::string> stringKey(const Value& client, std::string_view key) {
  const Value v = client[key];
  if (v.isNil()) {
    return std::nullopt;
  }
  if (!v.isString()) {
    backendsLogger().error("HTTPSPostBackend(updateBackendState): \"{}\" holds {}, not a string; ignored", key, v.kindName());
    return std::nullopt;
  }
  return *v.string();
}

// An integer key clamped into 32 bits.
std::int32_t int32Of(const Value& v) {
  const std::int64_t i = v.intValue();
  return static_cast<std::int32_t>(std::clamp<std::int64_t>(i, INT32_MIN, INT32_MAX));
}

// The text a filter hashes for a value: strings as they are, scalars in
// their text form, anything else in its one-line description.
std::string hashableText(const Value& v) {
  if (const std::string* s = v.string()) {
    return *s;
  }
  if (auto text = v.scalarText()) {
    return *text;
  }
  return v.description();
}

}  // namespace

// ---------------------------------------------------------------------------
// Storebag-driven state and filters

namespace {

// An empty (or malformed) list lets everything through a whitelist and
// nothing through a blacklist; a missing value passes only a blacklist.
template <typename Matches>
bool matchWithList(const Value& list, const std::optional<std::string>& wholeString, bool whitelist, Matches matches) {
  if (list.count() == 0 || !list.isArray()) {
    return whitelist;
  }
  if (!wholeString) {
    return !whitelist;
  }
  for (const Value& element : *list.array()) {
    if (const std::string* s = element.string(); s && matches(*wholeString, *s)) {
      return true;
    }
  }
  return false;
}

}  // namespace

bool HTTPSPostBackend::matchExactStringWithList(const Value& list, const std::optional<std::string>& wholeString,
                                                bool whitelist) {
  return matchWithList(list, wholeString, whitelist,
                       [](const std::string& whole, const std::string& s) { return equalsIgnoringCase(s, whole); });
}

bool HTTPSPostBackend::matchStringWithList(const Value& list, const std::optional<std::string>& wholeString,
                                           bool whitelist) {
  return matchWithList(list, wholeString, whitelist,
                       [](const std::string& whole, const std::string& s) { return containsIgnoringCase(whole, s); });
}

bool HTTPSPostBackend::matchClientNameAndServiceID(const Value& client, const std::optional<std::string>& clientName,
                                                   const std::optional<std::string>& serviceID) const {
  if (!matchExactStringWithList(nameList(client, "client"), clientName, true)) {
    return false;
  }
  return matchStringWithList(nameList(client, "service"), serviceID, true);
}

bool HTTPSPostBackend::isFrameworkEnabledForClient(const Value& client) const {
  const auto since = stringKey(client, "enabledSince");
  if (!since) {
    return true;
  }
  const auto pieces = split(*since, '.');
  std::uint8_t wanted[3] = {0, 0, 0};
  for (std::size_t i = 0; i < 3 && i < pieces.size(); ++i) {
    wanted[i] = static_cast<std::uint8_t>(Value(pieces[i]).intValue());
  }
  const std::uint8_t have[3] = {selfVersionMajor(), selfVersionMiddle(), selfVersionMinor()};
  return std::lexicographical_compare(wanted, wanted + 3, have, have + 3) ||
         std::equal(wanted, wanted + 3, have);
}

bool HTTPSPostBackend::updatePostLink(const Value& client) {
  std::lock_guard lock(fieldsMutex_);
  Fields& f = fields_;
  bool taken = false;
  if (!(f.useDefaultPostURL && f.postURL)) {
    f.useDefaultPostURL = false;
    if (auto url = stringKey(client, "post_url")) {
      f.postURL = *url;
      backendsLogger().info("HTTPSPostBackend(updatePostLink): Storebag '{}' for postURL", *url);
      taken = true;
    }
  }
  if (!(f.useDefaultRealtimePostURL && f.realtimePostURL)) {
    f.useDefaultRealtimePostURL = false;
    f.realtimePostURL.reset();
    if (auto url = stringKey(client, "realtime_post_url")) {
      f.realtimePostURL = *url;
      backendsLogger().info("HTTPSPostBackend(updatePostLink): Storebag '{}' for realtimePostURL", *url);
    } else {
      f.realtimePostURL = f.postURL;
      backendsLogger().info("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '{}'", orNull(f.postURL));
    }
  }
  return taken;
}

void HTTPSPostBackend::resetBackendStateWithClient(const Value& client) {
  const std::int32_t threshold = int32Of(numberOf(client, "event_threshold"));
  const std::int32_t extras = int32Of(numberOf(client, "extras_on_internal"));
  {
    std::lock_guard lock(fieldsMutex_);
    fields_.eventThreshold = threshold;
    fields_.extrasOnInternal = extras;
  }
  backendsLogger().info("resetBackendStateWithClient: event_threshold set to {}", threshold);
  if (threshold < 0) {
    backendsLogger().error("resetBackendStateWithClient: event_threshold {} is negative: every batched event flushes the batch",
                   threshold);
  }
  backendsLogger().info("setBackendStateWithClient: extras on internal is set to {}", extras);
}

void HTTPSPostBackend::createFiltersFromArray(const Value& array) {
  if (!array.isArray() || array.count() == 0) {
    return;
  }
  auto filters = std::make_shared<std::vector<Filter>>();
  for (const Value& element : *array.array()) {
    Filter filter;
    if (!element.isDict()) {
      backendsLogger().error("HTTPSPostBackend(createFiltersFromArray): a filter is {}, not a dictionary; it keeps nothing",
                     element.kindName());
    }
    const Value method = element["method"];
    const Value status = element["status"];
    filter.method = method.isNil() ? -1 : int32Of(method);
    filter.status = status.isNil() ? -1 : int32Of(status);
    const auto action = stringOf(element["action"]);
    filter.action = action == "remove" ? kFilterRemove : (action == "sha256" ? kFilterSHA256 : kFilterKeep);
    if (action && filter.action == kFilterKeep) {
      backendsLogger().debug("HTTPSPostBackend(createFiltersFromArray): unknown filter action '{}' keeps its key", *action);
    }
    filter.key = stringOf(element["key"]).value_or(std::string());
    filters->push_back(std::move(filter));
  }
  std::lock_guard lock(fieldsMutex_);
  fields_.numberOfFilters = static_cast<std::int32_t>(filters->size());
  fields_.filters = std::move(filters);
}

void HTTPSPostBackend::filterEvent(Dictionary& event) const {
  std::shared_ptr<const std::vector<Filter>> filters;
  {
    std::lock_guard lock(fieldsMutex_);
    filters = fields_.filters;
  }
  if (filters->empty()) {
    return;
  }
  const std::int64_t method = recordInteger(event, "_method").value_or(0);
  const std::int64_t status = recordInteger(event, "_status").value_or(0);
  // The first filter that names an entry decides its fate; the entries are
  // changed after the scan, so only those that a filter acts on are named.
  std::vector<std::pair<std::string, std::int32_t>> actions;
  for (const auto& [key, value] : event) {
    for (const Filter& filter : *filters) {
      if (filter.key.empty() || !equalsIgnoringCase(filter.key, key) || (filter.method != -1 && filter.method != method) ||
          (filter.status != -1 && filter.status != status)) {
        continue;
      }
      if (filter.action == kFilterSHA256 || filter.action == kFilterRemove) {
        actions.emplace_back(key, filter.action);
      }
      break;
    }
  }
  for (const auto& [key, action] : actions) {
    if (action == kFilterSHA256) {
      event.set(key, Value(convertIntoSHA256(hashableText(event.get(key)))));
    } else {
      event.erase(key);
    }
  }
}

void HTTPSPostBackend::updateState() { setState(updateBackendState()); }

std::int32_t HTTPSPostBackend::updateBackendState() {
  if (isImmutable()) {
    return state();
  }
  disabledBySampling_.store(false);
  // The override value is only taken when the draw is not below the
  // threshold; every other outcome (an earlier return, a plain or
  // per-country threshold that enables) leaves none, reported as -1.
  {
    std::lock_guard lock(fieldsMutex_);
    fields_.overrideSampling = Value();
  }
  const Value clients = profile()["clients"];
  if (!clients.isArray()) {
    if (!clients.isNil()) {
      backendsLogger().error("HTTPSPostBackend(updateBackendState): \"clients\" holds {}, not a list", clients.kindName());
    }
    return kBackendStateDisabled;
  }
  const Value userInfo = userInfoDict();
  const auto clientName = stringOf(userInfo[kZerithUserInfoClientName]);
  const auto serviceName = stringOf(userInfo[kZerithUserInfoServiceName]);

  std::vector<Value> entries;
  for (const Value& entry : *clients.array()) {
    if (entry.isDict()) {
      entries.push_back(entry);
    } else {
      backendsLogger().error("HTTPSPostBackend(updateBackendState): a client entry is {}, not a dictionary; skipped",
                     entry.kindName());
    }
  }

  for (const Value& entry : entries) {
    if (matchClientNameAndServiceID(entry, clientName, serviceName)) {
      const Value expedite = numberOf(entry, "expedite");
      if (!expedite.isNil()) {
        const bool batch = expedite.intValue() == 0;
        setBatchEvents(batch);
        backendsLogger().debug("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent={}", batch ? 1 : 0);
      }
      break;
    }
  }

  if (!requireUserInfo()) {
    for (const Value& entry : entries) {
      if (updatePostLink(entry)) {
        resetBackendStateWithClient(entry);
        break;
      }
    }
    return kBackendStateEnabled;
  }
  if (userInfo.count() == 0) {
    return kBackendStateUndecided;
  }

  const auto country = localeCountryCode();
  for (const Value& entry : entries) {
    if (!matchClientNameAndServiceID(entry, clientName, serviceName) || !isFrameworkEnabledForClient(entry)) {
      continue;
    }
    bool dnuEnabled;
    {
      std::lock_guard lock(fieldsMutex_);
      dnuEnabled = fields_.dnuEnabled;
    }
    const Value overrideDnu = numberOf(entry, "override_dnu");
    std::int32_t dnuType;
    if (overrideDnu.isNil() || overrideDnu.intValue() != 1) {
      dnuType = 0;
    } else {
      dnuType = dnuEnabled ? 2 : 1;
    }
    {
      std::lock_guard lock(fieldsMutex_);
      fields_.dnuType = dnuType;
    }
    if (dnuType == 0 && !dnuEnabled) {
      backendsLogger().debug("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: {}.", overrideDnu.intValue());
      return kBackendStateDisabled;
    }
    const Value locales = listOf(entry, "locale_whitelist");
    if (!matchStringWithList(locales, country, false)) {
      backendsLogger().debug("HTTPSPostBackend(updateBackendState): ({}) isn't in country code list {}", orNull(country),
                     locales.description());
      return kBackendStateDisabled;
    }
    const Value deviceWhitelist = listOf(entry, "device_whitelist");
    if (!matchStringWithList(deviceWhitelist, productFamily(), true)) {
      backendsLogger().debug("HTTPSPostBackend(updateBackendState): ({}) isn't in device whitelist {}", orNull(productFamily()),
                     deviceWhitelist.description());
      return kBackendStateDisabled;
    }
    const Value deviceBlacklist = listOf(entry, "device_blacklist");
    if (matchStringWithList(deviceBlacklist, hardwareType(), false)) {
      backendsLogger().debug("HTTPSPostBackend(updateBackendState): ({}) is in device blacklist {}", orNull(hardwareType()),
                     deviceBlacklist.description());
      return kBackendStateDisabled;
    }
    const Value filters = listOf(entry, "filters");
    if (filters.isNil()) {
      backendsLogger().error("HTTPSPostBackend(updateBackendState): filters are required.");
      return kBackendStateDisabled;
    }
    createFiltersFromArray(filters);

    Value threshold = numberOf(entry, "sampling_threshold");
    const Value perCountryRules = listOf(entry, "per_country_sampling_thresholds");
    if (const Array* perCountry = perCountryRules.array(); perCountry && country) {
      for (const Value& rule : *perCountry) {
        const Value countryList = rule["country"];
        const Array* countries = countryList.array();
        if (!countries || std::none_of(countries->begin(), countries->end(), [&](const Value& c) {
              return c.string() && *c.string() == *country;
            })) {
          continue;
        }
        const Value replacement = numberOf(rule, "threshold");
        backendsLogger().info("HTTPSPostBackend(updateBackendState): sampling threshold for {} changed from {:.2f} to {:.2f}",
                      *country, static_cast<float>(threshold.doubleValue()),
                      static_cast<float>(replacement.doubleValue()));
        threshold = replacement;
        break;
      }
    }
    setSamplingThreshold(threshold);

    const double factor = samplingFactor();
    std::int32_t result;
    Value overrideSampling;
    if (!threshold.isNil() && factor >= threshold.doubleValue()) {
      overrideSampling = numberOf(entry, "override_sampling");
      std::lock_guard lock(fieldsMutex_);
      fields_.overrideSampling = overrideSampling;
    }
    if (threshold.isNil()) {
      result = kBackendStateDisabled;
    } else if (factor < threshold.doubleValue()) {
      result = kBackendStateEnabled;
    } else if (overrideSampling.isNil()) {
      result = kBackendStateSampledOut;
    } else if (factor >= overrideSampling.doubleValue()) {
      result = kBackendStateDisabled;
    } else {
      result = kBackendStateSampledOut;
    }
    // Whether the draw, not a rule, kept this device from reporting: what
    // it drops then counts as sampled out.
    disabledBySampling_.store(result == kBackendStateDisabled && !threshold.isNil());

    resetBackendStateWithClient(entry);
    if (auto custom = stringKey(entry, "custom_clientId")) {
      std::lock_guard lock(fieldsMutex_);
      fields_.uuidCustom = *custom;
    }
    backendsLogger().info("HTTPSPostBackend(updateBackendState): {}: client found {}:{}, state={}, samplingFactor={:f}", name(),
                  orNull(clientName), orNull(serviceName), result, factor);

    updatePostLink(entry);
    if (const Value whitelist = listOf(entry, "event_whitelist"); !whitelist.isNil()) {
      setEventWhitelist(whitelist);
      backendsLogger().info("HTTPSPostBackend(updateBackendState): {}: eventWhitelist={}", name(), whitelist.description());
    }
    if (const Value blacklist = listOf(entry, "event_blacklist"); !blacklist.isNil()) {
      setEventBlacklist(blacklist);
      backendsLogger().info("HTTPSPostBackend(updateBackendState): {}: eventBlacklist={}", name(), blacklist.description());
    }
    setShouldUseWiFiOnly(numberOf(entry, "use_wifi_only").intValue() != 0);
    return result;
  }
  return kBackendStateDisabled;
}

}  // namespace zerith
