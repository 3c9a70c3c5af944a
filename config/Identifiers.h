#pragma once

// Identifiers and settings kept in the defaults domain com.velmar.zerith, and
// the client/service key of a client's user info.

#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace zerith {

// The identifier stored under "uuid:<first>:<second>" (nullopt parts count as
// empty); a new upper-case UUID is made and stored when there is none. Stable
// for as long as the defaults keep it.
std::string getPersistentIdentifierForCustomClientIDSuffix(const std::optional<std::string>& first,
                                                           const std::optional<std::string>& second);

// The setting `key` of the domain as a string: a string as it is, a number or
// boolean in its decimal form; nullopt when absent or of another kind.
std::optional<std::string> defaultsStringForKey(std::string_view key);

// "<client name>:<service name>" of a user info, both lower-cased, each empty
// when missing ("mail:sync").
std::string clientServiceKey(const Value& userInfo);

}  // namespace zerith
