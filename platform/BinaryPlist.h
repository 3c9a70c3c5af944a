#pragma once

// The socket's own binary property-list codec.
//
// Frames are read and written on every event, in the daemon and in the client
// framework, so they do not go through libplist: the reader walks a frame's
// bytes once, enforcing the same bounds as plist::checkBinary (size, trailer,
// offset table, references in range, no cycles, nesting depth, the expanded
// node count with each object visited once) while it builds the Value tree;
// an object referenced twice is built once and shared. The writer lays a
// Value tree out as libplist does (objects depth first, keys before values,
// smallest widths, ASCII or UTF-16 strings) straight into the caller's buffer,
// without merging equal scalars into one object.
//
// What a frame never carries is refused: null and fill objects, sets, UIDs,
// dates beyond 32-bit seconds from 2001 (libplist keeps no more). Where the
// reader accepts a list, libplist reads it to an equal tree; the differential
// fuzz target holds it to that.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/PropertyList.h"
#include "platform/Value.h"

namespace zerith::bplist {

enum class Text { Any, Utf8Only };
// The error of a read with Text::Utf8Only that met such text.
inline constexpr const char* kNotUtf8 = "holds text that is not valid UTF-8";

// The Value tree of a binary property list, or nullopt (and, when `error` is
// given, why) when the bytes break a bound or the format, or, with
// Text::Utf8Only, hold a string or key that is not strict UTF-8 (text in
// UTF-16 always reads as UTF-8).
std::optional<Value> decode(plist::Bytes bytes, const plist::Limits& limits = {}, std::string* error = nullptr,
                            Text text = Text::Any);

// Appends the binary property list of `value` to `out` and returns the bytes
// appended. nil entries inside containers are left out (a property list has
// no nil); nil itself appends nothing. A string ends at its first NUL, as it
// does through libplist; bytes that are not UTF-8 become U+FFFD.
std::size_t encode(const Value& value, Data& out);

// One entry of a dictionary written without being built as a Value first (a
// frame's envelope around its arguments).
struct Field {
  enum class Kind { Text, Integer, Dictionary, Value };
  std::string_view key;
  Kind kind = Kind::Value;
  std::string_view text{};
  std::uint64_t integer = 0;
  const zerith::Dictionary* dictionary = nullptr;
  const zerith::Value* value = nullptr;  // a nil value leaves the entry out
};
inline Field textField(std::string_view key, std::string_view text) { return {key, Field::Kind::Text, text}; }
inline Field integerField(std::string_view key, std::uint64_t n) { return {key, Field::Kind::Integer, {}, n}; }
inline Field dictionaryField(std::string_view key, const zerith::Dictionary& d) {
  return {key, Field::Kind::Dictionary, {}, 0, &d};
}
inline Field valueField(std::string_view key, const zerith::Value& v) {
  return {key, Field::Kind::Value, {}, 0, nullptr, &v};
}

// What a writer wrote, as decode() counts it against plist::Limits: the
// deepest nesting (the root is 1, a container's keys and values one below
// it) and the objects.
struct Shape {
  std::size_t depth = 0;
  std::size_t objects = 0;
};

// Writes the binary property list of the dictionary of `fields` (in that
// order, keys not repeated) at offset `at` of `buffer`, as encode() would
// write that dictionary built as a Value, and returns its size. The buffer
// grows to make room and is not shrunk: a reused buffer is written without
// being cleared or reallocated. With `shape`, says what it wrote.
std::size_t encodeAt(std::span<const Field> fields, Data& buffer, std::size_t at, Shape* shape = nullptr);

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF.
bool validUtf8(std::string_view text);

}  // namespace zerith::bplist
