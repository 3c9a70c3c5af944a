#pragma once

// What became of a backend's events: how many it sent and batched, how many
// it kept in the spool and tried again, and how many it dropped, by reason.
// A session's final report and `zerith status` show these per backend.
//
// Three of them are not totals but what is there now: inBatch, inFlight and
// inSpool go up when an event enters that place and down when it leaves.
// For a backend that batches and posts, every event it accepted is in
// exactly one place, so at any quiet moment
//   accepted = delivered + inBatch + inFlight + inSpool + every dropped...
// (`unaccounted` computes the difference).
//
// Counting is a relaxed atomic add: backends count on whatever thread meets
// the event, and a reader takes a snapshot that is exact per counter.

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace zerith {

enum class BackendCount : std::size_t {
  accepted,    // events the session handed to the backend
  sent,        // events handed to the backend's delivery (posted, queued as a datagram, written)
  batched,     // events added to a batch
  spooled,     // events written to the spool after a failed post
  retried,     // events posted again from the spool
  delivered,   // events the collector took (a 2xx answer)
  inBatch,     // events waiting in the batch now
  inFlight,    // events of posts under way or waiting for a slot now that the spool does not hold
  inSpool,     // events of batches in the spool now (a post of theirs may be under way)
  droppedSampledOut,
  droppedFiltered,
  droppedBlacklisted,
  droppedDisabled,      // the backend was off (undecided, disabled by the server, or no URL)
  droppedSpoolFull,     // the spool's size or age limit, or a full disk
  droppedTransportError,  // a post failed and nothing kept its batch
  droppedQueueFull,     // the datagram queue held its most and pushed out its oldest
  droppedUnsupported,   // the backend carries no session events (upload, datagram, energy log)
  droppedNoBodyFile,    // the post's body file could not be written (full storage, no descriptors)
  droppedBusy,          // the backend's posts in flight were at their limit and the spool is off
  droppedUnencodable,   // the batch could not be serialised
  count_
};

inline constexpr std::size_t kBackendCountKinds = static_cast<std::size_t>(BackendCount::count_);

// The key of each counter in reports ("droppedSpoolFull" and so on).
std::string_view backendCountName(BackendCount what);

using BackendCountsSnapshot = std::array<std::uint64_t, kBackendCountKinds>;

// Whether a count is a gauge (what is there now) rather than a total.
constexpr bool isBackendGauge(BackendCount what) {
  return what == BackendCount::inBatch || what == BackendCount::inFlight || what == BackendCount::inSpool;
}

// accepted minus every place an event can be and every drop: 0 when nothing
// is missing; signed, since a reader may catch an event between two counts.
inline std::int64_t unaccounted(const BackendCountsSnapshot& counts) {
  const auto at = [&](BackendCount what) { return static_cast<std::int64_t>(counts[static_cast<std::size_t>(what)]); };
  std::int64_t left = at(BackendCount::accepted) - at(BackendCount::delivered) - at(BackendCount::inBatch) -
                      at(BackendCount::inFlight) - at(BackendCount::inSpool);
  for (std::size_t i = static_cast<std::size_t>(BackendCount::droppedSampledOut); i < kBackendCountKinds; ++i) {
    left -= static_cast<std::int64_t>(counts[i]);
  }
  return left;
}

class BackendCounters {
 public:
  void add(BackendCount what, std::uint64_t n = 1) {
    counts_[static_cast<std::size_t>(what)].fetch_add(n, std::memory_order_relaxed);
  }
  // Takes `n` back from a gauge (inBatch, inFlight, inSpool).
  void remove(BackendCount what, std::uint64_t n = 1) {
    counts_[static_cast<std::size_t>(what)].fetch_sub(n, std::memory_order_relaxed);
  }
  std::uint64_t get(BackendCount what) const {
    return counts_[static_cast<std::size_t>(what)].load(std::memory_order_relaxed);
  }
  BackendCountsSnapshot snapshot() const {
    BackendCountsSnapshot out{};
    for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
      out[i] = counts_[i].load(std::memory_order_relaxed);
    }
    return out;
  }

 private:
  std::array<std::atomic<std::uint64_t>, kBackendCountKinds> counts_{};
};

}  // namespace zerith
