#pragma once

// The defaults keys that zerithd and its client framework read, by domain,
// for the warnings about names nobody reads: a misspelt domain or key is
// otherwise ignored without a word, and the setting it was meant to make
// never takes effect. zerith-defaults warns when it writes one, and the
// daemon logs the keys of its own domain that it does not read when it
// starts.

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zerith {

// nullopt when `key` is read in `domain` (or `domain` is not one of the
// daemon's); otherwise what to tell the operator: "zerithd does not read
// \"spoolEnbled\" in com.velmar.zerith (did you mean \"spoolEnabled\"?)".
std::optional<std::string> unreadDefaultsKey(std::string_view domain, std::string_view key);

// nullopt for a domain the daemon or the framework reads; otherwise what to
// tell the operator, with the nearest such domain.
std::optional<std::string> unreadDefaultsDomain(std::string_view domain);

// What unreadDefaultsKey says of each key of the domain's file, in its order.
std::vector<std::string> unreadDefaultsKeys(std::string_view domain);

}  // namespace zerith
