#include "backends/RecordJson.h"

#include <cmath>
#include <cstdint>
#include <cstring>
#include <string_view>

#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include "config/Conversions.h"

namespace zerith {

namespace {

using Writer = rapidjson::Writer<rapidjson::StringBuffer>;

// `s`, or when it is not UTF-8 its copy in `scratch` with each ill-formed
// sequence (the longest start of a valid one, or a byte no sequence starts
// with) replaced by U+FFFD: a sequence cut short costs one replacement and
// the byte that cut it is read again.
std::string_view utf8(std::string_view s, std::string& scratch) {
  std::string* out = nullptr;
  // Most text is ASCII: passed over eight bytes at a time.
  std::size_t i = 0;
  for (std::uint64_t word = 0; i + 8 <= s.size(); i += 8) {
    std::memcpy(&word, s.data() + i, 8);
    if (word & 0x8080808080808080u) {
      break;
    }
  }
  while (i < s.size()) {
    const auto c = static_cast<unsigned char>(s[i]);
    if (c < 0x80) {
      if (out) {
        out->push_back(static_cast<char>(c));
      }
      ++i;
      continue;
    }
    std::size_t need = 0;  // continuation bytes; the first in [lo, hi]
    unsigned char lo = 0x80;
    unsigned char hi = 0xBF;
    if (c >= 0xC2 && c <= 0xDF) {
      need = 1;
    } else if (c >= 0xE0 && c <= 0xEF) {
      need = 2;
      lo = c == 0xE0 ? 0xA0 : 0x80;
      hi = c == 0xED ? 0x9F : 0xBF;
    } else if (c >= 0xF0 && c <= 0xF4) {
      need = 3;
      lo = c == 0xF0 ? 0x90 : 0x80;
      hi = c == 0xF4 ? 0x8F : 0xBF;
    }
    std::size_t end = i + 1;
    for (std::size_t k = 0; k < need && end < s.size(); ++k, ++end) {
      const auto d = static_cast<unsigned char>(s[end]);
      if (d < lo || d > hi) {
        break;
      }
      lo = 0x80;
      hi = 0xBF;
    }
    const bool whole = need != 0 && end - i == need + 1;
    if (!whole && !out) {
      scratch.assign(s.data(), i);
      out = &scratch;
    }
    if (out) {
      out->append(whole ? s.substr(i, end - i) : std::string_view("\xEF\xBF\xBD"));
    }
    i = end;
  }
  return out ? std::string_view(*out) : s;
}

void writeKey(Writer& w, std::string_view key, std::string& scratch) {
  const std::string_view text = utf8(key, scratch);
  w.Key(text.data(), static_cast<rapidjson::SizeType>(text.size()));
}

void writeString(Writer& w, std::string_view s, std::string& scratch) {
  const std::string_view text = utf8(s, scratch);
  w.String(text.data(), static_cast<rapidjson::SizeType>(text.size()));
}

// Whether JSON carries the value: not nil, data, a nested array or
// dictionary, nor a real that is not finite.
bool carried(const Value& v) {
  switch (v.type()) {
    case Value::Type::Real: return std::isfinite(v.doubleValue());
    case Value::Type::Bool:
    case Value::Type::Int:
    case Value::Type::UInt:
    case Value::Type::String:
    case Value::Type::Date: return true;
    default: return false;
  }
}

void writeValue(Writer& w, const Value& v, std::string& scratch) {
  switch (v.type()) {
    case Value::Type::Bool: w.Bool(v.boolValue()); break;
    case Value::Type::Int: w.Int64(v.intValue()); break;
    case Value::Type::UInt: w.Uint64(v.unsignedValue()); break;
    case Value::Type::Real: w.Double(v.doubleValue()); break;
    case Value::Type::String: writeString(w, *v.string(), scratch); break;
    case Value::Type::Date: w.Double(sanitizeDouble(v.date()->secondsSince1970)); break;
    default: break;
  }
}

}  // namespace

std::string envelopeJson(double postTime, const std::optional<std::string>& clientId,
                         const std::vector<Dictionary>& records, const std::function<std::string()>& recordID,
                         const std::function<void(const std::string& key, const Value& value)>& dropped) {
  // Room for a typical record's text, so the buffer seldom grows.
  rapidjson::StringBuffer buffer(nullptr, 64 + (clientId ? records.size() * 768 : 0));
  Writer w(buffer);
  std::string scratch;
  w.StartObject();
  w.Key("postTime");
  w.Double(sanitizeDouble(postTime));
  if (clientId) {
    w.Key("clientId");
    writeString(w, *clientId, scratch);
    w.Key("events");
    w.StartArray();
    for (const Dictionary& record : records) {
      w.StartObject();
      for (const auto& [key, value] : record) {
        if (recordID && key == "_recordID") {
          continue;  // the spool's own identifier below takes its place: one key, not two
        }
        if (carried(value)) {
          writeKey(w, key, scratch);
          writeValue(w, value, scratch);
        } else if (dropped) {
          dropped(key, value);
        }
      }
      if (recordID) {
        w.Key("_recordID");
        writeString(w, recordID(), scratch);
      }
      w.EndObject();
    }
    w.EndArray();
  } else if (dropped) {
    // No record goes out, but what the records could not carry is told all
    // the same.
    for (const Dictionary& record : records) {
      for (const auto& [key, value] : record) {
        if (!carried(value)) {
          dropped(key, value);
        }
      }
    }
  }
  w.EndObject();
  return std::string(buffer.GetString(), buffer.GetSize());
}

}  // namespace zerith
