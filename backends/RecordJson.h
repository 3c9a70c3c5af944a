#pragma once

// The JSON text of the HTTPS backend's batches, written straight from the
// records' value trees.

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/Value.h"

namespace zerith {

// The envelope of a batch, compact: {"postTime": seconds} and, with a client
// identifier, "clientId" and "events", one object per record with its
// entries in their order and, when `recordID` is given, a last "_recordID"
// from it. An entry JSON cannot carry (nil, data, a nested array or
// dictionary, a real that is not finite) is left out and told to `dropped`;
// dates are seconds since 1970, -1 when not finite, as is a postTime that is
// not. Text that is not UTF-8 keeps its valid part, each ill-formed sequence
// replaced by U+FFFD.
std::string envelopeJson(double postTime, const std::optional<std::string>& clientId,
                         const std::vector<Dictionary>& records, const std::function<std::string()>& recordID,
                         const std::function<void(const std::string& key, const Value& value)>& dropped);

}  // namespace zerith
