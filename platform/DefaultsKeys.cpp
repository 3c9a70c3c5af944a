#include "platform/DefaultsKeys.h"

#include <algorithm>
#include <array>

#include "platform/Defaults.h"
#include "platform/Spelling.h"

namespace zerith {

namespace {

struct Domain {
  std::string_view name;
  std::vector<std::string_view> keys;
  // Keys the daemon makes itself, by their start (storebag metrics, client
  // identifiers).
  std::vector<std::string_view> prefixes;
};

const std::array<Domain, 3>& domains() {
  static const std::array<Domain, 3> table = {{
      {"com.velmar.zerith",
       {"environmentType", "httpsPostURL", "httpsRealtimePostURL", "forceEventLogging", "zerith_storebag_url",
        "storebag_require_issue_time", "maxConnections", "maxConnectionsPerUser", "postsInFlightPerBackend",
        "postsWaitingPerBackend", "spoolEnabled", "spoolMaxBytes", "spoolMaxAgeSeconds", "spoolRetryInitialSeconds",
        "spoolRetryMaxSeconds", "spoolCommitIntervalSeconds", "uploadTimeoutSeconds", "uploadsAtOnce",
        "uploadsPerClient", "PersistentIdentifier", "PersistentIdentifierForDNU"},
       {"CACHED_", "uuid:"}},
      {"com.velmar.zerith.consent", {"DiagnosticsSubmissionAllowed"}, {}},
      {"com.velmar.timed", {"AutomaticTimeZoneEnabled"}, {}},
  }};
  return table;
}

const Domain* find(std::string_view name) {
  const auto& all = domains();
  const auto it = std::find_if(all.begin(), all.end(), [name](const Domain& d) { return d.name == name; });
  return it == all.end() ? nullptr : &*it;
}

std::string didYouMean(const std::optional<std::string>& nearest) {
  return nearest ? " (did you mean \"" + *nearest + "\"?)" : "";
}

}  // namespace

std::optional<std::string> unreadDefaultsKey(std::string_view domain, std::string_view key) {
  const Domain* d = find(domain);
  if (!d || std::find(d->keys.begin(), d->keys.end(), key) != d->keys.end() ||
      std::any_of(d->prefixes.begin(), d->prefixes.end(), [key](std::string_view p) { return key.starts_with(p); })) {
    return std::nullopt;
  }
  return "zerithd does not read \"" + std::string(key) + "\" in " + std::string(domain) +
         didYouMean(nearestSpelling(key, d->keys));
}

std::optional<std::string> unreadDefaultsDomain(std::string_view domain) {
  if (find(domain)) {
    return std::nullopt;
  }
  std::vector<std::string_view> names;
  for (const Domain& d : domains()) {
    names.push_back(d.name);
  }
  return "zerithd reads no domain " + std::string(domain) + didYouMean(nearestSpelling(domain, names));
}

std::vector<std::string> unreadDefaultsKeys(std::string_view domain) {
  std::vector<std::string> unread;
  const Value values = Defaults(std::string(domain)).dictionary();
  if (const Dictionary* dict = values.dict()) {
    for (const auto& [key, value] : dict->entries()) {
      if (auto why = unreadDefaultsKey(domain, key)) {
        unread.push_back(std::move(*why));
      }
    }
  }
  return unread;
}

}  // namespace zerith
