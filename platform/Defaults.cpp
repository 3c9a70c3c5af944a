#include "platform/Defaults.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <system_error>

#include "platform/FileUtil.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* l = new log::Logger("defaults");
  return *l;
}

struct FileIdentity {
  dev_t dev = 0;
  ino_t ino = 0;
  off_t size = -1;
  timespec mtime{};
  bool operator==(const FileIdentity& o) const {
    return dev == o.dev && ino == o.ino && size == o.size && mtime.tv_sec == o.mtime.tv_sec &&
           mtime.tv_nsec == o.mtime.tv_nsec;
  }
};

struct CacheEntry {
  FileIdentity identity;
  Value contents;
};

std::mutex gCacheMutex;
std::map<std::string, CacheEntry> gCache;  // by file path

constexpr plist::Limits kDefaultsLimits{4u << 20, 32, 200000};

// Reads and parses the file; `corrupt` is set when it exists but is unusable.
Value readDomainFile(const std::filesystem::path& path, bool* corrupt) {
  if (corrupt) *corrupt = false;
  auto bytes = file::readAll(path, kDefaultsLimits.maxBytes);
  if (!bytes) {
    return Value(Dictionary{});
  }
  std::string why;
  auto value = plist::decode(plist::bytesOf(*bytes), kDefaultsLimits, &why);
  if (!value || !value->isDict()) {
    logger().error("Defaults: ignoring corrupt defaults file {}: {}", path.string(),
                   value ? std::string("root is not a dictionary") : why);
    if (corrupt) *corrupt = true;
    return Value(Dictionary{});
  }
  return *value;
}

Value cachedDomain(const std::filesystem::path& path) {
  struct stat st {};
  FileIdentity id;
  if (::stat(path.c_str(), &st) == 0) {
    id = {st.st_dev, st.st_ino, st.st_size, st.st_mtim};
  }
  {
    std::lock_guard lock(gCacheMutex);
    auto it = gCache.find(path.string());
    if (it != gCache.end() && it->second.identity == id) {
      return it->second.contents;
    }
  }
  Value contents = id.size < 0 ? Value(Dictionary{}) : readDomainFile(path, nullptr);
  std::lock_guard lock(gCacheMutex);
  gCache[path.string()] = {id, contents};
  return contents;
}

}  // namespace

Defaults::Defaults(std::string domain) : domain_(std::move(domain)) {}

std::filesystem::path Defaults::path() const { return paths::defaultsDir() / (domain_ + ".plist"); }

Value Defaults::dictionary() const { return cachedDomain(path()); }

Value Defaults::objectForKey(std::string_view key) const { return dictionary()[key]; }

bool Defaults::setObject(std::string_view key, const Value& value) const {
  const auto file = path();
  std::error_code ec;
  std::filesystem::create_directories(file.parent_path(), ec);
  const std::string lockPath = file.string() + ".lock";
  const int lockFd = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (lockFd < 0) {
    logger().error("Defaults: cannot open lock file {}: {}", lockPath, std::strerror(errno));
    return false;
  }
  file::UniqueFd lockGuard(lockFd);
  ::flock(lockFd, LOCK_EX);

  bool corrupt = false;
  Dictionary contents = readDomainFile(file, &corrupt).dictCopy();
  if (corrupt) {
    std::filesystem::rename(file, file.string() + ".corrupt", ec);
  }
  if (value.isNil()) {
    if (!contents.erase(key) && !corrupt) {
      return true;
    }
  } else {
    contents.set(std::string(key), value);
  }
  const std::string xml = plist::encodeXml(Value(std::move(contents)));
  if (!file::writeAtomically(file, plist::bytesOf(xml))) {
    logger().error("Defaults: could not write {}", file.string());
    return false;
  }
  return true;
}

}  // namespace zerith
