#include "daemon/KeepAliveTransaction.h"

#include <systemd/sd-daemon.h>

namespace zerith {

void KeepAliveTransaction::begin() {
  {
    std::lock_guard lock(mutex_);
    open_ = true;
    ++begins_;
  }
  // A no-op outside systemd.
  sd_notify(0, "STATUS=Serving sessions (keep-alive transaction open)");
}

void KeepAliveTransaction::end() {
  {
    std::lock_guard lock(mutex_);
    open_ = false;
    ++ends_;
  }
  closed_.notify_all();
  sd_notify(0, "STATUS=Idle (no keep-alive transaction)");
}

bool KeepAliveTransaction::isOpen() const {
  std::lock_guard lock(mutex_);
  return open_;
}

std::uint64_t KeepAliveTransaction::beginCount() const {
  std::lock_guard lock(mutex_);
  return begins_;
}

std::uint64_t KeepAliveTransaction::endCount() const {
  std::lock_guard lock(mutex_);
  return ends_;
}

bool KeepAliveTransaction::waitUntilClosed(std::chrono::steady_clock::time_point deadline) const {
  std::unique_lock lock(mutex_);
  return closed_.wait_until(lock, deadline, [this] { return !open_; });
}

}  // namespace zerith
