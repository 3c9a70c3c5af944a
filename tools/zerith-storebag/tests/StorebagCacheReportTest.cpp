// zerith-storebag cached: what the daemon makes of each copy in its disk
// cache, decided by the same checks the daemon runs when it reads one back.

#include "tools/zerith-storebag/StorebagCacheReport.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <fstream>

#include <gtest/gtest.h>

#include "config/StorebagDiskCache.h"
#include "config/StorebagIssueTimes.h"
#include "config/StorebagSigner.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithBundle.h"

namespace zerith {
namespace {

namespace fs = std::filesystem;

// 2026-11-26 12:00:00 UTC, and days before it.
constexpr double kNoon = 1795694400;
constexpr double kDay = 86400;

class StorebagCacheReportTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fs::create_directories(frameworkPublicKeyPath().parent_path());
    ASSERT_TRUE(file::writeAtomically(frameworkPublicKeyPath(), keys().publicKeyDER));
  }

  static const StorebagKeyPair& keys() {
    static const StorebagKeyPair pair = *generateStorebagKeyPair(2048);
    return pair;
  }

  // A signed copy of a bag of `version`, issued at `issued`, saved at `saved`
  // by an answer that granted `maxAge` seconds.
  void cache(const std::string& name, const std::string& version, double issued, double saved, int maxAge,
             const std::string& privateKeyPEM = keys().privateKeyPEM) {
    const Data plain = plist::encodeBinary(Value(Dictionary{{"version", version}, {"release", Dictionary{}}}));
    const Data container = *signStorebagContainer(privateKeyPEM, *stampStorebagIssueTime(plain, Date{issued}));
    fs::create_directories(paths::storebagCacheDir());
    const fs::path path = paths::storebagCacheDir() / name;
    ASSERT_TRUE(file::writeAtomically(path, container));
    const timespec times[2] = {{static_cast<time_t>(saved), 0}, {static_cast<time_t>(saved), 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    setDefaultsObjectForKey(storebagMetricsKey(name, "max-age"), Value(maxAge));
  }

  std::string report() {
    std::string why;
    const auto r = reportStorebagCache(paths::storebagCacheDir(), &why);
    EXPECT_TRUE(r) << why;
    return r ? describeStorebagCache(*r, Date{kNoon}) : std::string();
  }

  test::TempRoot root_;
};

TEST_F(StorebagCacheReportTest, EachCopyIsUsedOrRefusedAsTheDaemonWouldDecide) {
  cache("dravon", "8.0", kNoon - 3 * kDay, kNoon - 2 * 3600 - 300, 3600);
  ASSERT_TRUE(rememberStorebagIssueTime("dravon", Date{kNoon - 3 * kDay}));
  setDefaultsObjectForKey(storebagMetricsKey("dravon", "Last-Modified"), Value("Mon, 23 Nov 2026 12:00:00 GMT"));
  // Older than the newest issue time accepted for its name.
  cache("bostin", "2.0", kNoon - 10 * kDay, kNoon - 60, 86400);
  ASSERT_TRUE(rememberStorebagIssueTime("bostin", Date{kNoon - 5 * kDay}));
  // Signed by a key the device does not hold.
  const StorebagKeyPair other = *generateStorebagKeyPair(2048);
  cache("elquin", "1.0", kNoon - kDay, kNoon - 60, 86400, other.privateKeyPEM);
  // Not a file; and a time remembered for a name with no copy left.
  fs::create_directories(paths::storebagCacheDir() / "farrow");
  ASSERT_TRUE(rememberStorebagIssueTime("gelmo", Date{kNoon - 7 * kDay}));

  const std::string out = report();
  const std::string folder = paths::storebagCacheDir().string();
  EXPECT_EQ(out.substr(0, out.find("\nelquin")),
            "Storebags cached in " + folder + ":\n"
            "\n"
            "bostin (client types 6, 14, 15)\n"
            "  saved      2026-11-26 11:59:00 +0000, 1 min ago, " +
                std::to_string(fs::file_size(paths::storebagCacheDir() / "bostin")) + " bytes\n"
            "  max age    1 d: fresh for 23 h 59 min more\n"
            "  signature  verified\n"
            "  version    2.0\n"
            "  issued     2026-11-16 12:00:00 +0000\n"
            "  newest issue time accepted  2026-11-21 12:00:00 +0000\n"
            "  the daemon refuses this copy: a rollback: issued before 2026-11-21 12:00:00 +0000, the newest issue "
            "time accepted for it\n"
            "\n"
            "dravon (client types 7, 11, 13, 20)\n"
            "  saved      2026-11-26 09:55:00 +0000, 2 h 5 min ago, " +
                std::to_string(fs::file_size(paths::storebagCacheDir() / "dravon")) + " bytes\n"
            "  max age    1 h: passed; the next session's fetch uses this copy and asks the server again\n"
            "  server's Last-Modified  Mon, 23 Nov 2026 12:00:00 GMT\n"
            "  signature  verified\n"
            "  version    8.0\n"
            "  issued     2026-11-23 12:00:00 +0000\n"
            "  newest issue time accepted  2026-11-23 12:00:00 +0000\n"
            "  the daemon uses this copy\n");
  EXPECT_NE(out.find("elquin (client type 8)\n"), std::string::npos) << out;
  EXPECT_NE(out.find("  signature  refused: the signature does not match the bag under this public key ("),
            std::string::npos)
      << out;
  EXPECT_NE(out.find("  the daemon refuses this copy: its signature: the signature does not match"), std::string::npos)
      << out;
  EXPECT_NE(out.find("farrow (client type 9)\n  signature  not checked\n  the daemon refuses this copy: the file "
                     "cannot be read: not a regular file\n"),
            std::string::npos)
      << out;
  EXPECT_NE(out.find("Issue times remembered without a cached copy (" + storebagIssueTimesFile().string() +
                     "):\n  gelmo  2026-11-19 12:00:00 +0000\n"),
            std::string::npos)
      << out;

  // Read only: the remembered times are as they were.
  EXPECT_EQ(rememberedStorebagIssueTime("bostin"), Date{kNoon - 5 * kDay});
}

TEST_F(StorebagCacheReportTest, AnEmptyCacheAndUnreadableIssueTimes) {
  EXPECT_EQ(report(), "No storebag is cached in " + paths::storebagCacheDir().string() + ".\n");
  EXPECT_FALSE(fs::exists(paths::storebagCacheDir())) << "the report makes no folder";

  fs::create_directories(storebagIssueTimesFile().parent_path());
  std::ofstream(storebagIssueTimesFile()) << "not a property list";
  EXPECT_NE(report().find("The remembered issue times cannot be read: "), std::string::npos);
}

}  // namespace
}  // namespace zerith
