#include <gtest/gtest.h>

#include <limits>
#include <string>

#include "platform/Crypto.h"
#include "platform/Json.h"
#include "platform/Value.h"

namespace zerith {
namespace {

TEST(ValueTest, CopiesShareOneNodeAndBuildersDoNotAliasIt) {
  // Built from shared small values too (1, true).
  Dictionary d{{"a", 1}, {"t", true}};
  const Value frozen(d);
  const Value copy = frozen;
  EXPECT_EQ(frozen.identity(), copy.identity());
  d.set("a", 2);
  EXPECT_EQ(frozen, Value(Dictionary{{"a", 1}, {"t", true}}));
  EXPECT_EQ(Value(d)["a"].intValue(), 2);
  Dictionary changed = frozen.dictCopy();
  changed.set("a", 5);
  EXPECT_EQ(frozen["a"].intValue(), 1);
}

TEST(ValueTest, DictionaryKeepsOrderAcrossItsIndexThreshold) {
  Dictionary d;
  for (int i = 0; i < 40; ++i) d.set("k" + std::to_string(i), i);
  d.set("k3", 300);  // replace keeps position
  EXPECT_TRUE(d.erase("k10"));
  EXPECT_FALSE(d.erase("k10"));
  EXPECT_EQ(d.size(), 39u);
  EXPECT_EQ(d.entries()[3].second.intValue(), 300);
  EXPECT_EQ(d.entries()[10].first, "k11");
  for (int i = 0; i < 40; ++i) {
    if (i != 10) {
      EXPECT_TRUE(d.contains("k" + std::to_string(i))) << i;
    }
  }
}

TEST(ValueTest, NumberConversionsBehaveLikeBoxedNumbers) {
  EXPECT_EQ(Value(true).intValue(), 1);
  EXPECT_EQ(Value(3.9).intValue(), 3);
  EXPECT_EQ(Value("  42abc").intValue(), 42);
  EXPECT_EQ(Value(-1).unsignedValue() & 0xFFFFFFFFu, 0xFFFFFFFFu);
  EXPECT_EQ(Value(Dictionary{}).intValue(), 0);
  EXPECT_TRUE(Value("YES").boolValue());
  EXPECT_FALSE(Value("0").boolValue());
  EXPECT_TRUE(Value()["x"].isNil());
  EXPECT_TRUE(Value(Array{}).at(3).isNil());
}

TEST(ValueTest, JsonKeepsOrderAndEncodesDataAsBase64) {
  Value v(Dictionary{{"z", 1}, {"a", Array{Value("x"), Value(false)}}, {"d", Data{'h', 'i'}}, {"n", Value()}});
  EXPECT_EQ(json::serialize(v), R"({"z":1,"a":["x",false],"d":"aGk=","n":null})");
  EXPECT_EQ(json::fromJson(nlohmann::ordered_json::parse(R"({"q":[1,2.5,"s"]})"))["q"].at(1).doubleValue(), 2.5);
}

TEST(ValueTest, JsonFromCallersIsRefusedWithItsReasonWhenBrokenOrTooDeep) {
  std::string why;
  EXPECT_EQ(json::parseValue(R"({"q":[1,"]"]})", &why), Value(Dictionary{{"q", Array{Value(1), Value("]")}}})) << why;
  EXPECT_FALSE(json::parseValue("{\"q\":", &why));
  EXPECT_EQ(why, "is not valid JSON");
  // Deep enough to overflow a thread's stack in the conversion: refused
  // before anything is parsed. Brackets inside strings do not count.
  const std::string deep = std::string(200000, '[') + std::string(200000, ']');
  EXPECT_FALSE(json::parseValue(deep, &why));
  EXPECT_EQ(why, "nests deeper than 32 levels");
  EXPECT_TRUE(json::parseValue(std::string(32, '[') + std::string(32, ']')));
  EXPECT_FALSE(json::parseValue(std::string(33, '[') + std::string(33, ']')));
  EXPECT_EQ(json::nestingDepth("{\"a\":\"[[[[\\\"[[[\"}", 100), 1u);
}

TEST(ValueTest, SharedSmallNumbersBehaveAsNumbersMadeApart) {
  // Booleans and integers from -1 to 255 share their nodes; either side of
  // that range they are made apart. Type, equality and identity of copies
  // are the same for both.
  for (long long n : {-2LL, -1LL, 0LL, 1LL, 254LL, 255LL, 256LL}) {
    const Value a(n);
    const Value b(static_cast<double>(n));
    EXPECT_EQ(a.type(), Value::Type::Int) << n;
    EXPECT_EQ(a.intValue(), n);
    EXPECT_EQ(a, b) << n;
    EXPECT_EQ(a, Value(n)) << n;
    EXPECT_FALSE(a == Value(n + 1)) << n;
    if (n >= 0) {
      EXPECT_EQ(Value(static_cast<unsigned long long>(n)), a) << n;
      EXPECT_EQ(Value(static_cast<unsigned long long>(n)).type(), Value::Type::Int) << n;
    }
    const Value copy = a;
    EXPECT_EQ(copy.identity(), a.identity());
  }
  EXPECT_EQ(Value(7).identity(), Value(7u).identity());
  EXPECT_NE(Value(256).identity(), Value(256).identity());
  EXPECT_EQ(Value(std::numeric_limits<unsigned long long>::max()).type(), Value::Type::UInt);
  // A boolean is not the number of the same value, shared node or not.
  EXPECT_TRUE(Value(true).isBool());
  EXPECT_FALSE(Value(true) == Value(1));
  EXPECT_FALSE(Value(false) == Value(0));
  EXPECT_FALSE(Value(true) == Value(false));
  EXPECT_EQ(Value().allocationSize(), 0u);
  EXPECT_GT(Value(5).allocationSize(), 0u);
  EXPECT_EQ(Value(5).allocationSize(), Value(100000).allocationSize());
  EXPECT_GT(Value(std::string(100, 'x')).allocationSize(), Value("x").allocationSize() + 90);
}

TEST(ValueTest, CopyWithRoomKeepsEntriesOrderAndLookupsApartFromTheOriginal) {
  for (int size : {0, 3, 15, 16, 40}) {
    Dictionary original;
    for (int i = 0; i < size; ++i) original.set("k" + std::to_string(i), i);
    Dictionary copy(original, static_cast<std::size_t>(size) + 20);
    EXPECT_EQ(copy, original) << size;
    EXPECT_GE(copy.entries().capacity(), static_cast<std::size_t>(size) + 20);
    for (int i = 0; i < 20; ++i) copy.set("new" + std::to_string(i), i);
    if (size > 0) {
      copy.set("k0", 100);  // replaced in place
    }
    EXPECT_EQ(copy.size(), static_cast<std::size_t>(size) + 20) << size;
    EXPECT_EQ(original.size(), static_cast<std::size_t>(size));
    EXPECT_FALSE(original.contains("new0"));
    for (int i = 0; i < size; ++i) {
      EXPECT_EQ(copy.entries()[static_cast<std::size_t>(i)].first, "k" + std::to_string(i));
      EXPECT_EQ(original.get("k" + std::to_string(i)).intValue(), i);
    }
    for (int i = 0; i < 20; ++i) EXPECT_EQ(copy.get("new" + std::to_string(i)).intValue(), i) << size;
    if (size > 0) {
      EXPECT_EQ(copy.get("k0").intValue(), 100);
    }
  }
  // Asked for less room than the original holds: a whole copy all the same.
  Dictionary three{{"a", 1}, {"b", 2}, {"c", 3}};
  EXPECT_EQ(Dictionary(three, 1), three);
}

TEST(CryptoTest, Base64IgnoresForeignCharactersAndRejectsTruncation) {
  EXPECT_EQ(crypto::base64Encode(crypto::bytesOf("hello")), "aGVsbG8=");
  auto d = crypto::base64Decode("aGV s\nbG8=\r\n");
  ASSERT_TRUE(d);
  EXPECT_EQ(std::string(d->begin(), d->end()), "hello");
  EXPECT_FALSE(crypto::base64Decode("aGVsb"));  // one dangling symbol
  EXPECT_TRUE(crypto::base64Decode(""));
}

TEST(CryptoTest, DigestsAndRandomRanges) {
  EXPECT_EQ(crypto::hexLower(crypto::sha256(crypto::bytesOf("abc"))),
            "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
  EXPECT_EQ(crypto::hexLower(crypto::hmacSha1(crypto::bytesOf("key"), crypto::bytesOf("The quick brown fox jumps over the lazy dog"))),
            "de7c9b85b8b78aa6bc8a7a36f70a90701c9db4d9");
  for (int i = 0; i < 1000; ++i) EXPECT_LE(crypto::randomUniform(9), 9u);
  const std::string u = crypto::newUUIDString();
  EXPECT_EQ(u.size(), 36u);
  EXPECT_EQ(u[14], '4');
  EXPECT_EQ(u.find_first_of("abcdef"), std::string::npos);
}

}  // namespace
}  // namespace zerith
