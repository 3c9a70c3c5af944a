#pragma once

// The socket's framing and message shapes.
//
// A frame is a 4-byte big-endian body length followed by the body, a binary
// property list (never XML on the socket). The body must be a dictionary:
//   call:  {"op": <string>, "call": <unsigned, optional>, "args": <dictionary, optional>,
//           "fds": <unsigned, optional: descriptors the frame carries>}
//   reply: {"reply": <unsigned>, "args": <dictionary, optional>}
//          {"reply": <unsigned>, "error": {"domain", "code", "description"}}
// Anything else is a protocol violation that ends the connection.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "ipc/Connection.h"
#include "platform/BinaryPlist.h"
#include "platform/Error.h"
#include "platform/PropertyList.h"
#include "platform/Value.h"

namespace zerith::ipc {

// The client framework's error domain (kZerithErrorDomain); the IPC layer
// cannot link the framework, so it keeps the same text, and the framework's
// tests hold the two equal.
inline constexpr const char* kErrorDomain = "com.velmar.zerith.ErrorDomain";

inline constexpr std::size_t kFrameHeaderBytes = 4;

// Descriptors one call may carry (SCM_RIGHTS with the frame's first byte); a
// frame that claims more is a protocol violation.
inline constexpr std::uint32_t kMaxDescriptorsPerFrame = 4;

// The bounds a frame body must keep for the frame codec to read it.
plist::Limits frameLimits();

// One frame (header and body) carrying `message`.
Data encodeFrame(const Value& message);
Data encodeCall(std::string_view operation, std::optional<std::uint64_t> call, const Dictionary& args,
                std::uint32_t descriptors = 0);
// The same call frame written at offset `at` of `buffer`, which grows to
// make room and is not shrunk (a reused buffer is written without being
// cleared); returns the frame's size.
std::size_t encodeCallAt(Data& buffer, std::size_t at, std::string_view operation,
                         std::optional<std::uint64_t> call, const Dictionary& args, std::uint32_t descriptors = 0,
                         bplist::Shape* shape = nullptr);
// Why a frame's reader would refuse a body of `bodyBytes` bytes that has
// `shape` (too large, too deep, too many objects); nullopt when it would not.
std::optional<std::string> frameRefusal(std::size_t bodyBytes, const bplist::Shape& shape);
Data encodeReply(std::uint64_t call, const Dictionary& args);
Data encodeErrorReply(std::uint64_t call, const Error& error);

// Splits a byte stream into frame bodies. Bytes go in with append(); next()
// hands out complete bodies in order. Once it reports Invalid the stream is
// unusable (the connection closes).
class FrameDecoder {
 public:
  enum class Status { Frame, NeedMore, Invalid };

  explicit FrameDecoder(std::uint32_t maxFrameBytes = kMaxFrameBytes);

  void append(const std::uint8_t* bytes, std::size_t size);
  // Frame: `body` points into the decoder and stays valid until the next
  // append() or next(). Invalid: `why` says what was wrong.
  Status next(plist::Bytes& body, std::string& why);
  // Bytes received but not yet handed out.
  std::size_t buffered() const { return buffer_.size() - offset_; }
  // Bytes of memory the decoder holds (what is buffered and the spare room
  // behind it).
  std::size_t held() const { return buffer_.capacity(); }
  // Gives back its storage once nothing is buffered: an idle connection
  // holds no buffer.
  void releaseSpare();

 private:
  Data buffer_;
  std::size_t offset_ = 0;
  std::uint32_t maxFrameBytes_;
  bool invalid_ = false;
};

struct IncomingMessage {
  enum class Kind { Call, Reply };
  Kind kind = Kind::Call;
  Message call;                      // Kind::Call
  std::uint32_t descriptorCount = 0;  // Kind::Call: descriptors the frame claims
  std::uint64_t replyTo = 0;         // Kind::Reply
  Dictionary replyArgs;              // Kind::Reply without error
  std::optional<Error> replyError;   // Kind::Reply that failed
};

// The message in a frame body; nullopt when the body is not a binary
// property list of one of the shapes above (`why` says what was wrong).
std::optional<IncomingMessage> decodeMessage(plist::Bytes body, std::string* why = nullptr);

}  // namespace zerith::ipc
