#include "platform/FileUtil.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <string>

#include <fmt/format.h>

namespace zerith::file {

std::optional<Data> readAll(const std::filesystem::path& path, std::size_t limit) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) {
    return std::nullopt;
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode) || static_cast<std::uint64_t>(st.st_size) > limit) {
    return std::nullopt;
  }
  Data out;
  out.reserve(static_cast<std::size_t>(st.st_size));
  std::uint8_t buf[65536];
  for (;;) {
    const ssize_t n = ::read(fd.get(), buf, sizeof buf);
    if (n < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    if (n == 0) break;
    if (out.size() + static_cast<std::size_t>(n) > limit) {
      return std::nullopt;
    }
    out.insert(out.end(), buf, buf + n);
  }
  return out;
}

RegularFileRead readRegularFile(const std::filesystem::path& path, std::size_t limit) {
  RegularFileRead result;
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
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
  Data bytes(static_cast<std::size_t>(size));
  std::size_t got = 0;
  while (got < bytes.size()) {
    const ssize_t n = ::read(fd.get(), bytes.data() + got, bytes.size() - got);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      result.error = errno;
      result.why = std::strerror(errno);
      return result;
    }
    if (n == 0) {
      break;  // shorter than it was: what is there
    }
    got += static_cast<std::size_t>(n);
  }
  bytes.resize(got);
  result.bytes = std::move(bytes);
  return result;
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
