#include "tests/support/UdpTestServer.h"

#include <arpa/inet.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <stdexcept>

namespace zerith::test {

UdpTestServer::UdpTestServer() {
  fd_ = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  if (fd_ < 0 || ::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      ::getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &length) != 0) {
    throw std::runtime_error("UdpTestServer: cannot bind a loopback port");
  }
  // A large receive buffer: benchmarks send in bursts.
  const int size = 8 << 20;
  ::setsockopt(fd_, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
  port_ = ntohs(address.sin_port);
  stopFd_ = ::eventfd(0, EFD_CLOEXEC);
  thread_ = std::thread([this] { run(); });
}

UdpTestServer::~UdpTestServer() {
  const std::uint64_t one = 1;
  [[maybe_unused]] const auto n = ::write(stopFd_, &one, sizeof one);
  thread_.join();
  ::close(stopFd_);
  ::close(fd_);
}

void UdpTestServer::setPolicy(Policy policy) {
  std::lock_guard lock(mutex_);
  policy_ = std::move(policy);
}

void UdpTestServer::run() {
  std::vector<std::uint8_t> buffer(65536);
  for (;;) {
    pollfd fds[2] = {{fd_, POLLIN, 0}, {stopFd_, POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0) {
      continue;
    }
    if (fds[1].revents != 0) {
      return;
    }
    sockaddr_in from{};
    socklen_t fromLength = sizeof from;
    const ssize_t n = ::recvfrom(fd_, buffer.data(), buffer.size(), 0, reinterpret_cast<sockaddr*>(&from), &fromLength);
    if (n < 0) {
      continue;
    }
    UdpDatagram d;
    d.bytes.assign(buffer.begin(), buffer.begin() + n);
    Decision decision;
    {
      std::lock_guard lock(mutex_);
      if (policy_) {
        decision = policy_(d.bytes, arrivals_.size());
      }
    }
    if (!decision.drop && decision.acknowledge) {
      const std::size_t ackLength = std::min<std::size_t>(d.bytes.size(), 64);
      ::sendto(fd_, d.bytes.data(), ackLength, 0, reinterpret_cast<sockaddr*>(&from), fromLength);
      d.acknowledged = true;
    }
    {
      std::lock_guard lock(mutex_);
      arrivals_.push_back(std::move(d));
    }
    changed_.notify_all();
  }
}

std::vector<UdpDatagram> UdpTestServer::arrivals() const {
  std::lock_guard lock(mutex_);
  return arrivals_;
}

bool UdpTestServer::waitUntil(const std::function<bool(const std::vector<UdpDatagram>&)>& predicate,
                              std::chrono::milliseconds timeout) const {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] { return predicate(arrivals_); });
}

bool UdpTestServer::waitForArrivals(std::size_t count, std::chrono::milliseconds timeout) const {
  return waitUntil([count](const auto& a) { return a.size() >= count; }, timeout);
}

void UdpTestServer::sendTo(std::uint16_t port, const std::vector<std::uint8_t>& bytes) const {
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  to.sin_port = htons(port);
  ::sendto(fd_, bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to);
}

}  // namespace zerith::test
