#pragma once

// What the collector makes of a request body it has not trusted yet: the
// size is checked before anything else, gzip is undone with a hard limit on
// the inflated size (a small body cannot expand into gigabytes), and JSON is
// parsed only after a cheap scan has bounded its nesting depth. A JSON
// object with "postTime" is an envelope of event records; anything else is a
// file (an upload or a log-data post) kept as bytes.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

namespace zerith::collector {

struct BodyLimits {
  std::size_t maxBodyBytes = 16u << 20;      // as received
  std::size_t maxInflatedBytes = 64u << 20;  // after gzip is undone
  std::size_t maxJsonDepth = 64;
};

struct DecodedBody {
  bool ok = false;
  std::string error;        // why not ok
  bool wasGzip = false;     // the body came gzip'd (header or magic bytes)
  std::string bytes;        // the body with gzip undone
  std::optional<nlohmann::ordered_json> envelope;  // {"postTime", "clientId", "events"}
};

// `contentEncoding` is the request's "Content-Encoding" header ("" when
// none). A body that starts with gzip's magic bytes is inflated whatever the
// header says.
DecodedBody decodeRequestBody(std::string_view contentEncoding, std::string_view body, const BodyLimits& limits = {});

// Inflates gzip data; nullopt (with the reason) when it is not whole, valid
// gzip or would inflate beyond `maxBytes`.
std::optional<std::string> gunzipBounded(std::string_view gzip, std::size_t maxBytes, std::string* error = nullptr);

// "<xxxxxxxx xxxxxxxx ...>" of HMAC-SHA-1 over `message`, as the backends
// send it in "X-ZTH-DIGEST".
std::string digestHeaderValue(std::string_view key, std::string_view message);

std::string sha256Hex(std::string_view bytes);

}  // namespace zerith::collector
