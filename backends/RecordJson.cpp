#include "backends/RecordJson.h"

#include <cmath>
#include <cstdint>
#include <cstring>
#include <string_view>
#include <type_traits>

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

// What a text holds, eight bytes at a time: bytes above ASCII (then it may
// need making UTF-8), and characters JSON escapes (control characters,
// quote, backslash; bytes above ASCII pass as they are, as the writer
// passes UTF-8).
struct TextScan {
  bool high = false;
  bool special = false;
};
TextScan scanText(std::string_view s) {
  constexpr std::uint64_t kOnes = 0x0101010101010101u;
  constexpr std::uint64_t kHighs = 0x8080808080808080u;
  std::uint64_t high = 0;
  std::uint64_t special = 0;
  const auto add = [&](std::uint64_t w) {
    const std::uint64_t quote = w ^ (kOnes * '"');
    const std::uint64_t backslash = w ^ (kOnes * '\\');
    high |= w;
    special |= ((w - kOnes * 0x20) & ~w) | ((quote - kOnes) & ~quote) | ((backslash - kOnes) & ~backslash);
  };
  std::size_t i = 0;
  for (; i + 8 <= s.size(); i += 8) {
    std::uint64_t w = 0;
    std::memcpy(&w, s.data() + i, 8);
    add(w);
  }
  if (i < s.size()) {
    std::uint64_t w = kOnes * 'a';  // the last few bytes, filled up with plain ones
    std::memcpy(&w, s.data() + i, s.size() - i);
    add(w);
  }
  return {(high & kHighs) != 0, (special & kHighs) != 0};
}

struct Scratch {
  rapidjson::StringBuffer& buffer;  // what the writer writes into
  std::string text{};               // text made UTF-8
};

// A key or a string value: plain text is copied between its quotes in one
// go, other text goes through the writer's escaping.
void writeText(Writer& w, std::string_view s, Scratch& scratch) {
  TextScan scan = scanText(s);
  std::string_view text = s;
  if (scan.high) {
    text = utf8(s, scratch.text);
    scan = scanText(text);
  }
  if (!scan.special) {
    // The writer puts the separator before a value (comma or colon) and
    // keeps count; the text follows it straight into the buffer, as
    // RawValue would copy it a byte at a time.
    w.RawValue("", 0, rapidjson::kStringType);
    char* at = scratch.buffer.Push(text.size() + 2);
    at[0] = '"';
    std::memcpy(at + 1, text.data(), text.size());
    at[text.size() + 1] = '"';
  } else {
    w.String(text.data(), static_cast<rapidjson::SizeType>(text.size()));
  }
}

// Whether JSON carries the value: not nil, data, a nested array or
// dictionary, nor a real that is not finite.
bool carried(const Value& v) {
  return v.visit([](const auto& x) -> bool {
    using T = std::decay_t<decltype(x)>;
    if constexpr (std::is_same_v<T, double>) {
      return std::isfinite(x);
    } else {
      return std::is_same_v<T, bool> || std::is_same_v<T, std::int64_t> || std::is_same_v<T, std::uint64_t> ||
             std::is_same_v<T, std::string> || std::is_same_v<T, Date>;
    }
  });
}

// Writes `key` and the value when JSON carries it; false, with nothing
// written, otherwise.
bool writeEntry(Writer& w, std::string_view key, const Value& v, Scratch& scratch) {
  if (!carried(v)) {
    return false;
  }
  writeText(w, key, scratch);
  v.visit([&](const auto& x) {
    using T = std::decay_t<decltype(x)>;
    if constexpr (std::is_same_v<T, double>) {
      w.Double(x);
    } else if constexpr (std::is_same_v<T, bool>) {
      w.Bool(x);
    } else if constexpr (std::is_same_v<T, std::int64_t>) {
      w.Int64(x);
    } else if constexpr (std::is_same_v<T, std::uint64_t>) {
      w.Uint64(x);
    } else if constexpr (std::is_same_v<T, std::string>) {
      writeText(w, x, scratch);
    } else if constexpr (std::is_same_v<T, Date>) {
      w.Double(sanitizeDouble(x.secondsSince1970));
    }
  });
  return true;
}

}  // namespace

std::string envelopeJson(double postTime, const std::optional<std::string>& clientId,
                         const std::vector<Dictionary>& records, const std::function<std::string()>& recordID,
                         const std::function<void(const std::string& key, const Value& value)>& dropped) {
  // Room for a typical record's text, so the buffer seldom grows.
  rapidjson::StringBuffer buffer(nullptr, 64 + (clientId ? records.size() * 768 : 0));
  Writer w(buffer);
  Scratch scratch{buffer};
  w.StartObject();
  w.Key("postTime");
  w.Double(sanitizeDouble(postTime));
  if (clientId) {
    w.Key("clientId");
    writeText(w, *clientId, scratch);
    w.Key("events");
    w.StartArray();
    for (const Dictionary& record : records) {
      w.StartObject();
      for (const auto& [key, value] : record) {
        if (recordID && key == "_recordID") {
          continue;  // the spool's own identifier below takes its place: one key, not two
        }
        if (!writeEntry(w, key, value, scratch) && dropped) {
          dropped(key, value);
        }
      }
      if (recordID) {
        w.Key("_recordID");
        writeText(w, recordID(), scratch);
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
