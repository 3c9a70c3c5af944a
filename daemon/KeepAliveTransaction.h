#pragma once

// The service manager's keep-alive transaction. While it is open the daemon
// must not be stopped abruptly: on SIGTERM the process stops accepting and
// waits until the transaction ends (or a stop time-out passes) before it
// exits.
//
// The agent begins a transaction whenever a session arrives while its
// session list is empty and ends it each time its keep-alive count reaches 0,
// so a begin can follow a begin; the transaction is then simply still open.
// Every begin and every end is counted, so that the pairing can be checked.
//
// Under systemd (NOTIFY_SOCKET set) each change is also reported as the
// unit's STATUS=.

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>

namespace zerith {

class KeepAliveTransaction {
 public:
  KeepAliveTransaction() = default;
  KeepAliveTransaction(const KeepAliveTransaction&) = delete;
  KeepAliveTransaction& operator=(const KeepAliveTransaction&) = delete;

  void begin();
  void end();

  bool isOpen() const;
  std::uint64_t beginCount() const;
  std::uint64_t endCount() const;

  // Blocks until no transaction is open or the deadline passes; true when it
  // is closed.
  bool waitUntilClosed(std::chrono::steady_clock::time_point deadline) const;

 private:
  mutable std::mutex mutex_;
  mutable std::condition_variable closed_;
  bool open_ = false;
  std::uint64_t begins_ = 0;
  std::uint64_t ends_ = 0;
};

}  // namespace zerith
