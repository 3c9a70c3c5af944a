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

SpoolStore::WriteOutcome SpoolStore::write(const SpoolBatch& batch) {
  WriteOutcome outcome;
  const std::int64_t now = clock();
  outcome.dropped = dropExpired(now);
  const Data bytes = encodeSpoolFile(batch);
  if (bytes.size() > maxBytes_) {
    return outcome;  // alone larger than the whole spool
  }
  while (!index_.empty() && totalBytes_ + bytes.size() > maxBytes_) {
    Entry oldest = index_.begin()->second;
    remove(oldest.name);
    outcome.dropped.push_back({std::move(oldest), DropReason::size});
  }

  const std::string name = nextName(now);
  const fs::path path = folder_ / name;
  std::string tmpl = (folder_ / (std::string(kTemporaryPrefix) + name + ".XXXXXX")).string();
  file::UniqueFd fd(::mkostemp(tmpl.data(), O_CLOEXEC));
  if (!fd) {
    outcome.error = errno;
    return outcome;
  }
  const auto fail = [&] {
    outcome.error = errno != 0 ? errno : EIO;
    ::unlink(tmpl.c_str());
    return outcome;
  };
  ::fchmod(fd.get(), 0600);
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::write(fd.get(), bytes.data() + done, bytes.size() - done);
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      return fail();
    }
    if (n == 0) {
      errno = EIO;
      return fail();
    }
    done += static_cast<std::size_t>(n);
  }
  if (::fsync(fd.get()) != 0) {
    return fail();
  }
  if (::close(fd.release()) != 0) {
    return fail();
  }
  if (::rename(tmpl.c_str(), path.c_str()) != 0) {
    return fail();
  }
  file::UniqueFd dirFd(::open(folder_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (dirFd) {
    ::fsync(dirFd.get());
  }
  Entry entry{name, bytes.size(), batch.recordCount, batch.createdMillis};
  totalBytes_ += entry.bytes;
  index_.emplace(name, std::move(entry));
  outcome.written = true;
  outcome.name = name;
  return outcome;
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

std::uint64_t SpoolStore::totalRecords() const {
  std::uint64_t n = 0;
  for (const auto& [name, entry] : index_) {
    n += entry.records;
  }
  return n;
}

std::optional<SpoolBatch> SpoolStore::read(const std::string& name) {
  const fs::path path = folder_ / name;
  const auto bytes = file::readAll(path, kSpoolHeaderSize + kSpoolMaxBodySize + 2 * kSpoolMaxURLSize +
                                             kSpoolMaxHeaders * (2 * kSpoolMaxHeaderSize + 8));
  if (!bytes) {
    std::error_code ec;
    if (fs::exists(path, ec)) {
      moveAside(name, "unreadable or too large");
    } else if (auto it = index_.find(name); it != index_.end()) {
      totalBytes_ -= it->second.bytes;
      index_.erase(it);
    }
    return std::nullopt;
  }
  std::string why;
  auto batch = decodeSpoolFile(*bytes, &why);
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
    expired.push_back(name);
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
        if (outcome.error != 0) {
          backendsLogger().error("Spool: cannot keep a batch of {} records: {}; {} records dropped so far", records,
                                 std::strerror(outcome.error), self->droppedRecords_);
        } else {
          backendsLogger().error(
              "Spool: cannot keep a batch of {} records: larger than the size limit of {} bytes; {} records dropped so far",
              records, self->config_.maxBytes, self->droppedRecords_);
        }
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
  while ((entry = store_->oldest())) {
    batch = store_->read(entry->name);  // a bad file is moved aside and the next one read
    if (batch) {
      break;
    }
    owners_.erase(entry->name);
  }
  if (!batch) {
    hasBacklog_ = false;
    backoffSeconds_ = 0;
    return;  // empty: nothing stays scheduled
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
  countOn(entry->name, BackendCount::retried, entry->records);
  std::weak_ptr<Spool> weak = weak_from_this();
  const std::string name = entry->name;
  const std::uint32_t records = entry->records;
  transport_->postURLRequestWithCompletionHandler(
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
}

void Spool::retryAnswered(const std::string& name, std::uint32_t records, long status, const std::optional<Error>& error) {
  postInFlight_ = false;
  retryActive_ = false;
  if (!store_) {
    return;
  }
  if (!error && status >= 200 && status <= 299) {
    countOn(name, BackendCount::delivered, records);
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
