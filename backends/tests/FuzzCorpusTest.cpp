// Every kept input of the backends' fuzz targets, crash reproducers
// included, goes through the readers again (each target aborts on a broken
// invariant).

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/FileUtil.h"
#include "tests/support/TempRoot.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);  // the dashboard datagram's
extern "C" int spoolFileFuzzOneInput(const std::uint8_t* data, std::size_t size);
extern "C" int recordJsonFuzzOneInput(const std::uint8_t* data, std::size_t size);

namespace zerith::test {
namespace {

struct Corpus {
  const char* name;
  int (*target)(const std::uint8_t*, std::size_t);
  std::size_t atLeast;
};

class FuzzCorpusTest : public ::testing::TestWithParam<Corpus> {};

TEST_P(FuzzCorpusTest, EveryInputIsReadWithItsInvariants) {
  const auto corpus = sourceDir() / "fuzz/corpus" / GetParam().name;
  ASSERT_TRUE(std::filesystem::is_directory(corpus)) << corpus;
  std::size_t count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(corpus)) {
    const auto bytes = file::readAll(entry.path(), 1u << 20);
    ASSERT_TRUE(bytes.has_value()) << entry.path();
    GetParam().target(bytes->data(), bytes->size());
    ++count;
  }
  EXPECT_GE(count, GetParam().atLeast);
}

INSTANTIATE_TEST_SUITE_P(Targets, FuzzCorpusTest,
                         ::testing::Values(Corpus{"dashboard_datagram_fuzz", LLVMFuzzerTestOneInput, 6},
                                           Corpus{"spool_file_fuzz", spoolFileFuzzOneInput, 7},
                                           Corpus{"record_json_fuzz", recordJsonFuzzOneInput, 4}),
                         [](const ::testing::TestParamInfo<Corpus>& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace zerith::test
