#include <gtest/gtest.h>

#include <cmath>

#include "platform/Crypto.h"
#include "platform/Json.h"
#include "platform/Value.h"

namespace zerith {
namespace {

TEST(ValueTest, CopiesShareOneNodeAndBuildersDoNotAliasIt) {
  Dictionary d{{"a", 1}};
  const Value frozen(d);
  const Value copy = frozen;
  EXPECT_EQ(frozen.identity(), copy.identity());
  d.set("b", 2);
  EXPECT_EQ(frozen.count(), 1u);
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
  EXPECT_EQ(Value(5), Value(5.0));
  EXPECT_EQ(Value(5u), Value(5));
  EXPECT_FALSE(Value(1) == Value(true) && Value(true).isNumber());
  EXPECT_TRUE(Value()["x"].isNil());
  EXPECT_TRUE(Value(Array{}).at(3).isNil());
}

TEST(ValueTest, JsonKeepsOrderAndEncodesDataAsBase64) {
  Value v(Dictionary{{"z", 1}, {"a", Array{Value("x"), Value(false)}}, {"d", Data{'h', 'i'}}, {"n", Value()}});
  EXPECT_EQ(json::serialize(v), R"({"z":1,"a":["x",false],"d":"aGk=","n":null})");
  EXPECT_EQ(json::fromJson(nlohmann::ordered_json::parse(R"({"q":[1,2.5,"s"]})"))["q"].at(1).doubleValue(), 2.5);
}

TEST(ValueTest, AllocationSizeCountsHeapBuffers) {
  EXPECT_EQ(Value().allocationSize(), 0u);
  EXPECT_GT(Value(std::string(100, 'x')).allocationSize(), Value("x").allocationSize() + 90);
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
