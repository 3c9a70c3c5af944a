#include "platform/PropertyList.h"

#include <plist/plist.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <memory>
#include <string_view>
#include <vector>

#include <fmt/format.h>

namespace zerith::plist {

namespace {

// Seconds between 1970-01-01 and 2001-01-01, the property-list epoch.
constexpr double kEpochOffset = 978307200.0;

struct PlistDeleter {
  void operator()(plist_t p) const { plist_free(p); }
};
using PlistPtr = std::unique_ptr<void, PlistDeleter>;

// ---- binary structural check ---------------------------------------------------

class BinaryChecker {
 public:
  BinaryChecker(Bytes bytes, const Limits& limits) : b_(bytes), limits_(limits) {}

  std::optional<std::string> run() {
    if (b_.size() > limits_.maxBytes) {
      return fmt::format("binary property list of {} bytes exceeds the limit of {}", b_.size(), limits_.maxBytes);
    }
    if (b_.size() < 8 + 32 + 1 || std::memcmp(b_.data(), "bplist00", 8) != 0) {
      return std::string("not a binary property list (bad header or too short)");
    }
    const auto* t = b_.data() + b_.size() - 32;
    offsetSize_ = t[6];
    refSize_ = t[7];
    numObjects_ = readBE(t + 8, 8);
    topObject_ = readBE(t + 16, 8);
    tableOffset_ = readBE(t + 24, 8);
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) {
      return std::string("binary trailer has invalid integer sizes");
    }
    if (numObjects_ == 0 || numObjects_ > limits_.maxNodes || topObject_ >= numObjects_) {
      return std::string("binary trailer has an invalid object count or top object");
    }
    const std::uint64_t tableEnd = b_.size() - 32;
    if (tableOffset_ < 9 || tableOffset_ > tableEnd ||
        numObjects_ > (tableEnd - tableOffset_) / offsetSize_) {
      return std::string("binary offset table is out of range");
    }
    objects_.assign(numObjects_, Object{});
    std::uint64_t nodes = 0;
    std::size_t height = 0;
    if (auto err = visit(topObject_, 1, nodes, height)) {
      return err;
    }
    return std::nullopt;
  }

 private:
  std::uint64_t readBE(const std::uint8_t* p, std::size_t n) const {
    std::uint64_t v = 0;
    for (std::size_t i = 0; i < n; ++i) {
      v = (v << 8) | p[i];
    }
    return v;
  }

  // Reads the length of a variable-size object; advances `pos` past it.
  std::optional<std::string> readLength(std::uint8_t info, std::uint64_t& pos, std::uint64_t& length) const {
    if (info != 0x0F) {
      length = info;
      return std::nullopt;
    }
    if (pos + 1 > tableOffset_) {
      return std::string("object length runs past the object area");
    }
    const std::uint8_t marker = b_[pos];
    if ((marker & 0xF0) != 0x10 || (marker & 0x0F) > 3) {
      return std::string("object length is not a small integer");
    }
    const std::uint64_t n = 1u << (marker & 0x0F);
    if (pos + 1 + n > tableOffset_) {
      return std::string("object length runs past the object area");
    }
    length = readBE(b_.data() + pos + 1, n);
    pos += 1 + n;
    return std::nullopt;
  }

  std::optional<std::string> fits(std::uint64_t pos, std::uint64_t count, std::uint64_t unit) const {
    if (unit != 0 && count > (tableOffset_ - std::min(pos, tableOffset_)) / unit) {
      return std::string("object content runs past the object area");
    }
    return std::nullopt;
  }

  // Depth-first walk with memoised expanded sizes; `depth` counts the current
  // path including this object.
  std::optional<std::string> visit(std::uint64_t ref, std::size_t depth, std::uint64_t& nodesOut,
                                   std::size_t& heightOut) {
    if (depth > limits_.maxDepth) {
      return fmt::format("nesting deeper than {}", limits_.maxDepth);
    }
    Object& object = objects_[ref];
    if (object.state == 2) {
      if (depth + object.height - 1 > limits_.maxDepth) {
        return fmt::format("nesting deeper than {}", limits_.maxDepth);
      }
      nodesOut = object.expanded;
      heightOut = object.height;
      return std::nullopt;
    }
    if (object.state == 1) {
      return std::string("object references form a cycle");
    }
    object.state = 1;

    const std::uint64_t offset = readBE(b_.data() + tableOffset_ + ref * offsetSize_, offsetSize_);
    if (offset < 8 || offset >= tableOffset_) {
      return std::string("object offset is out of range");
    }
    const std::uint8_t marker = b_[offset];
    const std::uint8_t type = marker >> 4;
    const std::uint8_t info = marker & 0x0F;
    std::uint64_t pos = offset + 1;
    std::uint64_t nodes = 1;
    std::size_t height = 1;

    switch (type) {
      case 0x0:
        if (info != 0x0 && info != 0x8 && info != 0x9 && info != 0xF) {
          return std::string("unknown simple object");
        }
        break;
      case 0x1:
        if (info > 4) {
          return std::string("integer of unsupported size");
        }
        if (auto e = fits(pos, 1ull << info, 1)) return e;
        break;
      case 0x2:
        if (info != 2 && info != 3) {
          return std::string("real of unsupported size");
        }
        if (auto e = fits(pos, 1ull << info, 1)) return e;
        break;
      case 0x3:
        if (info != 3) {
          return std::string("date of unsupported size");
        }
        if (auto e = fits(pos, 8, 1)) return e;
        break;
      case 0x4:
      case 0x5:
      case 0x6:
      case 0x8: {
        std::uint64_t length = 0;
        if (type == 0x8) {
          length = info + 1u;
        } else if (auto e = readLength(info, pos, length)) {
          return e;
        }
        if (auto e = fits(pos, length, type == 0x6 ? 2 : 1)) return e;
        // libplist asserts that a string has no NUL inside (and aborts the
        // process when it has): such strings are refused here.
        if (type == 0x5 && std::find(b_.begin() + pos, b_.begin() + pos + length, 0) != b_.begin() + pos + length) {
          return std::string("string holds a NUL character");
        }
        if (type == 0x6) {
          for (std::uint64_t i = 0; i < length; ++i) {
            if (b_[pos + 2 * i] == 0 && b_[pos + 2 * i + 1] == 0) {
              return std::string("string holds a NUL character");
            }
          }
        }
        break;
      }
      case 0xA:
      case 0xC:
      case 0xD: {
        std::uint64_t count = 0;
        if (auto e = readLength(info, pos, count)) {
          return e;
        }
        const std::uint64_t refs = type == 0xD ? count * 2 : count;
        if (count > limits_.maxNodes) {
          return std::string("container holds too many objects");
        }
        if (auto e = fits(pos, refs, refSize_)) return e;
        for (std::uint64_t i = 0; i < refs; ++i) {
          const std::uint64_t child = readBE(b_.data() + pos + i * refSize_, refSize_);
          if (child >= numObjects_) {
            return std::string("object reference is out of range");
          }
          if (type == 0xD && i < count) {
            // Keys must be strings.
            const std::uint64_t keyOffset = readBE(b_.data() + tableOffset_ + child * offsetSize_, offsetSize_);
            if (keyOffset < 8 || keyOffset >= tableOffset_ || ((b_[keyOffset] >> 4) != 0x5 && (b_[keyOffset] >> 4) != 0x6)) {
              return std::string("dictionary key is not a string");
            }
          }
          std::uint64_t childNodes = 0;
          std::size_t childHeight = 0;
          if (auto e = visit(child, depth + 1, childNodes, childHeight)) {
            return e;
          }
          nodes += childNodes;
          height = std::max(height, childHeight + 1);
          if (nodes > limits_.maxNodes) {
            return fmt::format("expands to more than {} nodes", limits_.maxNodes);
          }
        }
        break;
      }
      default:
        return fmt::format("unknown object type 0x{:x}", type);
    }
    // A height is at most the depth limit, which a walk's stack bounds well
    // below 2^32.
    objects_[ref] = Object{nodes, static_cast<std::uint32_t>(height), 2};
    nodesOut = nodes;
    heightOut = height;
    return std::nullopt;
  }

  Bytes b_;
  const Limits& limits_;
  std::uint8_t offsetSize_ = 0;
  std::uint8_t refSize_ = 0;
  std::uint64_t numObjects_ = 0;
  std::uint64_t topObject_ = 0;
  std::uint64_t tableOffset_ = 0;
  // What the walk knows of each object, in one vector (one allocation).
  struct Object {
    std::uint64_t expanded = 0;  // nodes it expands to
    std::uint32_t height = 0;
    std::uint8_t state = 0;  // 0 unvisited, 1 on the current path, 2 done
  };
  std::vector<Object> objects_;
};

// ---- libplist <-> Value ---------------------------------------------------------

Value fromNode(plist_t node) {
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      std::uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return Value(b != 0);
    }
    case PLIST_UINT: {
      // libplist 2.2 keeps every integer as 64 raw bits; the binary format
      // stores signed 64-bit integers, so the bits are read as signed.
      std::uint64_t v = 0;
      plist_get_uint_val(node, &v);
      return Value(static_cast<long long>(v));
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return Value(d);
    }
    case PLIST_STRING: {
      // Read in place (the node keeps its text until the tree is freed)
      // instead of through a copy of it. The text ends at its first NUL, as
      // a copy made by libplist would.
      const char* s = plist_get_string_ptr(node, nullptr);
      return Value(std::string(s ? s : ""));
    }
    case PLIST_KEY: {
      char* s = nullptr;
      plist_get_key_val(node, &s);
      std::string out = s ? s : "";
      std::free(s);
      return Value(std::move(out));
    }
    case PLIST_DATA: {
      std::uint64_t length = 0;
      const auto* d = reinterpret_cast<const std::uint8_t*>(plist_get_data_ptr(node, &length));
      return Value(d ? Data(d, d + length) : Data());
    }
    case PLIST_DATE: {
      std::int32_t sec = 0;
      std::int32_t usec = 0;
      plist_get_date_val(node, &sec, &usec);
      return Value(Date{sec + usec / 1e6 + kEpochOffset});
    }
    case PLIST_UID: {
      std::uint64_t uid = 0;
      plist_get_uid_val(node, &uid);
      return Value(Dictionary{{"CF$UID", Value(static_cast<unsigned long long>(uid))}});
    }
    case PLIST_ARRAY: {
      Array out;
      const std::uint32_t n = plist_array_get_size(node);
      out.reserve(n);
      for (std::uint32_t i = 0; i < n; ++i) {
        out.push_back(fromNode(plist_array_get_item(node, i)));
      }
      return Value(std::move(out));
    }
    case PLIST_DICT: {
      Dictionary out;
      out.reserve(plist_dict_get_size(node));
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      for (;;) {
        char* key = nullptr;
        plist_t item = nullptr;
        plist_dict_next_item(node, it, &key, &item);
        if (!item) {
          std::free(key);
          break;
        }
        out.set(key ? key : "", fromNode(item));
        std::free(key);
      }
      std::free(it);
      return Value(std::move(out));
    }
    default:
      return {};
  }
}

plist_t toNode(const Value& v) {
  switch (v.type()) {
    case Value::Type::Nil: return nullptr;
    case Value::Type::Bool: return plist_new_bool(v.boolValue() ? 1 : 0);
    case Value::Type::Int:
    case Value::Type::UInt: return plist_new_uint(v.unsignedValue());
    case Value::Type::Real: return plist_new_real(v.doubleValue());
    case Value::Type::String: return plist_new_string(v.string()->c_str());
    case Value::Type::Data:
      return plist_new_data(reinterpret_cast<const char*>(v.data()->data()), v.data()->size());
    case Value::Type::Date: {
      // libplist 2.2 keeps dates as 32-bit seconds: dates beyond that range
      // (a client can send any) are clamped instead of overflowing the cast.
      double rel = v.date()->secondsSince1970 - kEpochOffset;
      rel = std::isnan(rel) ? 0.0 : std::clamp(rel, -2147483648.0, 2147483647.0);
      auto sec = static_cast<std::int32_t>(rel);
      auto usec = static_cast<std::int32_t>((rel - sec) * 1e6);
      return plist_new_date(sec, usec);
    }
    case Value::Type::Array: {
      plist_t a = plist_new_array();
      for (const auto& e : *v.array()) {
        if (plist_t n = toNode(e)) {
          plist_array_append_item(a, n);
        }
      }
      return a;
    }
    case Value::Type::Dict: {
      plist_t d = plist_new_dict();
      for (const auto& [k, e] : *v.dict()) {
        if (plist_t n = toNode(e)) {
          plist_dict_set_item(d, k.c_str(), n);
        }
      }
      return d;
    }
  }
  return nullptr;
}

void setError(std::string* error, std::string text) {
  if (error) {
    *error = std::move(text);
  }
}

// Skips `<? ... ?>`, `<!-- ... -->` and `<!...>`; returns false on an
// unterminated construct.
bool skipMarkup(std::string_view s, std::size_t& i) {
  if (s.compare(i, 4, "<!--") == 0) {
    const auto end = s.find("-->", i + 4);
    if (end == std::string_view::npos) return false;
    i = end + 3;
    return true;
  }
  const auto end = s.find('>', i);
  if (end == std::string_view::npos) return false;
  i = end + 1;
  return true;
}

}  // namespace

bool looksBinary(Bytes bytes) { return bytes.size() >= 8 && std::memcmp(bytes.data(), "bplist00", 8) == 0; }

std::optional<std::string> checkBinary(Bytes bytes, const Limits& limits) {
  return BinaryChecker(bytes, limits).run();
}

std::optional<std::string> checkXml(Bytes bytes, const Limits& limits) {
  if (bytes.size() > limits.maxBytes) {
    return fmt::format("XML property list of {} bytes exceeds the limit of {}", bytes.size(), limits.maxBytes);
  }
  const std::string_view s(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  if (s.find('\0') != std::string_view::npos) {
    return std::string("XML property list contains a NUL byte");
  }
  if (s.find("<!ENTITY") != std::string_view::npos) {
    return std::string("XML property list declares entities");
  }
  std::size_t depth = 0;
  std::size_t nodes = 0;
  std::size_t i = 0;
  while ((i = s.find('<', i)) != std::string_view::npos) {
    if (i + 1 < s.size() && (s[i + 1] == '?' || s[i + 1] == '!')) {
      if (!skipMarkup(s, i)) {
        return std::string("unterminated XML markup");
      }
      continue;
    }
    const auto end = s.find('>', i);
    if (end == std::string_view::npos) {
      return std::string("unterminated XML tag");
    }
    std::string_view tag = s.substr(i + 1, end - i - 1);
    const bool closing = !tag.empty() && tag.front() == '/';
    const bool selfClosing = !tag.empty() && tag.back() == '/';
    if (closing) tag.remove_prefix(1);
    const auto nameEnd = tag.find_first_of(" \t\r\n/");
    const std::string_view name = tag.substr(0, nameEnd);
    const bool container = name == "dict" || name == "array";
    if (!closing && name != "plist" && name != "key") {
      if (++nodes > limits.maxNodes) {
        return fmt::format("expands to more than {} nodes", limits.maxNodes);
      }
    }
    if (container && !selfClosing) {
      if (closing) {
        if (depth == 0) {
          return std::string("unbalanced XML containers");
        }
        --depth;
      } else if (++depth > limits.maxDepth) {
        return fmt::format("nesting deeper than {}", limits.maxDepth);
      }
    }
    i = end + 1;
  }
  if (depth != 0) {
    return std::string("unbalanced XML containers");
  }
  return std::nullopt;
}

std::optional<Value> decodeBinary(Bytes bytes, const Limits& limits, std::string* error) {
  if (auto why = checkBinary(bytes, limits)) {
    setError(error, *why);
    return std::nullopt;
  }
  plist_t root = nullptr;
  plist_from_bin(reinterpret_cast<const char*>(bytes.data()), static_cast<std::uint32_t>(bytes.size()), &root);
  PlistPtr guard(root);
  if (!root) {
    setError(error, "libplist could not parse the binary property list");
    return std::nullopt;
  }
  return fromNode(root);
}

std::optional<Value> decodeXml(Bytes bytes, const Limits& limits, std::string* error) {
  if (auto why = checkXml(bytes, limits)) {
    setError(error, *why);
    return std::nullopt;
  }
  plist_t root = nullptr;
  plist_from_xml(reinterpret_cast<const char*>(bytes.data()), static_cast<std::uint32_t>(bytes.size()), &root);
  PlistPtr guard(root);
  if (!root) {
    setError(error, "libplist could not parse the XML property list");
    return std::nullopt;
  }
  return fromNode(root);
}

std::optional<Value> decode(Bytes bytes, const Limits& limits, std::string* error) {
  return looksBinary(bytes) ? decodeBinary(bytes, limits, error) : decodeXml(bytes, limits, error);
}

Data encodeBinary(const Value& value) {
  PlistPtr root(toNode(value));
  if (!root) {
    return {};
  }
  char* out = nullptr;
  std::uint32_t len = 0;
  plist_to_bin(root.get(), &out, &len);
  Data data(reinterpret_cast<std::uint8_t*>(out), reinterpret_cast<std::uint8_t*>(out) + (out ? len : 0));
  plist_to_bin_free(out);
  return data;
}

std::string encodeXml(const Value& value) {
  PlistPtr root(toNode(value));
  if (!root) {
    return {};
  }
  char* out = nullptr;
  std::uint32_t len = 0;
  plist_to_xml(root.get(), &out, &len);
  std::string xml(out ? out : "", out ? len : 0);
  plist_to_xml_free(out);
  return xml;
}

}  // namespace zerith::plist
