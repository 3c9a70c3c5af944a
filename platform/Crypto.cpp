#include "platform/Crypto.h"

#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>
#include <openssl/sha.h>

#include <cstdio>
#include <cstdlib>

namespace zerith::crypto {

std::string base64Encode(Bytes bytes) {
  std::string out(4 * ((bytes.size() + 2) / 3), '\0');
  const int n = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data()), bytes.data(),
                                static_cast<int>(bytes.size()));
  out.resize(static_cast<std::size_t>(n));
  return out;
}

std::optional<Data> base64Decode(std::string_view text) {
  auto sextet = [](char c) -> int {
    if (c >= 'A' && c <= 'Z') return c - 'A';
    if (c >= 'a' && c <= 'z') return c - 'a' + 26;
    if (c >= '0' && c <= '9') return c - '0' + 52;
    if (c == '+') return 62;
    if (c == '/') return 63;
    return -1;
  };
  Data out;
  out.reserve(text.size() * 3 / 4);
  std::uint32_t acc = 0;
  int bits = 0;
  std::size_t symbols = 0;
  std::size_t padding = 0;
  for (char c : text) {
    if (c == '=') {
      ++padding;
      continue;
    }
    const int v = sextet(c);
    if (v < 0) {
      continue;  // foreign characters are ignored
    }
    if (padding > 0) {
      return std::nullopt;  // data after padding
    }
    ++symbols;
    acc = (acc << 6) | static_cast<std::uint32_t>(v);
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      out.push_back(static_cast<std::uint8_t>((acc >> bits) & 0xFF));
    }
  }
  // A final group of one symbol cannot hold a byte: the text was cut short.
  if (symbols % 4 == 1 || padding > 2) {
    return std::nullopt;
  }
  return out;
}

std::array<std::uint8_t, 20> sha1(Bytes bytes) {
  std::array<std::uint8_t, 20> d{};
  SHA1(bytes.data(), bytes.size(), d.data());
  return d;
}

std::array<std::uint8_t, 32> sha256(Bytes bytes) {
  std::array<std::uint8_t, 32> d{};
  SHA256(bytes.data(), bytes.size(), d.data());
  return d;
}

std::array<std::uint8_t, 20> hmacSha1(Bytes key, Bytes message) {
  std::array<std::uint8_t, 20> d{};
  unsigned int len = 0;
  HMAC(EVP_sha1(), key.data(), static_cast<int>(key.size()), message.data(), message.size(), d.data(), &len);
  return d;
}

std::string hexLower(Bytes bytes) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  out.reserve(bytes.size() * 2);
  for (auto b : bytes) {
    out.push_back(kHex[b >> 4]);
    out.push_back(kHex[b & 0xF]);
  }
  return out;
}

void randomBytes(std::span<std::uint8_t> out) {
  if (RAND_bytes(out.data(), static_cast<int>(out.size())) != 1) {
    std::fputs("zerith: the system's cryptographic random source failed\n", stderr);
    std::abort();
  }
}

std::uint32_t randomUniform(std::uint32_t upperInclusive) {
  if (upperInclusive == 0xFFFFFFFFu) {
    std::uint32_t v = 0;
    randomBytes({reinterpret_cast<std::uint8_t*>(&v), sizeof v});
    return v;
  }
  // Rejection sampling: no modulo bias.
  const std::uint64_t range = std::uint64_t{upperInclusive} + 1;
  const std::uint64_t limit = (std::uint64_t{1} << 32) - ((std::uint64_t{1} << 32) % range);
  for (;;) {
    std::uint32_t v = 0;
    randomBytes({reinterpret_cast<std::uint8_t*>(&v), sizeof v});
    if (v < limit) {
      return static_cast<std::uint32_t>(v % range);
    }
  }
}

std::array<std::uint8_t, 16> uuidBytes() {
  std::array<std::uint8_t, 16> b{};
  randomBytes(b);
  b[6] = static_cast<std::uint8_t>((b[6] & 0x0F) | 0x40);
  b[8] = static_cast<std::uint8_t>((b[8] & 0x3F) | 0x80);
  return b;
}

std::string uuidString(const std::array<std::uint8_t, 16>& b) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (std::size_t i = 0; i < 16; ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) {
      out.push_back('-');
    }
    out.push_back(kHex[b[i] >> 4]);
    out.push_back(kHex[b[i] & 0xF]);
  }
  return out;
}

}  // namespace zerith::crypto
