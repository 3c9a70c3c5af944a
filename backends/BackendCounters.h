#pragma once

// What became of a backend's events: how many it sent and batched, how many
// it kept in the spool and tried again, and how many it dropped, by reason.
// A session's final report and `zerith status` show these per backend.
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
  sent,        // events handed to the backend's delivery (posted, queued as a datagram, written)
  batched,     // events added to a batch
  spooled,     // events written to the spool after a failed post
  retried,     // events posted again from the spool
  delivered,   // events the collector took (a 2xx answer)
  droppedSampledOut,
  droppedFiltered,
  droppedBlacklisted,
  droppedDisabled,      // the backend was off (undecided, disabled by the server, or no URL)
  droppedSpoolFull,     // the spool's size or age limit, or a full disk
  droppedTransportError,  // a post failed and nothing kept its batch
  droppedQueueFull,     // the datagram queue held its most and pushed out its oldest
  droppedUnsupported,   // the backend carries no session events (upload, datagram, energy log)
  count_
};

inline constexpr std::size_t kBackendCountKinds = static_cast<std::size_t>(BackendCount::count_);

// The key of each counter in reports ("droppedSpoolFull" and so on).
std::string_view backendCountName(BackendCount what);

using BackendCountsSnapshot = std::array<std::uint64_t, kBackendCountKinds>;

class BackendCounters {
 public:
  void add(BackendCount what, std::uint64_t n = 1) {
    counts_[static_cast<std::size_t>(what)].fetch_add(n, std::memory_order_relaxed);
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
