#include "platform/BinaryPlist.h"

#include <fmt/format.h>

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <span>
#include <type_traits>
#include <string_view>
#include <vector>

namespace zerith::bplist {

namespace {

// Seconds between 1970-01-01 and 2001-01-01, the property-list epoch.
constexpr double kEpochOffset = 978307200.0;
constexpr std::size_t kHeaderBytes = 8;
constexpr std::size_t kTrailerBytes = 32;
// Text and data shared by many references would make a tree far larger than
// its bytes (a long key under every entry of a large dictionary): the text
// and data of the expanded tree, counted as encoded, stay within the size
// limit, as they do in any list that shares nothing.
constexpr const char* kExpandsPast = "text and data expand to more than {} bytes";

[[gnu::always_inline]] inline std::uint64_t readBE(const std::uint8_t* p, std::size_t n) {
  // References and offsets are read for every object: their usual widths
  // without a loop.
  switch (n) {
    case 1:
      return p[0];
    case 2:
      return (std::uint64_t{p[0]} << 8) | p[1];
    case 4: {
      std::uint32_t v = 0;
      std::memcpy(&v, p, 4);
      return __builtin_bswap32(v);
    }
    case 8: {
      std::uint64_t v = 0;
      std::memcpy(&v, p, 8);
      return __builtin_bswap64(v);
    }
    default:
      break;
  }
  std::uint64_t v = 0;
  for (std::size_t i = 0; i < n; ++i) {
    v = (v << 8) | p[i];
  }
  return v;
}

double readReal(const std::uint8_t* p, std::size_t n) {
  if (n == 4) {
    const auto bits = static_cast<std::uint32_t>(readBE(p, 4));
    float f = 0;
    std::memcpy(&f, &bits, sizeof f);
    return f;
  }
  const std::uint64_t bits = readBE(p, 8);
  double d = 0;
  std::memcpy(&d, &bits, sizeof d);
  return d;
}

// UTF-16 to UTF-8 exactly as libplist converts it (a lone surrogate is
// dropped), so that both readers give one frame the same text.
void appendUtf16(const std::uint8_t* p, std::uint64_t units, std::string& out) {
  out.reserve(units * 3);
  bool lead = false;
  std::uint32_t w = 0;
  for (std::uint64_t i = 0; i < units; ++i) {
    const std::uint32_t wc = (std::uint32_t{p[2 * i]} << 8) | p[2 * i + 1];
    if (wc >= 0xD800 && wc <= 0xDBFF) {
      if (!lead) {
        w = 0x10000 + ((wc & 0x3FF) << 10);
      }
      lead = !lead;
    } else if (wc >= 0xDC00 && wc <= 0xDFFF) {
      if (lead) {
        lead = false;
        w |= wc & 0x3FF;
        out += static_cast<char>(0xF0 + ((w >> 18) & 0x7));
        out += static_cast<char>(0x80 + ((w >> 12) & 0x3F));
        out += static_cast<char>(0x80 + ((w >> 6) & 0x3F));
        out += static_cast<char>(0x80 + (w & 0x3F));
      }
    } else if (wc >= 0x800) {
      out += static_cast<char>(0xE0 + ((wc >> 12) & 0xF));
      out += static_cast<char>(0x80 + ((wc >> 6) & 0x3F));
      out += static_cast<char>(0x80 + (wc & 0x3F));
    } else if (wc >= 0x80) {
      out += static_cast<char>(0xC0 + ((wc >> 6) & 0x1F));
      out += static_cast<char>(0x80 + (wc & 0x3F));
    } else {
      out += static_cast<char>(wc);
    }
  }
}

constexpr std::uint32_t kBadUtf8 = 0xFFFFFFFF;

// The code point of strict UTF-8 (no overlong forms, no surrogates, nothing
// above U+10FFFF) at `p`, advancing past it; kBadUtf8, with `p` unmoved, when
// the bytes there are not one.
std::uint32_t nextCodePoint(const unsigned char*& p, const unsigned char* end) {
  const unsigned c = *p;
  std::size_t extra = 0;
  std::uint32_t min = 0;
  std::uint32_t code = 0;
  if (c < 0x80) {
    ++p;
    return c;
  } else if ((c & 0xE0) == 0xC0) {
    extra = 1, min = 0x80, code = c & 0x1F;
  } else if ((c & 0xF0) == 0xE0) {
    extra = 2, min = 0x800, code = c & 0x0F;
  } else if ((c & 0xF8) == 0xF0) {
    extra = 3, min = 0x10000, code = c & 0x07;
  } else {
    return kBadUtf8;
  }
  if (static_cast<std::size_t>(end - p) <= extra) {
    return kBadUtf8;
  }
  for (std::size_t i = 1; i <= extra; ++i) {
    if ((p[i] & 0xC0) != 0x80) {
      return kBadUtf8;
    }
    code = (code << 6) | (p[i] & 0x3F);
  }
  if (code < min || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF)) {
    return kBadUtf8;
  }
  p += extra + 1;
  return code;
}

// Where a string's bytes end: at the first NUL (a string ends there, as it
// does through libplist), and whether they are all ASCII (then the writer
// writes them as they are, otherwise as UTF-16, and the reader need not
// check them as UTF-8). Eight bytes at a time.
constexpr std::uint64_t kAsciiText = 1ull << 63;
std::uint64_t scanText(std::string_view s) {
  constexpr std::uint64_t kOnes = 0x0101010101010101ull;
  constexpr std::uint64_t kHighs = 0x8080808080808080ull;
  const char* p = s.data();
  const std::size_t n = s.size();
  std::uint64_t seen = 0;
  std::size_t i = 0;
  for (; i + 8 <= n; i += 8) {
    std::uint64_t w = 0;
    std::memcpy(&w, p + i, 8);
    if (((w - kOnes) & ~w & kHighs) != 0) {
      break;  // a NUL in these eight: byte by byte from here
    }
    seen |= w;
  }
  if (i < n && n - i < 8) {
    // The last few bytes as one word, filled up with bytes that are neither
    // NUL nor high.
    std::uint64_t w = kOnes;
    std::memcpy(&w, p + i, n - i);
    if (((w - kOnes) & ~w & kHighs) == 0) {
      seen |= w;
      i = n;
    }
  }
  for (; i < n && p[i] != 0; ++i) {
    seen |= static_cast<unsigned char>(p[i]);
  }
  return i | ((seen & kHighs) == 0 ? kAsciiText : 0);
}

}  // namespace

bool validUtf8(std::string_view text) {
  // Most text is ASCII: one pass over it that the compiler vectorises.
  unsigned char high = 0;
  for (const char c : text) {
    high |= static_cast<unsigned char>(c);
  }
  if (high < 0x80) {
    return true;
  }
  const auto* p = reinterpret_cast<const unsigned char*>(text.data());
  const auto* end = p + text.size();
  while (p < end) {
    if (nextCodePoint(p, end) == kBadUtf8) {
      return false;
    }
  }
  return true;
}

namespace {

class Reader {
 public:
  Reader(plist::Bytes bytes, const plist::Limits& limits, Text text)
      : b_(bytes.data()), size_(bytes.size()), limits_(limits), text_(text) {}

  std::optional<Value> run() {
    if (size_ > limits_.maxBytes) {
      return fail(fmt::format("binary property list of {} bytes exceeds the limit of {}", size_, limits_.maxBytes));
    }
    if (size_ < kHeaderBytes + kTrailerBytes + 1 || std::memcmp(b_, "bplist00", kHeaderBytes) != 0) {
      return fail("not a binary property list (bad header or too short)");
    }
    const std::uint8_t* t = b_ + size_ - kTrailerBytes;
    offsetSize_ = t[6];
    refSize_ = t[7];
    numObjects_ = readBE(t + 8, 8);
    const std::uint64_t top = readBE(t + 16, 8);
    tableOffset_ = readBE(t + 24, 8);
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) {
      return fail("binary trailer has invalid integer sizes");
    }
    if (numObjects_ == 0 || numObjects_ > limits_.maxNodes || top >= numObjects_) {
      return fail("binary trailer has an invalid object count or top object");
    }
    const std::uint64_t tableEnd = size_ - kTrailerBytes;
    if (tableOffset_ < kHeaderBytes + 1 || tableOffset_ > tableEnd ||
        numObjects_ > (tableEnd - tableOffset_) / offsetSize_) {
      return fail("binary offset table is out of range");
    }
    // The objects' slots are the thread's, kept from one read to the next
    // unless a large list made them large.
    struct Release {
      ~Release() {
        if (objects_.capacity() > kKeptSlots) {
          std::vector<Object>().swap(objects_);
        } else {
          objects_.clear();
        }
      }
    } release;
    objects_.resize(numObjects_);
    const Object* root = visit(top, 1);
    if (!root) {
      return std::nullopt;
    }
    return root->value;
  }

  std::string error;

 private:
  struct Object {
    Value value;
    std::uint64_t expanded = 0;  // nodes it expands to
    std::uint64_t bytes = 0;     // text and data it expands to, as encoded
    std::uint32_t height = 0;
    std::uint8_t state = 0;  // 0 unvisited, 1 on the current path, 2 done
  };

  std::nullopt_t fail(std::string why) {
    error = std::move(why);
    return std::nullopt;
  }
  std::nullptr_t failed(std::string why) {
    error = std::move(why);
    return nullptr;
  }

  // Room for `count` units of `unit` bytes from `pos` inside the object area.
  bool fits(std::uint64_t pos, std::uint64_t count, std::uint64_t unit) const {
    return pos <= tableOffset_ && count <= (tableOffset_ - pos) / unit;
  }

  // The length of a variable-size object: in its marker or in an integer
  // after it; advances `pos` past it.
  bool readLength(std::uint8_t info, std::uint64_t& pos, std::uint64_t& length) {
    if (info != 0x0F) {
      length = info;
      return true;
    }
    if (!fits(pos, 1, 1)) {
      error = "object length runs past the object area";
      return false;
    }
    const std::uint8_t marker = b_[pos];
    if ((marker & 0xF0) != 0x10 || (marker & 0x0F) > 3) {
      error = "object length is not a small integer";
      return false;
    }
    const std::uint64_t n = 1u << (marker & 0x0F);
    if (!fits(pos + 1, n, 1)) {
      error = "object length runs past the object area";
      return false;
    }
    length = readBE(b_ + pos + 1, n);
    pos += 1 + n;
    return true;
  }

  std::uint64_t refAt(std::uint64_t pos, std::uint64_t i) const { return readBE(b_ + pos + i * refSize_, refSize_); }

  // Where object `ref` starts, or 0 when that is outside the object area.
  std::uint64_t offsetOf(std::uint64_t ref) const {
    const std::uint64_t offset = readBE(b_ + tableOffset_ + ref * offsetSize_, offsetSize_);
    return offset >= kHeaderBytes && offset < tableOffset_ ? offset : 0;
  }

  // The text of a string object (marker type 0x5 or 0x6) whose content
  // starts at `pos`; adds its encoded size to `bytes`.
  bool readText(std::uint8_t type, std::uint8_t info, std::uint64_t pos, std::string& out, std::uint64_t& bytes) {
    std::uint64_t length = 0;
    if (!readLength(info, pos, length)) {
      return false;
    }
    if (!fits(pos, length, type == 0x6 ? 2 : 1)) {
      error = "object content runs past the object area";
      return false;
    }
    const std::uint8_t* p = b_ + pos;
    bytes += type == 0x6 ? 2 * length : length;
    // libplist asserts that a string has no NUL inside (and aborts the
    // process when it has): such strings are refused.
    if (type == 0x5) {
      const std::string_view text(reinterpret_cast<const char*>(p), length);
      const std::uint64_t scan = scanText(text);
      if ((scan & ~kAsciiText) != length) {
        error = "string holds a NUL character";
        return false;
      }
      if (text_ == Text::Utf8Only && (scan & kAsciiText) == 0 && !validUtf8(text)) {
        error = kNotUtf8;
        return false;
      }
      out = std::string(text);
      return true;
    }
    if (length == 0) {
      error = "empty UTF-16 string";  // libplist refuses it
      return false;
    }
    for (std::uint64_t i = 0; i < length; ++i) {
      if (p[2 * i] == 0 && p[2 * i + 1] == 0) {
        error = "string holds a NUL character";
        return false;
      }
    }
    appendUtf16(p, length, out);
    return true;
  }

  static std::uint64_t keyBit(const std::string& key) {
    const std::size_t n = key.size();
    const unsigned mix = n == 0 ? 0 : n + 7u * static_cast<unsigned char>(key[0]) + 13u * static_cast<unsigned char>(key[n - 1]);
    return 1ull << (mix & 63);
  }

  // The text of key object `ref` at nesting `depth`, counted as a node of
  // the expanded tree like any other.
  bool readKey(std::uint64_t ref, std::size_t depth, std::string& out, std::uint64_t& bytes) {
    if (depth > limits_.maxDepth) {
      error = fmt::format("nesting deeper than {}", limits_.maxDepth);
      return false;
    }
    const std::uint64_t offset = offsetOf(ref);
    if (offset == 0) {
      error = "object offset is out of range";
      return false;
    }
    const std::uint8_t type = b_[offset] >> 4;
    if (type != 0x5 && type != 0x6) {
      error = "dictionary key is not a string";
      return false;
    }
    if (!readText(type, b_[offset] & 0x0F, offset + 1, out, bytes)) {
      return false;
    }
    if (bytes > limits_.maxBytes) {
      error = fmt::format(kExpandsPast, limits_.maxBytes);
      return false;
    }
    return true;
  }

  // Builds object `ref` reached at nesting `depth` (the root is 1); nullptr
  // with `error` set when it breaks a bound.
  const Object* visit(std::uint64_t ref, std::size_t depth) {
    if (depth > limits_.maxDepth) {
      return failed(fmt::format("nesting deeper than {}", limits_.maxDepth));
    }
    Object& object = objects_[ref];
    if (object.state == 2) {
      if (depth + object.height - 1 > limits_.maxDepth) {
        return failed(fmt::format("nesting deeper than {}", limits_.maxDepth));
      }
      return &object;
    }
    if (object.state == 1) {
      return failed("object references form a cycle");
    }
    object.state = 1;

    const std::uint64_t offset = offsetOf(ref);
    if (offset == 0) {
      return failed("object offset is out of range");
    }
    const std::uint8_t marker = b_[offset];
    const std::uint8_t type = marker >> 4;
    const std::uint8_t info = marker & 0x0F;
    std::uint64_t pos = offset + 1;
    std::uint64_t nodes = 1;
    std::uint64_t bytes = 0;  // of text and data, as encoded
    std::uint32_t height = 1;
    Value value;

    switch (type) {
      case 0x0:
        if (info != 0x8 && info != 0x9) {
          return failed("null and fill objects are not values");
        }
        value = Value(info == 0x9);
        break;
      case 0x1: {
        if (info > 4) {
          return failed("integer of unsupported size");
        }
        const std::uint64_t n = 1ull << info;
        if (!fits(pos, n, 1)) {
          return failed("object content runs past the object area");
        }
        if (n == 16) {
          // The unsigned 64-bit form: a 128-bit integer of which libplist
          // keeps the low 64 bits.
          const std::uint64_t high = readBE(b_ + pos, 8);
          const std::uint64_t low = readBE(b_ + pos + 8, 8);
          value = high == 0 && low > static_cast<std::uint64_t>(INT64_MAX) ? Value(static_cast<unsigned long long>(low))
                                                                           : Value(static_cast<long long>(low));
        } else {
          value = Value(static_cast<long long>(readBE(b_ + pos, n)));
        }
        break;
      }
      case 0x2:
      case 0x3: {
        if (info != 3 && (type == 0x3 || info != 2)) {
          return failed(type == 0x2 ? "real of unsupported size" : "date of unsupported size");
        }
        const std::uint64_t n = 1ull << info;
        if (!fits(pos, n, 1)) {
          return failed("object content runs past the object area");
        }
        const double d = readReal(b_ + pos, n);
        if (type == 0x2) {
          value = Value(d);
          break;
        }
        // Kept as 32-bit seconds and microseconds, as libplist keeps a date
        // (and as the writer writes it). libplist reads the fraction of a
        // date before 2001 with the wrong sign (-3.7 s as -2.3 s); this reader
        // reads the date that was written.
        if (!(d >= -2147483648.0 && d < 2147483648.0)) {
          return failed("date out of range");
        }
        const auto sec = static_cast<std::int32_t>(d);
        const auto usec = static_cast<std::int32_t>((d - sec) * 1e6);
        value = Value(Date{sec + usec / 1e6 + kEpochOffset});
        break;
      }
      case 0x4: {
        std::uint64_t length = 0;
        if (!readLength(info, pos, length)) {
          return nullptr;
        }
        if (!fits(pos, length, 1)) {
          return failed("object content runs past the object area");
        }
        value = Value(Data(b_ + pos, b_ + pos + length));
        bytes = length;
        break;
      }
      case 0x5:
      case 0x6: {
        std::string text;
        if (!readText(type, info, pos, text, bytes)) {
          return nullptr;
        }
        value = Value(std::move(text));
        break;
      }
      case 0xA:
      case 0xD: {
        std::uint64_t count = 0;
        if (!readLength(info, pos, count)) {
          return nullptr;
        }
        if (count > limits_.maxNodes) {
          return failed("container holds too many objects");
        }
        const std::uint64_t refs = type == 0xD ? count * 2 : count;
        if (!fits(pos, refs, refSize_)) {
          return failed("object content runs past the object area");
        }
        for (std::uint64_t i = 0; i < refs; ++i) {
          if (refAt(pos, i) >= numObjects_) {
            return failed("object reference is out of range");
          }
        }
        auto child = [&](std::uint64_t childRef) -> const Object* {
          const Object* c = visit(childRef, depth + 1);
          if (!c) {
            return nullptr;
          }
          nodes += c->expanded;
          bytes += c->bytes;
          height = std::max(height, c->height + 1);
          if (nodes > limits_.maxNodes) {
            return failed(fmt::format("expands to more than {} nodes", limits_.maxNodes));
          }
          if (bytes > limits_.maxBytes) {
            return failed(fmt::format(kExpandsPast, limits_.maxBytes));
          }
          return c;
        };
        if (type == 0xA) {
          Array array;
          array.reserve(count);
          for (std::uint64_t i = 0; i < count; ++i) {
            const Object* c = child(refAt(pos, i));
            if (!c) {
              return nullptr;
            }
            array.push_back(c->value);
          }
          value = Value(std::move(array));
          break;
        }
        Dictionary dict;
        dict.reserve(count);
        // Keys seen so far, one bit each by length and end bytes: a key whose
        // bit is clear is new and is appended without a look for it.
        std::uint64_t seenKeys = 0;
        for (std::uint64_t i = 0; i < count; ++i) {
          // A key is read as text only: no Value is made for it.
          std::string key;
          if (!readKey(refAt(pos, i), depth + 1, key, bytes)) {
            return nullptr;
          }
          height = std::max<std::uint32_t>(height, 2);
          if (++nodes > limits_.maxNodes) {
            return failed(fmt::format("expands to more than {} nodes", limits_.maxNodes));
          }
          const Object* entry = child(refAt(pos, count + i));
          if (!entry) {
            return nullptr;
          }
          // A key given twice keeps its first place and its last value, as
          // a tree read through libplist does.
          const std::uint64_t bit = keyBit(key);
          if ((seenKeys & bit) != 0) {
            dict.set(std::move(key), entry->value);
          } else {
            seenKeys |= bit;
            dict.appendNew(std::move(key), entry->value);
          }
        }
        value = Value(std::move(dict));
        break;
      }
      case 0x8:
        return failed("frames carry no UIDs");
      case 0xC:
        return failed("frames carry no sets");
      default:
        return failed(fmt::format("unknown object type 0x{:x}", type));
    }
    // `objects_` never grows during the walk: `object` is still valid.
    object.value = std::move(value);
    object.expanded = nodes;
    object.bytes = bytes;
    object.height = height;
    object.state = 2;
    return &object;
  }

  static constexpr std::size_t kKeptSlots = 4096;

  const std::uint8_t* b_;
  std::size_t size_;
  const plist::Limits& limits_;
  Text text_;
  std::uint8_t offsetSize_ = 0;
  std::uint8_t refSize_ = 0;
  std::uint64_t numObjects_ = 0;
  std::uint64_t tableOffset_ = 0;
  static thread_local std::vector<Object> objects_;
};

thread_local std::vector<Reader::Object> Reader::objects_;

// ---- writer
// ---------------------------------------------------------------------

// Bytes of the smallest of the widths 1, 2, 3, 4 and 8 that holds `v`, for
// references and offsets; an integer object has no 3-byte form and takes 4.
std::uint8_t tableWidthOf(std::uint64_t v) {
  if (v < (1ull << 8)) return 1;
  if (v < (1ull << 16)) return 2;
  if (v < (1ull << 24)) return 3;
  if (v < (1ull << 32)) return 4;
  return 8;
}
std::uint8_t widthOf(std::uint64_t v) {
  const std::uint8_t width = tableWidthOf(v);
  return width == 3 ? 4 : width;
}

std::uint8_t log2Width(std::uint8_t width) { return width == 1 ? 0 : width == 2 ? 1 : width == 4 ? 2 : 3; }

// Scratch of one encode, kept by the thread for the next.
struct WriterScratch {
  std::vector<std::uint32_t> sizes;    // each object's subtree, in write order
  std::vector<std::uint64_t> offsets;  // each object's offset
  std::vector<std::uint64_t> texts;    // each string's scanText, in write order
  std::vector<std::uint16_t> units;    // a string in UTF-16
};
WriterScratch& writerScratch() {
  static thread_local WriterScratch scratch;
  return scratch;
}

// Two walks over the tree: the first numbers the objects (depth first, a
// dictionary's keys before its values), counts each one's subtree, so that a
// container knows its children's numbers before they are written, scans the
// strings and adds up a bound on the bytes; the second writes the objects
// into room made once for that bound.
class Writer {
 public:
  Writer() : s_(writerScratch()) {}

  template <typename Root>
  std::size_t run(const Root& root, Data& out, std::size_t at) {
    s_.sizes.clear();
    s_.texts.clear();
    bound_ = kHeaderBytes + kTrailerBytes;
    refs_ = 0;
    depth_ = 0;
    plan(root, 1);
    const std::size_t numObjects = s_.sizes.size();
    refSize_ = tableWidthOf(numObjects);
    bound_ += refs_ * refSize_ + numObjects * 8;
    if (s_.offsets.size() < numObjects) {
      s_.offsets.resize(numObjects);
    }
    if (out.size() < at + bound_) {
      out.resize(at + bound_);
    }
    base_ = out.data() + at;
    p_ = base_;
    text_ = 0;
    std::memcpy(p_, "bplist00", kHeaderBytes);
    p_ += kHeaderBytes;
    emit(root, 0);
    const std::uint64_t tableOffset = static_cast<std::uint64_t>(p_ - base_);
    const std::uint8_t offsetSize = tableWidthOf(tableOffset);
    for (std::size_t i = 0; i < numObjects; ++i) {
      putBE(p_, s_.offsets[i], offsetSize);
      p_ += offsetSize;
    }
    std::memset(p_, 0, 6);
    p_[6] = offsetSize;
    p_[7] = refSize_;
    putBE(p_ + 8, numObjects, 8);
    putBE(p_ + 16, 0, 8);
    putBE(p_ + 24, tableOffset, 8);
    p_ += kTrailerBytes;
    if (s_.units.capacity() > (64u << 10)) {
      std::vector<std::uint16_t>().swap(s_.units);
    }
    return static_cast<std::size_t>(p_ - base_);
  }

 private:
  static void putBE(std::uint8_t* p, std::uint64_t v, std::size_t n) {
    for (std::size_t i = n; i-- > 0;) {
      p[i] = static_cast<std::uint8_t>(v);
      v >>= 8;
    }
  }

  // ---- the first walk

  void planText(std::string_view s) {
    const std::uint64_t info = scanText(s);
    s_.texts.push_back(info);
    const std::uint64_t length = info & ~kAsciiText;
    bound_ += 10 + ((info & kAsciiText) ? length : 2 * length);
  }

  // One object at nesting `depth` (the root is 1) and its subtree; `v` is
  // not nil.
  void plan(const Value& v, std::size_t depth) {
    depth_ = std::max(depth_, depth);
    const std::size_t index = s_.sizes.size();
    s_.sizes.push_back(1);
    v.visit([this, depth](const auto& x) {
      using T = std::decay_t<decltype(x)>;
      if constexpr (std::is_same_v<T, std::string>) {
        planText(x);
      } else if constexpr (std::is_same_v<T, Data>) {
        bound_ += 10 + x.size();
      } else if constexpr (std::is_same_v<T, Array>) {
        bound_ += 10;
        for (const auto& e : x) {
          if (!e.isNil()) {
            ++refs_;
            plan(e, depth + 1);
          }
        }
      } else if constexpr (std::is_same_v<T, Dictionary>) {
        planEntries(x, depth);
      } else {
        bound_ += 17;  // a scalar
      }
    });
    s_.sizes[index] = static_cast<std::uint32_t>(s_.sizes.size() - index);
  }

  // A dictionary's keys and values sit one level below it.
  void planEntries(const Dictionary& d, std::size_t depth) {
    bound_ += 10;
    for (const auto& [k, e] : d) {
      if (!e.isNil()) {
        refs_ += 2;
        s_.sizes.push_back(1);
        depth_ = std::max(depth_, depth + 1);
        planText(k);
        plan(e, depth + 1);
      }
    }
  }

  void plan(std::span<const Field> fields, std::size_t depth) {
    depth_ = std::max(depth_, depth);
    s_.sizes.push_back(1);
    bound_ += 10;
    for (const auto& f : fields) {
      if (f.kind == Field::Kind::Value && f.value->isNil()) {
        continue;
      }
      refs_ += 2;
      s_.sizes.push_back(1);
      depth_ = std::max(depth_, depth + 1);
      planText(f.key);
      switch (f.kind) {
        case Field::Kind::Text:
          s_.sizes.push_back(1);
          planText(f.text);
          break;
        case Field::Kind::Integer:
          s_.sizes.push_back(1);
          bound_ += 17;
          break;
        case Field::Kind::Dictionary: {
          const std::size_t index = s_.sizes.size();
          s_.sizes.push_back(1);
          planEntries(*f.dictionary, depth + 1);
          s_.sizes[index] = static_cast<std::uint32_t>(s_.sizes.size() - index);
          break;
        }
        case Field::Kind::Value:
          plan(*f.value, depth + 1);
          break;
      }
    }
    s_.sizes[0] = static_cast<std::uint32_t>(s_.sizes.size());
  }

  // ---- the second walk

  void writeInt(std::uint64_t v) {
    const std::uint8_t width = widthOf(v);
    p_[0] = static_cast<std::uint8_t>(0x10 | log2Width(width));
    putBE(p_ + 1, v, width);
    p_ += 1 + width;
  }

  void writeMarker(std::uint8_t type, std::uint64_t length) {
    *p_++ = static_cast<std::uint8_t>(type << 4 | (length < 15 ? length : 0xF));
    if (length >= 15) {
      writeInt(length);
    }
  }

  void writeReal(std::uint8_t type, double d) {
    if (type == 0x2 && static_cast<double>(static_cast<float>(d)) == d) {
      const float f = static_cast<float>(d);
      std::uint32_t bits = 0;
      std::memcpy(&bits, &f, sizeof bits);
      p_[0] = 0x22;
      putBE(p_ + 1, bits, 4);
      p_ += 5;
      return;
    }
    std::uint64_t bits = 0;
    std::memcpy(&bits, &d, sizeof bits);
    p_[0] = static_cast<std::uint8_t>(type << 4 | 3);
    putBE(p_ + 1, bits, 8);
    p_ += 9;
  }

  // libplist keeps a date as 32-bit seconds and microseconds: a date beyond
  // that is clamped, and the fraction kept to the microsecond.
  void writeDate(const Date& date) {
    double rel = date.secondsSince1970 - kEpochOffset;
    rel = std::isnan(rel) ? 0.0 : std::clamp(rel, -2147483648.0, 2147483647.0);
    const auto sec = static_cast<std::int32_t>(rel);
    const auto usec = static_cast<std::int32_t>((rel - sec) * 1e6);
    writeReal(0x3, sec + static_cast<double>(usec) / 1000000);
  }

  // The next string planned; bytes that are not UTF-8 become U+FFFD.
  void writeText(std::string_view s) {
    const std::uint64_t info = s_.texts[text_++];
    const std::uint64_t length = info & ~kAsciiText;
    if (info & kAsciiText) {
      writeMarker(0x5, length);
      std::memcpy(p_, s.data(), length);
      p_ += length;
      return;
    }
    auto& units = s_.units;
    units.clear();
    const auto* p = reinterpret_cast<const unsigned char*>(s.data());
    const auto* end = p + length;
    while (p < end) {
      std::uint32_t code = nextCodePoint(p, end);
      if (code == kBadUtf8) {
        code = 0xFFFD;
        ++p;
      }
      if (code >= 0x10000) {
        code -= 0x10000;
        units.push_back(static_cast<std::uint16_t>(0xD800 + (code >> 10)));
        units.push_back(static_cast<std::uint16_t>(0xDC00 + (code & 0x3FF)));
      } else {
        units.push_back(static_cast<std::uint16_t>(code));
      }
    }
    writeMarker(0x6, units.size());
    for (const std::uint16_t u : units) {
      *p_++ = static_cast<std::uint8_t>(u >> 8);
      *p_++ = static_cast<std::uint8_t>(u);
    }
  }

  void writeRef(std::uint64_t index) {
    if (refSize_ == 1) {
      *p_++ = static_cast<std::uint8_t>(index);
      return;
    }
    putBE(p_, index, refSize_);
    p_ += refSize_;
  }

  void mark(std::uint64_t index) { s_.offsets[index] = static_cast<std::uint64_t>(p_ - base_); }

  // Writes object `index` (`v`, not nil) and its subtree.
  void emit(const Value& v, std::uint64_t index) {
    mark(index);
    v.visit([this, index](const auto& x) {
      using T = std::decay_t<decltype(x)>;
      if constexpr (std::is_same_v<T, bool>) {
        *p_++ = x ? 0x09 : 0x08;
      } else if constexpr (std::is_same_v<T, std::int64_t>) {
        writeInt(static_cast<std::uint64_t>(x));
      } else if constexpr (std::is_same_v<T, std::uint64_t>) {
        if (x > static_cast<std::uint64_t>(INT64_MAX)) {
          // The unsigned form, so that the far end reads an unsigned number
          // (a negative one takes eight bytes).
          p_[0] = 0x14;
          putBE(p_ + 1, 0, 8);
          putBE(p_ + 9, x, 8);
          p_ += 17;
        } else {
          writeInt(x);
        }
      } else if constexpr (std::is_same_v<T, double>) {
        writeReal(0x2, x);
      } else if constexpr (std::is_same_v<T, Date>) {
        writeDate(x);
      } else if constexpr (std::is_same_v<T, std::string>) {
        writeText(x);
      } else if constexpr (std::is_same_v<T, Data>) {
        writeMarker(0x4, x.size());
        if (!x.empty()) {
          std::memcpy(p_, x.data(), x.size());
          p_ += x.size();
        }
      } else if constexpr (std::is_same_v<T, Array>) {
        std::uint64_t n = 0;
        for (const auto& e : x) n += e.isNil() ? 0 : 1;
        writeMarker(0xA, n);
        std::uint64_t child = index + 1;
        for (const auto& e : x) {
          if (!e.isNil()) {
            writeRef(child);
            child += s_.sizes[child];
          }
        }
        child = index + 1;
        for (const auto& e : x) {
          if (!e.isNil()) {
            emit(e, child);
            child += s_.sizes[child];
          }
        }
      } else if constexpr (std::is_same_v<T, Dictionary>) {
        emitEntries(x, index);
      }
    });
  }

  void emitEntries(const Dictionary& d, std::uint64_t index) {
    std::uint64_t n = 0;
    for (const auto& [k, e] : d) n += e.isNil() ? 0 : 1;
    writeMarker(0xD, n);
    std::uint64_t child = index + 1;
    for (const auto& [k, e] : d) {
      if (!e.isNil()) {
        writeRef(child);
        child += 1 + s_.sizes[child + 1];
      }
    }
    child = index + 1;
    for (const auto& [k, e] : d) {
      if (!e.isNil()) {
        writeRef(child + 1);
        child += 1 + s_.sizes[child + 1];
      }
    }
    child = index + 1;
    for (const auto& [k, e] : d) {
      if (!e.isNil()) {
        mark(child);
        writeText(k);
        emit(e, child + 1);
        child += 1 + s_.sizes[child + 1];
      }
    }
  }

  static bool written(const Field& f) { return f.kind != Field::Kind::Value || !f.value->isNil(); }

  void emit(std::span<const Field> fields, std::uint64_t index) {
    mark(index);
    std::uint64_t n = 0;
    for (const auto& f : fields) n += written(f) ? 1 : 0;
    writeMarker(0xD, n);
    std::uint64_t child = index + 1;
    for (const auto& f : fields) {
      if (written(f)) {
        writeRef(child);
        child += 1 + s_.sizes[child + 1];
      }
    }
    child = index + 1;
    for (const auto& f : fields) {
      if (written(f)) {
        writeRef(child + 1);
        child += 1 + s_.sizes[child + 1];
      }
    }
    child = index + 1;
    for (const auto& f : fields) {
      if (!written(f)) {
        continue;
      }
      mark(child);
      writeText(f.key);
      switch (f.kind) {
        case Field::Kind::Text:
          mark(child + 1);
          writeText(f.text);
          break;
        case Field::Kind::Integer:
          mark(child + 1);
          writeInt(f.integer);
          break;
        case Field::Kind::Dictionary:
          mark(child + 1);
          emitEntries(*f.dictionary, child + 1);
          break;
        case Field::Kind::Value:
          emit(*f.value, child + 1);
          break;
      }
      child += 1 + s_.sizes[child + 1];
    }
  }

  WriterScratch& s_;
  std::uint8_t* base_ = nullptr;
  std::uint8_t* p_ = nullptr;
  std::size_t bound_ = 0;
  std::size_t refs_ = 0;
  std::size_t depth_ = 0;
  std::size_t text_ = 0;
  std::uint8_t refSize_ = 1;

 public:
  // What the last run wrote, as a reader counts it against its limits.
  Shape shape() const { return Shape{depth_, s_.sizes.size()}; }
};

}  // namespace

std::optional<Value> decode(plist::Bytes bytes, const plist::Limits& limits, std::string* error, Text text) {
  Reader reader(bytes, limits, text);
  auto value = reader.run();
  if (!value && error) {
    *error = std::move(reader.error);
  }
  return value;
}

std::size_t encode(const Value& value, Data& out) {
  if (value.isNil()) {
    return 0;
  }
  const std::size_t at = out.size();
  const std::size_t n = Writer().run(value, out, at);
  out.resize(at + n);
  return n;
}

std::size_t encodeAt(std::span<const Field> fields, Data& buffer, std::size_t at, Shape* shape) {
  Writer writer;
  const std::size_t n = writer.run(fields, buffer, at);
  if (shape) {
    *shape = writer.shape();
  }
  return n;
}

}  // namespace zerith::bplist
