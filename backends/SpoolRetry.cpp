// The spool's retries: one batch at a time, oldest first, with back-off and
// jitter after a failure.

#include "backends/Spool.h"

#include <algorithm>
#include <cmath>

#include <fmt/format.h>

#include "backends/BackendsLog.h"
#include "transport/ReportingSessionConnectivityHelper.h"

namespace zerith {

namespace {

// Retries that get no answer within this time fail and wait their turn.
constexpr double kRetryPostTimeoutSeconds = 60;

}  // namespace

void Spool::retryLater() {
  if (retryActive_ || !store_ || store_->size() == 0) {
    return;
  }
  scheduleRetry(backoffWithJitter());
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
    forget(entry->name);
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
  // Posted again, unless this is the first post that carries it.
  if (unposted_.erase(entry->name) == 0) {
    countOn(entry->name, BackendCount::retried, entry->records);
  }
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
    forget(name);
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
    forget(name);
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

}  // namespace zerith
