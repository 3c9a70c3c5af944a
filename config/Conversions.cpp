#include "config/Conversions.h"

#include <arpa/inet.h>
#include <malloc.h>

#include <algorithm>
#include <cmath>
#include <cstring>

#include "zerith/ZerithConstants.h"

namespace zerith {

Error makeZerithError(std::string description, std::int64_t code) {
  return Error{kZerithErrorDomain, code, std::move(description)};
}

double timevalToSeconds(const timeval& time) {
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}

double sanitizeDouble(double value) { return std::isfinite(value) ? value : -1.0; }

std::int64_t roundDownToMinute(std::int64_t seconds) { return seconds / 60 * 60; }

void makeIPv4SocketAddress(std::string_view ipString, std::uint16_t port, sockaddr_in* address) {
  if (address == nullptr) {
    return;
  }
  // 16 characters and a terminator: inet_addr needs a terminated string even
  // when the caller's text fills all 16.
  char dotted[17] = {};
  std::memcpy(dotted, ipString.data(), std::min<std::size_t>(ipString.size(), 16));
  const in_addr_t converted = ::inet_addr(dotted);
  std::memset(address, 0, sizeof(*address));
  address->sin_family = AF_INET;
  address->sin_addr.s_addr = converted;
  address->sin_port = htons(port);
}

namespace {

// A key lives inside its dictionary's entry block; only a key too long for
// the inline buffer has a heap block of its own.
std::size_t keyAllocationSize(const std::string& key) {
  if (key.capacity() <= std::string().capacity()) {
    return 0;
  }
  return malloc_usable_size(const_cast<char*>(key.data()));
}

}  // namespace

std::size_t estimatedPlistMemorySize(const Value& object) {
  if (const Dictionary* dict = object.dict()) {
    std::size_t size = 0;
    for (const auto& [key, value] : *dict) {
      size += keyAllocationSize(key);
      size += estimatedPlistMemorySize(value) + value.allocationSize();
    }
    return size + object.allocationSize();
  }
  if (const Array* array = object.array()) {
    std::size_t size = 0;
    for (const Value& element : *array) {
      size += estimatedPlistMemorySize(element) + element.allocationSize();
    }
    return size + object.allocationSize();
  }
  return object.allocationSize();
}

}  // namespace zerith
