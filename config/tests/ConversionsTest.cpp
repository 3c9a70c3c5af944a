#include <gtest/gtest.h>
#include <arpa/inet.h>

#include <array>
#include <cmath>
#include <cstring>
#include <limits>

#include "config/Conversions.h"

namespace zerith {
namespace {

TEST(ConversionsTest, TimevalKeepsTheMicrosecondFraction) {
  EXPECT_DOUBLE_EQ(timevalToSeconds(timeval{1000, 500000}), 1000.5);
  EXPECT_DOUBLE_EQ(timevalToSeconds(timeval{1700000000, 1}), 1700000000.000001);
  EXPECT_DOUBLE_EQ(timevalToSeconds(timeval{0, 0}), 0.0);
}

TEST(ConversionsTest, NonFiniteDoublesBecomeMinusOne) {
  EXPECT_EQ(sanitizeDouble(std::numeric_limits<double>::quiet_NaN()), -1.0);
  EXPECT_EQ(sanitizeDouble(std::numeric_limits<double>::infinity()), -1.0);
  EXPECT_EQ(sanitizeDouble(-std::numeric_limits<double>::infinity()), -1.0);
  EXPECT_EQ(sanitizeDouble(-0.5), -0.5);
  EXPECT_EQ(sanitizeDouble(std::numeric_limits<double>::max()), std::numeric_limits<double>::max());
}

TEST(ConversionsTest, MinutesTruncateTowardsZero) {
  EXPECT_EQ(roundDownToMinute(119), 60);
  EXPECT_EQ(roundDownToMinute(-61), -60);
  EXPECT_EQ(roundDownToMinute(59), 0);
  EXPECT_EQ(roundDownToMinute(-59), 0);
  EXPECT_EQ(roundDownToMinute(120), 120);
  EXPECT_EQ(roundDownToMinute(1000), 960);
}

TEST(ConversionsTest, SocketAddressIsZeroFilledWithPortInNetworkOrder) {
  sockaddr_in address;
  std::memset(&address, 0xAB, sizeof(address));
  makeIPv4SocketAddress("127.0.0.1", 8080, &address);
  EXPECT_EQ(address.sin_family, AF_INET);
  const auto* port = reinterpret_cast<const unsigned char*>(&address.sin_port);
  EXPECT_EQ(port[0], 0x1F);
  EXPECT_EQ(port[1], 0x90);
  const auto* ip = reinterpret_cast<const unsigned char*>(&address.sin_addr);
  EXPECT_EQ((std::array<unsigned char, 4>{ip[0], ip[1], ip[2], ip[3]}), (std::array<unsigned char, 4>{127, 0, 0, 1}));
  for (unsigned char b : address.sin_zero) {
    EXPECT_EQ(b, 0);
  }
}

TEST(ConversionsTest, SocketAddressReadsNoMoreThanSixteenCharacters) {
  // Sixteen characters without a terminator: nothing past them is read
  // (the sanitizer build checks), and the text is no dotted quad.
  const char unterminated[16] = {'1', '9', '2', '.', '1', '6', '8', '.', '1', '0', '0', '.', '1', '0', '0', '0'};
  sockaddr_in address{};
  makeIPv4SocketAddress(std::string_view(unterminated, 16), 53, &address);
  EXPECT_EQ(address.sin_addr.s_addr, INADDR_NONE);
  EXPECT_EQ(ntohs(address.sin_port), 53);

  makeIPv4SocketAddress("255.255.255.254 and more text", 1, &address);
  EXPECT_EQ(address.sin_addr.s_addr, inet_addr("255.255.255.254"));
  makeIPv4SocketAddress("", 1, &address);
  EXPECT_EQ(address.sin_addr.s_addr, INADDR_NONE);
  makeIPv4SocketAddress("10.0.0.1", 1, nullptr);
}

TEST(ConversionsTest, MemoryEstimateIsAScalarsAllocationAndCountsLeavesInContainersTwice) {
  EXPECT_EQ(estimatedPlistMemorySize(Value()), 0u);
  EXPECT_GT(Value(42).allocationSize(), 0u);
  EXPECT_EQ(estimatedPlistMemorySize(Value(42)), Value(42).allocationSize());
  const Value a(std::string(100, 'a'));
  EXPECT_GE(estimatedPlistMemorySize(a), 100u);
  const Value b(7);
  const Value array(Array{a, b});
  EXPECT_EQ(estimatedPlistMemorySize(array),
            2 * a.allocationSize() + 2 * b.allocationSize() + array.allocationSize());

  // A key longer than the inline buffer adds its own block; a short one
  // lives inside the dictionary's entries.
  const std::string longKey(64, 'k');
  const Value dict(Dictionary{{"s", a}, {longKey, b}});
  const std::size_t withoutKeys = 2 * a.allocationSize() + 2 * b.allocationSize() + dict.allocationSize();
  EXPECT_GE(estimatedPlistMemorySize(dict), withoutKeys + 64);
  EXPECT_LT(estimatedPlistMemorySize(dict), withoutKeys + 128);

  // Nesting: the inner container's estimate plus its allocation again.
  const Value outer(Array{array});
  EXPECT_EQ(estimatedPlistMemorySize(outer),
            estimatedPlistMemorySize(array) + array.allocationSize() + outer.allocationSize());
}

}  // namespace
}  // namespace zerith
