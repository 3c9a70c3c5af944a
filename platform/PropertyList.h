#pragma once

// Property-list encoding and decoding through libplist, behind a structural
// check of our own.
//
// Untrusted property lists (client frames, storebag containers, cache and
// defaults files) never reach libplist unchecked: Debian's libplist 2.2 has no
// size, depth or reference limits, and a crafted binary list of a few hundred
// bytes whose objects reference each other many times expands into a tree of
// gigabytes. `check...` walks the raw bytes first: size, the binary trailer and
// offset table in range, every object's extent inside the object area, every
// reference to an existing object, no cycles, nesting depth and the expanded
// node count (each object visited once, its expanded size memoised) bounded.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "platform/Value.h"

namespace zerith::plist {

struct Limits {
  std::size_t maxBytes = 8u << 20;     // whole encoded list
  std::size_t maxDepth = 48;           // nesting of arrays and dictionaries
  std::size_t maxNodes = 1u << 20;     // nodes after references are expanded
};

using Bytes = std::span<const std::uint8_t>;

// nullopt when the bytes pass; otherwise why they do not.
std::optional<std::string> checkBinary(Bytes bytes, const Limits& limits = {});
std::optional<std::string> checkXml(Bytes bytes, const Limits& limits = {});

bool looksBinary(Bytes bytes);

// Check, then decode. On failure returns nullopt and, when `error` is given,
// says why. A decoded list whose root is nothing libplist can represent as a
// Value is a failure too.
std::optional<Value> decodeBinary(Bytes bytes, const Limits& limits = {}, std::string* error = nullptr);
std::optional<Value> decodeXml(Bytes bytes, const Limits& limits = {}, std::string* error = nullptr);
// Binary when the bytes start with the binary magic, XML otherwise.
std::optional<Value> decode(Bytes bytes, const Limits& limits = {}, std::string* error = nullptr);

// Dates keep whole seconds through libplist 2.2 (its XML form has no
// fraction).
//
// Encoding. nil entries inside containers are left out (a property list has
// no nil); encoding nil itself gives an empty result.
Data encodeBinary(const Value& value);
std::string encodeXml(const Value& value);

inline Bytes bytesOf(const std::string& s) {
  return {reinterpret_cast<const std::uint8_t*>(s.data()), s.size()};
}
inline Bytes bytesOf(const Data& d) { return {d.data(), d.size()}; }

}  // namespace zerith::plist
