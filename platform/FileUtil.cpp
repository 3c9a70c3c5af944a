#include "platform/FileUtil.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <string>

#include <fmt/format.h>

namespace zerith::file {

RegularFileRead readRegularFile(const std::filesystem::path& path, std::size_t limit, Links links) {
  RegularFileRead result;
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | (links == Links::followed ? 0 : O_NOFOLLOW)));
  if (!fd || ::fstat(fd.get(), &result.status) != 0) {
    result.error = errno;
    result.why = errno == ELOOP ? "a symbolic link, which is not followed" : std::strerror(errno);
    return result;
  }
  if (!S_ISREG(result.status.st_mode)) {
    result.why = "not a regular file";
    return result;
  }
  const auto size = static_cast<std::uint64_t>(result.status.st_size);
  if (size > limit) {
    result.why = fmt::format("{} bytes, more than the {} read", size, limit);
    return result;
  }
  // Up to the end, not the size seen: files of /proc and /sys give more
  // than their size says (or less), and one that grows past the limit is
  // refused.
  Data bytes;
  bytes.reserve(static_cast<std::size_t>(size));
  std::uint8_t buf[65536];
  for (;;) {
    const ssize_t n = ::read(fd.get(), buf, sizeof buf);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      result.error = errno;
      result.why = std::strerror(errno);
      return result;
    }
    if (n == 0) {
      break;
    }
    if (bytes.size() + static_cast<std::size_t>(n) > limit) {
      result.why = fmt::format("more than the {} bytes read", limit);
      return result;
    }
    bytes.insert(bytes.end(), buf, buf + n);
  }
  result.bytes = std::move(bytes);
  return result;
}

std::optional<Data> readAll(const std::filesystem::path& path, std::size_t limit) {
  return readRegularFile(path, limit, Links::followed).bytes;
}

bool writeAtomically(const std::filesystem::path& path, std::span<const std::uint8_t> bytes,
                     std::filesystem::perms perms) {
  std::string tmpl = (path.parent_path() / ("." + path.filename().string() + ".XXXXXX")).string();
  UniqueFd fd(::mkostemp(tmpl.data(), O_CLOEXEC));
  if (!fd) {
    return false;
  }
  const std::string tmp = tmpl;
  auto fail = [&] {
    ::unlink(tmp.c_str());
    return false;
  };
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::write(fd.get(), bytes.data() + done, bytes.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      return fail();
    }
    done += static_cast<std::size_t>(n);
  }
  ::fchmod(fd.get(), static_cast<mode_t>(perms));
  if (::fsync(fd.get()) != 0 || ::close(fd.release()) != 0) {
    return fail();
  }
  if (::rename(tmp.c_str(), path.c_str()) != 0) {
    return fail();
  }
  UniqueFd dir(::open(path.parent_path().empty() ? "." : path.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (dir) {
    ::fsync(dir.get());
  }
  return true;
}

}  // namespace zerith::file
