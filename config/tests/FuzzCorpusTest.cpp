// Replays the config fuzz corpora (seeds and kept crash inputs) through the
// parsers they exercise, so that the normal and sanitizer test runs guard
// against regressions without a fuzzing toolchain.

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>

#include "config/StorebagDiskCache.h"
#include "config/StorebagIssueTimes.h"
#include "config/StorebagVerify.h"
#include "platform/FileUtil.h"
#include "tests/support/TempRoot.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace zerith {
namespace {

// Every file of the target's corpus with its contents; none may be missing.
std::vector<std::pair<std::filesystem::path, Data>> corpus(const char* target, std::size_t limit) {
  std::vector<std::pair<std::filesystem::path, Data>> inputs;
  const auto dir = test::sourceDir() / "fuzz/corpus" / target;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(dir, ec)) {
    if (!e.is_regular_file()) continue;
    auto bytes = file::readAll(e.path(), limit);
    EXPECT_TRUE(bytes) << e.path();
    if (bytes) inputs.emplace_back(e.path(), std::move(*bytes));
  }
  EXPECT_FALSE(inputs.empty()) << "no corpus under " << dir;
  return inputs;
}

TEST(StorebagCorpus, ContainerInputsAreRefusedOrVerifiedWithoutCrashing) {
  for (const auto& [path, bytes] : corpus("storebag_container_fuzz", kMaxStorebagContainerBytes)) {
    // Without the corpus key nothing verifies: every input must end in a
    // clear refusal.
    EXPECT_NE(verifyStorebagContainer(bytes, std::nullopt).status, StorebagVerifyStatus::Verified) << path;
    (void)decodeStorebagBag(bytes);
  }
}

TEST(StorebagCorpus, IssueTimesInputsAreReadOrRefusedWithoutCrashing) {
  for (const auto& [path, bytes] : corpus("storebag_issue_times_fuzz", kMaxStorebagIssueTimesBytes)) {
    std::string why;
    if (!decodeStorebagIssueTimes(bytes, &why)) {
      EXPECT_FALSE(why.empty()) << path;
    }
  }
}

TEST(StorebagCorpus, CacheControlInputsGiveAMaxAge) {
  for (const auto& [path, bytes] : corpus("storebag_cache_control_fuzz", 1u << 20)) {
    (void)storebagMaxAgeFromCacheControl(std::string(bytes.begin(), bytes.end()));
  }
}

// In a child process: the inputs set the once-only internal-build flag.
TEST(DeviceFileCorpusDeathTest, EveryCorpusInputIsReadWithoutCrashing) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const auto inputs = corpus("device_file_fuzz", 1u << 20);
  EXPECT_EXIT(
      {
        {
          test::TempRoot root;  // gone before the exit, which unwinds nothing
          for (const auto& [path, bytes] : inputs) LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
        }
        std::exit(0);
      },
      ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace zerith
