#pragma once

// The dashboard datagram on the wire, shared by the dashboard backend, the
// zerith-dashboard receiver and the fuzz target.
//
// One datagram is a 64-byte header and a text of at most 1,023 bytes, with
// every multi-byte integer big-endian:
//
//   0  1  self version major            12  2  ~clientVersion
//   1  1  sender code index (compType)  14  2  ~(64 + text length)
//   2  1  constant 1                    16  2  method (event category)
//   3  1  microseconds / 4000           18  2  respCode (event type)
//   4  4  whole seconds                 20 40  device identifier bytes
//   8  4  ~sessionID                    60  2  event number
//                                       62  2  flags (1 reliable, 2 not from a profile)
//   64 n  " key=value" items, no terminating zero
//
// Session, client version and length travel complemented on purpose.
//
// An acknowledgement is any datagram of at least 62 bytes whose bytes 60-61
// carry the acknowledged event number; receivers echo the header.
//
// Everything that decodes bytes from the network checks their length before
// reading a field.

#include <sys/time.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zerith::dashboard {

inline constexpr std::size_t kHeaderSize = 64;
inline constexpr std::size_t kTextArea = 1024;  // the text is cut at kTextArea - 1 bytes
inline constexpr std::size_t kMaxDatagram = kHeaderSize + kTextArea;  // 1,088
inline constexpr std::size_t kLogLineArea = 1152;
inline constexpr std::size_t kUdidBytes = 40;
inline constexpr std::size_t kEventNumberOffset = 60;
inline constexpr std::size_t kMinAcknowledgement = kEventNumberOffset + 2;

inline constexpr std::uint16_t kFlagReliable = 1;
inline constexpr std::uint16_t kFlagNotFromProfile = 2;

struct Header {
  std::uint8_t selfVersionMajor = 0;
  std::uint8_t senderIndex = 0;
  std::uint32_t seconds = 0;
  std::uint32_t microseconds = 0;  // stored in steps of 4 ms
  std::uint32_t sessionID = 0;
  std::uint16_t clientVersion = 0;
  std::uint16_t method = 0;
  std::uint16_t respCode = 0;
  const char* udid = nullptr;  // the first 40 bytes are copied as they stand; nullptr: zeros
  std::uint16_t eventNumber = 0;
  std::uint16_t flags = 0;
};

// A whole datagram: the header, then `text` cut at 1,023 bytes.
std::vector<std::uint8_t> encode(const Header& header, std::string_view text);

// The text from key/value pairs: each appended as " key=value", the whole
// cut at 1,023 bytes. A key or value ends at its first zero byte, as a C
// string would.
std::string buildText(const std::vector<std::pair<std::string, std::string>>& items);

// Value text as it travels: line feeds removed, then every backslash doubled,
// then every "=" escaped with a backslash; an empty result is "empty".
std::string sanitize(std::string_view text);

// The readable line of one datagram:
// "<s>.<ms> <udid> 127.0.0.1 <code> <clientVersion> <sessionID> <event> <method> <respCode> <text>"
// with the numbers right-aligned in 5 columns. nullopt for fewer than 64 bytes.
std::optional<std::string> localLogLine(std::span<const std::uint8_t> datagram);

// A datagram taken apart, for receivers. Fields are read only after the
// length checks passed.
struct Decoded {
  std::uint8_t selfVersionMajor = 0;
  std::uint8_t senderIndex = 0;
  std::string senderCode;  // "Unknown" beyond the table
  std::uint8_t constant = 0;
  std::uint32_t seconds = 0;
  std::uint32_t milliseconds = 0;
  std::uint32_t sessionID = 0;
  std::uint16_t clientVersion = 0;
  std::uint16_t length = 0;
  std::uint16_t method = 0;
  std::uint16_t respCode = 0;
  std::string udid;  // up to the first zero byte of the 40
  std::uint16_t eventNumber = 0;
  std::uint16_t flags = 0;
  std::string text;
  // The text split back into items, escapes undone. Items whose shape is
  // not " key=value" make `wellFormedText` false and are left out.
  std::vector<std::pair<std::string, std::string>> items;
  bool wellFormedText = true;
};

// nullopt with the reason in `why` for fewer than 64 or more than 1,088
// bytes, or a length field that does not match the size.
std::optional<Decoded> decode(std::span<const std::uint8_t> datagram, std::string* why = nullptr);

// What a received acknowledgement says, after its checks: nullopt for fewer
// than 62 bytes or a datagram that was cut (more than 1,088 bytes).
std::optional<std::uint16_t> acknowledgedEventNumber(std::span<const std::uint8_t> bytes, bool truncated);

// The sender code of an index; "Unknown" beyond the table.
std::string_view senderCodeText(std::uint8_t index);

}  // namespace zerith::dashboard
