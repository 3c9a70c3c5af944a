// zerith-storebag as an operator runs it: key pairs, signing with one key
// or both, verification, display, and the way back past the anti-rollback
// check. (That the RSA signature is a plain SHA-1 one that other tools
// verify is checked by the storebag verification's unit tests.)

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "config/StorebagIssueTimes.h"
#include "platform/Crypto.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
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

  // Each command line ends with its status, what it prints beginning as given.
  struct Expected {
    std::string arguments;
    int status;
    std::string output;
  };
  void expectRuns(const std::vector<Expected>& runs) const {
    for (const auto& e : runs) {
      const test::CommandResult r = run(e.arguments);
      EXPECT_EQ(r.status, e.status) << e.arguments << "\n" << r.output;
      EXPECT_EQ(r.output.rfind(e.output, 0), 0u) << e.arguments << "\n" << r.output;
    }
  }

  test::TempRoot root_;
  const Value bag_ = Value(
      Dictionary{{"release", Value(Dictionary{{"kovu", Value(Dictionary{{"active", true}})}})}, {"version", "3.0.1"}});
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

  expectRuns({{"verify --public publicKey.der --in container", 0,
               "verified: " + std::to_string(signedBag.size()) + " bag bytes, version 3.0.1, issued "}});

  const test::CommandResult show = run("show --public publicKey.der --in container");
  EXPECT_EQ(show.status, 0);
  EXPECT_EQ(show.output, plist::encodeXml(stamped));

  // The XML form holds the same two base64 strings and verifies as well.
  ASSERT_EQ(run("sign --key key.pem --in bag.plist --out container.xml --format xml").status, 0);
  const Data xml = read("container.xml");
  EXPECT_FALSE(plist::looksBinary(plist::bytesOf(xml)));
  EXPECT_EQ(plist::decode(plist::bytesOf(xml))->count(), 2u);
  EXPECT_EQ(crypto::base64Decode(*fields["signature"].string())->size(), 256u);  // RSA 2048
  EXPECT_EQ(run("verify --public publicKey.der --in container.xml").status, 0);
}

TEST_F(ZerithStorebagToolTest, RefusalsExitWithOneAndSayWhy) {
  prepare();
  ASSERT_EQ(run("sign --key key.pem --in bag.plist --out container").status, 0);
  ASSERT_EQ(run("keygen --private other.pem --public other.der").status, 0);

  write("array.plist", plist::encodeXml(Value(Array{Value(1)})));
  write("junk", "not a property list");
  expectRuns({
      {"verify --public other.der --in container", 1,
       // OpenSSL's reason depends on the two random keys ("invalid padding"
       // or "data too large for modulus"); it follows in brackets.
       "zerith-storebag: 'container' refused: the signature does not match the bag under this public key ("},
      {"verify --public publicKey.der --in bag.plist", 1,
       "zerith-storebag: 'bag.plist' refused: the container has no \"signature\" string\n"},
      {"show --public key.pem --in container", 1,
       "zerith-storebag: 'container' refused: the public key is not an RSA public key in DER form\n"},
      {"verify --public publicKey.der --in missing", 1, "zerith-storebag: cannot read 'missing': no such file\n"},
      {"sign --key key.pem --in array.plist --out x", 1,
       "zerith-storebag: 'array.plist' is not a property list dictionary\n"},
      {"sign --key publicKey.der --in bag.plist --out x", 1, "zerith-storebag: cannot sign with 'publicKey.der': "},
      {"sign --key key.pem --in junk --out x", 1, "zerith-storebag: 'junk' is not a property list: "},
  });
  EXPECT_FALSE(fs::exists(at("x")));
  EXPECT_NE(run("sign --key key.pem --in bag.plist").status, 0);  // --out is required
  EXPECT_NE(run("").status, 0);
}

TEST_F(ZerithStorebagToolTest, OneCommandSignsWithBothAndVerifyNeedsBothWhenGivenTheSecondKey) {
  prepare();
  ASSERT_EQ(run("keygen --type ed25519 --private ed.pem --public ed.der").status, 0);
  const auto signing = run("sign --key key.pem --ed25519-key ed.pem --in bag.plist --out both");
  ASSERT_EQ(signing.status, 0) << signing.output;
  EXPECT_NE(signing.output.find("(RSA and Ed25519)"), std::string::npos) << signing.output;
  ASSERT_EQ(run("sign --key key.pem --in bag.plist --out rsa-only").status, 0);

  expectRuns({
      {"verify --public publicKey.der --ed25519-public ed.der --in both", 0, "verified (RSA and Ed25519): "},
      {"verify --public publicKey.der --in both", 0, "verified: "},
      {"verify --public publicKey.der --ed25519-public ed.der --in rsa-only", 1,
       "zerith-storebag: 'rsa-only' refused: the container has no \"signature_ed25519\" string"},
      {"sign --key key.pem --ed25519-key key.pem --in bag.plist --out x", 1,
       "zerith-storebag: cannot sign with 'key.pem': the private key is not an Ed25519 key"},
  });
  EXPECT_FALSE(fs::exists(at("x")));
}

TEST_F(ZerithStorebagToolTest, ForgetIssueTimeDropsOnlyTheNamedStorebag) {
  ASSERT_TRUE(rememberStorebagIssueTime("dravon", Date{1'800'000'000}));
  ASSERT_TRUE(rememberStorebagIssueTime("ambrel", Date{1'700'000'000}));
  const std::string rootOption = "--root '" + root_.path().string() + "' ";

  const auto forgot = run(rootOption + "forget-issue-time --name dravon");
  EXPECT_EQ(forgot.status, 0);
  EXPECT_EQ(forgot.output, "forgot issue time 2027-01-15 08:00:00 +0000 of storebag dravon in " +
                               storebagIssueTimesFile().string() + "\n");
  EXPECT_EQ(rememberedStorebagIssueTime("dravon"), std::nullopt);
  EXPECT_EQ(rememberedStorebagIssueTime("ambrel"), Date{1'700'000'000});
  EXPECT_EQ(run(rootOption + "forget-issue-time --name dravon").output,
            "no issue time remembered for storebag dravon\n");
  // What is left to forget, as the operator sees it.
  EXPECT_EQ(run(rootOption + "cached").output, "No storebag is cached in " + paths::storebagCacheDir().string() +
                                                   ".\n\nIssue times remembered without a cached copy (" +
                                                   storebagIssueTimesFile().string() +
                                                   "):\n  ambrel  2023-11-14 22:13:20 +0000\n");

  // A damaged file is not silently replaced by the operator's step.
  std::ofstream(storebagIssueTimesFile(), std::ios::trunc) << "garbage";
  const auto damaged = run(rootOption + "forget-issue-time --name ambrel");
  EXPECT_EQ(damaged.status, 1);
  EXPECT_NE(damaged.output.find("is unusable"), std::string::npos) << damaged.output;
}

// An operator's typos: lint names them and fails, sign says the same on
// standard error and signs all the same, and lint reads the bag inside the
// container too. A clean bag passes.
TEST_F(ZerithStorebagToolTest, LintNamesWhatTheDaemonWouldIgnoreBeforeAndAfterSigning) {
  prepare();
  const test::CommandResult clean = run("lint --in bag.plist");
  EXPECT_EQ(clean.status, 0);
  EXPECT_EQ(clean.output, "bag.plist: 0 errors, 0 warnings\n");

  const Value dashboard(Dictionary{{"ip", "10.0.0.1"}});
  write("typo.plist", plist::encodeXml(Value(Dictionary{{"seed", Dictionary{{"dashboard", dashboard}}},
                                                        {"relase", Dictionary{{"dashboard", dashboard}}}})));
  const std::string findings =
      "error: seed.dashboard: no \"port\": the backend is not made\n"
      "warning: unknown key \"relase\" (did you mean \"release\"?): the daemon does not read it\n";
  const test::CommandResult typo = run("lint --in typo.plist");
  EXPECT_EQ(typo.status, 1);
  EXPECT_EQ(typo.output, findings + "typo.plist: 1 error, 1 warning\n");

  const test::CommandResult signing = run("sign --key key.pem --in typo.plist --out typo.container");
  EXPECT_EQ(signing.status, 0) << signing.output;
  EXPECT_NE(signing.output.find("zerith-storebag: typo.plist: error: seed.dashboard: no \"port\""), std::string::npos)
      << signing.output;
  const test::CommandResult container = run("lint --in typo.container");
  EXPECT_EQ(container.status, 1);
  EXPECT_EQ(container.output, "typo.container: a signed container; its bag, not verified:\n" + findings +
                                  "typo.container: 1 error, 1 warning\n");
}

}  // namespace
}  // namespace zerith
