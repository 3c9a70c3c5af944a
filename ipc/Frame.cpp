#include "ipc/Frame.h"

#include <fmt/format.h>

#include <climits>
#include <cstring>

namespace zerith::ipc {

namespace {

void setWhy(std::string* why, std::string text) {
  if (why) {
    *why = std::move(text);
  }
}

// Call and reply numbers: non-negative integers (the binary format stores
// signed 64-bit integers, so that is how they come back).
std::optional<std::uint64_t> callNumber(const Value& v) {
  if (v.type() == Value::Type::Int && v.intValue() >= 0) {
    return static_cast<std::uint64_t>(v.intValue());
  }
  if (v.type() == Value::Type::UInt) {
    return v.unsignedValue();
  }
  return std::nullopt;
}

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF.
bool validUtf8(std::string_view s) {
  const auto* p = reinterpret_cast<const unsigned char*>(s.data());
  const auto* end = p + s.size();
  while (p < end) {
    const unsigned c = *p;
    std::size_t extra = 0;
    std::uint32_t min = 0;
    std::uint32_t code = 0;
    if (c < 0x80) {
      ++p;
      continue;
    } else if ((c & 0xe0) == 0xc0) {
      extra = 1, min = 0x80, code = c & 0x1f;
    } else if ((c & 0xf0) == 0xe0) {
      extra = 2, min = 0x800, code = c & 0x0f;
    } else if ((c & 0xf8) == 0xf0) {
      extra = 3, min = 0x10000, code = c & 0x07;
    } else {
      return false;
    }
    if (static_cast<std::size_t>(end - p) <= extra) {
      return false;
    }
    for (std::size_t i = 1; i <= extra; ++i) {
      if ((p[i] & 0xc0) != 0x80) {
        return false;
      }
      code = (code << 6) | (p[i] & 0x3f);
    }
    if (code < min || code > 0x10ffff || (code >= 0xd800 && code <= 0xdfff)) {
      return false;
    }
    p += extra + 1;
  }
  return true;
}

// Every string and key of a decoded message. libplist re-encodes a string
// that is not UTF-8 cut short at the first bad byte, so such a string would
// silently change on its way on; it is refused at the door instead.
bool allTextValid(const Value& v) {
  if (const auto* s = v.string()) {
    return validUtf8(*s);
  }
  if (const auto* d = v.dict()) {
    for (const auto& [key, value] : *d) {
      if (!validUtf8(key) || !allTextValid(value)) {
        return false;
      }
    }
  } else if (const auto* a = v.array()) {
    for (const auto& element : *a) {
      if (!allTextValid(element)) {
        return false;
      }
    }
  }
  return true;
}

}  // namespace

plist::Limits frameLimits() {
  // A frame holds one call: generous for payloads, small enough that a
  // hostile frame costs little.
  return plist::Limits{kMaxFrameBytes, 32, 1u << 18};
}

Data encodeFrame(const Value& message) {
  const Data body = plist::encodeBinary(message);
  Data frame(kFrameHeaderBytes + body.size());
  const auto n = static_cast<std::uint32_t>(body.size());
  frame[0] = static_cast<std::uint8_t>(n >> 24);
  frame[1] = static_cast<std::uint8_t>(n >> 16);
  frame[2] = static_cast<std::uint8_t>(n >> 8);
  frame[3] = static_cast<std::uint8_t>(n);
  if (!body.empty()) {
    std::memcpy(frame.data() + kFrameHeaderBytes, body.data(), body.size());
  }
  return frame;
}

Data encodeCall(std::string_view operation, std::optional<std::uint64_t> call, const Dictionary& args,
                std::uint32_t descriptors) {
  Dictionary message{{"op", Value(operation)}};
  if (call) {
    message.set("call", Value(static_cast<long long>(*call)));
  }
  if (descriptors > 0) {
    message.set("fds", Value(static_cast<long long>(descriptors)));
  }
  message.set("args", Value(args));
  return encodeFrame(Value(std::move(message)));
}

namespace {

Data encodeReplyFrame(std::uint64_t call, const Dictionary& args) {
  return encodeFrame(Value(Dictionary{{"reply", Value(static_cast<long long>(call))}, {"args", Value(args)}}));
}

// The reply of a call answered with no arguments (every event the backends
// took) is the same bytes from one call to the next but for the call number.
// libplist's binary writer sets up, zeroes and walks a table of 4096 buckets
// for every tree it writes, which costs more than the rest of such a reply
// (about 3 µs, and much more with cold caches). So libplist writes this reply
// once, with a call number wide enough to take eight bytes, and each reply
// copies those bytes and puts its own number in the same eight: a number the
// writer would have made narrower is the same integer in the wider form.
class EmptyReplyTemplate {
 public:
  EmptyReplyTemplate() {
    // Two numbers that need all eight bytes and differ in each of them.
    constexpr std::uint64_t kFirst = 0x5a5a5a5a5a5a5a5aull;
    constexpr std::uint64_t kSecond = 0x2b2b2b2b2b2b2b2bull;
    Data first = encodeReplyFrame(kFirst, Dictionary{});
    const Data second = encodeReplyFrame(kSecond, Dictionary{});
    if (first.size() != second.size()) {
      return;
    }
    std::size_t begin = 0;
    while (begin < first.size() && first[begin] == second[begin]) {
      ++begin;
    }
    std::size_t end = first.size();
    while (end > begin && first[end - 1] == second[end - 1]) {
      --end;
    }
    // Exactly the number's eight big-endian bytes differ; anything else means
    // the writer does not lay the reply out as expected, and every reply is
    // then written by libplist.
    if (end - begin != 8 || readBigEndian(first, begin) != kFirst || readBigEndian(second, begin) != kSecond) {
      return;
    }
    frame_ = std::move(first);
    numberAt_ = begin;
  }

  // The reply frame for `call`, or nullopt when the template is not usable
  // (or the number would not read back as the same non-negative integer).
  std::optional<Data> reply(std::uint64_t call) const {
    if (frame_.empty() || call > static_cast<std::uint64_t>(INT64_MAX)) {
      return std::nullopt;
    }
    Data frame = frame_;
    for (int i = 7; i >= 0; --i) {
      frame[numberAt_ + static_cast<std::size_t>(i)] = static_cast<std::uint8_t>(call & 0xff);
      call >>= 8;
    }
    return frame;
  }

 private:
  static std::uint64_t readBigEndian(const Data& bytes, std::size_t at) {
    std::uint64_t v = 0;
    for (std::size_t i = 0; i < 8; ++i) {
      v = (v << 8) | bytes[at + i];
    }
    return v;
  }

  Data frame_;
  std::size_t numberAt_ = 0;
};

// No argument with a value: a property list has no nil, so the reply is
// written without them (an accepted event's answer is {"result": nil}).
bool carriesNothing(const Dictionary& args) {
  for (const auto& [key, value] : args) {
    if (!value.isNil()) {
      return false;
    }
  }
  return true;
}

}  // namespace

Data encodeReply(std::uint64_t call, const Dictionary& args) {
  if (carriesNothing(args)) {
    static const EmptyReplyTemplate kEmptyReply;
    if (auto frame = kEmptyReply.reply(call)) {
      return std::move(*frame);
    }
  }
  return encodeReplyFrame(call, args);
}

Data encodeErrorReply(std::uint64_t call, const Error& error) {
  return encodeFrame(Value(Dictionary{{"reply", Value(static_cast<long long>(call))}, {"error", error.toValue()}}));
}

FrameDecoder::FrameDecoder(std::uint32_t maxFrameBytes) : maxFrameBytes_(maxFrameBytes) {}

void FrameDecoder::append(const std::uint8_t* bytes, std::size_t size) {
  if (offset_ > 0 && (offset_ == buffer_.size() || offset_ >= buffer_.size() / 2)) {
    buffer_.erase(buffer_.begin(), buffer_.begin() + static_cast<std::ptrdiff_t>(offset_));
    offset_ = 0;
  }
  buffer_.insert(buffer_.end(), bytes, bytes + size);
}

void FrameDecoder::releaseSpare() {
  constexpr std::size_t kKeep = 128u << 10;
  if (offset_ == buffer_.size() && buffer_.capacity() > kKeep) {
    Data().swap(buffer_);
    offset_ = 0;
  }
}

FrameDecoder::Status FrameDecoder::next(plist::Bytes& body, std::string& why) {
  if (invalid_) {
    why = "the stream was already invalid";
    return Status::Invalid;
  }
  const std::size_t available = buffer_.size() - offset_;
  if (available < kFrameHeaderBytes) {
    return Status::NeedMore;
  }
  const std::uint8_t* p = buffer_.data() + offset_;
  const std::uint32_t length = (std::uint32_t{p[0]} << 24) | (std::uint32_t{p[1]} << 16) |
                               (std::uint32_t{p[2]} << 8) | std::uint32_t{p[3]};
  if (length == 0) {
    invalid_ = true;
    why = "empty frame";
    return Status::Invalid;
  }
  if (length > maxFrameBytes_) {
    invalid_ = true;
    why = fmt::format("frame of {} bytes exceeds the limit of {}", length, maxFrameBytes_);
    return Status::Invalid;
  }
  if (available - kFrameHeaderBytes < length) {
    return Status::NeedMore;
  }
  body = plist::Bytes(p + kFrameHeaderBytes, length);
  offset_ += kFrameHeaderBytes + length;
  return Status::Frame;
}

std::optional<IncomingMessage> decodeMessage(plist::Bytes body, std::string* why) {
  if (!plist::looksBinary(body)) {
    setWhy(why, "frame body is not a binary property list");
    return std::nullopt;
  }
  std::string plistError;
  const auto root = plist::decodeBinary(body, frameLimits(), &plistError);
  if (!root) {
    setWhy(why, "frame body does not parse: " + plistError);
    return std::nullopt;
  }
  if (!root->isDict()) {
    setWhy(why, fmt::format("message is {}, not a dictionary", root->kindName()));
    return std::nullopt;
  }
  if (!allTextValid(*root)) {
    setWhy(why, "message holds text that is not valid UTF-8");
    return std::nullopt;
  }
  const Value args = (*root)["args"];
  if (!args.isNil() && !args.isDict()) {
    setWhy(why, fmt::format("message \"args\" is {}, not a dictionary", args.kindName()));
    return std::nullopt;
  }
  const Value op = (*root)["op"];
  const Value reply = (*root)["reply"];
  IncomingMessage message;
  if (!op.isNil()) {
    if (!op.isString()) {
      setWhy(why, fmt::format("message \"op\" is {}, not a string", op.kindName()));
      return std::nullopt;
    }
    if (!reply.isNil()) {
      setWhy(why, "message has both \"op\" and \"reply\"");
      return std::nullopt;
    }
    message.kind = IncomingMessage::Kind::Call;
    message.call.operation = *op.string();
    const Value call = (*root)["call"];
    if (!call.isNil()) {
      message.call.call = callNumber(call);
      if (!message.call.call) {
        setWhy(why, "message \"call\" is not an unsigned integer");
        return std::nullopt;
      }
    }
    if (const Value fds = (*root)["fds"]; !fds.isNil()) {
      const auto count = callNumber(fds);
      if (!count || *count > kMaxDescriptorsPerFrame) {
        setWhy(why, fmt::format("message \"fds\" is not a count of at most {} descriptors", kMaxDescriptorsPerFrame));
        return std::nullopt;
      }
      message.descriptorCount = static_cast<std::uint32_t>(*count);
    }
    if (const auto* d = args.dict()) {
      message.call.args = *d;
    }
    return message;
  }
  if (reply.isNil()) {
    setWhy(why, "message has neither \"op\" nor \"reply\"");
    return std::nullopt;
  }
  const auto replyTo = callNumber(reply);
  if (!replyTo) {
    setWhy(why, "message \"reply\" is not an unsigned integer");
    return std::nullopt;
  }
  message.kind = IncomingMessage::Kind::Reply;
  message.replyTo = *replyTo;
  const Value error = (*root)["error"];
  if (!error.isNil()) {
    if (!error.isDict()) {
      setWhy(why, fmt::format("reply \"error\" is {}, not a dictionary", error.kindName()));
      return std::nullopt;
    }
    message.replyError = Error::fromValue(error);
  } else if (const auto* d = args.dict()) {
    message.replyArgs = *d;
  }
  return message;
}

}  // namespace zerith::ipc
