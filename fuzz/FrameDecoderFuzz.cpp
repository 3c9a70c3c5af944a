// Bytes from a client socket -> frame decoder -> messages.
//
// The first byte chooses how the stream is cut into appends (1 to 256
// bytes), so frames straddle reads the way they do on a socket. Every frame
// the decoder hands out goes through the message decoder; a call that
// decodes must survive being encoded and decoded again with its operation
// and call number intact.

#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "ipc/Frame.h"

using namespace zerith;
using namespace zerith::ipc;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) {
    return 0;
  }
  const std::size_t chunk = std::size_t{data[0]} + 1;
  ++data;
  --size;

  FrameDecoder decoder;
  std::size_t offset = 0;
  bool invalid = false;
  while (offset < size && !invalid) {
    const std::size_t n = std::min(chunk, size - offset);
    decoder.append(data + offset, n);
    offset += n;
    for (;;) {
      plist::Bytes body;
      std::string why;
      const auto status = decoder.next(body, why);
      if (status == FrameDecoder::Status::NeedMore) {
        break;
      }
      if (status == FrameDecoder::Status::Invalid) {
        if (why.empty()) {
          std::abort();  // every refusal says why
        }
        invalid = true;
        break;
      }
      auto message = decodeMessage(body, &why);
      if (!message) {
        if (why.empty()) {
          std::abort();
        }
        continue;
      }
      if (message->kind != IncomingMessage::Kind::Call) {
        continue;
      }
      const Data again = encodeCall(message->call.operation, message->call.call, message->call.args);
      FrameDecoder second;
      second.append(again.data(), again.size());
      plist::Bytes body2;
      if (second.next(body2, why) != FrameDecoder::Status::Frame) {
        std::abort();
      }
      auto round = decodeMessage(body2, &why);
      if (!round || round->call.operation != message->call.operation || round->call.call != message->call.call) {
        std::abort();
      }
    }
  }
  return 0;
}
