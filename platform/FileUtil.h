#pragma once

// Small file helpers: an owned descriptor, bounded reads, atomic writes.

#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <span>
#include <string>

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

// Whether the last part of a path may be a symbolic link.
enum class Links { followed, notFollowed };

// A regular file of at most `limit` bytes, no FIFO waited on. A file of a
// folder that another user may write (the daemon's spool and caches, read by
// the operator's tools) is read with links not followed. `bytes` when it was
// read; otherwise `error` (an errno; 0 for a file that is not regular or too
// large) and `why`, for a person. `status` is the file's when it was opened.
struct RegularFileRead {
  std::optional<Data> bytes;
  int error = 0;
  std::string why;
  struct stat status {};
};
RegularFileRead readRegularFile(const std::filesystem::path& path, std::size_t limit,
                                Links links = Links::notFollowed);

// The whole regular file, links followed, or nullopt when it cannot be read
// or is larger than `limit`.
std::optional<Data> readAll(const std::filesystem::path& path, std::size_t limit);

// Temporary file in the same folder, fsync, rename over `path`, fsync the
// folder. The temporary file is removed on failure.
bool writeAtomically(const std::filesystem::path& path, std::span<const std::uint8_t> bytes,
                     std::filesystem::perms perms = std::filesystem::perms(0644));

}  // namespace zerith::file
