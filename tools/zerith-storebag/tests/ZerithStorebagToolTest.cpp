#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/Crypto.h"
#include "platform/FileUtil.h"
#include "platform/PropertyList.h"
#include "tests/support/Command.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

namespace fs = std::filesystem;

class ZerithStorebagToolTest : public ::testing::Test {
 protected:
  // The executable as an operator runs it, in the test's folder; standard
  // error joins the output.
  test::CommandResult run(const std::string& arguments) const {
    return test::runCommand("cd '" + root_.path().string() + "' && " + std::string(ZERITH_STOREBAG_TOOL) + " " +
                            arguments + " 2>&1");
  }
  fs::path at(const std::string& name) const { return root_.path() / name; }
  Data read(const std::string& name) const { return *file::readAll(at(name), 64u << 20); }
  void write(const std::string& name, const std::string& contents) const {
    std::ofstream(at(name), std::ios::binary) << contents;
  }

  // Key pair and an XML bag, as an operator starts.
  void prepare() {
    ASSERT_EQ(run("keygen --private key.pem --public publicKey.der").status, 0);
    write("bag.plist", plist::encodeXml(bag_));
  }

  test::TempRoot root_;
  const Value bag_ = Value(Dictionary{{"release", Value(Dictionary{{"kovu", Value(Dictionary{{"active", true}})}})},
                                      {"version", "3.0.1"}});
};

TEST_F(ZerithStorebagToolTest, SignedContainerVerifiesAndShowsTheBag) {
  prepare();
  EXPECT_EQ(fs::status(at("key.pem")).permissions() & fs::perms::group_read, fs::perms::none);
  const test::CommandResult signing = run("sign --key key.pem --in bag.plist --out container");
  ASSERT_EQ(signing.status, 0) << signing.output;

  const Data container = read("container");
  EXPECT_TRUE(plist::looksBinary(plist::bytesOf(container)));
  // The signed bytes are the bag as given, stamped with its issue time.
  const Value fields = *plist::decode(plist::bytesOf(container));
  const Data signedBag = *crypto::base64Decode(*fields["bag"].string());
  const Value stamped = *plist::decode(plist::bytesOf(signedBag));
  ASSERT_TRUE(stamped["issue_time"].date());
  EXPECT_NEAR(stamped["issue_time"].date()->secondsSince1970, Date::now().secondsSince1970, 60);
  Dictionary unstamped = stamped.dictCopy();
  unstamped.erase("issue_time");
  EXPECT_EQ(Value(unstamped), bag_);

  const test::CommandResult verify = run("verify --public publicKey.der --in container");
  EXPECT_EQ(verify.status, 0);
  EXPECT_EQ(verify.output.rfind("verified: " + std::to_string(signedBag.size()) + " bag bytes, version 3.0.1, issued ", 0),
            0u)
      << verify.output;

  const test::CommandResult show = run("show --public publicKey.der --in container");
  EXPECT_EQ(show.status, 0);
  EXPECT_EQ(show.output, plist::encodeXml(stamped));
}

TEST_F(ZerithStorebagToolTest, XmlContainerHoldsTheTwoBase64Strings) {
  prepare();
  ASSERT_EQ(run("sign --key key.pem --in bag.plist --out container.xml --format xml").status, 0);
  const Data xml = read("container.xml");
  EXPECT_FALSE(plist::looksBinary(plist::bytesOf(xml)));
  const Value fields = *plist::decode(plist::bytesOf(xml));
  ASSERT_EQ(fields.count(), 2u);
  EXPECT_TRUE(crypto::base64Decode(*fields["bag"].string()));
  EXPECT_EQ(crypto::base64Decode(*fields["signature"].string())->size(), 256u);  // RSA 2048
  EXPECT_EQ(run("verify --public publicKey.der --in container.xml").status, 0);
}

TEST_F(ZerithStorebagToolTest, SignatureIsPlainRsaSha1AsOpenSslMakesIt) {
  if (std::system("openssl version >/dev/null 2>&1") != 0) GTEST_SKIP() << "no openssl command";
  prepare();
  ASSERT_EQ(run("sign --key key.pem --in bag.plist --out container").status, 0);
  const Value fields = *plist::decode(plist::bytesOf(read("container")));
  const Data signature = *crypto::base64Decode(*fields["signature"].string());
  std::ofstream(at("sig"), std::ios::binary).write(reinterpret_cast<const char*>(signature.data()),
                                                    static_cast<std::streamsize>(signature.size()));
  const Data signedBag = *crypto::base64Decode(*fields["bag"].string());
  write("signed-bag", std::string(signedBag.begin(), signedBag.end()));
  const std::string command = "cd '" + root_.path().string() +
                              "' && openssl pkey -pubin -inform DER -in publicKey.der -out pub.pem && "
                              "openssl dgst -sha1 -verify pub.pem -signature sig signed-bag >/dev/null";
  EXPECT_EQ(std::system(command.c_str()), 0);
}

TEST_F(ZerithStorebagToolTest, RefusalsExitWithOneAndSayWhy) {
  prepare();
  ASSERT_EQ(run("sign --key key.pem --in bag.plist --out container").status, 0);
  ASSERT_EQ(run("keygen --private other.pem --public other.der").status, 0);

  struct Case {
    std::string arguments;
    std::string message;
  };
  write("array.plist", plist::encodeXml(Value(Array{Value(1)})));
  write("junk", "not a property list");
  const Case cases[] = {
      {"verify --public other.der --in container",
       // OpenSSL's reason depends on the two random keys ("invalid padding"
       // or "data too large for modulus"); it follows in brackets.
       "zerith-storebag: 'container' refused: the signature does not match the bag under this public key ("},
      {"verify --public publicKey.der --in bag.plist",
       "zerith-storebag: 'bag.plist' refused: the container has no \"signature\" string\n"},
      {"show --public key.pem --in container",
       "zerith-storebag: 'container' refused: the public key is not an RSA public key in DER form\n"},
      {"verify --public publicKey.der --in missing", "zerith-storebag: cannot read 'missing': no such file\n"},
      {"sign --key key.pem --in array.plist --out x", "zerith-storebag: 'array.plist' is not a property list dictionary\n"},
      {"sign --key publicKey.der --in bag.plist --out x", "zerith-storebag: cannot sign with 'publicKey.der': "},
      {"sign --key key.pem --in junk --out x", "zerith-storebag: 'junk' is not a property list: "},
  };
  for (const auto& c : cases) {
    const test::CommandResult r = run(c.arguments);
    EXPECT_EQ(r.status, 1) << c.arguments;
    EXPECT_EQ(r.output.substr(0, c.message.size()), c.message) << c.arguments;
  }
  EXPECT_FALSE(fs::exists(at("x")));
  EXPECT_NE(run("sign --key key.pem --in bag.plist").status, 0);  // --out is required
  EXPECT_NE(run("").status, 0);
}

}  // namespace
}  // namespace zerith
