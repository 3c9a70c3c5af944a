#include "ipc/Frame.h"

#include <fmt/format.h>

#include <span>

#include "platform/BinaryPlist.h"

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

}  // namespace

plist::Limits frameLimits() {
  // A frame holds one call: generous for payloads, small enough that a
  // hostile frame costs little.
  return plist::Limits{kMaxFrameBytes, 32, 1u << 18};
}

namespace {

void putLength(Data& buffer, std::size_t at, std::size_t n) {
  buffer[at] = static_cast<std::uint8_t>(n >> 24);
  buffer[at + 1] = static_cast<std::uint8_t>(n >> 16);
  buffer[at + 2] = static_cast<std::uint8_t>(n >> 8);
  buffer[at + 3] = static_cast<std::uint8_t>(n);
}

// The frame of the dictionary of `fields`, written in place.
Data encodeFields(std::span<const bplist::Field> fields) {
  Data frame;
  const std::size_t n = bplist::encodeAt(fields, frame, kFrameHeaderBytes);
  frame.resize(kFrameHeaderBytes + n);
  putLength(frame, 0, n);
  return frame;
}

}  // namespace

Data encodeFrame(const Value& message) {
  // The header, then the body written in place behind it.
  Data frame;
  frame.reserve(256);
  frame.resize(kFrameHeaderBytes);
  putLength(frame, 0, bplist::encode(message, frame));
  return frame;
}

std::size_t encodeCallAt(Data& buffer, std::size_t at, std::string_view operation,
                         std::optional<std::uint64_t> call, const Dictionary& args, std::uint32_t descriptors,
                         bplist::Shape* shape) {
  bplist::Field fields[4];
  std::size_t count = 0;
  fields[count++] = bplist::textField("op", operation);
  if (call) {
    fields[count++] = bplist::integerField("call", *call);
  }
  if (descriptors > 0) {
    fields[count++] = bplist::integerField("fds", descriptors);
  }
  fields[count++] = bplist::dictionaryField("args", args);
  const std::size_t n = bplist::encodeAt(std::span(fields, count), buffer, at + kFrameHeaderBytes, shape);
  putLength(buffer, at, n);
  return kFrameHeaderBytes + n;
}

std::optional<std::string> frameRefusal(std::size_t bodyBytes, const bplist::Shape& shape) {
  const plist::Limits limits = frameLimits();
  if (bodyBytes > limits.maxBytes) {
    return fmt::format("message of {} bytes exceeds the frame limit of {}", bodyBytes, limits.maxBytes);
  }
  if (shape.depth > limits.maxDepth) {
    return fmt::format("message nests deeper than {} levels", limits.maxDepth);
  }
  if (shape.objects > limits.maxNodes) {
    return fmt::format("message holds more than {} objects", limits.maxNodes);
  }
  return std::nullopt;
}

Data encodeCall(std::string_view operation, std::optional<std::uint64_t> call, const Dictionary& args,
                std::uint32_t descriptors) {
  Data frame;
  frame.resize(encodeCallAt(frame, 0, operation, call, args, descriptors));
  return frame;
}

Data encodeReply(std::uint64_t call, const Dictionary& args) {
  const bplist::Field fields[] = {bplist::integerField("reply", call), bplist::dictionaryField("args", args)};
  return encodeFields(fields);
}

Data encodeErrorReply(std::uint64_t call, const Error& error) {
  const Value described = error.toValue();
  const bplist::Field fields[] = {bplist::integerField("reply", call), bplist::valueField("error", described)};
  return encodeFields(fields);
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
  if (offset_ == buffer_.size() && buffer_.capacity() > 0) {
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
  // Text that is not UTF-8 would silently change on its way on (the frame
  // writer puts U+FFFD for its bad bytes, libplist cuts it short at the
  // first), so the read refuses it at the door.
  const auto root = bplist::decode(body, frameLimits(), &plistError, bplist::Text::Utf8Only);
  if (!root) {
    setWhy(why, plistError == bplist::kNotUtf8 ? std::string("message holds text that is not valid UTF-8")
                                               : "frame body does not parse: " + plistError);
    return std::nullopt;
  }
  if (!root->isDict()) {
    setWhy(why, fmt::format("message is {}, not a dictionary", root->kindName()));
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
