#include "config/Compression.h"

#include <zlib.h>

#include <limits>
#include <memory>
#include <mutex>
#include <vector>

#include "config/ConfigLog.h"

namespace zerith {

namespace {

// The stream is initialised with the version text "1.2.11". zlib only
// compares the first character with its own version, so Debian's 1.2.13
// accepts it; should the linked zlib ever be of another major version, the
// header's own ZLIB_VERSION is passed instead, since "1.2.11" would then be
// refused.
constexpr const char* kZlibVersionText = ZLIB_VERSION[0] == '1' ? "1.2.11" : ZLIB_VERSION;

// A deflate stream's state is about 270 KiB (window, hash chains, pending
// buffer). Setting one up for every request body and freeing it after cost
// more than compressing a batch: the allocator gave the memory back to the
// system and faulted it in again for the next body. Finished streams are
// therefore kept, reset, for the next call; a handful covers the threads
// that compress at once, and a stream beyond that is ended. Reset streams
// produce the same bytes as fresh ones.
constexpr std::size_t kIdleStreamsKept = 2;

class StreamCache {
 public:
  // An initialised stream of the format, or nullptr when none is idle.
  z_stream* take(bool gzip) {
    std::lock_guard lock(mutex_);
    auto& idle = gzip ? gzip_ : zlib_;
    if (idle.empty()) {
      return nullptr;
    }
    z_stream* stream = idle.back().release();
    idle.pop_back();
    return stream;
  }
  // Takes back a stream that finished cleanly, or ends it.
  void give(bool gzip, z_stream* stream) {
    if (::deflateReset(stream) == Z_OK) {
      std::lock_guard lock(mutex_);
      auto& idle = gzip ? gzip_ : zlib_;
      if (idle.size() < kIdleStreamsKept) {
        idle.emplace_back(stream);
        return;
      }
    }
    end(stream);
  }
  static void end(z_stream* stream) {
    ::deflateEnd(stream);
    delete stream;
  }

 private:
  struct Ender {
    void operator()(z_stream* stream) const { end(stream); }
  };
  std::mutex mutex_;
  std::vector<std::unique_ptr<z_stream, Ender>> gzip_;
  std::vector<std::unique_ptr<z_stream, Ender>> zlib_;
};

StreamCache& streamCache() {
  static auto* cache = new StreamCache;  // used by any thread until exit
  return *cache;
}

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

  z_stream* stream = streamCache().take(gzip);
  if (!stream) {
    stream = new z_stream{};
    const int init = ::deflateInit2_(stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, gzip ? 31 : 15, 8, Z_DEFAULT_STRATEGY,
                                     kZlibVersionText, static_cast<int>(sizeof(z_stream)));
    if (init != Z_OK) {
      configLogger().error("compressDataWithZlibOrGzip: deflateInit2() Error: \"{}\" Message: \"{}\"",
                           compression::initErrorMessage(init), streamMessage(*stream));
      delete stream;
      return std::nullopt;
    }
  }
  stream->next_in = const_cast<Bytef*>(data.data());
  stream->avail_in = static_cast<uInt>(data.size());

  // The one output allocation; never grown.
  Data out(::deflateBound(stream, static_cast<uLong>(data.size())));
  while (true) {
    stream->next_out = out.data() + stream->total_out;
    stream->avail_out = static_cast<uInt>(out.size() - stream->total_out);
    const int rc = ::deflate(stream, Z_FINISH);
    if (rc == Z_OK) {
      continue;
    }
    if (rc == Z_STREAM_END) {
      break;
    }
    configLogger().error("compressDataWithZlibOrGzip: zlib error while attempting compression: \"{}\" Message: \"{}\"",
                         compression::deflateErrorMessage(rc), streamMessage(*stream));
    StreamCache::end(stream);
    return std::nullopt;
  }
  const std::size_t produced = stream->total_out;
  streamCache().give(gzip, stream);
  out.resize(produced);
  configLogger().debug("compressDataWithZlibOrGzip: Compressed file from {} to {}", data.size(), out.size());
  return out;
}

}  // namespace zerith
