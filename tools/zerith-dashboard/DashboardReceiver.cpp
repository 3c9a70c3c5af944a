#include "tools/zerith-dashboard/DashboardReceiver.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <stdexcept>

#include <nlohmann/json.hpp>

#include "backends/DashboardDatagram.h"

namespace zerith::tools {

DashboardReceiver::DashboardReceiver(const ReceiverOptions& options) : options_(options), random_(options.seed) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(options.port);
  if (::inet_pton(AF_INET, options.address.c_str(), &address.sin_addr) != 1) {
    throw std::runtime_error("'" + options.address + "' is no IPv4 address");
  }
  fd_ = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  socklen_t length = sizeof address;
  if (fd_ < 0 || ::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      ::getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &length) != 0) {
    throw std::runtime_error("cannot listen on " + options.address + ":" + std::to_string(options.port));
  }
  port_ = ntohs(address.sin_port);
}

DashboardReceiver::~DashboardReceiver() {
  if (fd_ >= 0) {
    ::close(fd_);
  }
}

bool DashboardReceiver::chance(double share) {
  return share > 0 && std::uniform_real_distribution<double>(0.0, 1.0)(random_) < share;
}

std::string DashboardReceiver::describe(std::span<const std::uint8_t> bytes, bool truncated, const std::string& from,
                                        bool acknowledged) {
  nlohmann::ordered_json line;
  line["from"] = from;
  line["size"] = bytes.size();
  std::string why;
  const auto d = truncated ? std::nullopt : dashboard::decode(bytes, &why);
  if (!d) {
    line["error"] = truncated ? std::string("longer than a datagram can be") : why;
    return line.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
  }
  line["time"] = static_cast<double>(d->seconds) + d->milliseconds / 1000.0;
  line["version"] = d->selfVersionMajor;
  line["sender"] = d->senderCode;
  line["senderIndex"] = d->senderIndex;
  line["sessionID"] = d->sessionID;
  line["clientVersion"] = d->clientVersion;
  line["udid"] = d->udid;
  line["event"] = d->eventNumber;
  line["method"] = d->method;
  line["respCode"] = d->respCode;
  line["reliable"] = (d->flags & dashboard::kFlagReliable) != 0;
  line["fromProfile"] = (d->flags & dashboard::kFlagNotFromProfile) == 0;
  nlohmann::ordered_json items = nlohmann::ordered_json::object();
  for (const auto& [key, value] : d->items) {
    items[key] = value;
  }
  line["items"] = items;
  if (!d->wellFormedText) {
    line["text"] = d->text;
  }
  line["acknowledged"] = acknowledged;
  return line.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

std::optional<std::string> DashboardReceiver::receiveOne() {
  std::array<std::uint8_t, dashboard::kMaxDatagram> buffer;
  sockaddr_in from{};
  socklen_t fromLength = sizeof from;
  const ssize_t n =
      ::recvfrom(fd_, buffer.data(), buffer.size(), MSG_TRUNC, reinterpret_cast<sockaddr*>(&from), &fromLength);
  if (n < 0) {
    return std::nullopt;
  }
  if (chance(options_.dropDatagrams)) {
    return std::nullopt;
  }
  const bool truncated = static_cast<std::size_t>(n) > buffer.size();
  const std::span<const std::uint8_t> bytes(buffer.data(), std::min<std::size_t>(static_cast<std::size_t>(n), buffer.size()));
  char text[INET_ADDRSTRLEN] = {};
  ::inet_ntop(AF_INET, &from.sin_addr, text, sizeof text);
  const std::string source = std::string(text) + ":" + std::to_string(ntohs(from.sin_port));

  bool acknowledged = false;
  if (options_.acknowledge && !truncated && bytes.size() >= dashboard::kHeaderSize) {
    const auto d = dashboard::decode(bytes);
    if (d && (d->flags & dashboard::kFlagReliable) != 0 && !chance(options_.dropAcknowledgements)) {
      acknowledged = ::sendto(fd_, bytes.data(), dashboard::kHeaderSize, 0, reinterpret_cast<sockaddr*>(&from),
                              fromLength) == static_cast<ssize_t>(dashboard::kHeaderSize);
    }
  }
  return describe(bytes, truncated, source, acknowledged);
}

}  // namespace zerith::tools
