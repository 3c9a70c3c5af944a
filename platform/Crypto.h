#pragma once

// The few cryptographic and encoding primitives zerithd needs, on OpenSSL 3.

#include <array>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace zerith::crypto {

using Bytes = std::span<const std::uint8_t>;

inline Bytes bytesOf(std::string_view s) { return {reinterpret_cast<const std::uint8_t*>(s.data()), s.size()}; }

// Standard base64 with padding and no line breaks.
std::string base64Encode(Bytes bytes);
// Decodes base64 text, ignoring every character outside the base64 alphabet
// (line breaks, spaces, foreign bytes). nullopt when what remains is not a
// whole base64 text (a truncated final group).
std::optional<Data> base64Decode(std::string_view text);

std::array<std::uint8_t, 20> sha1(Bytes bytes);
std::array<std::uint8_t, 32> sha256(Bytes bytes);
std::array<std::uint8_t, 20> hmacSha1(Bytes key, Bytes message);
std::string hexLower(Bytes bytes);

// Cryptographically strong random bytes; aborts if the system source fails.
void randomBytes(std::span<std::uint8_t> out);
// Uniform integer in [0, upperInclusive] from the cryptographic source.
std::uint32_t randomUniform(std::uint32_t upperInclusive);

// A random (version 4) UUID: its 16 bytes, and its canonical upper-case text
// 8-4-4-4-12 ("E621E1F8-C36C-495A-93FC-0C247A3E6E5F").
std::array<std::uint8_t, 16> uuidBytes();
std::string uuidString(const std::array<std::uint8_t, 16>& bytes);
inline std::string newUUIDString() { return uuidString(uuidBytes()); }

}  // namespace zerith::crypto
