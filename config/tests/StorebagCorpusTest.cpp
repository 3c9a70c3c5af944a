// Replays the storebag fuzz corpora (seeds and kept crash inputs) through the
// parsers they exercise, so that the normal and sanitizer test runs guard
// against regressions without a fuzzing toolchain.

#include <gtest/gtest.h>

#include <filesystem>

#include "config/StorebagDiskCache.h"
#include "config/StorebagIssueTimes.h"
#include "config/StorebagVerify.h"
#include "platform/FileUtil.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

std::vector<std::filesystem::path> corpus(const char* target) {
  std::vector<std::filesystem::path> files;
  const auto dir = test::sourceDir() / "fuzz/corpus" / target;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(dir, ec)) {
    if (e.is_regular_file()) files.push_back(e.path());
  }
  return files;
}

TEST(StorebagCorpus, ContainerInputsAreRefusedOrVerifiedWithoutCrashing) {
  const auto files = corpus("storebag_container_fuzz");
  ASSERT_FALSE(files.empty()) << "no corpus under " << test::sourceDir();
  for (const auto& path : files) {
    const auto bytes = file::readAll(path, kMaxStorebagContainerBytes);
    ASSERT_TRUE(bytes) << path;
    // Without the corpus key nothing verifies: every input must end in a
    // clear refusal.
    const auto result = verifyStorebagContainer(*bytes, std::nullopt);
    EXPECT_NE(result.status, StorebagVerifyStatus::Verified) << path;
    (void)decodeStorebagBag(*bytes);
  }
}

TEST(StorebagCorpus, IssueTimesInputsAreReadOrRefusedWithoutCrashing) {
  const auto files = corpus("storebag_issue_times_fuzz");
  ASSERT_FALSE(files.empty());
  for (const auto& path : files) {
    const auto bytes = file::readAll(path, kMaxStorebagIssueTimesBytes);
    ASSERT_TRUE(bytes) << path;
    std::string why;
    if (!decodeStorebagIssueTimes(*bytes, &why)) {
      EXPECT_FALSE(why.empty()) << path;
    }
  }
}

TEST(StorebagCorpus, CacheControlInputsGiveAMaxAge) {
  for (const auto& path : corpus("storebag_cache_control_fuzz")) {
    const auto bytes = file::readAll(path, 1u << 20);
    ASSERT_TRUE(bytes) << path;
    (void)storebagMaxAgeFromCacheControl(std::string(bytes->begin(), bytes->end()));
  }
}

}  // namespace
}  // namespace zerith
