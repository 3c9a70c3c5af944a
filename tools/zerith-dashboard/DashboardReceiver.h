#pragma once

// The receiving end of the dashboard datagrams, for people and scripts: one
// JSON line per datagram (fields checked before they are read), an
// acknowledgement (the echoed 64-byte header) for reliable datagrams when
// asked, and a chosen share of datagrams and acknowledgements lost on
// purpose, to watch the backend's retransmissions.

#include <netinet/in.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <random>
#include <span>
#include <string>

namespace zerith::tools {

struct ReceiverOptions {
  std::string address = "127.0.0.1";
  std::uint16_t port = 0;
  bool acknowledge = false;
  double dropDatagrams = 0;  // share in [0, 1]
  double dropAcknowledgements = 0;
  std::uint32_t seed = 1;
};

class DashboardReceiver {
 public:
  // Throws std::runtime_error when the address does not parse or the port
  // cannot be bound.
  explicit DashboardReceiver(const ReceiverOptions& options);
  ~DashboardReceiver();
  DashboardReceiver(const DashboardReceiver&) = delete;
  DashboardReceiver& operator=(const DashboardReceiver&) = delete;

  std::uint16_t port() const { return port_; }

  // Waits for one datagram and returns its JSON line; nullopt when the
  // datagram was dropped on purpose or receiving failed.
  std::optional<std::string> receiveOne();

  // The JSON line of a datagram, with its acknowledgement state.
  static std::string describe(std::span<const std::uint8_t> bytes, bool truncated, const std::string& from,
                              bool acknowledged);

 private:
  bool chance(double share);

  ReceiverOptions options_;
  int fd_ = -1;
  std::uint16_t port_ = 0;
  std::mt19937 random_;
};

}  // namespace zerith::tools
