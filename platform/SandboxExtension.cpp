#include "platform/SandboxExtension.h"

#include <fcntl.h>
#include <sys/fsuid.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>
#include <mutex>
#include <unordered_map>

#include <fmt/format.h>

#include "platform/Crypto.h"

namespace zerith::sandbox {

namespace {

// For the lifetime of the object the calling thread opens and unlinks files
// with `who`'s file-system identity; only when the process is root (anyone
// else could not switch, and keeps its own, narrower rights).
class FileSystemIdentity {
 public:
  explicit FileSystemIdentity(const Identity& who) {
    if (::geteuid() != 0 || who.uid == 0) {
      return;
    }
    previousGid_ = ::setfsgid(who.gid);
    previousUid_ = ::setfsuid(who.uid);
    switched_ = true;
  }
  ~FileSystemIdentity() {
    if (switched_) {
      ::setfsuid(static_cast<uid_t>(previousUid_));
      ::setfsgid(static_cast<gid_t>(previousGid_));
    }
  }
  FileSystemIdentity(const FileSystemIdentity&) = delete;
  FileSystemIdentity& operator=(const FileSystemIdentity&) = delete;

 private:
  bool switched_ = false;
  int previousUid_ = 0;
  int previousGid_ = 0;
};

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
  if (S_ISLNK(mode)) {
    return "a symbolic link";
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

bool sameFile(const struct stat& a, const struct stat& b) { return a.st_dev == b.st_dev && a.st_ino == b.st_ino; }

bool unchanged(const struct stat& a, const struct stat& b) {
  return sameFile(a, b) && a.st_size == b.st_size && a.st_mtim.tv_sec == b.st_mtim.tv_sec &&
         a.st_mtim.tv_nsec == b.st_mtim.tv_nsec;
}

struct Registry {
  std::mutex mutex;
  std::unordered_map<std::string, std::shared_ptr<GrantedFile>> files;
};

Registry& registry() {
  static Registry* r = new Registry;  // outlives every session
  return *r;
}

}  // namespace

Identity Identity::ofProcess() { return Identity{::geteuid(), ::getegid()}; }

GrantedFile::~GrantedFile() {
  if (fd_ >= 0) {
    ::close(fd_);
  }
  if (directory_ >= 0) {
    ::close(directory_);
  }
}

std::shared_ptr<GrantedFile> GrantedFile::open(std::string_view path, const Identity& owner, std::string* why) {
  auto fail = [why](std::string reason) -> std::shared_ptr<GrantedFile> {
    refuse(why, std::move(reason));
    return nullptr;
  };
  if (path.empty() || path.front() != '/') {
    return fail("the path is not absolute");
  }
  if (path.find('\0') != std::string_view::npos) {
    return fail("the path holds a zero byte");
  }
  if (path.size() >= PATH_MAX) {
    return fail("the path is too long");
  }
  std::vector<std::string_view> components;
  for (std::size_t start = 1; start <= path.size();) {
    const std::size_t end = std::min(path.find('/', start), path.size());
    const std::string_view c = path.substr(start, end - start);
    if (c == "..") {
      return fail("the path holds a \"..\" component");
    }
    if (!c.empty() && c != ".") {
      components.emplace_back(c);
    }
    start = end + 1;
  }
  if (components.empty()) {
    return fail("the path names no file");
  }

  std::shared_ptr<GrantedFile> file(new GrantedFile);
  file->path_ = std::string(path);
  file->owner_ = owner;
  file->name_ = std::string(components.back());

  FileSystemIdentity as(owner);
  file->directory_ = ::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC);
  if (file->directory_ < 0) {
    return fail(fmt::format("the root folder cannot be opened ({})", std::strerror(errno)));
  }
  for (std::size_t i = 0; i + 1 < components.size(); ++i) {
    const std::string component(components[i]);
    const int next = ::openat(file->directory_, component.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (next < 0) {
      const int e = errno;
      return fail(e == ENOTDIR ? fmt::format("\"{}\" on the path is no folder (or a symbolic link)", component)
                               : fmt::format("\"{}\" on the path cannot be opened ({})", component, std::strerror(e)));
    }
    ::close(file->directory_);
    file->directory_ = next;
  }

  struct stat before {};
  if (::fstatat(file->directory_, file->name_.c_str(), &before, AT_SYMLINK_NOFOLLOW) != 0) {
    return fail(fmt::format("the file cannot be reached ({})", std::strerror(errno)));
  }
  if (!S_ISREG(before.st_mode)) {
    return fail(fmt::format("the file is {}", kindOf(before.st_mode)));
  }
  file->fd_ = ::openat(file->directory_, file->name_.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
  if (file->fd_ < 0) {
    return fail(fmt::format("the file cannot be opened ({})", std::strerror(errno)));
  }
  if (::fstat(file->fd_, &file->status_) != 0 || !sameFile(before, file->status_) || !S_ISREG(file->status_.st_mode)) {
    return fail("the file was replaced while it was opened");
  }
  if (file->status_.st_uid != owner.uid) {
    return fail(fmt::format("the file belongs to user {}, not to the client (user {})", file->status_.st_uid, owner.uid));
  }
  if ((file->status_.st_mode & S_IRUSR) == 0) {
    return fail("the file is not readable for its owner");
  }
  if (static_cast<std::uint64_t>(file->status_.st_size) > kMaxUploadFileBytes) {
    return fail(fmt::format("the file has {} bytes, more than the {} an upload may have", file->status_.st_size,
                            kMaxUploadFileBytes));
  }
  return file;
}

std::optional<Data> GrantedFile::readAll(std::string* why) const {
  const auto expected = static_cast<std::size_t>(status_.st_size);
  Data bytes(expected + 1);
  std::size_t got = 0;
  while (got < bytes.size()) {
    const ssize_t n = ::pread(fd_, bytes.data() + got, bytes.size() - got, static_cast<off_t>(got));
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
  if (got != expected || ::fstat(fd_, &after) != 0 || !unchanged(status_, after)) {
    refuse(why, "the file changed while it was read");
    return std::nullopt;
  }
  bytes.resize(expected);
  return bytes;
}

bool GrantedFile::remove(std::string* why) const {
  FileSystemIdentity as(owner_);
  struct stat now {};
  if (::fstatat(directory_, name_.c_str(), &now, AT_SYMLINK_NOFOLLOW) != 0) {
    return refuse(why, fmt::format("the file is gone ({})", std::strerror(errno)));
  }
  if (!sameFile(now, status_)) {
    return refuse(why, "the name no longer names the uploaded file");
  }
  if (::unlinkat(directory_, name_.c_str(), 0) != 0) {
    return refuse(why, fmt::format("the file cannot be removed ({})", std::strerror(errno)));
  }
  return true;
}

std::string issueExtension(std::shared_ptr<GrantedFile> file) {
  std::array<std::uint8_t, 16> random{};
  crypto::randomBytes(random);
  std::string token = "zerith-extension:";
  for (const auto b : random) {
    token += fmt::format("{:02x}", b);
  }
  std::lock_guard lock(registry().mutex);
  registry().files.emplace(token, std::move(file));
  return token;
}

void revokeExtension(const std::string& token) {
  std::lock_guard lock(registry().mutex);
  registry().files.erase(token);
}

std::shared_ptr<GrantedFile> consumeExtension(const char* token) {
  if (token == nullptr) {
    return nullptr;
  }
  std::lock_guard lock(registry().mutex);
  const auto it = registry().files.find(token);
  return it == registry().files.end() ? nullptr : it->second;
}

}  // namespace zerith::sandbox
