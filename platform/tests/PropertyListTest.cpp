#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "platform/PropertyList.h"

namespace zerith {
namespace {

Value sample() {
  return Value(Dictionary{
      {"name", "zerith"},
      {"count", 42},
      {"negative", -1},
      {"ratio", 0.25},
      {"on", true},
      {"blob", Data{0, 1, 2, 255}},
      {"when", Date{1700000000}},
      {"list", Array{Value(1), Value("two"), Value(Dictionary{{"three", 3}})}},
  });
}

TEST(PropertyListTest, BinaryAndXmlRoundTripKeepTypesAndOrder) {
  const Value v = sample();
  for (bool binary : {true, false}) {
    std::optional<Value> back;
    if (binary) {
      back = plist::decode(plist::bytesOf(plist::encodeBinary(v)));
    } else {
      back = plist::decode(plist::bytesOf(plist::encodeXml(v)));
    }
    ASSERT_TRUE(back) << (binary ? "binary" : "xml");
    EXPECT_EQ(*back, v);
    std::vector<std::string> keys;
    for (const auto& [k, _] : *back->dict()) keys.push_back(k);
    EXPECT_EQ(keys, (std::vector<std::string>{"name", "count", "negative", "ratio", "on", "blob", "when", "list"}));
    EXPECT_EQ((*back)["negative"].intValue(), -1);
    EXPECT_NEAR((*back)["when"].date()->secondsSince1970, 1700000000, 1e-3);
  }
}

TEST(PropertyListTest, NilEntriesAreLeftOut) {
  Dictionary d{{"a", 1}, {"b", Value()}};
  auto back = plist::decode(plist::bytesOf(plist::encodeBinary(Value(d))));
  ASSERT_TRUE(back);
  EXPECT_EQ(back->count(), 1u);
  EXPECT_TRUE(plist::encodeBinary(Value()).empty());
}

constexpr char kMagic[] = "bplist00";

// Builds a binary list by hand: objects, then offset table, then trailer.
struct BinaryBuilder {
  Data bytes = Data(std::begin(kMagic), std::end(kMagic) - 1);
  std::vector<std::uint64_t> offsets;
  std::size_t add(std::initializer_list<std::uint8_t> object) {
    offsets.push_back(bytes.size());
    bytes.insert(bytes.end(), object);
    return offsets.size() - 1;
  }
  Data finish(std::uint64_t top, std::uint64_t numObjects = 0, std::uint8_t refSize = 1) {
    Data out = bytes;
    const std::uint64_t table = out.size();
    for (auto o : offsets) out.push_back(static_cast<std::uint8_t>(o));
    Data trailer(32, 0);
    trailer[6] = 1;
    trailer[7] = refSize;
    auto put = [&](std::size_t at, std::uint64_t v) {
      for (int i = 7; i >= 0; --i) trailer[at + 7 - i] = static_cast<std::uint8_t>(v >> (8 * i));
    };
    put(8, numObjects ? numObjects : offsets.size());
    put(16, top);
    put(24, table);
    out.insert(out.end(), trailer.begin(), trailer.end());
    return out;
  }
};

TEST(PropertyListTest, SharedReferencesThatExpandExponentiallyAreRejected) {
  // Each array holds its predecessor twice: 2^40 nodes once expanded, from a
  // list of a few hundred bytes.
  BinaryBuilder b;
  b.add({0x10, 0x01});  // integer 1
  for (int i = 1; i <= 40; ++i) {
    b.add({0xA2, static_cast<std::uint8_t>(i - 1), static_cast<std::uint8_t>(i - 1)});
  }
  const Data evil = b.finish(40);
  EXPECT_LT(evil.size(), 300u);
  std::string why;
  plist::Limits limits;
  limits.maxDepth = 100;
  EXPECT_FALSE(plist::decodeBinary(plist::bytesOf(evil), limits, &why));
  EXPECT_NE(why.find("expands to more than"), std::string::npos) << why;
}

TEST(PropertyListTest, CyclesDepthAndBadOffsetsAreRejected) {
  {
    BinaryBuilder b;
    b.add({0xA1, 0x00});  // an array that contains itself
    std::string why;
    EXPECT_FALSE(plist::decodeBinary(plist::bytesOf(b.finish(0)), {}, &why));
    EXPECT_NE(why.find("cycle"), std::string::npos) << why;
  }
  {
    BinaryBuilder b;
    b.add({0x10, 0x01});
    for (int i = 1; i <= 60; ++i) b.add({0xA1, static_cast<std::uint8_t>(i - 1)});
    std::string why;
    EXPECT_FALSE(plist::decodeBinary(plist::bytesOf(b.finish(60)), {}, &why));
    EXPECT_NE(why.find("nesting deeper"), std::string::npos) << why;
  }
  {
    BinaryBuilder b;
    b.add({0x5F, 0x13, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF});  // string claiming 2^63 bytes
    std::string why;
    EXPECT_FALSE(plist::decodeBinary(plist::bytesOf(b.finish(0)), {}, &why));
  }
  {
    BinaryBuilder b;
    b.add({0xA1, 0x07});  // reference to an object that does not exist
    EXPECT_FALSE(plist::decodeBinary(plist::bytesOf(b.finish(0))));
  }
  {
    BinaryBuilder b;
    b.add({0xD1, 0x01, 0x01});  // dictionary whose key is an integer
    b.add({0x10, 0x05});
    std::string why;
    EXPECT_FALSE(plist::decodeBinary(plist::bytesOf(b.finish(0)), {}, &why));
    EXPECT_NE(why.find("key is not a string"), std::string::npos) << why;
  }
}

TEST(PropertyListTest, LargeContainersAndTextComeBackWhole) {
  // Past the dictionary's index threshold, beyond short-string storage, data
  // and strings read in place: every entry back, in order, found by key.
  Dictionary big;
  Array list;
  for (int i = 0; i < 1000; ++i) {
    big.set("key-" + std::to_string(i), i % 3 == 0 ? Value(std::string(40, static_cast<char>('a' + i % 26)))
                                                   : Value(i * 1000));
    list.push_back(i % 2 ? Value(Data(static_cast<std::size_t>(i % 50), static_cast<std::uint8_t>(i))) : Value(i));
  }
  big.set("list", Value(list));
  big.set("empty", Value(std::string()));
  big.set("unicode", Value("caf\xc3\xa9 \xe2\x82\xac"));
  const Value v(big);
  for (bool binary : {true, false}) {
    const auto back = binary ? plist::decode(plist::bytesOf(plist::encodeBinary(v)))
                             : plist::decode(plist::bytesOf(plist::encodeXml(v)));
    ASSERT_TRUE(back) << binary;
    EXPECT_EQ(*back, v) << binary;
    ASSERT_EQ(back->count(), 1003u);
    EXPECT_EQ(back->dict()->entries()[999].first, "key-999");
    EXPECT_EQ((*back)["key-998"].intValue(), 998000);
    EXPECT_EQ(*(*back)["key-999"].string(), std::string(40, static_cast<char>('a' + 999 % 26)));
    EXPECT_EQ((*back)["list"].count(), 1000u);
    EXPECT_EQ((*back)["list"].at(49).data()->size(), 49u);
    EXPECT_EQ(*(*back)["unicode"].string(), "caf\xc3\xa9 \xe2\x82\xac");
    EXPECT_TRUE((*back)["empty"].string()->empty());
  }
}

TEST(PropertyListTest, RepeatedDictionaryKeyKeepsTheLastValueAtTheFirstPlace) {
  // A hand-made list whose dictionary names "a" twice: one entry, the
  // later value, where the key first stood.
  BinaryBuilder b;
  b.add({0xD3, 0x01, 0x02, 0x01, 0x03, 0x04, 0x05});  // {a: 1, b: 2, a: 3}
  b.add({0x51, 'a'});
  b.add({0x51, 'b'});
  b.add({0x10, 0x01});
  b.add({0x10, 0x02});
  b.add({0x10, 0x03});
  const auto back = plist::decodeBinary(plist::bytesOf(b.finish(0)));
  ASSERT_TRUE(back);
  ASSERT_EQ(back->count(), 2u);
  EXPECT_EQ(back->dict()->entries()[0].first, "a");
  EXPECT_EQ((*back)["a"].intValue(), 3);
  EXPECT_EQ((*back)["b"].intValue(), 2);
}

TEST(PropertyListTest, EveryTruncationOfAValidListFailsCleanly) {
  const Data good = plist::encodeBinary(sample());
  for (std::size_t n = 0; n < good.size(); ++n) {
    plist::Bytes cut(good.data(), n);
    (void)plist::decodeBinary(cut);  // must not crash or read out of bounds
  }
  EXPECT_TRUE(plist::decodeBinary(plist::bytesOf(good)));
}

TEST(PropertyListTest, XmlCheckBoundsDepthEntitiesAndSize) {
  std::string deep = "<plist>";
  for (int i = 0; i < 100; ++i) deep += "<array>";
  for (int i = 0; i < 100; ++i) deep += "</array>";
  deep += "</plist>";
  EXPECT_TRUE(plist::checkXml(plist::bytesOf(deep)));
  EXPECT_TRUE(plist::checkXml(plist::bytesOf(std::string("<!DOCTYPE x [<!ENTITY a \"b\">]><plist/>"))));
  plist::Limits small;
  small.maxBytes = 10;
  EXPECT_TRUE(plist::checkXml(plist::bytesOf(plist::encodeXml(sample())), small));
  EXPECT_FALSE(plist::checkXml(plist::bytesOf(plist::encodeXml(sample()))));
  EXPECT_FALSE(plist::decode(plist::bytesOf(std::string("not a plist at all"))));
}

}  // namespace
}  // namespace zerith
