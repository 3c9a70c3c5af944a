// A reply frame body from the daemon's socket -> message decoder -> the
// status parser of `zerith status`.
//
// Whatever the parser accepts must survive being written back and parsed
// again unchanged; whatever it refuses must say why.

#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "ipc/DaemonStatus.h"
#include "ipc/Frame.h"

using namespace zerith;
using namespace zerith::ipc;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string why;
  const auto message = decodeMessage(plist::Bytes(data, size), &why);
  if (!message || message->kind != IncomingMessage::Kind::Reply) {
    return 0;
  }
  why.clear();
  const auto status = DaemonStatus::fromValue(message->replyArgs.get(kStatusArgument), &why);
  if (!status) {
    if (why.empty()) {
      std::abort();  // every refusal says why
    }
    return 0;
  }
  const Value written = status->toValue();
  const auto again = DaemonStatus::fromValue(written);
  if (!again || again->toValue() != written) {
    std::abort();
  }
  // Through the wire once more, as the daemon sends it.
  const Data frame = encodeReply(1, Dictionary{{kStatusArgument, written}});
  const auto decoded = decodeMessage(plist::Bytes(frame.data() + kFrameHeaderBytes, frame.size() - kFrameHeaderBytes));
  if (!decoded || !DaemonStatus::fromValue(decoded->replyArgs.get(kStatusArgument))) {
    std::abort();
  }
  return 0;
}
