#include <gtest/gtest.h>

#include <sstream>

#include "platform/Defaults.h"
#include "platform/PropertyList.h"
#include "tests/support/Command.h"
#include "tests/support/TempRoot.h"
#include "tools/zerith-defaults/DefaultsTool.h"

namespace zerith {
namespace {

struct Result {
  int status;
  std::string out;
  std::string err;
};

class DefaultsToolTest : public ::testing::Test {
 protected:
  Result run(std::vector<std::string> words) {
    std::ostringstream out, err;
    const int status = tool::runDefaultsCommand(words, out, err);
    return {status, out.str(), err.str()};
  }

  // The real executable, as an operator runs it.
  Result runTool(const std::string& arguments) {
    const auto errFile = root_ / "/stderr.txt";
    const std::string command = std::string(ZERITH_DEFAULTS_TOOL) + " --root '" + root_.path().string() + "' " +
                                arguments + " 2>'" + errFile.string() + "'";
    const test::CommandResult r = test::runCommand(command);
    return {r.status, r.output, test::readText(errFile)};
  }

  test::TempRoot root_;
  const Defaults domain_{"com.velmar.zerith"};
};

TEST_F(DefaultsToolTest, TypedWritesAsTheExecutableParsesThem) {
  const std::pair<std::string, Value> writes[] = {
      {"environmentType -int -1", Value(-1)},
      {"forceEventLogging -bool YES", Value(true)},
      {"ratio -real 0.25", Value(0.25)},
      {"httpsPostURL https://127.0.0.1:8443/post", Value("https://127.0.0.1:8443/post")},
      {"label -string -int", Value("-int")}};
  for (const auto& [arguments, value] : writes) {
    EXPECT_EQ(runTool("write com.velmar.zerith " + arguments).status, 0) << arguments;
    EXPECT_EQ(domain_.objectForKey(arguments.substr(0, arguments.find(' '))), value) << arguments;
  }

  const Result read = runTool("read com.velmar.zerith environmentType");
  EXPECT_EQ(read.status, 0);
  EXPECT_EQ(read.out, "-1\n");
}

TEST_F(DefaultsToolTest, ReadPrintsPlainScalarsAndXmlOtherwise) {
  ASSERT_TRUE(domain_.setObject("flag", Value(false)));
  ASSERT_TRUE(domain_.setObject("list", Value(Array{Value(1), Value("two")})));
  ASSERT_TRUE(domain_.setObject("when", Value(Date{1700000000})));
  EXPECT_EQ(run({"read", "com.velmar.zerith", "flag"}).out, "0\n");
  EXPECT_EQ(run({"read", "com.velmar.zerith", "when"}).out, "2023-11-14 22:13:20 +0000\n");
  const Result list = run({"read", "com.velmar.zerith", "list"});
  EXPECT_EQ(plist::decodeXml(plist::bytesOf(list.out)), Value(Array{Value(1), Value("two")}));
  const Result whole = run({"read", "com.velmar.zerith"});
  EXPECT_EQ(whole.status, 0);
  EXPECT_EQ(plist::decodeXml(plist::bytesOf(whole.out)), domain_.dictionary());
}

TEST_F(DefaultsToolTest, MissingDomainOrKeyIsStatusOneWithAMessage) {
  Result r = run({"read", "com.velmar.nothing"});
  EXPECT_EQ(r.status, tool::kNotFound);
  EXPECT_EQ(r.err, "zerith-defaults: domain com.velmar.nothing does not exist\n");
  ASSERT_TRUE(domain_.setObject("a", Value(1)));
  r = run({"read", "com.velmar.zerith", "b"});
  EXPECT_EQ(r.status, tool::kNotFound);
  EXPECT_EQ(r.err, "zerith-defaults: domain com.velmar.zerith has no key b\n");
  EXPECT_EQ(run({"delete", "com.velmar.zerith", "b"}).status, tool::kNotFound);
}

TEST_F(DefaultsToolTest, BadValuesAndBadCommandLinesChangeNothing) {
  ASSERT_TRUE(domain_.setObject("environmentType", Value(2)));
  Result r = run({"write", "com.velmar.zerith", "environmentType", "-int", "4x"});
  EXPECT_EQ(r.status, tool::kUsage);
  EXPECT_EQ(r.err, "zerith-defaults: '4x' is not an integer\n");
  EXPECT_EQ(run({"write", "com.velmar.zerith", "f", "-bool", "maybe"}).status, tool::kUsage);
  EXPECT_EQ(run({"write", "com.velmar.zerith", "r", "-real", "inf"}).status, tool::kUsage);
  EXPECT_EQ(run({"write", "com.velmar.zerith", "r", "-date", "now"}).status, tool::kUsage);
  EXPECT_EQ(run({"write", "../../etc/passwd", "k", "v"}).status, tool::kUsage);
  EXPECT_EQ(run({"frobnicate"}).status, tool::kUsage);
  EXPECT_EQ(run({}).status, tool::kUsage);
  EXPECT_EQ(domain_.objectForKey("environmentType"), Value(2));
  EXPECT_EQ(domain_.dictionary().count(), 1u);
}

TEST_F(DefaultsToolTest, DeleteRemovesAKeyOrTheWholeDomain) {
  ASSERT_TRUE(domain_.setObject("a", Value(1)));
  ASSERT_TRUE(domain_.setObject("b", Value(2)));
  EXPECT_EQ(run({"delete", "com.velmar.zerith", "a"}).status, 0);
  EXPECT_TRUE(domain_.objectForKey("a").isNil());
  EXPECT_EQ(domain_.objectForKey("b"), Value(2));
  EXPECT_EQ(runTool("delete com.velmar.zerith").status, 0);
  EXPECT_FALSE(std::filesystem::exists(domain_.path()));
  EXPECT_EQ(run({"delete", "com.velmar.zerith"}).status, tool::kNotFound);
}

// A name the daemon does not read is written all the same, with a warning
// that names the nearest one it reads; the daemon's own keys and the ones it
// makes itself (storebag metrics, identifiers) draw none.
TEST_F(DefaultsToolTest, AKeyOrDomainTheDaemonDoesNotReadIsWrittenWithAWarning) {
  const std::pair<std::string, std::string> writes[] = {
      {"com.velmar.zerith spoolEnbled -bool true",
       "zerith-defaults: warning: zerithd does not read \"spoolEnbled\" in com.velmar.zerith (did you mean "
       "\"spoolEnabled\"?)\n"},
      {"com.velmar.zerth spoolEnabled -bool true",
       "zerith-defaults: warning: zerithd reads no domain com.velmar.zerth (did you mean \"com.velmar.zerith\"?)\n"},
      {"com.velmar.zerith.consent DiagnosticsSubmissionAllowed -bool true", ""},
      {"com.velmar.zerith spoolEnabled -bool true", ""},
      {"com.velmar.zerith CACHED_dravon_max-age -int 600", ""},
  };
  for (const auto& [arguments, warning] : writes) {
    const Result r = runTool("write " + arguments);
    EXPECT_EQ(r.status, 0) << arguments;
    EXPECT_EQ(r.err, warning) << arguments;
  }
  EXPECT_EQ(domain_.objectForKey("spoolEnbled"), Value(true));

  // A value the daemon's reader refuses is written with a warning too.
  const Result outOfRange = runTool("write com.velmar.zerith uploadsAtOnce -int 0");
  EXPECT_EQ(outOfRange.status, 0);
  EXPECT_EQ(outOfRange.err, "zerith-defaults: warning: \"uploadsAtOnce\" in com.velmar.zerith is 0, outside 1 to "
                            "64; zerithd does not use this value\n");
}

// check names every problem of the domains the daemon reads, in each file's
// order, and says whether there was one.
TEST_F(DefaultsToolTest, CheckNamesUnreadKeysAndRefusedValues) {
  EXPECT_EQ(run({"check"}).out, "no problems\n");
  ASSERT_TRUE(domain_.setObject("spoolMaxBytes", Value("lots")));
  ASSERT_TRUE(domain_.setObject("spoolEnbled", Value(true)));
  ASSERT_TRUE(domain_.setObject("spoolEnabled", Value(true)));
  ASSERT_TRUE(Defaults("com.velmar.timed").setObject("AutomaticTimeZoneEnabled", Value("sometimes")));
  ASSERT_TRUE(Defaults("com.velmar.zerth").setObject("a", Value(1)));

  const Result all = run({"check"});
  EXPECT_EQ(all.status, tool::kNotFound);
  EXPECT_EQ(all.out, "3 problems\n");
  EXPECT_EQ(all.err,
            "zerith-defaults: \"spoolMaxBytes\" in com.velmar.zerith holds 'lots', not a number; zerithd does not use "
            "this value\n"
            "zerith-defaults: zerithd does not read \"spoolEnbled\" in com.velmar.zerith (did you mean "
            "\"spoolEnabled\"?); it is ignored\n"
            "zerith-defaults: \"AutomaticTimeZoneEnabled\" in com.velmar.timed holds 'sometimes', not a boolean; "
            "zerithd does not use this value\n");
  const Result named = runTool("check com.velmar.zerth");
  EXPECT_EQ(named.status, tool::kNotFound);
  EXPECT_EQ(named.err, "zerith-defaults: zerithd reads no domain com.velmar.zerth (did you mean "
                       "\"com.velmar.zerith\"?)\n");
  EXPECT_EQ(run({"check", "com.velmar.zerith", "../etc"}).status, tool::kUsage);
}

}  // namespace
}  // namespace zerith
