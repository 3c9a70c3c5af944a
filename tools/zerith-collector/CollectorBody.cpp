#include "tools/zerith-collector/CollectorBody.h"

#include <zlib.h>

#include <algorithm>
#include <cctype>

#include "platform/Crypto.h"
#include "platform/Json.h"

namespace zerith::collector {

namespace {

bool startsWithGzipMagic(std::string_view body) {
  return body.size() >= 2 && static_cast<unsigned char>(body[0]) == 0x1f && static_cast<unsigned char>(body[1]) == 0x8b;
}

std::string lowered(std::string_view s) {
  std::string out(s);
  std::transform(out.begin(), out.end(), out.begin(), [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return out;
}

}  // namespace

std::optional<std::string> gunzipBounded(std::string_view gzip, std::size_t maxBytes, std::string* error) {
  const auto fail = [&](std::string why) -> std::optional<std::string> {
    if (error) {
      *error = std::move(why);
    }
    return std::nullopt;
  };
  z_stream stream{};
  if (inflateInit2(&stream, 16 + MAX_WBITS) != Z_OK) {
    return fail("inflateInit2 failed");
  }
  std::string out;
  char buffer[65536];
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(gzip.data()));
  stream.avail_in = static_cast<uInt>(std::min<std::size_t>(gzip.size(), UINT32_MAX));
  int rc = Z_OK;
  while (rc == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(buffer);
    stream.avail_out = sizeof(buffer);
    rc = inflate(&stream, Z_NO_FLUSH);
    const std::size_t produced = sizeof(buffer) - stream.avail_out;
    if (out.size() + produced > maxBytes) {
      inflateEnd(&stream);
      return fail("gzip body inflates beyond " + std::to_string(maxBytes) + " bytes");
    }
    out.append(buffer, produced);
    if (rc == Z_BUF_ERROR && stream.avail_in == 0) {
      break;  // input ended before the stream did
    }
  }
  inflateEnd(&stream);
  if (rc != Z_STREAM_END) {
    return fail(stream.avail_in == 0 ? "gzip body is truncated" : "gzip body is not valid gzip");
  }
  if (stream.avail_in != 0) {
    return fail("gzip body has trailing bytes");
  }
  return out;
}

DecodedBody decodeRequestBody(std::string_view contentEncoding, std::string_view body, const BodyLimits& limits) {
  DecodedBody out;
  if (body.size() > limits.maxBodyBytes) {
    out.error = "body of " + std::to_string(body.size()) + " bytes exceeds " + std::to_string(limits.maxBodyBytes);
    return out;
  }
  const std::string encoding = lowered(contentEncoding);
  if (!encoding.empty() && encoding != "gzip" && encoding != "identity") {
    out.error = "unsupported Content-Encoding '" + std::string(contentEncoding) + "'";
    return out;
  }
  if (encoding == "gzip" || startsWithGzipMagic(body)) {
    out.wasGzip = true;
    auto inflated = gunzipBounded(body, limits.maxInflatedBytes, &out.error);
    if (!inflated) {
      return out;
    }
    out.bytes = std::move(*inflated);
  } else {
    out.bytes.assign(body);
  }
  out.ok = true;

  const auto first = out.bytes.find_first_not_of(" \t\r\n");
  if (first == std::string::npos || out.bytes[first] != '{' ||
      json::nestingDepth(out.bytes, limits.maxJsonDepth) > limits.maxJsonDepth) {
    return out;
  }
  auto json = nlohmann::ordered_json::parse(out.bytes, nullptr, /*allow_exceptions=*/false);
  if (json.is_discarded() || !json.is_object() || !json.contains("postTime")) {
    return out;
  }
  if (json.contains("events") && !json["events"].is_array()) {
    return out;
  }
  out.envelope = std::move(json);
  return out;
}

std::string digestHeaderValue(std::string_view key, std::string_view message) {
  const auto digest = crypto::hmacSha1(crypto::bytesOf(key), crypto::bytesOf(message));
  const std::string hex = crypto::hexLower(digest);
  std::string out = "<";
  for (std::size_t i = 0; i < hex.size(); i += 8) {
    if (i > 0) {
      out += ' ';
    }
    out += hex.substr(i, 8);
  }
  return out + ">";
}

std::string sha256Hex(std::string_view bytes) { return crypto::hexLower(crypto::sha256(crypto::bytesOf(bytes))); }

}  // namespace zerith::collector
