#pragma once

// The spool: batches kept on disk and posted again until a collector takes
// them. A batch is written ahead of its post (flushed to disk before the post
// starts, and removed when a collector took it), so a crash loses no batch
// that was formed; a batch whose live post failed, found no free post slot or
// no body file stays for the retry.
//
// Off unless the defaults key "spoolEnabled" is true. When on, every record
// carries "_recordID" (a per-daemon random prefix and a counter, 32 hex
// digits) so that a collector can drop the duplicates that at-least-once
// delivery brings.
//
// Files: one per batch in the spool folder (<state folder>/spool, mode 0700),
// named <created µs, hex>-<sequence, hex>.zspool so that names sort oldest
// first. A file is a fixed header followed by the body:
//
//   offset size
//   0      8    magic "ZTHSPOOL"
//   8      4    format version (1), little-endian
//   12     4    number of records in the batch
//   16     8    creation time, ms since 1970 (signed)
//   24     4    body length in bytes
//   28     4    CRC-32 of bytes 0..27 and the body
//   32     ...  body: the URL, the request headers and the request body as
//                they were posted, each a 32-bit length and the bytes
//                (headers: a 32-bit count of name/value pairs first)
//
// Files are written under a temporary name in the same folder, flushed to
// disk and renamed, so a crash leaves either the whole file or a temporary
// that the next start removes. Batches written together share one flush (one
// fsync for a lone batch, one syncfs for several) and one fsync of the
// folder; "spoolCommitIntervalSeconds" above 0 gathers the batches of that
// interval into one such group. A file whose header or checksum does not
// hold, or of another version, is moved into bad/ with a log line and never
// parsed further; a file that cannot be opened or read for a passing reason
// (no descriptor left, no memory) stays where it is and is read again later.
// A batch that the reader would refuse (a field past its bound) is never
// written.
//
// Limits: "spoolMaxBytes" (total file bytes) and "spoolMaxAgeSeconds". A
// batch that does not fit drops the oldest batches first (never one whose
// live post is under way); batches past the
// age are dropped before every write and every retry. Each drop is logged and
// counted (droppedSpoolFull), as is a batch that cannot be written (full
// disk, quota, I/O error): spooling stops for that batch, the daemon goes on.
//
// Retry: one batch at a time, oldest first, through the spool's own HTTP
// helper (a backend that a 5xx disabled is not needed). A failure (transport
// error or 5xx) waits with exponential back-off and jitter, from
// "spoolRetryInitialSeconds" doubling up to "spoolRetryMaxSeconds"; a 2xx
// removes the file and takes the next at once; any other status means the
// collector will never take the batch: it is removed with a log line. With an
// empty spool no timer is pending.

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <random>
#include <set>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "backends/BackendCounters.h"
#include "platform/DefaultsKeys.h"
#include "platform/SerialQueue.h"
#include "platform/Value.h"
#include "transport/ReportingSessionConnectivityInterface.h"

namespace zerith {

class ZerithBackend;

// ---------------------------------------------------------------------------
// Configuration

struct SpoolConfig {
  static constexpr std::uint64_t kDefaultMaxBytes = 64ull << 20;
  // The smallest "spoolMaxBytes" taken.
  static constexpr auto kMinMaxBytes = static_cast<std::uint64_t>(defaultsSetting("spoolMaxBytes").low);
  static constexpr std::int64_t kDefaultMaxAgeSeconds = 7 * 24 * 3600;
  static constexpr double kDefaultRetryInitialSeconds = 1;
  static constexpr double kDefaultRetryMaxSeconds = 300;

  bool enabled = false;
  std::uint64_t maxBytes = kDefaultMaxBytes;
  std::int64_t maxAgeSeconds = kDefaultMaxAgeSeconds;
  double retryInitialSeconds = kDefaultRetryInitialSeconds;
  double retryMaxSeconds = kDefaultRetryMaxSeconds;
  // 0: a batch is on disk before its writer goes on; above 0: batches of
  // this interval share one flush, and a crash loses up to this interval's.
  double commitIntervalSeconds = 0;

  // From the defaults domain com.velmar.zerith. Values of the wrong kind or
  // out of range are logged and replaced by the default.
  static SpoolConfig fromDefaults();
  // The same from a dictionary of those keys (the defaults' contents).
  static SpoolConfig fromDictionary(const Value& values);
};

// "spoolEnabled" of the defaults (false when absent or not a boolean).
bool spoolEnabledInDefaults();

// A fresh record ID: 32 lower-case hex digits, unique for this daemon's life
// and, by its random prefix, across restarts.
std::string newRecordID();

// How many records a compact JSON envelope carries (objects inside its
// "events" array), counted without parsing it into values.
std::uint32_t countEnvelopeRecords(std::string_view json);

// ---------------------------------------------------------------------------
// The file format

struct SpoolBatch {
  std::int64_t createdMillis = 0;
  std::uint32_t recordCount = 0;
  std::string url;
  HTTPHeaders headers;
  Data body;
};

inline constexpr std::array<char, 8> kSpoolMagic = {'Z', 'T', 'H', 'S', 'P', 'O', 'O', 'L'};
inline constexpr std::uint32_t kSpoolVersion = 1;
inline constexpr std::size_t kSpoolHeaderSize = 32;
inline constexpr std::size_t kSpoolMaxBodySize = 64u << 20;
inline constexpr std::size_t kSpoolMaxURLSize = 8192;
inline constexpr std::size_t kSpoolMaxHeaders = 64;
inline constexpr std::size_t kSpoolMaxHeaderSize = 8192;

struct SpoolFileHeader {
  std::uint32_t version = 0;
  std::uint32_t recordCount = 0;
  std::int64_t createdMillis = 0;
  std::uint32_t bodyLength = 0;
  std::uint32_t checksum = 0;
};

Data encodeSpoolFile(const SpoolBatch& batch);
// The fixed header, checked for magic, version and body size; nullopt with
// the reason otherwise.
std::optional<SpoolFileHeader> decodeSpoolHeader(std::span<const std::uint8_t> bytes, std::string* why);
// A whole file: header, checksum, then the body's fields with every length
// bounded; nullopt with the reason on any mismatch or trailing byte.
std::optional<SpoolBatch> decodeSpoolFile(std::span<const std::uint8_t> bytes, std::string* why);

// ---------------------------------------------------------------------------
// The folder of files (not thread-safe: the spool uses it on its queue)

class SpoolStore {
 public:
  struct Entry {
    std::string name;
    std::uint64_t bytes = 0;
    std::uint32_t records = 0;
    std::int64_t createdMillis = 0;
  };
  enum class DropReason { size, age };
  struct Dropped {
    Entry entry;
    DropReason reason;
  };
  struct WriteOutcome {
    bool written = false;
    std::string name;       // when written
    int error = 0;          // errno of a failed write; 0 when the batch cannot be kept at all
    std::string why;        // when not written: the cause, for the log
    std::vector<Dropped> dropped;  // older batches dropped to make room
  };

  SpoolStore(std::filesystem::path folder, std::uint64_t maxBytes, std::int64_t maxAgeSeconds);

  // Creates the folder with mode 0700 (and sets that mode on an existing
  // one), removes temporaries that a crash left and indexes the files,
  // moving aside those whose header is bad. False (with the reason) when the
  // folder cannot be used.
  bool open(std::string* why);

  const std::filesystem::path& folder() const { return folder_; }
  std::filesystem::path badFolder() const { return folder_ / "bad"; }

  WriteOutcome write(const SpoolBatch& batch);
  // Several batches with one flush to disk and one fsync of the folder; an
  // outcome per batch, in order (older batches dropped for room are in the
  // outcome of the batch that needed it).
  std::vector<WriteOutcome> writeMany(const std::vector<const SpoolBatch*>& batches);
  // Oldest first.
  std::vector<Entry> entries() const;
  std::optional<Entry> oldest() const;
  std::optional<Entry> find(const std::string& name) const;
  // The oldest batch that is not pinned.
  std::optional<Entry> oldestUnpinned() const;
  // A pinned batch (its live post is under way) is neither dropped for room
  // or age nor picked for a retry.
  void pin(const std::string& name) { pinned_.insert(name); }
  void unpin(const std::string& name) { pinned_.erase(name); }
  bool isPinned(const std::string& name) const { return pinned_.count(name) != 0; }
  std::size_t size() const { return index_.size(); }
  std::uint64_t totalBytes() const { return totalBytes_; }
  std::uint64_t totalRecords() const;

  // The batch in a file; a file that fails the checks is moved into bad/
  // (logged) and nullopt comes back, as it does for a file that has gone. A
  // file that cannot be read now (no descriptor, no memory) stays, nullopt
  // comes back and `later` (when given) is set.
  std::optional<SpoolBatch> read(const std::string& name, bool* later = nullptr);
  void remove(const std::string& name);
  std::vector<Dropped> dropExpired(std::int64_t nowMillis);

  // Test hook: the wall clock in ms since 1970.
  std::function<std::int64_t()> clock;

 private:
  void moveAside(const std::string& name, const std::string& why);
  std::string nextName(std::int64_t nowMillis);

  std::filesystem::path folder_;
  std::uint64_t maxBytes_;
  std::int64_t maxAgeSeconds_;
  std::map<std::string, Entry> index_;  // names sort oldest first
  std::set<std::string> pinned_;
  std::uint64_t totalBytes_ = 0;
  std::uint32_t sequence_ = 0;
};

// ---------------------------------------------------------------------------
// The daemon's spool

class Spool : public std::enable_shared_from_this<Spool> {
 public:
  struct Token {
   private:
    Token() = default;
    friend class Spool;
  };

  // The daemon's spool, made on first use when "spoolEnabled" is true
  // (nullptr while it is not). Made once, its limits hold until the daemon
  // restarts. Making it opens the folder and starts draining what an
  // earlier run left.
  static std::shared_ptr<Spool> shared();
  // The made spool without reading the defaults (nullptr when none): cheap
  // enough for every post's answer.
  static Spool* current();

  // A spool of its own (tests, benchmarks). `transport` carries the retries.
  static std::shared_ptr<Spool> create(std::filesystem::path folder, SpoolConfig config,
                                       std::shared_ptr<ReportingSessionConnectivityInterface> transport);
  Spool(Token, std::filesystem::path folder, SpoolConfig config,
        std::shared_ptr<ReportingSessionConnectivityInterface> transport);

  // Whether a batch the spool keeps went out in a post before: its first
  // post from the spool counts as "retried" only then.
  enum class Kept { afterItsPost, withoutAPost };
  // Keeps a failed post's request (written on the spool's queue) and counts
  // it, on the posting backend's `counters` too (when given) until the batch
  // is delivered or dropped, whether or not the backend still lives. `done`
  // (optional) runs on the spool's queue once the batch is written or
  // dropped.
  void keep(URLRequest request, std::uint32_t records, std::shared_ptr<BackendCounters> counters,
            std::function<void(bool kept)> done = nullptr, Kept how = Kept::afterItsPost);
  // A collector answered a live post with 2xx: a waiting retry goes now.
  void collectorAnswered();

  // Write-ahead: keeps the request of a batch about to be posted. `then`
  // runs on a queue of the spool's own (never its state queue) once the
  // batch is on disk, with its file's
  // name (the batch is pinned until liveAnswered), or with nullopt when it
  // could not be written (the caller posts it without the spool). With a
  // commit interval of 0 the caller waits, at most kWriteAheadWait, until
  // then (a short bound: the flush may queue behind threads that wait too).
  // False, and `then` never runs, when the spool folder is not usable.
  static constexpr std::chrono::seconds kWriteAheadWait{2};
  bool writeAhead(URLRequest request, std::uint32_t records, std::shared_ptr<BackendCounters> counters,
                  std::function<void(std::optional<std::string> name)> then);
  enum class LiveAnswer {
    delivered,  // a 2xx: the file goes
    refused,    // another status that is not 5xx: the collector never takes it, the file goes
    failed,     // no answer or a 5xx: the batch stays for the retry
    notPosted,  // no post slot or no body file: the batch stays for the retry
  };
  void liveAnswered(const std::string& name, LiveAnswer answer);

  // Every spool's own counts: spooled, retried, delivered, droppedSpoolFull,
  // droppedTransportError (batches a collector refused for good).
  const BackendCounters& counters() const { return counters_; }
  // Batches and records on disk (a synchronous read on the queue).
  std::size_t pendingBatches() const;
  std::uint64_t pendingRecords() const;
  std::uint64_t pendingBytes() const;
  const std::filesystem::path& folder() const { return folder_; }
  const SpoolConfig& config() const { return config_; }
  // Runs `block` on the spool's queue after everything queued so far.
  void sync(const std::function<void()>& block) const { queue_.sync(block); }

 private:
  void start();
  void scheduleRetry(std::chrono::steady_clock::duration delay);
  void retryNext();
  void retryAnswered(const std::string& name, std::uint32_t records, long status, const std::optional<Error>& error);
  std::chrono::steady_clock::duration backoffWithJitter();
  void countDrops(const std::vector<SpoolStore::Dropped>& dropped);
  // The batch is gone from the spool: its owner and its mark go too.
  void forget(const std::string& name) {
    owners_.erase(name);
    unposted_.erase(name);
  }
  void countOn(const std::string& name, BackendCount what, std::uint64_t n);
  // Takes `n` back from a gauge, on the spool's counts and the batch's backend's.
  void uncountOn(const std::string& name, BackendCount what, std::uint64_t n);
  void commitWriteAhead();
  // A retry when none is pending, after the current back-off.
  void retryLater();

  std::filesystem::path folder_;
  SpoolConfig config_;
  std::shared_ptr<ReportingSessionConnectivityInterface> transport_;
  SerialQueue queue_;
  BackendCounters counters_;

  // Queue only.
  std::optional<SpoolStore> store_;
  bool retryActive_ = false;  // a timer is pending or a retry post is under way
  bool postInFlight_ = false;
  SerialQueue::Timer timer_;
  double backoffSeconds_ = 0;  // 0: the next failure waits the initial delay
  std::uint64_t droppedRecords_ = 0;
  std::map<std::string, std::shared_ptr<BackendCounters>> owners_;  // a batch's backend's counts
  // Batches no post has carried yet (kept without one). A batch found from
  // an earlier run may have been posted before the daemon stopped: its
  // first post counts as a retry.
  std::set<std::string> unposted_;
  std::mt19937_64 random_;
  std::atomic<bool> hasBacklog_{false};
  std::atomic<bool> usable_{false};  // the folder opened

  // Write-ahead batches waiting for their group's flush (queue only).
  struct PendingWrite {
    SpoolBatch batch;
    std::shared_ptr<BackendCounters> counters;
    std::function<void(std::optional<std::string>)> then;
    std::function<void()> onDisk;  // wakes a waiting writer
  };
  std::vector<PendingWrite> pending_;
  bool commitScheduled_ = false;
  // Where a written-ahead batch's post starts: starting a post may wait for
  // the transport's queue, whose thread may itself be a writer waiting for
  // this spool's queue, so the spool's queue never starts one.
  SerialQueue postQueue_{"com.velmar.zerithd.spool.posts"};
  SerialQueue::Timer commitTimer_;
};

}  // namespace zerith
