// The spool's file format: a fixed header with a checksum, then the batch's
// URL, headers and body as length-prefixed fields.

#include "backends/Spool.h"

#include <zlib.h>

#include <cstring>

#include <fmt/format.h>

namespace zerith {

namespace {

// ---------------------------------------------------------------------------
// Little-endian fields

void putU32(Data& out, std::uint32_t v) {
  for (int i = 0; i < 4; ++i) {
    out.push_back(static_cast<std::uint8_t>(v >> (8 * i)));
  }
}
void putBytes(Data& out, const void* bytes, std::size_t n) {
  putU32(out, static_cast<std::uint32_t>(n));
  const auto* p = static_cast<const std::uint8_t*>(bytes);
  out.insert(out.end(), p, p + n);
}
std::uint32_t getU32(const std::uint8_t* p) {
  std::uint32_t v = 0;
  for (int i = 3; i >= 0; --i) {
    v = (v << 8) | p[i];
  }
  return v;
}
std::uint64_t getU64(const std::uint8_t* p) {
  std::uint64_t v = 0;
  for (int i = 7; i >= 0; --i) {
    v = (v << 8) | p[i];
  }
  return v;
}

std::uint32_t checksumOf(std::span<const std::uint8_t> head, std::span<const std::uint8_t> body) {
  uLong crc = crc32(0L, Z_NULL, 0);
  crc = crc32(crc, head.data(), static_cast<uInt>(head.size()));
  // zlib takes 32-bit lengths; bodies are bounded well below that.
  crc = crc32(crc, body.data(), static_cast<uInt>(body.size()));
  return static_cast<std::uint32_t>(crc);
}

// A reader of length-prefixed fields that never reads past its end.
class FieldReader {
 public:
  explicit FieldReader(std::span<const std::uint8_t> bytes) : bytes_(bytes) {}
  bool u32(std::uint32_t& v) {
    if (bytes_.size() - at_ < 4) {
      return false;
    }
    v = getU32(bytes_.data() + at_);
    at_ += 4;
    return true;
  }
  bool field(std::size_t limit, std::span<const std::uint8_t>& out) {
    std::uint32_t n = 0;
    if (!u32(n) || n > limit || bytes_.size() - at_ < n) {
      return false;
    }
    out = bytes_.subspan(at_, n);
    at_ += n;
    return true;
  }
  bool atEnd() const { return at_ == bytes_.size(); }

 private:
  std::span<const std::uint8_t> bytes_;
  std::size_t at_ = 0;
};

std::string textOf(std::span<const std::uint8_t> bytes) { return std::string(bytes.begin(), bytes.end()); }

}  // namespace

// ---------------------------------------------------------------------------
// The file format

Data encodeSpoolFile(const SpoolBatch& batch) {
  Data body;
  body.reserve(batch.body.size() + batch.url.size() + 256);
  putBytes(body, batch.url.data(), batch.url.size());
  putU32(body, static_cast<std::uint32_t>(batch.headers.size()));
  for (const auto& [name, value] : batch.headers) {
    putBytes(body, name.data(), name.size());
    putBytes(body, value.data(), value.size());
  }
  putBytes(body, batch.body.data(), batch.body.size());

  std::array<std::uint8_t, kSpoolHeaderSize> head{};
  const auto setU32 = [&](std::size_t at, std::uint32_t v) {
    for (std::size_t i = 0; i < 4; ++i) {
      head[at + i] = static_cast<std::uint8_t>(v >> (8 * i));
    }
  };
  std::memcpy(head.data(), kSpoolMagic.data(), kSpoolMagic.size());
  setU32(8, kSpoolVersion);
  setU32(12, batch.recordCount);
  const auto created = static_cast<std::uint64_t>(batch.createdMillis);
  setU32(16, static_cast<std::uint32_t>(created));
  setU32(20, static_cast<std::uint32_t>(created >> 32));
  setU32(24, static_cast<std::uint32_t>(body.size()));
  setU32(28, checksumOf(std::span<const std::uint8_t>(head.data(), 28), body));
  Data out(kSpoolHeaderSize + body.size());
  std::memcpy(out.data(), head.data(), kSpoolHeaderSize);
  std::memcpy(out.data() + kSpoolHeaderSize, body.data(), body.size());
  return out;
}

std::optional<SpoolFileHeader> decodeSpoolHeader(std::span<const std::uint8_t> bytes, std::string* why) {
  const auto fail = [&](std::string reason) -> std::optional<SpoolFileHeader> {
    if (why) {
      *why = std::move(reason);
    }
    return std::nullopt;
  };
  if (bytes.size() < kSpoolHeaderSize) {
    return fail(fmt::format("truncated header ({} of {} bytes)", bytes.size(), kSpoolHeaderSize));
  }
  if (!std::equal(kSpoolMagic.begin(), kSpoolMagic.end(), bytes.begin())) {
    return fail("not a spool file (bad magic)");
  }
  SpoolFileHeader header;
  header.version = getU32(bytes.data() + 8);
  if (header.version != kSpoolVersion) {
    return fail(fmt::format("format version {} (this daemon reads {})", header.version, kSpoolVersion));
  }
  header.recordCount = getU32(bytes.data() + 12);
  header.createdMillis = static_cast<std::int64_t>(getU64(bytes.data() + 16));
  header.bodyLength = getU32(bytes.data() + 24);
  header.checksum = getU32(bytes.data() + 28);
  // The body carries at least the URL's length, the header count and the
  // body's length.
  if (header.bodyLength < 12 || header.bodyLength > kSpoolMaxBodySize + kSpoolMaxURLSize +
                                                         kSpoolMaxHeaders * (2 * kSpoolMaxHeaderSize + 8) + 12) {
    return fail(fmt::format("body length {} out of range", header.bodyLength));
  }
  return header;
}

std::optional<SpoolBatch> decodeSpoolFile(std::span<const std::uint8_t> bytes, std::string* why) {
  const auto fail = [&](std::string reason) -> std::optional<SpoolBatch> {
    if (why) {
      *why = std::move(reason);
    }
    return std::nullopt;
  };
  const auto header = decodeSpoolHeader(bytes, why);
  if (!header) {
    return std::nullopt;
  }
  if (bytes.size() - kSpoolHeaderSize != header->bodyLength) {
    return fail(fmt::format("{} body bytes where the header says {}", bytes.size() - kSpoolHeaderSize, header->bodyLength));
  }
  const auto body = bytes.subspan(kSpoolHeaderSize);
  if (checksumOf(bytes.first(28), body) != header->checksum) {
    return fail("checksum mismatch");
  }
  SpoolBatch batch;
  batch.createdMillis = header->createdMillis;
  batch.recordCount = header->recordCount;
  FieldReader reader(body);
  std::span<const std::uint8_t> field;
  if (!reader.field(kSpoolMaxURLSize, field)) {
    return fail("bad URL field");
  }
  batch.url = textOf(field);
  std::uint32_t headerCount = 0;
  if (!reader.u32(headerCount) || headerCount > kSpoolMaxHeaders) {
    return fail("bad header count");
  }
  for (std::uint32_t i = 0; i < headerCount; ++i) {
    std::span<const std::uint8_t> name, value;
    if (!reader.field(kSpoolMaxHeaderSize, name) || !reader.field(kSpoolMaxHeaderSize, value)) {
      return fail(fmt::format("bad request header {}", i));
    }
    batch.headers.emplace_back(textOf(name), textOf(value));
  }
  if (!reader.field(kSpoolMaxBodySize, field)) {
    return fail("bad request body field");
  }
  batch.body.assign(field.begin(), field.end());
  if (!reader.atEnd()) {
    return fail("trailing bytes after the request body");
  }
  return batch;
}

}  // namespace zerith
