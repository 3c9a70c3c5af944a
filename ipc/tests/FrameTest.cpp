#include "ipc/Frame.h"

#include <gtest/gtest.h>

#include <climits>
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

TEST(FrameCodec, AFrameIsABigEndianLengthAndABinaryPropertyList) {
  const Data frame = encodeCall("fetchDisplayURL:", 3, Dictionary{});
  ASSERT_GT(frame.size(), 12u);
  const std::size_t length = (std::size_t{frame[0]} << 24) | (std::size_t{frame[1]} << 16) | (std::size_t{frame[2]} << 8) | frame[3];
  EXPECT_EQ(length, frame.size() - 4);
  EXPECT_EQ(std::string(frame.begin() + 4, frame.begin() + 12), "bplist00");
  const auto decoded = plist::decodeBinary(plist::Bytes(frame.data() + 4, length));
  ASSERT_TRUE(decoded);
  EXPECT_EQ(*decoded, Value(Dictionary{{"op", "fetchDisplayURL:"}, {"call", 3}, {"args", Dictionary{}}}));
}

TEST(FrameCodec, EmptyRepliesReadBackWithTheirNumberAtEveryWidth) {
  // Every number must read back as itself, whatever width it is written in.
  const std::uint64_t wide = 0x1234567890abcdefull;
  EXPECT_EQ(encodeReply(wide, Dictionary{}),
            encodeFrame(Value(Dictionary{{"reply", Value(static_cast<long long>(wide))}, {"args", Dictionary{}}})));
  FrameDecoder decoder;
  const std::vector<std::uint64_t> numbers{0,           1,           255,        256,     65535, 65536, 0xffffffffull,
                                           1ull << 32,  1ull << 40,  wide,       static_cast<std::uint64_t>(INT64_MAX)};
  for (const std::uint64_t n : numbers) {
    const Data frame = encodeReply(n, Dictionary{});
    decoder.append(frame.data(), frame.size());
  }
  const auto bodies = drain(decoder);
  ASSERT_EQ(bodies.size(), numbers.size());
  for (std::size_t i = 0; i < numbers.size(); ++i) {
    std::string why;
    const auto m = decodeMessage(plist::bytesOf(bodies[i]), &why);
    ASSERT_TRUE(m) << numbers[i] << ": " << why;
    EXPECT_EQ(m->kind, IncomingMessage::Kind::Reply);
    EXPECT_EQ(m->replyTo, numbers[i]);
    EXPECT_TRUE(m->replyArgs.empty());
    EXPECT_FALSE(m->replyError);
  }
  // Arguments without a value are left out: a property list has no nil.
  const Dictionary nils{{"result", Value()}, {"error", Value()}};
  EXPECT_EQ(encodeReply(wide, nils),
            encodeFrame(Value(Dictionary{{"reply", Value(static_cast<long long>(wide))}, {"args", Value(nils)}})));
}

TEST(FrameCodec, DatesBeyondThirtyTwoBitSecondsAreClampedNotOverflowed) {
  // A client can send any date; answering with it must not overflow.
  const Data frame = encodeReply(1, Dictionary{{"late", Value(Date{1e15})}, {"early", Value(Date{-1e15})}});
  const auto message = decodeMessage(plist::Bytes(frame.data() + 4, frame.size() - 4));
  ASSERT_TRUE(message);
  EXPECT_EQ(message->replyArgs.get("late").date()->secondsSince1970, 2147483647.0 + 978307200.0);
  EXPECT_EQ(message->replyArgs.get("early").date()->secondsSince1970, -2147483648.0 + 978307200.0);
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

TEST(MessageShape, RepliesAndCallsThatBreakTheShapeAreRefusedWithTheReason) {
  auto why = [](const Value& v) {
    std::string w;
    EXPECT_FALSE(decodeMessage(plist::bytesOf(plist::encodeBinary(v)), &w)) << v.description();
    return w;
  };
  EXPECT_EQ(why(Value(Dictionary{{"op", "x"}, {"reply", 1}})), "message has both \"op\" and \"reply\"");
  EXPECT_EQ(why(Value(Dictionary{{"reply", "1"}})), "message \"reply\" is not an unsigned integer");
  EXPECT_EQ(why(Value(Dictionary{{"reply", 1}, {"error", "bad"}})), "reply \"error\" is a string, not a dictionary");
  EXPECT_EQ(why(Value(Dictionary{{"op", "x"}, {"call", 1.5}})), "message \"call\" is not an unsigned integer");
  EXPECT_EQ(why(Value("just a string")), "message is a string, not a dictionary");
}

}  // namespace
}  // namespace zerith::ipc
