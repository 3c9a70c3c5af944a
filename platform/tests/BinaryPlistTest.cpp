#include <gtest/gtest.h>

#include <climits>
#include <string>
#include <vector>

#include "platform/BinaryPlist.h"
#include "platform/PropertyList.h"

namespace zerith {
namespace {

Data encoded(const Value& v) {
  Data out;
  bplist::encode(v, out);
  return out;
}

// `v` written by us, read back by us.
std::optional<Value> back(const Value& v) { return bplist::decode(plist::bytesOf(encoded(v))); }

std::vector<std::string> keysOf(const Value& v) {
  std::vector<std::string> keys;
  for (const auto& [k, e] : *v.dict()) keys.push_back(k);
  return keys;
}

Value distinctStrings(int n) {
  Array a;
  for (int i = 0; i < n; ++i) a.push_back(Value("s" + std::to_string(i)));
  return Value(std::move(a));
}

Value nested(int depth) {
  Value v(true);
  for (int i = 0; i < depth; ++i) v = Value(Array{v});
  return v;
}

// What the trailer of an encoding says: offset width, reference width.
std::pair<int, int> widths(const Data& d) { return {d[d.size() - 26], d[d.size() - 25]}; }

struct RoundTrip {
  const char* name;
  Value value;
  // SameBytes: libplist writes the same bytes (no two equal scalars for it
  // to merge). SameTree: libplist reads them to the same tree. Ours: too
  // large for libplist in a test (its writer and the walk of its arrays take
  // time quadratic in an array's length).
  enum { SameBytes, SameTree, Ours } libplist;
  std::pair<int, int> widths{1, 1};
};

class BinaryPlistRoundTrip : public testing::TestWithParam<RoundTrip> {};

TEST_P(BinaryPlistRoundTrip, ReadsBackEqualByUsAndByLibplist) {
  const RoundTrip& row = GetParam();
  const Data bytes = encoded(row.value);
  std::string why;
  const auto ours = bplist::decode(plist::bytesOf(bytes), {}, &why);
  ASSERT_TRUE(ours) << why;
  EXPECT_EQ(*ours, row.value);
  if (row.value.isDict()) {
    EXPECT_EQ(keysOf(*ours), keysOf(row.value));
  }
  if (row.libplist != RoundTrip::Ours) {
    const auto theirs = plist::decodeBinary(plist::bytesOf(bytes), {}, &why);
    ASSERT_TRUE(theirs) << why;
    EXPECT_EQ(*theirs, *ours);
  }
  if (row.libplist == RoundTrip::SameBytes) {
    EXPECT_EQ(bytes, plist::encodeBinary(row.value));
  }
  EXPECT_EQ(widths(bytes), row.widths);
}

const Value kUnicode(Dictionary{{"ascii", "plain"},
                                {"latin", "h\u00e9llo"},
                                {"bmp", "\u20ac \u4e2d\u6587"},
                                {"astral", "\U0001F600 and \U00010348"},
                                {"k\u00e9y", "key not ASCII"}});

INSTANTIATE_TEST_SUITE_P(
    Kinds, BinaryPlistRoundTrip,
    testing::Values(
        RoundTrip{"Empties", Value(Array{Value(Dictionary{}), Value(Array{}), Value(""), Value(Data{})}),
                  RoundTrip::SameBytes},
        RoundTrip{"IntegersAtEveryWidth",
                  Value(Array{0, 255, 256, 65535, 65536, 0xffffffffLL, 1LL << 32, LLONG_MAX, -1, LLONG_MIN}),
                  RoundTrip::SameBytes},
        RoundTrip{"RealsFourAndEightBytes", Value(Array{0.5, 0.1, -1e300, 3.4e38, 5e-324}), RoundTrip::SameBytes},
        RoundTrip{"BooleansDatesData",
                  Value(Array{true, false, Value(Date{1700000000.25}), Value(Date{0}), Value(Data{0, 1, 255})}),
                  RoundTrip::SameBytes},
        RoundTrip{"UnicodeAsUtf16", kUnicode, RoundTrip::SameBytes},
        RoundTrip{"LengthsPastTheMarker",
                  Value(Array{Value(std::string(15, 'x')), Value(std::string(300, 'y')), Value(Data(70, 7)),
                              distinctStrings(15)}),
                  RoundTrip::SameBytes,
                  {2, 1}},
        RoundTrip{"TwoByteReferences", distinctStrings(300), RoundTrip::SameBytes, {2, 2}},
        RoundTrip{
            "ThreeByteOffsets", Value(Array{Value(Data(70000, 1)), Value("after")}), RoundTrip::SameBytes, {3, 1}},
        RoundTrip{"ThreeByteReferences", distinctStrings(66000), RoundTrip::Ours, {3, 3}},
        RoundTrip{"Nested", nested(40), RoundTrip::SameBytes},
        // libplist writes one object for equal scalars; written twice, the
        // tree is the same.
        RoundTrip{"EqualScalarsNotMerged", Value(Dictionary{{"a", 1}, {"b", 1}, {"c", "a"}, {"d", "a"}}),
                  RoundTrip::SameTree}),
    [](const auto& info) { return std::string(info.param.name); });

TEST(BinaryPlistWriter, KeepsWhatLibplistWouldLoseOrRefuse) {
  // Unsigned above the signed range: the 128-bit form, read back unsigned
  // (equal integers are of one type; libplist keeps the same 64 bits).
  const Value big(Array{Value(0xfffffffffffffff0ull)});
  EXPECT_EQ(back(big), big);
  EXPECT_EQ(plist::decodeBinary(plist::bytesOf(encoded(big)))->at(0).unsignedValue(), 0xfffffffffffffff0ull);

  // A date before 2001 with a fraction reads back as written.
  const Value early(Array{Value(Date{978307200.0 - 3.75})});
  EXPECT_EQ(back(early), early);

  // nil is left out; text ends at a NUL; bytes that are not UTF-8 become
  // U+FFFD; nil alone writes nothing.
  const Value odd(Dictionary{{"nil", Value()},
                             {"nul", Value(std::string("ab\0cd", 5))},
                             {"bad",
                              "x\xff"
                              "y\xc3"}});
  EXPECT_EQ(back(odd), Value(Dictionary{{"nul", "ab"}, {"bad", "x\uFFFDy\uFFFD"}}));
  Data none;
  EXPECT_EQ(bplist::encode(Value(), none), 0u);
  EXPECT_TRUE(none.empty());
}

// ---- refused input -----------------------------------------------------

// A binary list of `objects` (the first is the top), references of `refSize`
// bytes and one-byte offsets, each object's references already in place.
Data listOf(const std::vector<Data>& objects, std::uint8_t refSize = 1) {
  Data out{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<std::size_t> offsets;
  for (const Data& o : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), o.begin(), o.end());
  }
  const std::size_t table = out.size();
  for (const std::size_t o : offsets) out.push_back(static_cast<std::uint8_t>(o));
  Data trailer(32, 0);
  trailer[6] = 1;
  trailer[7] = refSize;
  trailer[15] = static_cast<std::uint8_t>(objects.size());
  for (int i = 0; i < 8; ++i) {
    trailer[24 + i] = static_cast<std::uint8_t>(table >> (56 - 8 * i));
  }
  out.insert(out.end(), trailer.begin(), trailer.end());
  return out;
}

Data withByte(Data d, std::ptrdiff_t at, std::uint8_t byte) {
  d[static_cast<std::size_t>(at < 0 ? static_cast<std::ptrdiff_t>(d.size()) + at : at)] = byte;
  return d;
}

struct Refused {
  const char* name;
  Data bytes;
  std::string why;
  bool checked = true;  // refused by plist::checkBinary as well
};

class BinaryPlistRefuses : public testing::TestWithParam<Refused> {};

const plist::Limits kSmall{1u << 16, 8, 1000};

// Our reader and the check in front of libplist enforce the same bounds;
// rows only our reader refuses (libplist reads them its own way) say so.
TEST_P(BinaryPlistRefuses, WithTheReasonAsLibplistDoesOrMore) {
  const Refused& row = GetParam();
  std::string why;
  EXPECT_FALSE(bplist::decode(plist::bytesOf(row.bytes), kSmall, &why));
  EXPECT_NE(why.find(row.why), std::string::npos) << why;
  if (row.checked) {
    EXPECT_TRUE(plist::checkBinary(plist::bytesOf(row.bytes), kSmall)) << "plist::checkBinary let it through";
    EXPECT_FALSE(plist::decodeBinary(plist::bytesOf(row.bytes), kSmall));
  }
}

const Data kPair = listOf({{0xA2, 1, 2}, {0x51, 'a'}, {0x09}});

Data bomb() {
  // Seven levels of arrays of fifteen references to the next: 15^7 nodes in
  // 8 objects.
  std::vector<Data> objects;
  for (std::uint8_t level = 0; level < 7; ++level) {
    Data a{0xAF, 0x10, 15};
    a.insert(a.end(), 15, static_cast<std::uint8_t>(level + 1));
    objects.push_back(a);
  }
  objects.push_back({0x09});
  return listOf(objects);
}

Data keyBomb() {
  // A hundred references to one dictionary whose key is 700 bytes long:
  // 70,000 bytes of text from a list of 900.
  Data array{0xAF, 0x10, 100};
  array.insert(array.end(), 100, 1);
  Data key{0x5F, 0x11, 0x02, 0xBC};
  key.insert(key.end(), 700, 'k');
  return listOf({array, {0xD1, 3, 2}, {0x09}, key});
}

INSTANTIATE_TEST_SUITE_P(
    Bounds, BinaryPlistRefuses,
    testing::Values(
        Refused{"TooLarge", Data(70000, 0), "exceeds the limit"},
        Refused{"BadHeader", withByte(kPair, 7, '1'), "bad header"},
        Refused{"Truncated", Data(kPair.begin(), kPair.end() - 1), ""},
        Refused{"OffsetWidthZero", withByte(kPair, -26, 0), "invalid integer sizes"},
        Refused{"RefWidthNine", withByte(kPair, -25, 9), "invalid integer sizes"},
        Refused{"TopPastCount", withByte(kPair, -9, 3), "invalid object count or top object"},
        Refused{"TablePastTrailer", withByte(kPair, -1, 200), "offset table is out of range"},
        Refused{"OffsetIntoTable", withByte(kPair, 14, 14), "object offset is out of range"},
        Refused{"ReferencePastCount", withByte(kPair, 9, 3), "object reference is out of range"},
        Refused{"Cycle", withByte(kPair, 9, 0), "cycle"},
        Refused{"ContentPastArea", listOf({{0xA1, 1}, {0x53, 'a'}}), "past the object area"},
        Refused{
            "Depth",
            listOf({{0xA1, 1}, {0xA1, 2}, {0xA1, 3}, {0xA1, 4}, {0xA1, 5}, {0xA1, 6}, {0xA1, 7}, {0xA1, 8}, {0x09}}),
            "nesting deeper than 8"},
        Refused{"NodeBomb", bomb(), "expands to more than 1000 nodes"},
        Refused{"SharedTextBomb", keyBomb(), "text and data expand to more than 65536 bytes", false},
        Refused{"KeyNotString", listOf({{0xD1, 1, 2}, {0x09}, {0x09}}), "key is not a string"},
        Refused{"NulInString", listOf({{0xA1, 1}, {0x53, 'a', 0, 'b'}}), "NUL"},
        Refused{"EmptyUtf16", listOf({{0xA1, 1}, {0x60}}), "empty UTF-16", false},
        Refused{"LengthNotInteger", listOf({{0xA1, 1}, {0x5F, 0x23, 0, 0, 0, 0, 0, 0, 0, 1, 'a'}}), "small integer"},
        Refused{"Null", listOf({{0xA1, 1}, {0x00}}), "null and fill", false},
        Refused{"Uid", listOf({{0xA1, 1}, {0x80, 5}}), "no UIDs", false},
        Refused{"Set", listOf({{0xC1, 1}, {0x09}}), "no sets", false},
        Refused{"DateBeyond32Bits", listOf({{0xA1, 1}, {0x33, 0x41, 0xF2, 0xA0, 0x5F, 0x20, 0, 0, 0}}),
                "date out of range", false},
        Refused{"RealOfOneByte", listOf({{0xA1, 1}, {0x20, 0}}), "real of unsupported size"},
        Refused{"UnknownType", listOf({{0xA1, 1}, {0x70}}), "unknown object type 0x7"},
        // A string that claims 2^63 bytes.
        Refused{"LengthPastAnyList", listOf({{0xA1, 1}, {0x5F, 0x13, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}}),
                "past the object area"}),
    [](const auto& info) { return std::string(info.param.name); });

TEST(BinaryPlistReader, SharedObjectsAreBuiltOnceAtEveryReferenceWidth) {
  // One dictionary referenced three times.
  for (const std::uint8_t width : {1, 2, 3, 4, 8}) {
    // A marker, then references of `width` bytes.
    auto object = [&](Data out, std::initializer_list<std::uint8_t> to) {
      for (const std::uint8_t r : to) {
        out.insert(out.end(), width - 1u, 0);
        out.push_back(r);
      }
      return out;
    };
    const Data bytes = listOf({object({0xA3}, {1, 1, 1}), object({0xD1}, {2, 3}), {0x51, 'k'}, {0x10, 7}}, width);
    const auto v = bplist::decode(plist::bytesOf(bytes));
    ASSERT_TRUE(v) << int{width};
    EXPECT_EQ(*v, *plist::decodeBinary(plist::bytesOf(bytes)));
    EXPECT_EQ(v->at(0), Value(Dictionary{{"k", 7}}));
    EXPECT_EQ(v->at(0).identity(), v->at(2).identity());
  }
}

TEST(BinaryPlistReader, ARepeatedKeyKeepsTheLastValueAtTheFirstPlace) {
  // {a: 1, b: 2, a: 3}: one entry "a", the later value, where the key first
  // stood; libplist's reading through plist::decodeBinary agrees. The second
  // "a" is the same key object, then a key object of its own.
  for (const Data& bytes :
       {listOf({{0xD3, 1, 2, 1, 3, 4, 5}, {0x51, 'a'}, {0x51, 'b'}, {0x10, 1}, {0x10, 2}, {0x10, 3}}),
        listOf({{0xD3, 1, 2, 6, 3, 4, 5}, {0x51, 'a'}, {0x51, 'b'}, {0x10, 1}, {0x10, 2}, {0x10, 3}, {0x51, 'a'}})}) {
    for (const auto& back : {bplist::decode(plist::bytesOf(bytes)), plist::decodeBinary(plist::bytesOf(bytes))}) {
      ASSERT_TRUE(back);
      EXPECT_EQ(keysOf(*back), (std::vector<std::string>{"a", "b"}));
      EXPECT_EQ(*back, Value(Dictionary{{"a", 3}, {"b", 2}}));
    }
  }
}

}  // namespace
}  // namespace zerith
