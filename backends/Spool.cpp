#include "backends/Spool.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <future>
#include <iterator>

#include <fmt/format.h>

#include "backends/BackendsLog.h"
#include "backends/ZerithBackend.h"
#include "platform/Defaults.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "transport/ReportingSessionConnectivityHelper.h"

namespace zerith {

namespace fs = std::filesystem;

namespace {

constexpr const char* kDefaultsDomain = "com.velmar.zerith";
constexpr const char* kSpoolSuffix = ".zspool";
constexpr const char* kTemporaryPrefix = ".tmp-";
// Retries that get no answer within this time fail and wait their turn.
constexpr double kRetryPostTimeoutSeconds = 60;

std::int64_t wallMillis() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::system_clock::now().time_since_epoch())
      .count();
}

// ---------------------------------------------------------------------------
// Little-endian fields

void putU32(Data& out, std::uint32_t v) {
  for (int i = 0; i < 4; ++i) {
    out.push_back(static_cast<std::uint8_t>(v >> (8 * i)));
  }
}
void putBytes(Data& out, const void* bytes, std::size_t n) {
  putU32(out, static_cast<std::uint32_t>(n));
  const auto* p = static_cast<const std::uint8_t*>(bytes);
  out.insert(out.end(), p, p + n);
}
std::uint32_t getU32(const std::uint8_t* p) {
  std::uint32_t v = 0;
  for (int i = 3; i >= 0; --i) {
    v = (v << 8) | p[i];
  }
  return v;
}
std::uint64_t getU64(const std::uint8_t* p) {
  std::uint64_t v = 0;
  for (int i = 7; i >= 0; --i) {
    v = (v << 8) | p[i];
  }
  return v;
}

std::uint32_t checksumOf(std::span<const std::uint8_t> head, std::span<const std::uint8_t> body) {
  uLong crc = crc32(0L, Z_NULL, 0);
  crc = crc32(crc, head.data(), static_cast<uInt>(head.size()));
  // zlib takes 32-bit lengths; bodies are bounded well below that.
  crc = crc32(crc, body.data(), static_cast<uInt>(body.size()));
  return static_cast<std::uint32_t>(crc);
}

// A reader of length-prefixed fields that never reads past its end.
class FieldReader {
 public:
  explicit FieldReader(std::span<const std::uint8_t> bytes) : bytes_(bytes) {}
  bool u32(std::uint32_t& v) {
    if (bytes_.size() - at_ < 4) {
      return false;
    }
    v = getU32(bytes_.data() + at_);
    at_ += 4;
    return true;
  }
  bool field(std::size_t limit, std::span<const std::uint8_t>& out) {
    std::uint32_t n = 0;
    if (!u32(n) || n > limit || bytes_.size() - at_ < n) {
      return false;
    }
    out = bytes_.subspan(at_, n);
    at_ += n;
    return true;
  }
  bool atEnd() const { return at_ == bytes_.size(); }

 private:
  std::span<const std::uint8_t> bytes_;
  std::size_t at_ = 0;
};

std::string textOf(std::span<const std::uint8_t> bytes) { return std::string(bytes.begin(), bytes.end()); }

// Errors of the moment: the file is fine, this process cannot read it now.
bool isPassingError(int error) {
  return error == EMFILE || error == ENFILE || error == ENOMEM || error == EAGAIN || error == EINTR ||
         error == ENOBUFS;
}


// A 64-bit seed from the kernel's random source.
std::uint64_t randomSeed() {
  std::random_device device;
  return (static_cast<std::uint64_t>(device()) << 32) ^ device();
}

bool parseBool(const Value& v, std::optional<bool>& out) {
  if (v.isBool()) {
    out = v.boolValue();
    return true;
  }
  if (v.isNumber()) {
    const std::int64_t i = v.intValue();
    if (i == 0 || i == 1) {
      out = i == 1;
      return true;
    }
    return false;
  }
  if (const std::string* s = v.string()) {
    std::string lower(*s);
    std::transform(lower.begin(), lower.end(), lower.begin(), [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    if (lower == "true" || lower == "yes" || lower == "1") {
      out = true;
      return true;
    }
    if (lower == "false" || lower == "no" || lower == "0") {
      out = false;
      return true;
    }
  }
  return false;
}

// A number key within [low, high]; anything else is logged and the default
// stays.
template <typename T>
void numberKey(const Value& values, const char* key, T low, T high, T& into) {
  const Value v = values[key];
  if (v.isNil()) {
    return;
  }
  double d = 0;
  if (v.isNumber()) {
    d = v.doubleValue();
  } else if (const std::string* s = v.string()) {
    char* end = nullptr;
    errno = 0;
    d = std::strtod(s->c_str(), &end);
    if (s->empty() || *end != '\0' || errno != 0) {
      backendsLogger().error("Spool: defaults key \"{}\" holds '{}', not a number; using {}", key, *s, into);
      return;
    }
  } else {
    backendsLogger().error("Spool: defaults key \"{}\" holds {}, not a number; using {}", key, v.kindName(), into);
    return;
  }
  if (!std::isfinite(d) || d < static_cast<double>(low) || d > static_cast<double>(high)) {
    backendsLogger().error("Spool: defaults key \"{}\" is {}, outside {} to {}; using {}", key, d, low, high, into);
    return;
  }
  into = static_cast<T>(d);
}

}  // namespace

// ---------------------------------------------------------------------------
// Configuration, record IDs, record counts

SpoolConfig SpoolConfig::fromDictionary(const Value& values) {
  SpoolConfig config;
  if (const Value enabled = values["spoolEnabled"]; !enabled.isNil()) {
    std::optional<bool> on;
    if (parseBool(enabled, on)) {
      config.enabled = *on;
    } else {
      backendsLogger().error("Spool: defaults key \"spoolEnabled\" holds {} '{}', not a boolean; the spool stays off",
                             enabled.kindName(), enabled.description());
    }
  }
  numberKey<std::uint64_t>(values, "spoolMaxBytes", kMinMaxBytes, kMaxMaxBytes, config.maxBytes);
  numberKey<std::int64_t>(values, "spoolMaxAgeSeconds", 1, kMaxMaxAgeSeconds, config.maxAgeSeconds);
  numberKey<double>(values, "spoolRetryInitialSeconds", 0.01, 3600, config.retryInitialSeconds);
  numberKey<double>(values, "spoolRetryMaxSeconds", 0.01, 86400, config.retryMaxSeconds);
  numberKey<double>(values, "spoolCommitIntervalSeconds", 0.0, kMaxCommitIntervalSeconds, config.commitIntervalSeconds);
  if (config.retryMaxSeconds < config.retryInitialSeconds) {
    backendsLogger().error("Spool: \"spoolRetryMaxSeconds\" {} is below \"spoolRetryInitialSeconds\" {}; using the latter for both",
                           config.retryMaxSeconds, config.retryInitialSeconds);
    config.retryMaxSeconds = config.retryInitialSeconds;
  }
  return config;
}

SpoolConfig SpoolConfig::fromDefaults() { return fromDictionary(Defaults(kDefaultsDomain).dictionary()); }

bool spoolEnabledInDefaults() {
  std::optional<bool> on;
  return parseBool(Defaults(kDefaultsDomain).objectForKey("spoolEnabled"), on) && *on;
}

std::string newRecordID() {
  static const std::uint64_t prefix = randomSeed();
  static std::atomic<std::uint64_t> counter{0};
  return fmt::format("{:016x}{:016x}", prefix, counter.fetch_add(1, std::memory_order_relaxed));
}

std::uint32_t countEnvelopeRecords(std::string_view json) {
  // The envelope is an object (depth 1) whose only array is "events" (depth
  // 2); a record is an object opened at depth 2. Braces inside strings do
  // not count.
  std::uint32_t records = 0;
  int depth = 0;
  bool inString = false;
  for (std::size_t i = 0; i < json.size(); ++i) {
    const char c = json[i];
    if (inString) {
      if (c == '\\') {
        ++i;
      } else if (c == '"') {
        inString = false;
      }
      continue;
    }
    switch (c) {
      case '"': inString = true; break;
      case '{':
        records += depth == 2 ? 1 : 0;
        ++depth;
        break;
      case '[': ++depth; break;
      case '}':
      case ']': --depth; break;
      default: break;
    }
  }
  return records;
}

// ---------------------------------------------------------------------------
// The file format

Data encodeSpoolFile(const SpoolBatch& batch) {
  Data body;
  body.reserve(batch.body.size() + batch.url.size() + 256);
  putBytes(body, batch.url.data(), batch.url.size());
  putU32(body, static_cast<std::uint32_t>(batch.headers.size()));
  for (const auto& [name, value] : batch.headers) {
    putBytes(body, name.data(), name.size());
    putBytes(body, value.data(), value.size());
  }
  putBytes(body, batch.body.data(), batch.body.size());

  std::array<std::uint8_t, kSpoolHeaderSize> head{};
  const auto setU32 = [&](std::size_t at, std::uint32_t v) {
    for (std::size_t i = 0; i < 4; ++i) {
      head[at + i] = static_cast<std::uint8_t>(v >> (8 * i));
    }
  };
  std::memcpy(head.data(), kSpoolMagic.data(), kSpoolMagic.size());
  setU32(8, kSpoolVersion);
  setU32(12, batch.recordCount);
  const auto created = static_cast<std::uint64_t>(batch.createdMillis);
  setU32(16, static_cast<std::uint32_t>(created));
  setU32(20, static_cast<std::uint32_t>(created >> 32));
  setU32(24, static_cast<std::uint32_t>(body.size()));
  setU32(28, checksumOf(std::span<const std::uint8_t>(head.data(), 28), body));
  Data out(kSpoolHeaderSize + body.size());
  std::memcpy(out.data(), head.data(), kSpoolHeaderSize);
  std::memcpy(out.data() + kSpoolHeaderSize, body.data(), body.size());
  return out;
}

std::optional<SpoolFileHeader> decodeSpoolHeader(std::span<const std::uint8_t> bytes, std::string* why) {
  const auto fail = [&](std::string reason) -> std::optional<SpoolFileHeader> {
    if (why) {
      *why = std::move(reason);
    }
    return std::nullopt;
  };
  if (bytes.size() < kSpoolHeaderSize) {
    return fail(fmt::format("truncated header ({} of {} bytes)", bytes.size(), kSpoolHeaderSize));
  }
  if (!std::equal(kSpoolMagic.begin(), kSpoolMagic.end(), bytes.begin())) {
    return fail("not a spool file (bad magic)");
  }
  SpoolFileHeader header;
  header.version = getU32(bytes.data() + 8);
  if (header.version != kSpoolVersion) {
    return fail(fmt::format("format version {} (this daemon reads {})", header.version, kSpoolVersion));
  }
  header.recordCount = getU32(bytes.data() + 12);
  header.createdMillis = static_cast<std::int64_t>(getU64(bytes.data() + 16));
  header.bodyLength = getU32(bytes.data() + 24);
  header.checksum = getU32(bytes.data() + 28);
  // The body carries at least the URL's length, the header count and the
  // body's length.
  if (header.bodyLength < 12 || header.bodyLength > kSpoolMaxBodySize + kSpoolMaxURLSize +
                                                         kSpoolMaxHeaders * (2 * kSpoolMaxHeaderSize + 8) + 12) {
    return fail(fmt::format("body length {} out of range", header.bodyLength));
  }
  return header;
}

std::optional<SpoolBatch> decodeSpoolFile(std::span<const std::uint8_t> bytes, std::string* why) {
  const auto fail = [&](std::string reason) -> std::optional<SpoolBatch> {
    if (why) {
      *why = std::move(reason);
    }
    return std::nullopt;
  };
  const auto header = decodeSpoolHeader(bytes, why);
  if (!header) {
    return std::nullopt;
  }
  if (bytes.size() - kSpoolHeaderSize != header->bodyLength) {
    return fail(fmt::format("{} body bytes where the header says {}", bytes.size() - kSpoolHeaderSize, header->bodyLength));
  }
  const auto body = bytes.subspan(kSpoolHeaderSize);
  if (checksumOf(bytes.first(28), body) != header->checksum) {
    return fail("checksum mismatch");
  }
  SpoolBatch batch;
  batch.createdMillis = header->createdMillis;
  batch.recordCount = header->recordCount;
  FieldReader reader(body);
  std::span<const std::uint8_t> field;
  if (!reader.field(kSpoolMaxURLSize, field)) {
    return fail("bad URL field");
  }
  batch.url = textOf(field);
  std::uint32_t headerCount = 0;
  if (!reader.u32(headerCount) || headerCount > kSpoolMaxHeaders) {
    return fail("bad header count");
  }
  for (std::uint32_t i = 0; i < headerCount; ++i) {
    std::span<const std::uint8_t> name, value;
    if (!reader.field(kSpoolMaxHeaderSize, name) || !reader.field(kSpoolMaxHeaderSize, value)) {
      return fail(fmt::format("bad request header {}", i));
    }
    batch.headers.emplace_back(textOf(name), textOf(value));
  }
  if (!reader.field(kSpoolMaxBodySize, field)) {
    return fail("bad request body field");
  }
  batch.body.assign(field.begin(), field.end());
  if (!reader.atEnd()) {
    return fail("trailing bytes after the request body");
  }
  return batch;
}

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

// ---------------------------------------------------------------------------
// Spool

namespace {

std::mutex& sharedMutex() {
  static auto* mutex = new std::mutex;
  return *mutex;
}
// Kept for the daemon's life: retries may be under way at exit.
std::shared_ptr<Spool>& sharedSpool() {
  static auto* spool = new std::shared_ptr<Spool>;
  return *spool;
}
std::atomic<Spool*> currentSpool{nullptr};

}  // namespace

std::shared_ptr<Spool> Spool::shared() {
  std::lock_guard lock(sharedMutex());
  auto& spool = sharedSpool();
  if (spool) {
    return spool;
  }
  const SpoolConfig config = SpoolConfig::fromDefaults();
  if (!config.enabled) {
    return nullptr;
  }
  spool = create(paths::spoolDir(), config,
                 ReportingSessionConnectivityHelper::initWithDelegate(std::weak_ptr<ConnectivityHelperDelegate>(),
                                                                      ReportingSessionConnectivityHelper::POSTRequestMode()));
  currentSpool.store(spool.get(), std::memory_order_release);
  return spool;
}

Spool* Spool::current() { return currentSpool.load(std::memory_order_acquire); }

std::shared_ptr<Spool> Spool::create(fs::path folder, SpoolConfig config,
                                     std::shared_ptr<ReportingSessionConnectivityInterface> transport) {
  auto spool = std::make_shared<Spool>(Token{}, std::move(folder), config, std::move(transport));
  spool->start();
  return spool;
}

Spool::Spool(Token, fs::path folder, SpoolConfig config, std::shared_ptr<ReportingSessionConnectivityInterface> transport)
    : folder_(std::move(folder)),
      config_(config),
      transport_(std::move(transport)),
      queue_("com.velmar.zerithd.spool"),
      random_(randomSeed()) {}

void Spool::start() {
  queue_.sync([&] {
    store_.emplace(folder_, config_.maxBytes, config_.maxAgeSeconds);
    std::string why;
    if (!store_->open(&why)) {
      backendsLogger().error("Spool: the spool folder cannot be used ({}); failed batches are dropped", why);
      store_.reset();
      return;
    }
    backendsLogger().info("Spool: on in {} (limits {} bytes, {} seconds)", folder_.string(), config_.maxBytes,
                          config_.maxAgeSeconds);
    usable_ = true;
    counters_.add(BackendCount::inSpool, store_->totalRecords());
    countDrops(store_->dropExpired(store_->clock()));
    if (store_->size() > 0) {
      backendsLogger().info("Spool: {} batches ({} records) found from an earlier run; draining", store_->size(),
                            store_->totalRecords());
      hasBacklog_ = true;
      scheduleRetry(std::chrono::steady_clock::duration::zero());
    }
  });
}

void Spool::keep(URLRequest request, std::uint32_t records, std::shared_ptr<BackendCounters> counters,
                 std::function<void(bool kept)> done) {
  std::weak_ptr<Spool> weak = weak_from_this();
  queue_.async([weak, request = std::move(request), records, backend = std::move(counters), done = std::move(done)] {
    auto self = weak.lock();
    if (!self) {
      return;
    }
    bool kept = false;
    const auto countBoth = [&](BackendCount what, std::uint64_t n) {
      self->counters_.add(what, n);
      if (backend) {
        backend->add(what, n);
      }
    };
    if (!self->store_) {
      self->droppedRecords_ += records;
      countBoth(BackendCount::droppedSpoolFull, records);
      backendsLogger().error("Spool: cannot keep a batch of {} records: the spool folder is not usable; {} records dropped so far",
                             records, self->droppedRecords_);
    } else {
      SpoolBatch batch;
      batch.createdMillis = self->store_->clock();
      batch.recordCount = records;
      batch.url = request.url;
      batch.headers = request.headers;
      batch.body = request.body;
      const auto outcome = self->store_->write(batch);
      self->countDrops(outcome.dropped);
      if (outcome.written) {
        kept = true;
        self->owners_[outcome.name] = backend;
        countBoth(BackendCount::spooled, records);
        countBoth(BackendCount::inSpool, records);
        self->hasBacklog_ = true;
        backendsLogger().info("Spool: kept batch {} ({} records); {} batches ({} bytes) waiting", outcome.name, records,
                              self->store_->size(), self->store_->totalBytes());
        if (!self->retryActive_) {
          const double wait = self->backoffSeconds_ > 0 ? self->backoffSeconds_ : self->config_.retryInitialSeconds;
          self->backoffSeconds_ = wait;
          self->scheduleRetry(std::chrono::duration_cast<std::chrono::steady_clock::duration>(
              std::chrono::duration<double>(wait)));
        }
      } else {
        self->droppedRecords_ += records;
        countBoth(BackendCount::droppedSpoolFull, records);
        backendsLogger().error("Spool: cannot keep a batch of {} records: {}; {} records dropped so far", records,
                               outcome.why, self->droppedRecords_);
      }
    }
    if (done) {
      done(kept);
    }
  });
}

void Spool::collectorAnswered() {
  if (!hasBacklog_.load(std::memory_order_relaxed)) {
    return;
  }
  std::weak_ptr<Spool> weak = weak_from_this();
  queue_.async([weak] {
    auto self = weak.lock();
    if (!self || !self->store_ || self->postInFlight_ || !self->retryActive_ || self->store_->size() == 0) {
      return;
    }
    // The collector is back: the waiting retry goes now.
    self->timer_.cancel();
    self->backoffSeconds_ = 0;
    self->retryActive_ = false;
    self->scheduleRetry(std::chrono::steady_clock::duration::zero());
  });
}

void Spool::countDrops(const std::vector<SpoolStore::Dropped>& dropped) {
  for (const auto& drop : dropped) {
    droppedRecords_ += drop.entry.records;
    countOn(drop.entry.name, BackendCount::droppedSpoolFull, drop.entry.records);
    uncountOn(drop.entry.name, BackendCount::inSpool, drop.entry.records);
    owners_.erase(drop.entry.name);
    if (drop.reason == SpoolStore::DropReason::size) {
      backendsLogger().error(
          "Spool: dropped the oldest batch {} ({} records) for the size limit of {} bytes; {} records dropped so far",
          drop.entry.name, drop.entry.records, config_.maxBytes, droppedRecords_);
    } else {
      backendsLogger().error("Spool: dropped batch {} ({} records) older than {} seconds; {} records dropped so far",
                             drop.entry.name, drop.entry.records, config_.maxAgeSeconds, droppedRecords_);
    }
  }
}

void Spool::countOn(const std::string& name, BackendCount what, std::uint64_t n) {
  counters_.add(what, n);
  if (auto it = owners_.find(name); it != owners_.end()) {
    if (it->second) {
      it->second->add(what, n);
    }
  }
}

void Spool::uncountOn(const std::string& name, BackendCount what, std::uint64_t n) {
  counters_.remove(what, n);
  if (auto it = owners_.find(name); it != owners_.end()) {
    if (it->second) {
      it->second->remove(what, n);
    }
  }
}

void Spool::retryLater() {
  if (retryActive_ || !store_ || store_->size() == 0) {
    return;
  }
  scheduleRetry(backoffWithJitter());
}

bool Spool::writeAhead(URLRequest request, std::uint32_t records, std::shared_ptr<BackendCounters> counters,
                       std::function<void(std::optional<std::string> name)> then) {
  if (!usable_.load()) {
    return false;
  }
  PendingWrite write;
  write.batch.createdMillis = wallMillis();
  write.batch.recordCount = records;
  write.batch.url = std::move(request.url);
  write.batch.headers = std::move(request.headers);
  write.batch.body = std::move(request.body);
  write.counters = std::move(counters);
  write.then = std::move(then);
  // With no interval the writer waits for its batch's flush: what it formed
  // is on disk before it goes on.
  std::shared_ptr<std::promise<void>> onDisk;
  std::future<void> waited;
  if (config_.commitIntervalSeconds <= 0) {
    onDisk = std::make_shared<std::promise<void>>();
    waited = onDisk->get_future();
    write.onDisk = [onDisk] { onDisk->set_value(); };
  }
  std::weak_ptr<Spool> weak = weak_from_this();
  queue_.async([weak, write = std::move(write)]() mutable {
    auto self = weak.lock();
    if (!self) {
      return;
    }
    self->pending_.push_back(std::move(write));
    if (self->commitScheduled_) {
      return;
    }
    self->commitScheduled_ = true;
    auto commit = [weak] {
      if (auto again = weak.lock()) {
        again->commitWriteAhead();
      }
    };
    if (self->config_.commitIntervalSeconds <= 0) {
      // Writers that arrive while this group is written join the next one.
      self->queue_.async(std::move(commit));
    } else {
      self->commitTimer_ = self->queue_.after(
          std::chrono::duration_cast<std::chrono::steady_clock::duration>(
              std::chrono::duration<double>(self->config_.commitIntervalSeconds)),
          std::move(commit));
    }
  });
  if (waited.valid()) {
    (void)waited.wait_for(kWriteAheadWait);
  }
  return true;
}

void Spool::commitWriteAhead() {
  commitScheduled_ = false;
  // A group holds a descriptor per batch until its flush: at most this many.
  constexpr std::size_t kMaxGroup = 64;
  std::vector<PendingWrite> group;
  const std::size_t n = std::min(pending_.size(), kMaxGroup);
  group.reserve(n);
  std::move(pending_.begin(), pending_.begin() + static_cast<std::ptrdiff_t>(n), std::back_inserter(group));
  pending_.erase(pending_.begin(), pending_.begin() + static_cast<std::ptrdiff_t>(n));
  if (!pending_.empty()) {
    commitScheduled_ = true;
    std::weak_ptr<Spool> weak = weak_from_this();
    queue_.async([weak] {
      if (auto self = weak.lock()) {
        self->commitWriteAhead();
      }
    });
  }
  std::vector<SpoolStore::WriteOutcome> outcomes(group.size());
  if (store_) {
    std::vector<const SpoolBatch*> batches;
    batches.reserve(group.size());
    for (const PendingWrite& write : group) {
      batches.push_back(&write.batch);
    }
    outcomes = store_->writeMany(batches);
  }
  for (std::size_t i = 0; i < group.size(); ++i) {
    PendingWrite& write = group[i];
    const SpoolStore::WriteOutcome& outcome = outcomes[i];
    countDrops(outcome.dropped);
    std::optional<std::string> name;
    if (outcome.written) {
      name = outcome.name;
      owners_[outcome.name] = write.counters;
      store_->pin(outcome.name);
      countOn(outcome.name, BackendCount::spooled, write.batch.recordCount);
      countOn(outcome.name, BackendCount::inSpool, write.batch.recordCount);
      hasBacklog_ = true;
    } else {
      backendsLogger().error("Spool: cannot write a batch of {} records ahead of its post: {}; posted without the spool",
                             write.batch.recordCount, outcome.why.empty() ? "the spool folder is not usable" : outcome.why);
    }
    if (write.onDisk) {
      write.onDisk();
    }
    if (write.then) {
      postQueue_.async([then = std::move(write.then), name = std::move(name)]() mutable { then(std::move(name)); });
    }
  }
}

void Spool::liveAnswered(const std::string& name, LiveAnswer answer) {
  std::weak_ptr<Spool> weak = weak_from_this();
  queue_.async([weak, name, answer] {
    auto self = weak.lock();
    if (!self || !self->store_) {
      return;
    }
    SpoolStore& store = *self->store_;
    store.unpin(name);
    const auto entry = store.find(name);
    const std::uint32_t records = entry ? entry->records : 0;
    if (records == 0 && answer != LiveAnswer::failed && answer != LiveAnswer::notPosted) {
      self->owners_.erase(name);  // already gone (dropped while its post ran): counted then
      return;
    }
    switch (answer) {
      case LiveAnswer::delivered:
        self->countOn(name, BackendCount::delivered, records);
        self->uncountOn(name, BackendCount::inSpool, records);
        store.remove(name);
        self->owners_.erase(name);
        break;
      case LiveAnswer::refused:
        self->countOn(name, BackendCount::droppedTransportError, records);
        self->uncountOn(name, BackendCount::inSpool, records);
        store.remove(name);
        self->owners_.erase(name);
        break;
      case LiveAnswer::failed:
        backendsLogger().info("Spool: kept batch {} ({} records) after its post failed; {} batches ({} bytes) waiting",
                              name, records, store.size(), store.totalBytes());
        self->retryLater();
        break;
      case LiveAnswer::notPosted:
        backendsLogger().debug("Spool: kept batch {} ({} records) without a post; {} batches waiting", name, records,
                               store.size());
        self->retryLater();
        break;
    }
    if (store.size() == 0) {
      self->hasBacklog_ = false;
    }
  });
}

void Spool::scheduleRetry(std::chrono::steady_clock::duration delay) {
  retryActive_ = true;
  std::weak_ptr<Spool> weak = weak_from_this();
  auto block = [weak] {
    if (auto self = weak.lock()) {
      self->retryNext();
    }
  };
  if (delay <= std::chrono::steady_clock::duration::zero()) {
    queue_.async(std::move(block));
  } else {
    timer_ = queue_.after(delay, std::move(block));
  }
}

std::chrono::steady_clock::duration Spool::backoffWithJitter() {
  // Doubling up to the ceiling; the wait is drawn from the upper half so that
  // devices that failed together do not come back together.
  backoffSeconds_ = backoffSeconds_ <= 0 ? config_.retryInitialSeconds
                                         : std::min(backoffSeconds_ * 2, config_.retryMaxSeconds);
  std::uniform_real_distribution<double> jitter(0.5, 1.0);
  return std::chrono::duration_cast<std::chrono::steady_clock::duration>(
      std::chrono::duration<double>(backoffSeconds_ * jitter(random_)));
}

void Spool::retryNext() {
  if (postInFlight_) {
    return;  // a nudge raced a timer: the post under way goes on
  }
  retryActive_ = false;
  if (!store_) {
    return;
  }
  countDrops(store_->dropExpired(store_->clock()));
  std::optional<SpoolBatch> batch;
  std::optional<SpoolStore::Entry> entry;
  while ((entry = store_->oldestUnpinned())) {
    bool later = false;
    batch = store_->read(entry->name, &later);  // a bad file is moved aside and the next one read
    if (batch) {
      break;
    }
    if (later) {
      scheduleRetry(backoffWithJitter());
      return;
    }
    // Moved aside or gone: what it held is lost.
    countOn(entry->name, BackendCount::droppedSpoolFull, entry->records);
    uncountOn(entry->name, BackendCount::inSpool, entry->records);
    owners_.erase(entry->name);
  }
  if (!batch) {
    if (store_->size() == 0) {
      hasBacklog_ = false;
    }
    backoffSeconds_ = 0;
    return;  // empty, or only batches whose live post is under way: nothing stays scheduled
  }
  URLRequest request;
  request.httpMethod = "POST";
  request.url = batch->url;
  request.headers = std::move(batch->headers);
  request.body = std::move(batch->body);
  request.timeoutSeconds = kRetryPostTimeoutSeconds;
  request.allowsCellularAccess = false;
  retryActive_ = true;
  postInFlight_ = true;
  // Kept from the size and age limits while its post is under way.
  store_->pin(entry->name);
  countOn(entry->name, BackendCount::retried, entry->records);
  std::weak_ptr<Spool> weak = weak_from_this();
  const std::string name = entry->name;
  const std::uint32_t records = entry->records;
  const bool taken = transport_->postURLRequestWithCompletionHandler(
      request, [weak, name, records](const Data&, const std::optional<HTTPURLResponse>& response,
                                     const std::optional<Error>& error) {
        const long status = response ? response->statusCode : 0;
        if (auto self = weak.lock()) {
          self->queue_.async([weak, name, records, status, error] {
            if (auto again = weak.lock()) {
              again->retryAnswered(name, records, status, error);
            }
          });
        }
      });
  if (!taken) {
    // No body file could be written: the batch stays, tried again later.
    store_->unpin(name);
    postInFlight_ = false;
    retryActive_ = false;
    const auto wait = backoffWithJitter();
    backendsLogger().error("Spool: retry of batch {} not sent: its body file could not be written; next try in {} ms", name,
                           std::chrono::duration_cast<std::chrono::milliseconds>(wait).count());
    scheduleRetry(wait);
  }
}

void Spool::retryAnswered(const std::string& name, std::uint32_t records, long status, const std::optional<Error>& error) {
  postInFlight_ = false;
  retryActive_ = false;
  if (!store_) {
    return;
  }
  store_->unpin(name);
  if (!error && status >= 200 && status <= 299) {
    countOn(name, BackendCount::delivered, records);
    uncountOn(name, BackendCount::inSpool, records);
    store_->remove(name);
    owners_.erase(name);
    backoffSeconds_ = 0;
    backendsLogger().info("Spool: delivered batch {} ({} records); {} batches waiting", name, records, store_->size());
    if (store_->size() > 0) {
      scheduleRetry(std::chrono::steady_clock::duration::zero());
    } else {
      hasBacklog_ = false;
      backendsLogger().info("Spool: empty");
    }
    return;
  }
  if (!error && !(status >= 500 && status <= 599)) {
    // The collector answered and will not take it: posting again changes
    // nothing.
    countOn(name, BackendCount::droppedTransportError, records);
    uncountOn(name, BackendCount::inSpool, records);
    store_->remove(name);
    owners_.erase(name);
    backendsLogger().error("Spool: the collector refused batch {} ({} records) with status {}; dropped", name, records,
                           status);
    scheduleRetry(std::chrono::steady_clock::duration::zero());
    return;
  }
  const auto wait = backoffWithJitter();
  const std::string why = error ? error->description : fmt::format("status {}", status);
  backendsLogger().info("Spool: retry of batch {} failed ({}); next try in {} ms", name, why,
                        std::chrono::duration_cast<std::chrono::milliseconds>(wait).count());
  scheduleRetry(wait);
}

std::size_t Spool::pendingBatches() const {
  return queue_.sync([&]() -> std::size_t { return store_ ? store_->size() : 0; });
}
std::uint64_t Spool::pendingRecords() const {
  return queue_.sync([&]() -> std::uint64_t { return store_ ? store_->totalRecords() : 0; });
}
std::uint64_t Spool::pendingBytes() const {
  return queue_.sync([&]() -> std::uint64_t { return store_ ? store_->totalBytes() : 0; });
}

}  // namespace zerith
