#pragma once

// Lock ranks: every lock of the daemon that threads of different kinds share
// has a rank, and a thread takes locks only in rising rank. A serial queue's
// sync turn counts as the lowest rank: no ranked lock may be held while
// waiting for a queue's turn (turns nest with each other; the pools grow for
// those waits). Debug builds (NDEBUG not defined) keep each thread's held
// locks and abort with both names on the first acquire against the order;
// release builds keep nothing and a RankedMutex is its bare mutex.
//
//   RankedMutex<std::recursive_mutex> lock{LockRank::Agent, "agent lock"};
//   std::lock_guard guard(lock);

#include <cstddef>
#include <mutex>
#include <type_traits>
#include <utility>

namespace zerith {

enum class LockRank : int {
  QueueTurn = 10,     // a serial queue's sync turn
  Agent = 20,         // the agent's tables (recursive)
  StorebagCache = 30, // the agent's storebag entries and fetches under way
  SessionClass = 40,  // a flush join, the one-shot helper
  StorebagDisk = 50,  // the storebag disk cache and metrics (recursive)
  KeepAlive = 60,     // the keep-alive count
};

#ifdef NDEBUG
inline constexpr bool kLockRanksChecked = false;
#else
inline constexpr bool kLockRanksChecked = true;
#endif

namespace lockrank {

// Aborts when the calling thread holds a lock that may not be held while
// taking `lock` at `rank`; re-entry of a held recursive lock is allowed.
void willAcquire(LockRank rank, const void* lock, const char* name, bool recursive);
void acquired(LockRank rank, const void* lock, const char* name);
void released(const void* lock);
// Aborts when the calling thread holds any ranked lock: it is about to wait
// for work that other threads do (`what` names the wait).
void assertNoLockHeld(const char* what);
// How many ranked locks the calling thread holds (re-entries counted).
std::size_t heldCount();

}  // namespace lockrank

template <typename Mutex, bool Checked = kLockRanksChecked>
class RankedMutex {
 public:
  RankedMutex(LockRank rank, const char* name) : rank_(rank), name_(name) {}
  RankedMutex(const RankedMutex&) = delete;
  RankedMutex& operator=(const RankedMutex&) = delete;

  void lock() {
    if constexpr (Checked) {
      lockrank::willAcquire(rank_, this, name_, kRecursive);
    }
    mutex_.lock();
    if constexpr (Checked) {
      lockrank::acquired(rank_, this, name_);
    }
  }
  bool try_lock() {
    // Never waits, so never closes a circle: only the bookkeeping.
    if (!mutex_.try_lock()) {
      return false;
    }
    if constexpr (Checked) {
      lockrank::acquired(rank_, this, name_);
    }
    return true;
  }
  void unlock() {
    if constexpr (Checked) {
      lockrank::released(this);
    }
    mutex_.unlock();
  }

  LockRank rank() const { return rank_; }
  const char* name() const { return name_; }

 private:
  static constexpr bool kRecursive = std::is_same_v<Mutex, std::recursive_mutex>;
  Mutex mutex_;
  const LockRank rank_;
  const char* const name_;
};

}  // namespace zerith
