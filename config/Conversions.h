#pragma once

// Small conversions the sessions and backends share: the error maker, time
// values, JSON-safe doubles, IPv4 socket addresses and the memory estimate of
// a property-list value.

#include <netinet/in.h>
#include <sys/time.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Value.h"

namespace zerith {

// An error in kZerithErrorDomain with `code` and `description` as its
// localised description.
Error makeZerithError(std::string description, std::int64_t code);

// Whole seconds plus microseconds / 1e6.
double timevalToSeconds(const timeval& time);

// `value`, or -1.0 when it is NaN or infinite (JSON carries neither).
double sanitizeDouble(double value);

// Truncated towards zero to a multiple of 60: 119 -> 60, -61 -> -60.
std::int64_t roundDownToMinute(std::int64_t seconds);

// Fills `address` for `ipString`:`port`. At most 16 characters of the dotted
// address are used (the longest dotted quad has 15), converted with
// inet_addr; the rest of the structure is zero. Linux's sockaddr_in has no
// length byte, so the length that other systems store there is skipped.
void makeIPv4SocketAddress(std::string_view ipString, std::uint16_t port, sockaddr_in* address);

// Estimated bytes held by a property-list value: a container counts its own
// blocks, each key's heap block, and for every element its estimate plus its
// allocation size again (leaves are thus counted twice, as the health figures
// and batch sizes have always been reported); a scalar counts its own blocks.
std::size_t estimatedPlistMemorySize(const Value& object);

}  // namespace zerith
