#include <gtest/gtest.h>

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

TEST(PropertyListTest, NilEntriesAreLeftOut) {
  Dictionary d{{"a", 1}, {"b", Value()}};
  EXPECT_EQ(plist::decode(plist::bytesOf(plist::encodeBinary(Value(d)))), Value(Dictionary{{"a", 1}}));
  EXPECT_TRUE(plist::encodeBinary(Value()).empty());
}

TEST(PropertyListTest, BinaryAndXmlKeepTypesOrderAndLargeContainersWhole) {
  // Every kind, then past the dictionary's index threshold, beyond
  // short-string storage, data and strings read in place: every entry back,
  // in order, found by key.
  Dictionary big = sample().dictCopy();
  Array list;
  for (int i = 0; i < 1000; ++i) {
    big.set("key-" + std::to_string(i),
            i % 3 == 0 ? Value(std::string(40, static_cast<char>('a' + i % 26))) : Value(i * 1000));
    list.push_back(i % 2 ? Value(Data(static_cast<std::size_t>(i % 50), static_cast<std::uint8_t>(i))) : Value(i));
  }
  big.set("many", Value(list));
  big.set("empty", Value(std::string()));
  big.set("unicode", Value("caf\xc3\xa9 \xe2\x82\xac"));
  const Value v(big);
  for (bool binary : {true, false}) {
    const auto back = binary ? plist::decode(plist::bytesOf(plist::encodeBinary(v)))
                             : plist::decode(plist::bytesOf(plist::encodeXml(v)));
    ASSERT_TRUE(back) << binary;
    EXPECT_EQ(back->dict()->entries(), v.dict()->entries()) << binary;
    // Every key of the original looked up through the read list's own index.
    EXPECT_EQ(v, *back) << binary;
  }
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
