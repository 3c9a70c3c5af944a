#include "config/StorebagDiskCache.h"

#include <fstream>

#include "config/tests/StorebagTestFixture.h"

namespace zerith {
namespace {

using log::Level;
using test::bytes;

HTTPURLResponse response(std::optional<std::string> cacheControl, std::optional<std::string> lastModified) {
  HTTPURLResponse r;
  r.statusCode = 200;
  r.url = "https://127.0.0.1/ambrel";
  if (cacheControl) r.headers.emplace_back("cache-control", *cacheControl);  // names are case-insensitive
  if (lastModified) r.headers.emplace_back("Last-Modified", *lastModified);
  return r;
}

using StorebagDiskCacheTest = test::StorebagTest;

TEST(StorebagCacheControl, MaxAgeIsTheComponentAfterMaxAgeElse86400) {
  struct Case {
    std::optional<std::string> header;
    std::int32_t maxAge;
  };
  const Case cases[] = {
      {"max-age=600", 600},
      {"public, max-age=600, must-revalidate", 600},  // "600," counts by its leading digits
      {"max-age 42", 42},                              // a space separates as '=' does
      {"no-cache", 86400},
      {std::nullopt, 86400},
      {"", 86400},
      {"public, max-age", 86400},   // nothing after it
      {"max-age= 600", 0},          // the empty component between '=' and ' ' follows it
      {"max-age=abc", 0},
      {"s-maxage=5", 86400},
      {"Max-Age=5", 86400},  // the directive name is matched exactly
      {"max-age=0", 0},
      {"max-age=99999999999", 2147483647},
      {"max-age=-5", -5},
      {"max-age=1, max-age=2", 1},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(storebagMaxAgeFromCacheControl(c.header), c.maxAge) << c.header.value_or("(no header)");
  }
}

TEST_F(StorebagDiskCacheTest, ReadingMetricsReportsAChangedOrUnchangedLastModified) {
  std::int32_t maxAge = -1;
  bool unchanged = false;
  std::optional<std::string> lastModified;
  getLastLoadedStorebagMetricsWithName("ambrel", &maxAge, &unchanged, &lastModified);
  EXPECT_EQ(std::tie(maxAge, unchanged, lastModified),
            std::make_tuple(0, false, std::optional<std::string>()));  // no metrics: a cached copy is always stale
  EXPECT_TRUE(logs_.has(Level::Debug, "getLastLoadedStorebagMetricsWithName: maxAge is 0 for storebag ambrel"));

  saveLastLoadedStorebagMetricsWithName("ambrel", response("max-age=77", "Wed, 01 May 2024 10:00:00 GMT"));
  getLastLoadedStorebagMetricsWithName("ambrel", &maxAge, &unchanged, &lastModified);
  EXPECT_EQ(std::tie(maxAge, unchanged, lastModified),  // unchanged: nothing passed in always differs
            std::make_tuple(77, false, std::optional<std::string>("Wed, 01 May 2024 10:00:00 GMT")));
  EXPECT_TRUE(logs_.has(Level::Debug,
                        "getLastLoadedStorebagMetricsWithName: 'Last-Modified' has changed to 'Wed, 01 May 2024 "
                        "10:00:00 GMT' for storebag 'ambrel'"));

  getLastLoadedStorebagMetricsWithName("ambrel", nullptr, &unchanged, &lastModified);
  EXPECT_TRUE(unchanged);
  EXPECT_TRUE(logs_.has(Level::Debug,
                        "getLastLoadedStorebagMetricsWithName: 'Last-Modified' has not changed for storebag 'ambrel': "
                        "'Wed, 01 May 2024 10:00:00 GMT'"));

  // An equal value without a flag to set is harmless.
  getLastLoadedStorebagMetricsWithName("ambrel", nullptr, nullptr, &lastModified);
}

TEST_F(StorebagDiskCacheTest, SavedContainerIsReadBackWithItsModificationDate) {
  EXPECT_FALSE(storebagCacheModificationDate("ambrel"));
  const Data container = bytes("signed container bytes");
  const double before = Date::now().secondsSince1970;
  ASSERT_TRUE(saveStorebagToDisk("ambrel", container));
  EXPECT_EQ(loadStorebagFromDisk("ambrel"), container);
  EXPECT_EQ(storebagCacheFileURL("ambrel"), paths::storebagCacheDir() / "ambrel");
  const auto modified = storebagCacheModificationDate("ambrel");
  ASSERT_TRUE(modified);
  EXPECT_GE(modified->secondsSince1970, before - 1);
  EXPECT_LE(modified->secondsSince1970, Date::now().secondsSince1970 + 1);

  // A second save replaces the whole file.
  ASSERT_TRUE(saveStorebagToDisk("ambrel", bytes("x")));
  EXPECT_EQ(loadStorebagFromDisk("ambrel"), bytes("x"));
  // No temporary files are left next to it.
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(paths::storebagCacheDir()), {}), 1);
}

TEST_F(StorebagDiskCacheTest, MissingOrOversizedCacheFileIsALoggedLoadFailure) {
  EXPECT_FALSE(loadStorebagFromDisk("ambrel"));
  const std::string path = (paths::storebagCacheDir() / "ambrel").string();
  EXPECT_TRUE(logs_.has(Level::Error, "loadStorebagFromDisk: could not load storebag 'ambrel' from file '" + path +
                                          "'. Error is 'No such file or directory'"));

  std::ofstream(paths::storebagCacheDir() / "ambrel") << std::string(kMaxStorebagContainerBytes + 1, 'x');
  logs_.clear();
  EXPECT_FALSE(loadStorebagFromDisk("ambrel"));
  EXPECT_TRUE(logs_.contains("loadStorebagFromDisk: could not load storebag 'ambrel' from file '" + path +
                             "'. Error is 'file of 4194305 bytes is larger than 4194304 bytes'"));
}

TEST_F(StorebagDiskCacheTest, UnwritableCacheIsALoggedSaveFailureThatKeepsTheOldFile) {
  ASSERT_TRUE(saveStorebagToDisk("ambrel", bytes("old")));
  // A folder in the file's place cannot be replaced by the saved file (file
  // modes would not stop the superuser the tests may run as).
  std::filesystem::create_directories(paths::storebagCacheDir() / "bostin" / "inside");
  EXPECT_FALSE(saveStorebagToDisk("bostin", bytes("new")));
  const std::string path = (paths::storebagCacheDir() / "bostin").string();
  EXPECT_TRUE(logs_.has(Level::Error, "saveStorebagToDisk: could not save storebag 'bostin' to file '" + path +
                                          "'. Error is 'Is a directory'"));
  EXPECT_EQ(loadStorebagFromDisk("ambrel"), bytes("old"));
}

}  // namespace
}  // namespace zerith
