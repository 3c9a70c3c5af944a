// The spool's write-ahead writer: a batch goes to disk before its live post
// starts and leaves it when a collector took it.

#include "backends/Spool.h"
#include "backends/SpoolHelpers.h"

#include <future>

#include <fmt/format.h>

#include "backends/BackendsLog.h"

namespace zerith {

using spool_detail::wallMillis;

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
      self->forget(name);  // already gone (dropped while its post ran): counted then
      return;
    }
    switch (answer) {
      case LiveAnswer::delivered:
        self->countOn(name, BackendCount::delivered, records);
        self->uncountOn(name, BackendCount::inSpool, records);
        store.remove(name);
        self->forget(name);
        break;
      case LiveAnswer::refused:
        self->countOn(name, BackendCount::droppedTransportError, records);
        self->uncountOn(name, BackendCount::inSpool, records);
        store.remove(name);
        self->forget(name);
        break;
      case LiveAnswer::failed:
        backendsLogger().info("Spool: kept batch {} ({} records) after its post failed; {} batches ({} bytes) waiting",
                              name, records, store.size(), store.totalBytes());
        self->retryLater();
        break;
      case LiveAnswer::notPosted:
        if (entry) {
          self->unposted_.insert(name);
        }
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

}  // namespace zerith
