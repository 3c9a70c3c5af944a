#include "ipc/Frame.h"

#include <gtest/gtest.h>

#include <random>
#include <vector>

namespace zerith::ipc {
namespace {

std::vector<Data> drain(FrameDecoder& decoder) {
  std::vector<Data> bodies;
  for (;;) {
    plist::Bytes body;
    std::string why;
    const auto status = decoder.next(body, why);
    if (status != FrameDecoder::Status::Frame) {
      EXPECT_NE(status, FrameDecoder::Status::Invalid) << why;
      return bodies;
    }
    bodies.emplace_back(body.begin(), body.end());
  }
}

// The messages of `frames`, read back through one decoder.
std::vector<IncomingMessage> readBack(std::initializer_list<Data> frames) {
  FrameDecoder decoder;
  for (const Data& f : frames) {
    decoder.append(f.data(), f.size());
  }
  std::vector<IncomingMessage> out;
  for (const Data& body : drain(decoder)) {
    std::string why;
    const auto m = decodeMessage(plist::bytesOf(body), &why);
    EXPECT_TRUE(m) << why;
    out.push_back(m.value_or(IncomingMessage{}));
  }
  EXPECT_EQ(out.size(), frames.size());
  return out;
}

TEST(FrameCodec, EmptyRepliesReadBackWithTheirNumberAtEveryWidth) {
  // Every number must read back as itself, whatever width it is written in.
  const std::uint64_t wide = 0x1234567890abcdefull;
  EXPECT_EQ(encodeReply(wide, Dictionary{}),
            encodeFrame(Value(Dictionary{{"reply", Value(static_cast<long long>(wide))}, {"args", Dictionary{}}})));
  for (const std::uint64_t n : std::initializer_list<std::uint64_t>{0, 1, 255, 256, 65535, 65536, 0xffffffffull, 1ull << 32,
                                                                     1ull << 40, wide, INT64_MAX}) {
    const auto m = readBack({encodeReply(n, Dictionary{})});
    ASSERT_EQ(m.size(), 1u);
    EXPECT_EQ(std::make_tuple(m[0].kind, m[0].replyTo, m[0].replyArgs, m[0].replyError),
              std::make_tuple(IncomingMessage::Kind::Reply, n, Dictionary{}, std::optional<Error>()));
  }
  // Arguments without a value are left out: a property list has no nil.
  const Dictionary nils{{"result", Value()}, {"error", Value()}};
  EXPECT_EQ(encodeReply(wide, nils),
            encodeFrame(Value(Dictionary{{"reply", Value(static_cast<long long>(wide))}, {"args", Value(nils)}})));
  // Replies with arguments are still written whole.
  const auto withArgs = readBack({encodeReply(7, Dictionary{{"result", "r"}})});
  ASSERT_EQ(withArgs.size(), 1u);
  EXPECT_EQ(withArgs[0].replyArgs, (Dictionary{{"result", "r"}}));
}

TEST(FrameCodec, DatesBeyondThirtyTwoBitSecondsAreClampedNotOverflowed) {
  // A client can send any date; answering with it must not overflow.
  const auto m = readBack({encodeReply(1, Dictionary{{"late", Value(Date{1e15})}, {"early", Value(Date{-1e15})}})});
  ASSERT_EQ(m.size(), 1u);
  EXPECT_EQ(m[0].replyArgs, (Dictionary{{"late", Value(Date{2147483647.0 + 978307200.0})},
                                        {"early", Value(Date{-2147483648.0 + 978307200.0})}}));
}

TEST(FrameDecoderTest, FramesCutAtEveryPossiblePlaceComeOutWholeAndInOrder) {
  // Many frames of varied sizes, appended in random cuts (including cuts
  // inside the length header), so the buffer compacts while frames are
  // half-read.
  std::mt19937 random(7);
  Data stream;
  std::vector<Data> expected;
  for (int i = 0; i < 300; ++i) {
    const Data f = encodeCall("n", static_cast<std::uint64_t>(i), Dictionary{{"pad", Value(Data(random() % 3000, 1))}});
    expected.emplace_back(f.begin() + 4, f.end());
    stream.insert(stream.end(), f.begin(), f.end());
  }
  FrameDecoder decoder;
  std::vector<Data> got;
  for (std::size_t off = 0; off < stream.size();) {
    const std::size_t n = std::min<std::size_t>(1 + random() % 5000, stream.size() - off);
    decoder.append(stream.data() + off, n);
    off += n;
    for (auto& b : drain(decoder)) {
      got.push_back(std::move(b));
    }
  }
  EXPECT_EQ(got, expected);
  EXPECT_EQ(decoder.buffered(), 0u);
}

TEST(FrameDecoderTest, ExactlyTheLimitPassesOneMoreIsRefusedFromTheHeaderAloneAndStaysRefused) {
  FrameDecoder exact(10);
  const Data frame{0, 0, 0, 10, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10};
  exact.append(frame.data(), frame.size());
  plist::Bytes body;
  std::string why;
  ASSERT_EQ(exact.next(body, why), FrameDecoder::Status::Frame);
  EXPECT_EQ(body.size(), 10u);

  FrameDecoder decoder(100);
  const Data header{0, 0, 0, 101};
  decoder.append(header.data(), header.size());
  EXPECT_EQ(decoder.next(body, why), FrameDecoder::Status::Invalid);
  EXPECT_EQ(why, "frame of 101 bytes exceeds the limit of 100");
  const Data ok = encodeCall("x", std::nullopt, {});
  decoder.append(ok.data(), ok.size());
  EXPECT_EQ(decoder.next(body, why), FrameDecoder::Status::Invalid);
}

}  // namespace
}  // namespace zerith::ipc
