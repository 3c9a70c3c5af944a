#include <gtest/gtest.h>

#include <filesystem>

#include "platform/FileUtil.h"
#include "tests/support/TempRoot.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace zerith {
namespace {

// Every kept input of the dashboard fuzz target, crash reproducers included,
// goes through the datagram and acknowledgement readers again (the target
// aborts on a broken invariant).
TEST(DashboardCorpusTest, EveryCorpusInputIsReadWithItsInvariants) {
  const auto corpus = test::sourceDir() / "fuzz/corpus/dashboard_datagram_fuzz";
  ASSERT_TRUE(std::filesystem::is_directory(corpus)) << corpus;
  std::size_t count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(corpus)) {
    const auto bytes = file::readAll(entry.path(), 1u << 20);
    ASSERT_TRUE(bytes.has_value()) << entry.path();
    LLVMFuzzerTestOneInput(bytes->data(), bytes->size());
    ++count;
  }
  EXPECT_GE(count, 6u);
}

}  // namespace
}  // namespace zerith
