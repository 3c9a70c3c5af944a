#include "ipc/ClientSessionWire.h"

#include <fmt/format.h>

#include <array>
#include <limits>

#include "ipc/Frame.h"

namespace zerith::ipc::wire {

namespace {

constexpr ArgSpec kSetSessionInfoArgs[] = {{"sessionInfo", ArgType::Dictionary},
                                           {"userInfo", ArgType::Dictionary},
                                           {"frameworksToCheck", ArgType::Array},
                                           {"hasAggregationBlock", ArgType::Bool}};
constexpr ArgSpec kFetchStatesArgs[] = {{"userInfo", ArgType::Dictionary}};
constexpr ArgSpec kSendMessageArgs[] = {{"message", ArgType::Dictionary}};
constexpr ArgSpec kUploadFileArgs[] = {{"fileURL", ArgType::String}, {"extensionToken", ArgType::OptString}};
constexpr ArgSpec kUploadLogDataArgs[] = {{"logData", ArgType::Array}};
constexpr ArgSpec kSendMessageWithSessionInfoArgs[] = {{"sessionInfo", ArgType::Dictionary},
                                                       {"userInfo", ArgType::Dictionary},
                                                       {"category", ArgType::UInt16},
                                                       {"type", ArgType::UInt16},
                                                       {"payload", ArgType::Dictionary}};
constexpr ArgSpec kUpdateSharedDataArgs[] = {{"dictionary", ArgType::Dictionary}};
constexpr ArgSpec kUpdateSharedDataForKeyArgs[] = {{"key", ArgType::String}, {"value", ArgType::Any}};
constexpr ArgSpec kSetDigestKeyArgs[] = {{"digestKey", ArgType::OptData}, {"algorithm", ArgType::Int32}};
constexpr ArgSpec kSendMessageToClientArgs[] = {{"message", ArgType::Dictionary},
                                                {"timestamp", ArgType::Number},
                                                {"category", ArgType::UInt16},
                                                {"type", ArgType::UInt16},
                                                {"payload", ArgType::Dictionary}};

const std::array<OperationSpec, 13> kSessionOperations = {{
    {kSetSessionInfo, kSetSessionInfoArgs, false},
    {kStartConfig, {}, true},
    {kFetchStates, kFetchStatesArgs, true},
    {kFetchDisplayURL, {}, true},
    {kSendMessage, kSendMessageArgs, true},
    {kFlushMessages, {}, true},
    {kFinishSession, {}, false},
    {kUploadFile, kUploadFileArgs, true},
    {kUploadLogData, kUploadLogDataArgs, true},
    {kSendMessageWithSessionInfo, kSendMessageWithSessionInfoArgs, true},
    {kUpdateSharedData, kUpdateSharedDataArgs, false},
    {kUpdateSharedDataForKey, kUpdateSharedDataForKeyArgs, false},
    {kSetDigestKey, kSetDigestKeyArgs, false},
}};

const OperationSpec kSendMessageToClientOperation = {kSendMessageToClient, kSendMessageToClientArgs, false};

bool isInteger(const Value& v) { return v.type() == Value::Type::Int || v.type() == Value::Type::UInt; }

bool inRange(const Value& v, long long low, long long high) {
  if (v.type() == Value::Type::UInt) {
    return v.unsignedValue() <= static_cast<unsigned long long>(high);
  }
  return v.intValue() >= low && v.intValue() <= high;
}

// nullptr when `v` fits; otherwise what was expected.
const char* mismatch(ArgType type, const Value& v) {
  switch (type) {
    case ArgType::Dictionary: return v.isNil() || v.isDict() ? nullptr : "a dictionary";
    case ArgType::Array: return v.isNil() || v.isArray() ? nullptr : "an array";
    case ArgType::String: return v.isString() ? nullptr : "a string";
    case ArgType::OptString: return v.isNil() || v.isString() ? nullptr : "a string";
    case ArgType::OptData: return v.isNil() || v.isData() ? nullptr : "data";
    case ArgType::Bool: return v.isNil() || v.isBool() ? nullptr : "a boolean";
    case ArgType::UInt16: return isInteger(v) && inRange(v, 0, 65535) ? nullptr : "an unsigned 16-bit integer";
    case ArgType::Int32:
      return isInteger(v) && inRange(v, std::numeric_limits<std::int32_t>::min(), std::numeric_limits<std::int32_t>::max())
                 ? nullptr
                 : "a signed 32-bit integer";
    case ArgType::Number: return v.isNumber() ? nullptr : "a number";
    case ArgType::Any: return nullptr;
  }
  return nullptr;
}

}  // namespace

std::span<const OperationSpec> sessionOperations() { return kSessionOperations; }

const OperationSpec* sessionOperation(std::string_view name) {
  for (const auto& op : kSessionOperations) {
    if (name == op.name) {
      return &op;
    }
  }
  return nullptr;
}

const OperationSpec* replyOperation(std::string_view name) {
  return name == kSendMessageToClient ? &kSendMessageToClientOperation : nullptr;
}

std::optional<std::string> checkArguments(const OperationSpec& op, const Dictionary& args) {
  for (const auto& spec : op.args) {
    const Value v = args.get(spec.name);
    if (const char* expected = mismatch(spec.type, v)) {
      // An integer out of range names its value: "must be ..., not 70000".
      const std::string got = v.type() == Value::Type::UInt ? std::to_string(v.unsignedValue())
                              : v.type() == Value::Type::Int ? std::to_string(v.intValue())
                                                             : std::string(v.kindName());
      return fmt::format("Argument \"{}\" of {} must be {}, not {}", spec.name, op.name, expected, got);
    }
  }
  return std::nullopt;
}

Error unknownOperationError(std::string_view name) {
  return Error{kErrorDomain, -1, fmt::format("Unknown operation \"{}\"", name)};
}

Error argumentError(std::string description) { return Error{kErrorDomain, -1, std::move(description)}; }

Dictionary setSessionInfoArgs(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                              bool hasAggregationBlock) {
  return Dictionary{{"sessionInfo", sessionInfo},
                    {"userInfo", userInfo},
                    {"frameworksToCheck", frameworksToCheck},
                    {"hasAggregationBlock", hasAggregationBlock}};
}

Dictionary fetchStatesArgs(const Value& userInfo) { return Dictionary{{"userInfo", userInfo}}; }

Dictionary sendMessageArgs(const Value& message) { return Dictionary{{"message", message}}; }

Dictionary uploadFileArgs(const Value& fileURL, const Value& extensionToken) {
  return Dictionary{{"fileURL", fileURL}, {"extensionToken", extensionToken}};
}

Dictionary uploadLogDataArgs(const Value& logData) { return Dictionary{{"logData", logData}}; }

Dictionary sendMessageWithSessionInfoArgs(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                          std::uint16_t type, const Value& payload) {
  return Dictionary{{"sessionInfo", sessionInfo},
                    {"userInfo", userInfo},
                    {"category", Value(unsigned{category})},
                    {"type", Value(unsigned{type})},
                    {"payload", payload}};
}

Dictionary updateSharedDataArgs(const Value& dictionary) { return Dictionary{{"dictionary", dictionary}}; }

Dictionary updateSharedDataForKeyArgs(const Value& key, const Value& value) {
  return Dictionary{{"key", key}, {"value", value}};
}

Dictionary setDigestKeyArgs(const Value& digestKey, std::int32_t algorithm) {
  return Dictionary{{"digestKey", digestKey}, {"algorithm", Value(algorithm)}};
}

Dictionary sendMessageToClientArgs(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                                   const Value& payload) {
  return Dictionary{{"message", message},
                    {"timestamp", timestamp},
                    {"category", Value(unsigned{category})},
                    {"type", Value(unsigned{type})},
                    {"payload", payload}};
}

std::optional<Error> errorArgument(const Dictionary& replyArgs) {
  const Value error = replyArgs.get(kError);
  if (!error.isDict()) {
    return std::nullopt;
  }
  return Error::fromValue(error);
}

std::string filePathOfURL(const std::string& url) {
  if (!url.starts_with("file://")) {
    return url;
  }
  std::string rest = url.substr(7);
  if (rest.starts_with("localhost/")) {
    rest = rest.substr(9);
  }
  std::string path;
  for (std::size_t i = 0; i < rest.size(); ++i) {
    const auto hex = [](char c) -> int {
      if (c >= '0' && c <= '9') return c - '0';
      if (c >= 'a' && c <= 'f') return c - 'a' + 10;
      if (c >= 'A' && c <= 'F') return c - 'A' + 10;
      return -1;
    };
    if (rest[i] == '%' && i + 2 < rest.size() && hex(rest[i + 1]) >= 0 && hex(rest[i + 2]) >= 0) {
      path.push_back(static_cast<char>(hex(rest[i + 1]) * 16 + hex(rest[i + 2])));
      i += 2;
    } else {
      path.push_back(rest[i]);
    }
  }
  return path;
}

std::string lastPathComponent(std::string path) {
  while (path.size() > 1 && path.back() == '/') {
    path.pop_back();
  }
  const auto slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

}  // namespace zerith::ipc::wire
