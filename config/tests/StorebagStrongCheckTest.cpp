// The checks a signed storebag passes beyond its RSA signature: the Ed25519
// signature when its key is installed, an XML container that ends where it
// ends, a usable bag, and an issue time not older than the newest accepted.

#include <gtest/gtest.h>

#include "config/StorebagIssueTimes.h"
#include "config/StorebagVerify.h"
#include "config/tests/StorebagTestFixture.h"

namespace zerith {
namespace {

using log::Level;
using test::bytes;
using test::sampleStorebag;
using test::storebagKeys;
using test::text;

const StorebagKeyPair& ed25519Keys() {
  static const StorebagKeyPair keys = *generateStorebagEd25519KeyPair();
  return keys;
}

Data bagBytes(const std::string& version = "2.4.0") { return plist::encodeBinary(sampleStorebag(version)); }

// A container whose Ed25519 signature, when there is one, is `strong`.
Data container(const Data& bag, const std::optional<Data>& strong) {
  const auto rsa = signStorebagBytes(storebagKeys().privateKeyPEM, bag);
  return plist::encodeBinary(makeStorebagContainer(*rsa, bag, strong));
}
Data ed25519Signature(const Data& bag, const StorebagKeyPair& keys = ed25519Keys()) {
  return *signStorebagBytes(keys.privateKeyPEM, bag, nullptr, /*ed25519=*/true);
}

// What the end-to-end test does not reach: the second signature never
// excuses the first, one that is not base64 is refused, and a key file that
// is not Ed25519 refuses every container.
TEST(StrongSignature, ChecksBesideTheRsaSignature) {
  const auto verify = [](const Data& c, const std::optional<Data>& strongKey) {
    return verifyStorebagContainer(plist::bytesOf(c), storebagKeys().publicKeyDER, strongKey).status;
  };
  const Data& strongKey = ed25519Keys().publicKeyDER;
  const Data otherRsa = *signStorebagBytes(storebagKeys().privateKeyPEM, bagBytes("9.9.9"));
  EXPECT_EQ(verify(plist::encodeBinary(makeStorebagContainer(otherRsa, bagBytes(), ed25519Signature(bagBytes()))),
                   strongKey),
            StorebagVerifyStatus::SignatureMismatch);
  const Data badStrong = container(bagBytes(), ed25519Signature(bagBytes("9.9.9")));
  Dictionary cut = plist::decode(plist::bytesOf(badStrong))->dictCopy();
  cut.set(kStorebagStrongSignatureKey, "QUJDQ");  // a stray symbol after the last group
  EXPECT_EQ(verify(plist::encodeBinary(Value(cut)), strongKey), StorebagVerifyStatus::BadStrongSignatureText);
  EXPECT_EQ(verify(badStrong, storebagKeys().publicKeyDER), StorebagVerifyStatus::BadStrongPublicKey);
  EXPECT_EQ(verify(badStrong, Data()), StorebagVerifyStatus::BadStrongPublicKey);
}

struct TrailingCase {
  const char* name;
  bool xml;
  const char* tail;
  bool accepted;
};

class ContainerEnd : public ::testing::TestWithParam<TrailingCase> {};

TEST_P(ContainerEnd, BytesAfterTheListAreRefusedInEitherForm) {
  const TrailingCase& c = GetParam();
  const Value fields = *plist::decode(plist::bytesOf(container(bagBytes(), std::nullopt)));
  std::string encoded = c.xml ? plist::encodeXml(fields) : text(plist::encodeBinary(fields));
  encoded += c.tail;
  const auto result = verifyStorebagContainer(plist::bytesOf(encoded), storebagKeys().publicKeyDER);
  EXPECT_EQ(result.status == StorebagVerifyStatus::Verified, c.accepted) << describeStorebagRefusal(result);
}

INSTANTIATE_TEST_SUITE_P(Forms, ContainerEnd,
                         ::testing::Values(TrailingCase{"Xml", true, "", true},
                                           TrailingCase{"XmlWhiteSpace", true, "\n \t\r\n", true},
                                           TrailingCase{"XmlJunk", true, "junk", false},
                                           TrailingCase{"XmlSecondList", true, "<plist><dict/></plist>", false},
                                           TrailingCase{"BinaryJunk", false, "junk", false}),
                         [](const auto& info) { return std::string(info.param.name); });

// The daemon's check of a container: with the framework's keys, the
// remembered issue times and the disk cache.
class StorebagIssueTimeTest : public test::StorebagTest {
 protected:
  static Data stamped(double issued, const Value& bag = sampleStorebag()) {
    return container(*stampStorebagIssueTime(plist::encodeBinary(bag), Date{issued}), std::nullopt);
  }
  Value accept(const Data& c, bool save = true) {
    return parseAndVerifyStorebag("ambrel", c, save, StorebagSource{"https://bags.test/zerith/ambrel"});
  }
  static constexpr double kOlder = 1'700'000'000;
  static constexpr double kNewer = 1'800'000'000;
};

// (An older bag refused and the same time passing are the end-to-end rollback test's.)
TEST_F(StorebagIssueTimeTest, ABagWithoutAnIssueTimePassesUntilTheDefaultsKeyRequiresOne) {
  ASSERT_FALSE(accept(stamped(kNewer)).isNil());
  EXPECT_FALSE(accept(container(bagBytes(), std::nullopt)).isNil());
  setDefaultsObjectForKey(kRequireStorebagIssueTimeKey, true);
  EXPECT_TRUE(accept(container(bagBytes(), std::nullopt)).isNil());
  EXPECT_TRUE(logs_.has(Level::Error, "fetchStorebagWithName: storebag 'ambrel' from "
                                           "https://bags.test/zerith/ambrel has no \"issue_time\" and "
                                           "storebag_require_issue_time is set: refused"));
  EXPECT_FALSE(accept(stamped(kNewer)).isNil());
}

TEST_F(StorebagIssueTimeTest, ADamagedTimesFileCountsAsEmptyAndIsWrittenAfresh) {
  root_.write("/var/lib/zerithd/storebag-issue-times.plist", "not a list");
  EXPECT_FALSE(accept(stamped(kOlder)).isNil());
  EXPECT_TRUE(logs_.contains("rememberStorebagIssueTime: '" + storebagIssueTimesFile().string() +
                                               "' is unusable: "));
  EXPECT_EQ(rememberedStorebagIssueTime("ambrel"), Date{kOlder});
}

TEST(StorebagIssueTimesFile, OnlyADictionaryOfDatesIsRead) {
  const std::pair<const char*, std::string> bad[] = {
      {"array", plist::encodeXml(Value(Array{}))},
      {"number entry", plist::encodeXml(Value(Dictionary{{"dravon", 5}}))},
      {"empty name", text(encodeStorebagIssueTimes({{"", Date{1}}}))},
      {"nested", plist::encodeXml(Value(Dictionary{{"a", Dictionary{{"b", Dictionary{}}}}}))},
      {"oversized", std::string(kMaxStorebagIssueTimesBytes + 1, ' ')},
  };
  for (const auto& [what, encoded] : bad) {
    std::string why;
    EXPECT_FALSE(decodeStorebagIssueTimes(plist::bytesOf(encoded), &why)) << what;
    EXPECT_FALSE(why.empty()) << what;
  }
  const StorebagIssueTimes times{{"dravon", Date{1'800'000'000}}, {"ambrel", Date{3}}};
  EXPECT_EQ(decodeStorebagIssueTimes(plist::bytesOf(encodeStorebagIssueTimes(times))), times);
}

}  // namespace
}  // namespace zerith
