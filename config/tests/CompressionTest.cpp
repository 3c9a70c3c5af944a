#include <gtest/gtest.h>
#include <zlib.h>

#include <string>
#include <thread>
#include <vector>

#include "config/Compression.h"
#include "platform/Crypto.h"
#include "platform/Log.h"

namespace zerith {
namespace {

using log::Level;

Data bytes(const std::string& s) { return Data(s.begin(), s.end()); }

TEST(CompressionTest, EmptyBufferGivesNilAndItsError) {
  log::LogCapture capture;
  EXPECT_EQ(compressDataWithZlibOrGzip(true, Data{}), std::nullopt);
  EXPECT_EQ(compressDataWithZlibOrGzip(false, Data{}), std::nullopt);
  EXPECT_EQ(gzipDeflate(Data{}), std::nullopt);
  EXPECT_TRUE(capture.has(Level::Error, "compressDataWithZlibOrGzip: Cannot compress empty QFData"));
}

// Streams are kept, reset, for later calls: a stream that compressed a
// large input, of the other format, or on another thread at the same time,
// must leave nothing behind that changes the next output. A fresh zlib
// stream at the same settings (windowBits 31 gzip, 15 zlib) is the
// reference for the exact bytes, so every output also reads back whole.
Data freshDeflate(bool gzip, const Data& input) {
  z_stream s{};
  EXPECT_EQ(deflateInit2(&s, Z_DEFAULT_COMPRESSION, Z_DEFLATED, gzip ? 31 : 15, 8, Z_DEFAULT_STRATEGY), Z_OK);
  Data out(deflateBound(&s, static_cast<uLong>(input.size())));
  s.next_in = const_cast<Bytef*>(input.data());
  s.avail_in = static_cast<uInt>(input.size());
  s.next_out = out.data();
  s.avail_out = static_cast<uInt>(out.size());
  EXPECT_EQ(deflate(&s, Z_FINISH), Z_STREAM_END);
  out.resize(s.total_out);
  deflateEnd(&s);
  return out;
}

TEST(CompressionTest, KeptStreamsGiveTheBytesOfAFreshStreamWhateverRanBefore) {
  Data random(300000);
  crypto::randomBytes(random);
  std::string text;
  for (int i = 0; i < 500; ++i) {
    text += R"({"_sender":"YJ","_method":)" + std::to_string(i) + "},";
  }
  const std::vector<Data> inputs{random, bytes(text), bytes("a"), bytes(text.substr(0, 700))};
  log::LogCapture capture;
  // The formats by their headers (gzip with deflate; zlib at the default
  // level), and text this repetitive shrinks a lot.
  const Data gz = compressDataWithZlibOrGzip(true, inputs[1]).value();
  const Data z = compressDataWithZlibOrGzip(false, inputs[1]).value();
  EXPECT_EQ(Data(gz.begin(), gz.begin() + 3), (Data{0x1f, 0x8b, 8}));
  EXPECT_EQ(Data(z.begin(), z.begin() + 2), (Data{0x78, 0x9c}));
  EXPECT_LT(gz.size(), text.size() / 10);
  EXPECT_TRUE(capture.has(Level::Debug, "compressDataWithZlibOrGzip: Compressed file from " +
                                            std::to_string(text.size()) + " to " + std::to_string(gz.size())));
  for (int round = 0; round < 3; ++round) {
    for (const Data& input : inputs) {
      for (const bool gzip : {true, false}) {
        const auto out = compressDataWithZlibOrGzip(gzip, input);
        ASSERT_TRUE(out);
        EXPECT_EQ(*out, freshDeflate(gzip, input)) << (gzip ? "gzip" : "zlib") << " of " << input.size() << " bytes";
      }
    }
  }
  // More threads than streams kept: each gets a stream of its own, and
  // every output is still exact.
  std::vector<std::thread> threads;
  std::vector<int> wrong(6, 0);
  for (int t = 0; t < 6; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 20; ++i) {
        const Data& input = inputs[static_cast<std::size_t>((t + i) % 4)];
        const bool gzip = (t + i) % 2 == 0;
        const auto out = compressDataWithZlibOrGzip(gzip, input);
        if (!out || *out != freshDeflate(gzip, input)) {
          ++wrong[static_cast<std::size_t>(t)];
        }
      }
    });
  }
  for (auto& thread : threads) {
    thread.join();
  }
  EXPECT_EQ(wrong, std::vector<int>(6, 0));
}

TEST(CompressionTest, InitAndDeflateTablesDifferWhereTheyMust) {
  EXPECT_STREQ(compression::initErrorMessage(Z_BUF_ERROR), "Unknown error code.");
  EXPECT_STREQ(compression::deflateErrorMessage(Z_BUF_ERROR), "Ran out of output buffer for writing compressed bytes.");
  EXPECT_STREQ(compression::initErrorMessage(Z_MEM_ERROR), "Insufficient memory.");
  EXPECT_STREQ(compression::deflateErrorMessage(Z_MEM_ERROR), "Memory could not be allocated for processing.");
  EXPECT_STREQ(compression::initErrorMessage(Z_STREAM_ERROR), "Invalid parameter passed in to function.");
  EXPECT_STREQ(compression::deflateErrorMessage(Z_STREAM_ERROR),
               "The stream state was inconsistent (e.g., next_in or next_out was NULL).");
  EXPECT_STREQ(compression::initErrorMessage(Z_DATA_ERROR), "Unknown error code.");
  EXPECT_STREQ(compression::deflateErrorMessage(Z_DATA_ERROR), "The deflate data was invalid or incomplete.");
  EXPECT_STREQ(compression::initErrorMessage(Z_ERRNO), "Unknown error code.");
  EXPECT_STREQ(compression::deflateErrorMessage(Z_ERRNO), "Error occured while reading file.");
  EXPECT_STREQ(compression::initErrorMessage(Z_VERSION_ERROR), compression::deflateErrorMessage(Z_VERSION_ERROR));
  EXPECT_STREQ(compression::deflateErrorMessage(42), "Unknown error code.");
}

}  // namespace
}  // namespace zerith
