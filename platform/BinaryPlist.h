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
#include <optional>
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

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF.
bool validUtf8(std::string_view text);

}  // namespace zerith::bplist
