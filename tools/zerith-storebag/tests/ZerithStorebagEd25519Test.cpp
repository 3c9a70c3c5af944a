// The tool's second key and its way back past the anti-rollback check.

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "config/StorebagIssueTimes.h"
#include "platform/Crypto.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

namespace fs = std::filesystem;

class ZerithStorebagEd25519Test : public ::testing::Test {
 protected:
  // Exit status and what the tool printed (stdout and stderr together).
  std::pair<int, std::string> run(const std::string& arguments) const {
    const std::string command =
        "cd '" + root_.path().string() + "' && " + std::string(ZERITH_STOREBAG_TOOL) + " " + arguments + " 2>&1";
    std::string output;
    FILE* pipe = ::popen(command.c_str(), "r");
    if (!pipe) return {-1, output};
    char buf[4096];
    std::size_t n;
    while ((n = std::fread(buf, 1, sizeof buf, pipe)) > 0) output.append(buf, n);
    const int status = ::pclose(pipe);
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, output};
  }
  void SetUp() override {
    ASSERT_EQ(run("keygen --private key.pem --public publicKey.der").first, 0);
    ASSERT_EQ(run("keygen --type ed25519 --private ed.pem --public ed.der").first, 0);
    std::ofstream(root_.path() / "bag.plist") << plist::encodeXml(Value(Dictionary{{"version", "1"}}));
  }

  test::TempRoot root_;
};

TEST_F(ZerithStorebagEd25519Test, OneCommandSignsWithBothAndVerifyNeedsBothWhenGivenTheSecondKey) {
  const auto signing = run("sign --key key.pem --ed25519-key ed.pem --in bag.plist --out both");
  ASSERT_EQ(signing.first, 0) << signing.second;
  EXPECT_NE(signing.second.find("(RSA and Ed25519)"), std::string::npos) << signing.second;
  ASSERT_EQ(run("sign --key key.pem --in bag.plist --out rsa-only").first, 0);

  struct Case {
    const char* arguments;
    int status;
    const char* output;  // its beginning
  } cases[] = {
      {"verify --public publicKey.der --ed25519-public ed.der --in both", 0, "verified (RSA and Ed25519): "},
      {"verify --public publicKey.der --in both", 0, "verified: "},
      {"verify --public publicKey.der --ed25519-public ed.der --in rsa-only", 1,
       "zerith-storebag: 'rsa-only' refused: the container has no \"signature_ed25519\" string"},
      {"sign --key key.pem --ed25519-key key.pem --in bag.plist --out x", 1,
       "zerith-storebag: cannot sign with 'key.pem': the private key is not an Ed25519 key"},
  };
  for (const auto& c : cases) {
    const auto [status, output] = run(c.arguments);
    EXPECT_EQ(status, c.status) << c.arguments << "\n" << output;
    EXPECT_EQ(output.rfind(c.output, 0), 0u) << c.arguments << "\n" << output;
  }
  EXPECT_FALSE(fs::exists(root_.path() / "x"));
}

TEST_F(ZerithStorebagEd25519Test, ForgetIssueTimeDropsOnlyTheNamedStorebag) {
  ASSERT_TRUE(rememberStorebagIssueTime("dravon", Date{1'800'000'000}));
  ASSERT_TRUE(rememberStorebagIssueTime("ambrel", Date{1'700'000'000}));
  const std::string rootOption = "--root '" + root_.path().string() + "' ";

  const auto forgot = run(rootOption + "forget-issue-time --name dravon");
  EXPECT_EQ(forgot.first, 0);
  EXPECT_EQ(forgot.second, "forgot issue time 2027-01-15 08:00:00 +0000 of storebag dravon in " +
                               storebagIssueTimesFile().string() + "\n");
  EXPECT_EQ(rememberedStorebagIssueTime("dravon"), std::nullopt);
  EXPECT_EQ(rememberedStorebagIssueTime("ambrel"), Date{1'700'000'000});
  EXPECT_EQ(run(rootOption + "forget-issue-time --name dravon").second, "no issue time remembered for storebag dravon\n");

  // A damaged file is not silently replaced by the operator's step.
  std::ofstream(storebagIssueTimesFile(), std::ios::trunc) << "garbage";
  const auto damaged = run(rootOption + "forget-issue-time --name ambrel");
  EXPECT_EQ(damaged.first, 1);
  EXPECT_NE(damaged.second.find("is unusable"), std::string::npos) << damaged.second;
}

}  // namespace
}  // namespace zerith
