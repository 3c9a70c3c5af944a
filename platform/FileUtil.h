#pragma once

// Small file helpers: an owned descriptor, bounded reads, atomic writes.

#include <unistd.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <span>

#include "platform/Value.h"

namespace zerith::file {

class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  ~UniqueFd() { reset(); }
  UniqueFd(UniqueFd&& o) noexcept : fd_(o.release()) {}
  UniqueFd& operator=(UniqueFd&& o) noexcept {
    if (this != &o) {
      reset(o.release());
    }
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;

  int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }
  int release() {
    const int fd = fd_;
    fd_ = -1;
    return fd;
  }
  void reset(int fd = -1) {
    if (fd_ >= 0) {
      ::close(fd_);
    }
    fd_ = fd;
  }

 private:
  int fd_ = -1;
};

// The whole file, or nullopt when it cannot be read or is larger than `limit`.
std::optional<Data> readAll(const std::filesystem::path& path, std::size_t limit);

// Temporary file in the same folder, fsync, rename over `path`, fsync the
// folder. The temporary file is removed on failure.
bool writeAtomically(const std::filesystem::path& path, std::span<const std::uint8_t> bytes,
                     std::filesystem::perms perms = std::filesystem::perms(0644));

}  // namespace zerith::file
