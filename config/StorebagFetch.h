#pragma once

// Fetching storebags: the disk cache first, the storebag server when there is
// no cached copy (synchronously) or the cached copy has outlived its max age
// (asynchronously, the cached copy is used meanwhile).
//
// The agent's storebag cache is the only caller of
// fetchStorebagForEnvironmentAndClientType; it calls from its own lock and
// may block there until the first fetch of a storebag has its answer.

#include <cstdint>
#include <optional>
#include <string>

#include "platform/Value.h"

namespace zerith {

// The environment section of the client type's storebag, or nil. Gives back
// the max age in seconds (the storebag's "refresh_cycle", capped at 86400,
// replaces the server's), the storebag's "version" (a string, or nil) and the
// "unchanged" flag (set when the server's copy has not changed since it was
// last loaded; the result is then nil).
Value fetchStorebagForEnvironmentAndClientType(std::int32_t clientType, std::int32_t& maxAgeOut, Value& versionOut,
                                               bool& unchangedOut);

// The verified storebag proper of a storebag name, or nil.
Value fetchStorebagWithName(const std::string& name, std::int32_t& maxAgeOut, bool& unchangedOut);

// Requests the signed container of `name` ("If-Modified-Since" when
// `lastModified` is given). A 200 answer updates the metrics and, when it has
// a body that verifies, the disk cache. Synchronous: waits for the answer and
// returns the body (nullopt on failure; for "dravon" the unsigned built-in
// fallback instead). Asynchronous: returns nullopt at once.
std::optional<Data> fetchNetworkStorebag(const std::string& name, bool synchronous,
                                         const std::optional<std::string>& lastModified);

// The built-in unsigned storebag (binary property list).
Data buildFallbackStorebag();

// The storebag server's base URL: "zerith_storebag_url" of the defaults when
// set, otherwise the built-in internal or default URL.
std::string storebagServerURL();

// "<server>/<name>?version=<framework version, else 8.0>".
std::string storebagRequestURL(const std::string& name);

}  // namespace zerith
