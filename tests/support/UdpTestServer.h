#pragma once

// A UDP server on 127.0.0.1, port 0, for the datagram tests and benchmarks.
// A thread receives every datagram and asks the policy what to do with it:
// drop it (as a lossy network would, before it counts as delivered) and
// whether to acknowledge it (by echoing its 64-byte header to the sender,
// unless the acknowledgement is to be lost). Tests wait on conditions over
// what arrived, with a time limit, instead of sleeping.

#include <netinet/in.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace zerith::test {

struct UdpDatagram {
  std::vector<std::uint8_t> bytes;
  bool acknowledged = false;  // an acknowledgement was sent for it
};

class UdpTestServer {
 public:
  struct Decision {
    bool drop = false;
    bool acknowledge = false;
  };
  // Called on the server's thread with the datagram and its index among all
  // arrivals (dropped ones included).
  using Policy = std::function<Decision(const std::vector<std::uint8_t>& bytes, std::size_t index)>;

  UdpTestServer();
  ~UdpTestServer();
  UdpTestServer(const UdpTestServer&) = delete;
  UdpTestServer& operator=(const UdpTestServer&) = delete;

  std::uint16_t port() const { return port_; }
  void setPolicy(Policy policy);

  std::vector<UdpDatagram> arrivals() const;
  // Waits until `predicate(arrivals)` holds; false on time-out.
  bool waitUntil(const std::function<bool(const std::vector<UdpDatagram>&)>& predicate,
                 std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;
  bool waitForArrivals(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  // Sends raw bytes from the server's socket to 127.0.0.1:`port`.
  void sendTo(std::uint16_t port, const std::vector<std::uint8_t>& bytes) const;

 private:
  void run();

  int fd_ = -1;
  int stopFd_ = -1;
  std::uint16_t port_ = 0;
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  Policy policy_;
  std::vector<UdpDatagram> arrivals_;
  std::thread thread_;
};

}  // namespace zerith::test
