#include "backends/Spool.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>

#include <fmt/format.h>

#include "backends/BackendsLog.h"
#include "backends/ZerithBackend.h"
#include "platform/Defaults.h"
#include "platform/DefaultsKeys.h"
#include "platform/Paths.h"
#include "transport/ReportingSessionConnectivityHelper.h"

namespace zerith {

namespace fs = std::filesystem;

namespace {

// A 64-bit seed from the kernel's random source.
std::uint64_t randomSeed() {
  std::random_device device;
  return (static_cast<std::uint64_t>(device()) << 32) ^ device();
}

// A number setting within its range; anything else is logged and the default
// stays.
template <typename T>
void numberKey(const Value& values, const DefaultsSetting& setting, T& into) {
  std::string problem;
  if (const auto d = defaultsNumber(setting, values[setting.key], &problem)) {
    into = static_cast<T>(*d);
  } else if (!problem.empty()) {
    backendsLogger().error("Spool: defaults key \"{}\" {}; using {}", setting.key, problem, into);
  }
}

}  // namespace

// ---------------------------------------------------------------------------
// Configuration, record IDs, record counts

SpoolConfig SpoolConfig::fromDictionary(const Value& values) {
  SpoolConfig config;
  constexpr const DefaultsSetting& enabledSetting = defaultsSetting("spoolEnabled");
  std::string problem;
  if (const auto on = defaultsBoolean(enabledSetting, values[enabledSetting.key], &problem)) {
    config.enabled = *on;
  } else if (!problem.empty()) {
    backendsLogger().error("Spool: defaults key \"spoolEnabled\" {}; the spool stays off", problem);
  }
  numberKey(values, defaultsSetting("spoolMaxBytes"), config.maxBytes);
  numberKey(values, defaultsSetting("spoolMaxAgeSeconds"), config.maxAgeSeconds);
  numberKey(values, defaultsSetting("spoolRetryInitialSeconds"), config.retryInitialSeconds);
  numberKey(values, defaultsSetting("spoolRetryMaxSeconds"), config.retryMaxSeconds);
  numberKey(values, defaultsSetting("spoolCommitIntervalSeconds"), config.commitIntervalSeconds);
  if (config.retryMaxSeconds < config.retryInitialSeconds) {
    backendsLogger().error("Spool: \"spoolRetryMaxSeconds\" {} is below \"spoolRetryInitialSeconds\" {}; using the latter for both",
                           config.retryMaxSeconds, config.retryInitialSeconds);
    config.retryMaxSeconds = config.retryInitialSeconds;
  }
  return config;
}

SpoolConfig SpoolConfig::fromDefaults() { return fromDictionary(Defaults(std::string(kZerithDomain)).dictionary()); }

bool spoolEnabledInDefaults() {
  constexpr const DefaultsSetting& setting = defaultsSetting("spoolEnabled");
  std::string problem;
  return defaultsBoolean(setting, Defaults(std::string(kZerithDomain)).objectForKey(setting.key), &problem)
      .value_or(false);
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
                 std::function<void(bool kept)> done, Kept how) {
  std::weak_ptr<Spool> weak = weak_from_this();
  queue_.async([weak, request = std::move(request), records, backend = std::move(counters), done = std::move(done),
                how] {
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
        if (how == Kept::withoutAPost) {
          self->unposted_.insert(outcome.name);
        }
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
    forget(drop.entry.name);
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
