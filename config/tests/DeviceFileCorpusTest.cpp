#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <vector>

#include "platform/FileUtil.h"
#include "tests/support/TempRoot.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace zerith {
namespace {

// Every kept input of the device-file fuzz target, crash reproducers
// included, goes through the same readers again. In a child process: the
// inputs set the once-only internal-build flag.
TEST(DeviceFileCorpusDeathTest, EveryCorpusInputIsReadWithoutCrashing) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const auto corpus = test::sourceDir() / "fuzz/corpus/device_file_fuzz";
  ASSERT_TRUE(std::filesystem::is_directory(corpus)) << corpus;
  std::vector<std::filesystem::path> inputs;
  for (const auto& entry : std::filesystem::directory_iterator(corpus)) {
    inputs.push_back(entry.path());
  }
  ASSERT_FALSE(inputs.empty());
  EXPECT_EXIT(
      {
        test::TempRoot root;
        for (const auto& input : inputs) {
          const auto bytes = file::readAll(input, 1u << 20);
          if (!bytes) {
            std::exit(2);
          }
          LLVMFuzzerTestOneInput(bytes->data(), bytes->size());
        }
        std::exit(0);
      },
      ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace zerith
