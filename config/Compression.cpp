#include "config/Compression.h"

#include <zlib.h>

#include <limits>

#include "config/ConfigLog.h"

namespace zerith {

namespace {

// The stream is initialised with the version text "1.2.11". zlib only
// compares the first character with its own version, so Debian's 1.2.13
// accepts it; should the linked zlib ever be of another major version, the
// header's own ZLIB_VERSION is passed instead, since "1.2.11" would then be
// refused.
constexpr const char* kZlibVersionText = ZLIB_VERSION[0] == '1' ? "1.2.11" : ZLIB_VERSION;

// Ends a successfully initialised stream on every way out.
struct DeflateEnder {
  z_stream* stream;
  ~DeflateEnder() { ::deflateEnd(stream); }
};

const char* streamMessage(const z_stream& stream) { return stream.msg ? stream.msg : "(null)"; }

}  // namespace

namespace compression {

const char* initErrorMessage(int code) {
  switch (code) {
    case Z_VERSION_ERROR:
      return "The version of zlib.h and the version of the library linked do not match.";
    case Z_MEM_ERROR:
      return "Insufficient memory.";
    case Z_STREAM_ERROR:
      return "Invalid parameter passed in to function.";
    default:
      return "Unknown error code.";
  }
}

const char* deflateErrorMessage(int code) {
  switch (code) {
    case Z_VERSION_ERROR:
      return "The version of zlib.h and the version of the library linked do not match.";
    case Z_BUF_ERROR:
      return "Ran out of output buffer for writing compressed bytes.";
    case Z_MEM_ERROR:
      return "Memory could not be allocated for processing.";
    case Z_DATA_ERROR:
      return "The deflate data was invalid or incomplete.";
    case Z_STREAM_ERROR:
      return "The stream state was inconsistent (e.g., next_in or next_out was NULL).";
    case Z_ERRNO:
      return "Error occured while reading file.";
    default:
      return "Unknown error code.";
  }
}

}  // namespace compression

std::optional<Data> compressDataWithZlibOrGzip(bool gzip, std::span<const std::uint8_t> data) {
  if (data.empty()) {
    configLogger().error("compressDataWithZlibOrGzip: Cannot compress empty QFData");
    return std::nullopt;
  }
  if (data.size() > std::numeric_limits<uInt>::max()) {
    configLogger().error("compressDataWithZlibOrGzip: Cannot compress {} bytes in one pass", data.size());
    return std::nullopt;
  }

  z_stream stream{};
  stream.next_in = const_cast<Bytef*>(data.data());
  stream.avail_in = static_cast<uInt>(data.size());
  const int init = ::deflateInit2_(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, gzip ? 31 : 15, 8,
                                   Z_DEFAULT_STRATEGY, kZlibVersionText, static_cast<int>(sizeof(z_stream)));
  if (init != Z_OK) {
    configLogger().error("compressDataWithZlibOrGzip: deflateInit2() Error: \"{}\" Message: \"{}\"",
                   compression::initErrorMessage(init), streamMessage(stream));
    return std::nullopt;
  }
  DeflateEnder ender{&stream};

  // The one output allocation; never grown.
  Data out(::deflateBound(&stream, static_cast<uLong>(data.size())));
  while (true) {
    stream.next_out = out.data() + stream.total_out;
    stream.avail_out = static_cast<uInt>(out.size() - stream.total_out);
    const int rc = ::deflate(&stream, Z_FINISH);
    if (rc == Z_OK) {
      continue;
    }
    if (rc == Z_STREAM_END) {
      break;
    }
    configLogger().error("compressDataWithZlibOrGzip: zlib error while attempting compression: \"{}\" Message: \"{}\"",
                   compression::deflateErrorMessage(rc), streamMessage(stream));
    return std::nullopt;
  }
  out.resize(stream.total_out);
  configLogger().debug("compressDataWithZlibOrGzip: Compressed file from {} to {}", data.size(), out.size());
  return out;
}

}  // namespace zerith
