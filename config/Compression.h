#pragma once

// One-shot compression of an in-memory buffer in the zlib or the gzip
// format: one output allocation of zlib's worst-case bound and one
// finishing pass.

#include <cstdint>
#include <optional>
#include <span>

#include "platform/Value.h"

namespace zerith {

// The compressed bytes, or nullopt (after one error line) for an empty input
// or a zlib failure.
std::optional<Data> compressDataWithZlibOrGzip(bool gzip, std::span<const std::uint8_t> data);

// The gzip form, as request bodies use it.
inline std::optional<Data> gzipDeflate(std::span<const std::uint8_t> data) {
  return compressDataWithZlibOrGzip(true, data);
}

namespace compression {
// What a zlib return code means after deflateInit2_ and after deflate; the
// two tables differ.
const char* initErrorMessage(int code);
const char* deflateErrorMessage(int code);
}  // namespace compression

}  // namespace zerith
