#include <gtest/gtest.h>
#include <arpa/inet.h>

#include <cstring>
#include <iterator>
#include <limits>
#include <string>

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
  const std::pair<std::int64_t, std::int64_t> cases[] = {{119, 60},  {-61, -60}, {59, 0},
                                                          {-59, 0},  {120, 120}, {1000, 960}};
  for (const auto& [seconds, minute] : cases) EXPECT_EQ(roundDownToMinute(seconds), minute) << seconds;
}

TEST(ConversionsTest, SocketAddressIsZeroFilledWithPortInNetworkOrder) {
  sockaddr_in address;
  std::memset(&address, 0xAB, sizeof(address));
  makeIPv4SocketAddress("127.0.0.1", 8080, &address);
  EXPECT_EQ(address.sin_family, AF_INET);
  EXPECT_EQ(ntohs(address.sin_port), 8080);
  EXPECT_EQ(ntohl(address.sin_addr.s_addr), INADDR_LOOPBACK);
  EXPECT_EQ(std::string(std::begin(address.sin_zero), std::end(address.sin_zero)), std::string(8, '\0'));
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
