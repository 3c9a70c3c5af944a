#include "platform/SandboxExtension.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

namespace zerith::sandbox {

namespace {

bool refuse(std::string* why, std::string reason) {
  if (why != nullptr) {
    *why = std::move(reason);
  }
  return false;
}

const char* kindOf(mode_t mode) {
  if (S_ISDIR(mode)) {
    return "a folder";
  }
  if (S_ISFIFO(mode)) {
    return "a FIFO";
  }
  if (S_ISSOCK(mode)) {
    return "a socket";
  }
  if (S_ISCHR(mode) || S_ISBLK(mode)) {
    return "a device";
  }
  return "not a regular file";
}

bool unchanged(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino && a.st_size == b.st_size &&
         a.st_mtim.tv_sec == b.st_mtim.tv_sec && a.st_mtim.tv_nsec == b.st_mtim.tv_nsec;
}

}  // namespace

std::shared_ptr<GrantedFile> GrantedFile::adopt(std::shared_ptr<const file::UniqueFd> descriptor, std::string name,
                                                std::string* why) {
  if (!descriptor || !*descriptor) {
    refuse(why, "no descriptor came with the request");
    return nullptr;
  }
  std::shared_ptr<GrantedFile> file(new GrantedFile);
  file->descriptor_ = std::move(descriptor);
  file->name_ = std::move(name);
  const int fd = file->descriptor_->get();
  if (::fstat(fd, &file->status_) != 0) {
    refuse(why, fmt::format("the descriptor cannot be examined ({})", std::strerror(errno)));
    return nullptr;
  }
  if (!S_ISREG(file->status_.st_mode)) {
    refuse(why, fmt::format("the file is {}", kindOf(file->status_.st_mode)));
    return nullptr;
  }
  const int flags = ::fcntl(fd, F_GETFL);
  if (flags < 0 || (flags & O_PATH) != 0 || (flags & O_ACCMODE) == O_WRONLY) {
    refuse(why, "the descriptor is not open for reading");
    return nullptr;
  }
  if (static_cast<std::uint64_t>(file->status_.st_size) > kMaxUploadFileBytes) {
    refuse(why, fmt::format("the file has {} bytes, more than the {} an upload may have", file->status_.st_size,
                            kMaxUploadFileBytes));
    return nullptr;
  }
  return file;
}

std::optional<Data> GrantedFile::readAll(std::string* why) const {
  const int fd = descriptor_->get();
  const auto expected = static_cast<std::size_t>(status_.st_size);
  // One byte more than expected shows a file that grew.
  Data bytes(expected + 1);
  std::size_t got = 0;
  while (got < bytes.size()) {
    const ssize_t n = ::pread(fd, bytes.data() + got, bytes.size() - got, static_cast<off_t>(got));
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      refuse(why, fmt::format("the file cannot be read ({})", std::strerror(errno)));
      return std::nullopt;
    }
    if (n == 0) {
      break;
    }
    got += static_cast<std::size_t>(n);
  }
  struct stat after {};
  if (got != expected || ::fstat(fd, &after) != 0 || !unchanged(status_, after)) {
    refuse(why, "the file changed while it was read");
    return std::nullopt;
  }
  bytes.resize(expected);
  return bytes;
}

}  // namespace zerith::sandbox
