#include "backends/DashboardDatagram.h"

#include <cstring>

#include <fmt/format.h>

#include "config/SenderCodes.h"

namespace zerith::dashboard {

namespace {

void put16(std::uint8_t* at, std::uint16_t v) {
  at[0] = static_cast<std::uint8_t>(v >> 8);
  at[1] = static_cast<std::uint8_t>(v);
}

void put32(std::uint8_t* at, std::uint32_t v) {
  at[0] = static_cast<std::uint8_t>(v >> 24);
  at[1] = static_cast<std::uint8_t>(v >> 16);
  at[2] = static_cast<std::uint8_t>(v >> 8);
  at[3] = static_cast<std::uint8_t>(v);
}

std::uint16_t get16(const std::uint8_t* at) { return static_cast<std::uint16_t>((at[0] << 8) | at[1]); }

std::uint32_t get32(const std::uint8_t* at) {
  return (static_cast<std::uint32_t>(at[0]) << 24) | (static_cast<std::uint32_t>(at[1]) << 16) |
         (static_cast<std::uint32_t>(at[2]) << 8) | at[3];
}

// The part of `s` a C string would see: up to its first zero byte.
std::string_view cString(std::string_view s) { return s.substr(0, s.find('\0')); }

std::string unescape(std::string_view s) {
  std::string out;
  out.reserve(s.size());
  for (std::size_t i = 0; i < s.size(); ++i) {
    if (s[i] == '\\' && i + 1 < s.size()) {
      ++i;
    }
    out.push_back(s[i]);
  }
  return out;
}

// Splits " k1=v1 k2=v2 ...": every unescaped "=" ends a key, which starts
// after the last blank before it (keys carry no blanks; values may).
void splitItems(std::string_view text, Decoded& d) {
  if (text.empty()) {
    return;
  }
  std::vector<std::size_t> equals;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\') {
      ++i;
    } else if (text[i] == '=') {
      equals.push_back(i);
    }
  }
  if (text[0] != ' ' || equals.empty()) {
    d.wellFormedText = false;
    return;
  }
  std::vector<std::size_t> keyStarts;
  std::size_t floor = 0;
  for (const std::size_t e : equals) {
    const std::size_t blank = text.rfind(' ', e);
    if (blank == std::string_view::npos || blank < floor || (keyStarts.empty() && blank != 0)) {
      d.wellFormedText = false;
      break;
    }
    keyStarts.push_back(blank + 1);
    floor = e + 1;
  }
  for (std::size_t k = 0; k < keyStarts.size(); ++k) {
    const std::size_t e = equals[k];
    const std::size_t valueEnd = k + 1 < keyStarts.size() ? keyStarts[k + 1] - 1 : text.size();
    d.items.emplace_back(std::string(text.substr(keyStarts[k], e - keyStarts[k])),
                         unescape(text.substr(e + 1, valueEnd - e - 1)));
  }
}

}  // namespace

std::string_view senderCodeText(std::uint8_t index) {
  return index < kSenderCodeTable.size() ? senderCode(index) : std::string_view("Unknown");
}

std::string sanitize(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    if (c == '\n') {
      continue;
    }
    if (c == '\\') {
      out += "\\\\";
    } else if (c == '=') {
      out += "\\=";
    } else {
      out.push_back(c);
    }
  }
  return out.empty() ? std::string("empty") : out;
}

std::string buildText(const std::vector<std::pair<std::string, std::string>>& items) {
  std::string text;
  for (const auto& [key, value] : items) {
    if (text.size() >= kTextArea - 1) {
      break;
    }
    text += ' ';
    text += cString(key);
    text += '=';
    text += cString(value);
    if (text.size() > kTextArea - 1) {
      text.resize(kTextArea - 1);
    }
  }
  return text;
}

std::vector<std::uint8_t> encode(const Header& h, std::string_view text) {
  text = text.substr(0, kTextArea - 1);
  std::vector<std::uint8_t> out(kHeaderSize + text.size(), 0);
  std::uint8_t* p = out.data();
  p[0] = h.selfVersionMajor;
  p[1] = h.senderIndex;
  p[2] = 1;
  p[3] = static_cast<std::uint8_t>(h.microseconds / 4000);
  put32(p + 4, h.seconds);
  put32(p + 8, ~h.sessionID);
  put16(p + 12, static_cast<std::uint16_t>(~h.clientVersion));
  put16(p + 14, static_cast<std::uint16_t>(~static_cast<std::uint16_t>(out.size())));
  put16(p + 16, h.method);
  put16(p + 18, h.respCode);
  if (h.udid != nullptr) {
    // As they stand, without a terminator; a shorter identifier is padded
    // with zeros rather than read past its end.
    std::memcpy(p + 20, h.udid, strnlen(h.udid, kUdidBytes));
  }
  put16(p + kEventNumberOffset, h.eventNumber);
  put16(p + 62, h.flags);
  std::memcpy(p + kHeaderSize, text.data(), text.size());
  return out;
}

std::optional<std::string> localLogLine(std::span<const std::uint8_t> d) {
  if (d.size() < kHeaderSize) {
    return std::nullopt;
  }
  char udid[kUdidBytes + 1] = {};
  std::memcpy(udid, d.data() + 20, kUdidBytes);
  const std::string_view text(reinterpret_cast<const char*>(d.data() + kHeaderSize),
                              std::min(d.size() - kHeaderSize, kTextArea - 1));
  std::string line = fmt::format("{}.{:03d} {} 127.0.0.1 {} {:5d} {:5d} {:5d} {:5d} {:5d} {}", get32(d.data() + 4),
                                 d[3] * 4, static_cast<const char*>(udid), senderCodeText(d[1]),
                                 static_cast<std::uint16_t>(~get16(d.data() + 12)), ~get32(d.data() + 8),
                                 get16(d.data() + kEventNumberOffset), get16(d.data() + 16), get16(d.data() + 18),
                                 cString(text));
  if (line.size() > kLogLineArea - 1) {
    line.resize(kLogLineArea - 1);
  }
  return line;
}

std::optional<Decoded> decode(std::span<const std::uint8_t> d, std::string* why) {
  auto refuse = [why](std::string reason) -> std::optional<Decoded> {
    if (why != nullptr) {
      *why = std::move(reason);
    }
    return std::nullopt;
  };
  if (d.size() < kHeaderSize) {
    return refuse(fmt::format("{} bytes, shorter than the 64-byte header", d.size()));
  }
  if (d.size() > kHeaderSize + kTextArea - 1) {
    return refuse(fmt::format("{} bytes, longer than a datagram can be", d.size()));
  }
  Decoded out;
  out.length = static_cast<std::uint16_t>(~get16(d.data() + 14));
  if (out.length != d.size()) {
    return refuse(fmt::format("length field says {} bytes, {} arrived", out.length, d.size()));
  }
  out.selfVersionMajor = d[0];
  out.senderIndex = d[1];
  out.senderCode = std::string(senderCodeText(d[1]));
  out.constant = d[2];
  out.milliseconds = d[3] * 4u;
  out.seconds = get32(d.data() + 4);
  out.sessionID = ~get32(d.data() + 8);
  out.clientVersion = static_cast<std::uint16_t>(~get16(d.data() + 12));
  out.method = get16(d.data() + 16);
  out.respCode = get16(d.data() + 18);
  out.udid = std::string(cString(std::string_view(reinterpret_cast<const char*>(d.data() + 20), kUdidBytes)));
  out.eventNumber = get16(d.data() + kEventNumberOffset);
  out.flags = get16(d.data() + 62);
  out.text.assign(reinterpret_cast<const char*>(d.data() + kHeaderSize), d.size() - kHeaderSize);
  splitItems(out.text, out);
  return out;
}

std::optional<std::uint16_t> acknowledgedEventNumber(std::span<const std::uint8_t> bytes, bool truncated) {
  if (truncated || bytes.size() < kMinAcknowledgement || bytes.size() > kMaxDatagram) {
    return std::nullopt;
  }
  return get16(bytes.data() + kEventNumberOffset);
}

}  // namespace zerith::dashboard
