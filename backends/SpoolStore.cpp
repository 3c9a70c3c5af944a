// The spool's folder of files: indexing, writing under a temporary name,
// reading back, dropping for room or age and moving bad files aside.

#include "backends/Spool.h"
#include "backends/SpoolHelpers.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iterator>

#include <fmt/format.h>

#include "backends/BackendsLog.h"
#include "platform/FileUtil.h"

namespace zerith {

namespace fs = std::filesystem;

using spool_detail::wallMillis;

namespace {

constexpr const char* kSpoolSuffix = ".zspool";
constexpr const char* kTemporaryPrefix = ".tmp-";

// Errors of the moment: the file is fine, this process cannot read it now.
bool isPassingError(int error) {
  return error == EMFILE || error == ENFILE || error == ENOMEM || error == EAGAIN || error == EINTR ||
         error == ENOBUFS;
}

}  // namespace

// ---------------------------------------------------------------------------
// SpoolStore

SpoolStore::SpoolStore(fs::path folder, std::uint64_t maxBytes, std::int64_t maxAgeSeconds)
    : clock(wallMillis), folder_(std::move(folder)), maxBytes_(maxBytes), maxAgeSeconds_(maxAgeSeconds) {}

bool SpoolStore::open(std::string* why) {
  std::error_code ec;
  fs::create_directories(folder_, ec);
  if (ec) {
    *why = fmt::format("cannot create {}: {}", folder_.string(), ec.message());
    return false;
  }
  // Other users neither list nor read what devices reported.
  if (::chmod(folder_.c_str(), 0700) != 0) {
    *why = fmt::format("cannot set the mode of {}: {}", folder_.string(), std::strerror(errno));
    return false;
  }
  index_.clear();
  totalBytes_ = 0;
  DIR* dir = ::opendir(folder_.c_str());
  if (!dir) {
    *why = fmt::format("cannot list {}: {}", folder_.string(), std::strerror(errno));
    return false;
  }
  std::vector<std::string> names;
  while (const dirent* entry = ::readdir(dir)) {
    names.emplace_back(entry->d_name);
  }
  ::closedir(dir);
  for (const std::string& name : names) {
    if (name == "." || name == ".." || name == "bad") {
      continue;
    }
    const fs::path path = folder_ / name;
    if (name.rfind(kTemporaryPrefix, 0) == 0) {
      // A write that a crash cut short: never renamed, never read.
      ::unlink(path.c_str());
      backendsLogger().info("Spool: removed {}, a write that did not finish", name);
      continue;
    }
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode) || name.size() <= std::strlen(kSpoolSuffix) ||
        name.compare(name.size() - std::strlen(kSpoolSuffix), std::string::npos, kSpoolSuffix) != 0) {
      moveAside(name, "not a spool file name or not a regular file");
      continue;
    }
    file::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    std::uint8_t head[kSpoolHeaderSize];
    const ssize_t n = fd ? ::pread(fd.get(), head, sizeof head, 0) : -1;
    if (n < 0 && isPassingError(errno)) {
      backendsLogger().error("Spool: cannot read {} now ({}); left for the next start", name, std::strerror(errno));
      continue;
    }
    std::string reason;
    const auto header = n < 0 ? std::nullopt : decodeSpoolHeader(std::span<const std::uint8_t>(head, static_cast<std::size_t>(n)), &reason);
    if (!header) {
      moveAside(name, n < 0 ? std::string(std::strerror(errno)) : reason);
      continue;
    }
    if (static_cast<std::uint64_t>(st.st_size) != kSpoolHeaderSize + header->bodyLength) {
      moveAside(name, fmt::format("truncated: {} bytes where the header says {}", st.st_size,
                                  kSpoolHeaderSize + header->bodyLength));
      continue;
    }
    Entry entry{name, static_cast<std::uint64_t>(st.st_size), header->recordCount, header->createdMillis};
    totalBytes_ += entry.bytes;
    index_.emplace(name, std::move(entry));
  }
  return true;
}

std::string SpoolStore::nextName(std::int64_t nowMillis) {
  // Microseconds of the wall clock keep names in time order across restarts;
  // the sequence keeps two writes of one microsecond apart.
  const auto micros = std::chrono::duration_cast<std::chrono::microseconds>(
                          std::chrono::system_clock::now().time_since_epoch())
                          .count();
  const std::uint64_t stamp = static_cast<std::uint64_t>(std::max<std::int64_t>(micros, nowMillis * 1000));
  std::string name;
  do {
    name = fmt::format("{:016x}-{:08x}{}", stamp, sequence_++, kSpoolSuffix);
  } while (index_.count(name) != 0);
  return name;
}

namespace {

// Whether the reader takes every field of `batch` back; the cause otherwise.
bool readerTakes(const SpoolBatch& batch, std::string* why) {
  if (batch.url.size() > kSpoolMaxURLSize) {
    *why = fmt::format("its URL of {} bytes is past the spool's {}", batch.url.size(), kSpoolMaxURLSize);
    return false;
  }
  if (batch.headers.size() > kSpoolMaxHeaders) {
    *why = fmt::format("its {} request headers are past the spool's {}", batch.headers.size(), kSpoolMaxHeaders);
    return false;
  }
  for (const auto& [name, value] : batch.headers) {
    if (name.size() > kSpoolMaxHeaderSize || value.size() > kSpoolMaxHeaderSize) {
      *why = fmt::format("its request header {:.64} is past the spool's {} bytes", name, kSpoolMaxHeaderSize);
      return false;
    }
  }
  if (batch.body.size() > kSpoolMaxBodySize) {
    *why = fmt::format("its body of {} bytes is past the spool's {}", batch.body.size(), kSpoolMaxBodySize);
    return false;
  }
  return true;
}

bool writeWhole(int fd, const Data& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      return false;
    }
    if (n == 0) {
      errno = EIO;
      return false;
    }
    done += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

SpoolStore::WriteOutcome SpoolStore::write(const SpoolBatch& batch) { return std::move(writeMany({&batch}).front()); }

std::vector<SpoolStore::WriteOutcome> SpoolStore::writeMany(const std::vector<const SpoolBatch*>& batches) {
  std::vector<WriteOutcome> outcomes(batches.size());
  if (batches.empty()) {
    return outcomes;
  }
  const std::int64_t now = clock();
  outcomes.front().dropped = dropExpired(now);

  // Each batch under a temporary name, not yet flushed.
  struct Staged {
    std::size_t index;
    std::string name;
    std::string temporary;
    file::UniqueFd fd;
    Entry entry;
  };
  std::vector<Staged> staged;
  std::uint64_t reserved = 0;  // bytes of staged batches, not yet in totalBytes_
  for (std::size_t i = 0; i < batches.size(); ++i) {
    const SpoolBatch& batch = *batches[i];
    WriteOutcome& outcome = outcomes[i];
    if (!readerTakes(batch, &outcome.why)) {
      continue;
    }
    const Data bytes = encodeSpoolFile(batch);
    if (bytes.size() > maxBytes_) {
      outcome.why = fmt::format("larger than the size limit of {} bytes", maxBytes_);
      continue;
    }
    while (totalBytes_ + reserved + bytes.size() > maxBytes_) {
      auto victim = std::find_if(index_.begin(), index_.end(), [&](const auto& e) { return !isPinned(e.first); });
      if (victim == index_.end()) {
        break;
      }
      Entry oldest = victim->second;
      remove(oldest.name);
      outcome.dropped.push_back({std::move(oldest), DropReason::size});
    }
    if (totalBytes_ + reserved + bytes.size() > maxBytes_) {
      outcome.why = fmt::format("the size limit of {} bytes is taken by batches being posted", maxBytes_);
      continue;
    }
    Staged s;
    s.index = i;
    s.name = nextName(now);
    s.temporary = (folder_ / (std::string(kTemporaryPrefix) + s.name + ".XXXXXX")).string();
    s.fd = file::UniqueFd(::mkostemp(s.temporary.data(), O_CLOEXEC));
    if (!s.fd) {
      outcome.error = errno;
      outcome.why = std::strerror(errno);
      continue;
    }
    ::fchmod(s.fd.get(), 0600);
    if (!writeWhole(s.fd.get(), bytes)) {
      outcome.error = errno != 0 ? errno : EIO;
      outcome.why = std::strerror(outcome.error);
      ::unlink(s.temporary.c_str());
      continue;
    }
    s.entry = Entry{s.name, bytes.size(), batch.recordCount, batch.createdMillis};
    reserved += bytes.size();
    staged.push_back(std::move(s));
  }
  if (staged.empty()) {
    return outcomes;
  }

  // One flush for the group: the file itself when alone, its file system
  // when several.
  const int synced = staged.size() == 1 ? ::fsync(staged.front().fd.get()) : ::syncfs(staged.front().fd.get());
  const int syncError = synced != 0 ? errno : 0;
  std::size_t renamed = 0;
  for (Staged& s : staged) {
    WriteOutcome& outcome = outcomes[s.index];
    const int closed = ::close(s.fd.release());
    if (syncError != 0 || closed != 0 || ::rename(s.temporary.c_str(), (folder_ / s.name).c_str()) != 0) {
      outcome.error = syncError != 0 ? syncError : (errno != 0 ? errno : EIO);
      outcome.why = std::strerror(outcome.error);
      ::unlink(s.temporary.c_str());
      continue;
    }
    totalBytes_ += s.entry.bytes;
    index_.emplace(s.name, s.entry);
    outcome.written = true;
    outcome.name = s.name;
    ++renamed;
  }
  if (renamed > 0) {
    file::UniqueFd dirFd(::open(folder_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (dirFd) {
      ::fsync(dirFd.get());
    }
  }
  return outcomes;
}

std::vector<SpoolStore::Entry> SpoolStore::entries() const {
  std::vector<Entry> out;
  out.reserve(index_.size());
  for (const auto& [name, entry] : index_) {
    out.push_back(entry);
  }
  return out;
}

std::optional<SpoolStore::Entry> SpoolStore::oldest() const {
  if (index_.empty()) {
    return std::nullopt;
  }
  return index_.begin()->second;
}

std::optional<SpoolStore::Entry> SpoolStore::find(const std::string& name) const {
  if (auto it = index_.find(name); it != index_.end()) {
    return it->second;
  }
  return std::nullopt;
}

std::optional<SpoolStore::Entry> SpoolStore::oldestUnpinned() const {
  for (const auto& [name, entry] : index_) {
    if (!isPinned(name)) {
      return entry;
    }
  }
  return std::nullopt;
}

std::uint64_t SpoolStore::totalRecords() const {
  std::uint64_t n = 0;
  for (const auto& [name, entry] : index_) {
    n += entry.records;
  }
  return n;
}

std::optional<SpoolBatch> SpoolStore::read(const std::string& name, bool* later) {
  const fs::path path = folder_ / name;
  const auto forget = [&] {
    if (auto it = index_.find(name); it != index_.end()) {
      totalBytes_ -= it->second.bytes;
      index_.erase(it);
    }
  };
  // Only what the file holds can make it bad: an error of this process (no
  // descriptor, no memory) leaves it for a later read.
  const auto cannotNow = [&](int error) -> std::optional<SpoolBatch> {
    if (error == ENOENT) {
      forget();
    } else if (isPassingError(error)) {
      backendsLogger().error("Spool: cannot read {} now ({}); read again later", name, std::strerror(error));
      if (later) {
        *later = true;
      }
    } else {
      moveAside(name, fmt::format("unreadable: {}", std::strerror(error)));
    }
    return std::nullopt;
  };
  file::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!fd) {
    return cannotNow(errno);
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) {
    return cannotNow(errno);
  }
  const std::uint64_t limit = kSpoolHeaderSize + kSpoolMaxBodySize + kSpoolMaxURLSize +
                              kSpoolMaxHeaders * (2 * kSpoolMaxHeaderSize + 8) + 12;
  if (!S_ISREG(st.st_mode) || static_cast<std::uint64_t>(st.st_size) > limit) {
    moveAside(name, fmt::format("not a regular file or {} bytes, past {}", st.st_size, limit));
    return std::nullopt;
  }
  Data bytes;
  try {
    bytes.resize(static_cast<std::size_t>(st.st_size));
  } catch (const std::bad_alloc&) {
    return cannotNow(ENOMEM);
  }
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::pread(fd.get(), bytes.data() + done, bytes.size() - done, static_cast<off_t>(done));
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      return cannotNow(errno);
    }
    if (n == 0) {
      break;  // shorter than it was: the checks below say so
    }
    done += static_cast<std::size_t>(n);
  }
  bytes.resize(done);
  std::string why;
  auto batch = decodeSpoolFile(bytes, &why);
  if (!batch) {
    moveAside(name, why);
    return std::nullopt;
  }
  return batch;
}

void SpoolStore::remove(const std::string& name) {
  ::unlink((folder_ / name).c_str());
  if (auto it = index_.find(name); it != index_.end()) {
    totalBytes_ -= it->second.bytes;
    index_.erase(it);
  }
}

std::vector<SpoolStore::Dropped> SpoolStore::dropExpired(std::int64_t nowMillis) {
  std::vector<Dropped> dropped;
  const std::int64_t oldestKept = nowMillis - maxAgeSeconds_ * 1000;
  // Names and creation times come from one clock reading, so the index is
  // in creation order (a clock set back gives later batches both a smaller
  // name and an earlier time): the expired ones are a prefix of it.
  std::vector<std::string> expired;
  for (const auto& [name, entry] : index_) {
    if (entry.createdMillis >= oldestKept) {
      break;
    }
    if (!isPinned(name)) {
      expired.push_back(name);
    }
  }
  for (const std::string& name : expired) {
    Entry entry = index_.at(name);
    remove(name);
    dropped.push_back({std::move(entry), DropReason::age});
  }
  return dropped;
}

void SpoolStore::moveAside(const std::string& name, const std::string& why) {
  std::error_code ec;
  fs::create_directories(badFolder(), ec);
  ::chmod(badFolder().c_str(), 0700);
  const fs::path from = folder_ / name;
  const fs::path to = badFolder() / name;
  if (ec || ::rename(from.c_str(), to.c_str()) != 0) {
    // Nowhere to keep it: gone rather than read again and again.
    ::unlink(from.c_str());
    backendsLogger().error("Spool: removed {} ({}); it could not be moved aside", name, why);
  } else {
    backendsLogger().error("Spool: moved {} aside to bad/: {}", name, why);
  }
  if (auto it = index_.find(name); it != index_.end()) {
    totalBytes_ -= it->second.bytes;
    index_.erase(it);
  }
}

}  // namespace zerith
