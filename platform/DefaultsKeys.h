#pragma once

// The defaults settings that zerithd and its client framework read: one
// table of every key, by domain, with the kind of value it takes and, for a
// number, the range the readers accept. The readers take their keys from it
// (defaultsSetting("spoolMaxBytes") does not compile for a key the table
// lacks) and parse values with the functions below, so every number setting
// takes the same forms and every refusal reads alike.
//
// The same table says which names nobody reads: a misspelt domain or key is
// otherwise ignored without a word, and the setting it was meant to make
// never takes effect. zerith-defaults warns when it writes one and checks a
// whole domain; the daemon logs its own domain's problems when it starts.

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Value.h"

namespace zerith {

inline constexpr std::string_view kZerithDomain = "com.velmar.zerith";
inline constexpr std::string_view kConsentDomain = "com.velmar.zerith.consent";
inline constexpr std::string_view kTimedDomain = "com.velmar.timed";

struct DefaultsSetting {
  enum class Kind {
    Boolean,  // true or false; also 0 or 1, and "true", "yes", "1", "false", "no", "0" in any case
    Number,   // a number within [low, high], or a string that holds one
    Integer,  // the same, and whole
    String,
  };
  std::string_view domain;
  std::string_view key;
  Kind kind;
  double low = 0;
  double high = 0;
};

using DK = DefaultsSetting::Kind;

inline constexpr std::array kDefaultsSettings = {
    // Where and how events are posted.
    DefaultsSetting{kZerithDomain, "environmentType", DK::Integer, 0, 4},
    DefaultsSetting{kZerithDomain, "httpsPostURL", DK::String},
    DefaultsSetting{kZerithDomain, "httpsRealtimePostURL", DK::String},
    DefaultsSetting{kZerithDomain, "forceEventLogging", DK::Boolean},
    DefaultsSetting{kZerithDomain, "postsInFlightPerBackend", DK::Integer, 1, 4096},
    DefaultsSetting{kZerithDomain, "postsWaitingPerBackend", DK::Integer, 0, 65536},
    // Storebags.
    DefaultsSetting{kZerithDomain, "zerith_storebag_url", DK::String},
    DefaultsSetting{kZerithDomain, "storebag_require_issue_time", DK::Boolean},
    // Client connections (further capped by the descriptor limit).
    DefaultsSetting{kZerithDomain, "maxConnections", DK::Integer, 1, 1 << 30},
    DefaultsSetting{kZerithDomain, "maxConnectionsPerUser", DK::Integer, 1, 1 << 30},
    // The spool.
    DefaultsSetting{kZerithDomain, "spoolEnabled", DK::Boolean},
    DefaultsSetting{kZerithDomain, "spoolMaxBytes", DK::Integer, 4096, 1099511627776.0},
    DefaultsSetting{kZerithDomain, "spoolMaxAgeSeconds", DK::Integer, 1, 365.0 * 24 * 3600},
    DefaultsSetting{kZerithDomain, "spoolRetryInitialSeconds", DK::Number, 0.01, 3600},
    DefaultsSetting{kZerithDomain, "spoolRetryMaxSeconds", DK::Number, 0.01, 86400},
    DefaultsSetting{kZerithDomain, "spoolCommitIntervalSeconds", DK::Number, 0, 1},
    // Uploads.
    DefaultsSetting{kZerithDomain, "uploadTimeoutSeconds", DK::Number, 0.1, 3600},
    DefaultsSetting{kZerithDomain, "uploadsAtOnce", DK::Integer, 1, 64},
    DefaultsSetting{kZerithDomain, "uploadsPerClient", DK::Integer, 1, 64},
    // Written by the framework itself.
    DefaultsSetting{kZerithDomain, "PersistentIdentifier", DK::String},
    DefaultsSetting{kZerithDomain, "PersistentIdentifierForDNU", DK::String},
    // Other components' domains that zerithd reads.
    DefaultsSetting{kConsentDomain, "DiagnosticsSubmissionAllowed", DK::Boolean},
    DefaultsSetting{kTimedDomain, "AutomaticTimeZoneEnabled", DK::Boolean},
};

// Keys the daemon makes itself in its own domain, by their start (storebag
// metrics "CACHED_<name>_max-age", client identifiers "uuid:<client>").
inline constexpr std::array<std::string_view, 2> kDaemonMadeKeyPrefixes = {"CACHED_", "uuid:"};

// The setting of `key` in com.velmar.zerith (or `domain`). Evaluated while
// compiling: a key the table lacks is a compile error, not a reader that the
// checks below would call unread.
consteval const DefaultsSetting& defaultsSetting(std::string_view key, std::string_view domain = kZerithDomain) {
  for (const DefaultsSetting& s : kDefaultsSettings) {
    if (s.key == key && s.domain == domain) {
      return s;
    }
  }
  throw "not a setting of the defaults table";
}

// A Boolean setting's value; nullopt with `problem` ("holds 'maybe', not a
// boolean") for anything else. A nil value is nullopt without a problem.
std::optional<bool> defaultsBoolean(const DefaultsSetting& setting, const Value& value, std::string* problem);
// A Number or Integer setting's value; nullopt with `problem` ("holds
// 'fast', not a number", "is 0, outside 1 to 64", "is 2.5, not a whole
// number") otherwise. A nil value is nullopt without a problem.
std::optional<double> defaultsNumber(const DefaultsSetting& setting, const Value& value, std::string* problem);
// Whether `value` is one the readers of `setting` take; the problem otherwise.
std::optional<std::string> defaultsValueProblem(const DefaultsSetting& setting, const Value& value);

// nullopt when `key` is read in `domain` (or `domain` is not one of the
// daemon's); otherwise what to tell the operator: "zerithd does not read
// \"spoolEnbled\" in com.velmar.zerith (did you mean \"spoolEnabled\"?)".
std::optional<std::string> unreadDefaultsKey(std::string_view domain, std::string_view key);

// nullopt for a domain the daemon or the framework reads; otherwise what to
// tell the operator, with the nearest such domain.
std::optional<std::string> unreadDefaultsDomain(std::string_view domain);

// Every problem of the domain's file, in its order: keys nobody reads ("...;
// it is ignored") and values the readers refuse ("\"spoolMaxBytes\" in
// com.velmar.zerith is 100, outside 4096 to 1099511627776; zerithd does not
// use this value").
std::vector<std::string> defaultsDomainProblems(std::string_view domain);

}  // namespace zerith
