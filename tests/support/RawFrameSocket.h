#pragma once

// One end of a stream socket that speaks the frame protocol by hand: it
// writes bytes (whole or in chunks) and reads frames with a deadline, for
// tests that play a client or a peer byte by byte. Header-only: its users
// link the IPC library for the frame codec.

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>

#include <chrono>
#include <cstring>
#include <optional>
#include <span>
#include <string>

#include "ipc/Frame.h"
#include "platform/FileUtil.h"
#include "platform/PropertyList.h"
#include "tests/support/DaemonProcess.h"

namespace zerith::test {

// A frame whose body is exactly `body` (which need not be a message).
inline Data frameWithBody(const Data& body) {
  Data frame{static_cast<std::uint8_t>(body.size() >> 24), static_cast<std::uint8_t>(body.size() >> 16),
             static_cast<std::uint8_t>(body.size() >> 8), static_cast<std::uint8_t>(body.size())};
  frame.insert(frame.end(), body.begin(), body.end());
  return frame;
}

// Sends `bytes` (at least one) over the stream socket `socket` with up to
// eight descriptors `fds` attached (SCM_RIGHTS) to its first byte; true when
// all of it went. System calls only: safe in a child between fork and _exit.
inline bool sendWithDescriptors(int socket, std::span<const std::uint8_t> bytes, std::span<const int> fds) {
  iovec part{const_cast<std::uint8_t*>(bytes.data()), bytes.size()};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * 8)] = {};
  msghdr m{};
  m.msg_iov = &part;
  m.msg_iovlen = 1;
  if (fds.size() > 8) {
    return false;
  }
  if (!fds.empty()) {
    m.msg_control = control;
    m.msg_controllen = CMSG_SPACE(sizeof(int) * fds.size());
    cmsghdr* c = CMSG_FIRSTHDR(&m);
    c->cmsg_level = SOL_SOCKET;
    c->cmsg_type = SCM_RIGHTS;
    c->cmsg_len = CMSG_LEN(sizeof(int) * fds.size());
    std::memcpy(CMSG_DATA(c), fds.data(), sizeof(int) * fds.size());
  }
  return ::sendmsg(socket, &m, MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
}

// One descriptor on a byte of its own, as receiveDescriptor takes it.
inline bool sendDescriptor(int socket, int fd) {
  static constexpr std::uint8_t kByte[1] = {'d'};
  return sendWithDescriptors(socket, kByte, std::span<const int>(&fd, 1));
}

// The descriptor that came with the next byte on `socket`; empty when the
// byte came without one or nothing came.
inline file::UniqueFd receiveDescriptor(int socket) {
  char byte = 0;
  iovec part{&byte, 1};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
  msghdr m{};
  m.msg_iov = &part;
  m.msg_iovlen = 1;
  m.msg_control = control;
  m.msg_controllen = sizeof control;
  if (::recvmsg(socket, &m, MSG_CMSG_CLOEXEC) != 1 || CMSG_FIRSTHDR(&m) == nullptr) {
    return file::UniqueFd();
  }
  int fd = -1;
  std::memcpy(&fd, CMSG_DATA(CMSG_FIRSTHDR(&m)), sizeof fd);
  return file::UniqueFd(fd);
}

class RawFrameSocket {
 public:
  explicit RawFrameSocket(file::UniqueFd fd, std::uint32_t maxFrameBytes = ipc::kMaxFrameBytes)
      : fd_(std::move(fd)), decoder_(maxFrameBytes) {}

  // A client of the daemon listening under the current root; nullopt when
  // nothing listens there.
  static std::optional<RawFrameSocket> connect() {
    file::UniqueFd fd = connectToDaemonSocket();
    if (!fd) {
      return std::nullopt;
    }
    return RawFrameSocket(std::move(fd));
  }

  int fd() const { return fd_.get(); }

  // Writes all of `bytes`, `chunk` bytes per send when not 0; false when the
  // other end is gone.
  bool write(const Data& bytes, std::size_t chunk = 0) {
    std::size_t done = 0;
    while (done < bytes.size()) {
      const std::size_t n = chunk ? std::min(chunk, bytes.size() - done) : bytes.size() - done;
      const ssize_t w = ::send(fd_.get(), bytes.data() + done, n, MSG_NOSIGNAL);
      if (w <= 0) {
        return false;
      }
      done += static_cast<std::size_t>(w);
    }
    return true;
  }
  bool call(std::string_view operation, std::uint64_t number, const Dictionary& args = {}) {
    return write(ipc::encodeCall(operation, number, args));
  }

  // The next frame's body; nullopt when the other end closed (closed() is
  // then true), nothing came before the deadline, or the bytes are not a
  // frame (a test failure: a real peer never sends those).
  std::optional<plist::Bytes> readFrame(std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
      plist::Bytes body;
      std::string why;
      switch (decoder_.next(body, why)) {
        case ipc::FrameDecoder::Status::Frame:
          return body;
        case ipc::FrameDecoder::Status::Invalid:
          ADD_FAILURE() << "invalid frame: " << why;
          return std::nullopt;
        case ipc::FrameDecoder::Status::NeedMore:
          break;
      }
      if (!readSome(deadline)) {
        return std::nullopt;
      }
    }
  }
  // The reply to call `number` as a property list (other messages are
  // skipped).
  std::optional<Value> replyTo(std::uint64_t number, std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    for (;;) {
      const auto body = readFrame(timeout);
      auto m = body ? plist::decodeBinary(*body) : std::nullopt;
      if (!m || (*m)["reply"].unsignedValue() == number) {
        return m;
      }
    }
  }
  // True when the other end closes before the deadline (frames still
  // arriving meanwhile are read and dropped).
  bool waitClosed(std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!closed_ && readSome(deadline)) {
    }
    return closed_;
  }
  bool closed() const { return closed_; }
  void close() { fd_.reset(); }

 private:
  bool readSome(std::chrono::steady_clock::time_point deadline) {
    if (closed_) {
      return false;
    }
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    pollfd p{fd_.get(), POLLIN, 0};
    if (left.count() <= 0 || ::poll(&p, 1, static_cast<int>(left.count())) <= 0) {
      return false;
    }
    std::uint8_t buffer[65536];
    const ssize_t n = ::recv(fd_.get(), buffer, sizeof(buffer), 0);
    if (n <= 0) {
      closed_ = true;
      return false;
    }
    decoder_.append(buffer, static_cast<std::size_t>(n));
    return true;
  }

  file::UniqueFd fd_;
  ipc::FrameDecoder decoder_;
  bool closed_ = false;
};

}  // namespace zerith::test
