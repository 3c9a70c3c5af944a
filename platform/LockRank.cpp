#include "platform/LockRank.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <vector>

namespace zerith::lockrank {

namespace {

struct Held {
  LockRank rank;
  const void* lock;
  const char* name;
};

thread_local std::vector<Held> tHeld;

[[noreturn]] void violation(const char* what, int rank, const Held& held) {
  std::fprintf(stderr, "zerith: lock order violated: %s (rank %d) while holding %s (rank %d)\n", what, rank, held.name,
               static_cast<int>(held.rank));
  std::abort();
}

}  // namespace

void willAcquire(LockRank rank, const void* lock, const char* name, bool recursive) {
  const bool reentry = recursive && std::any_of(tHeld.begin(), tHeld.end(), [&](const Held& h) { return h.lock == lock; });
  if (reentry) {
    return;
  }
  for (const Held& held : tHeld) {
    const bool nestedTurns = rank == LockRank::QueueTurn && held.rank == LockRank::QueueTurn;
    if (!nestedTurns && held.rank >= rank) {
      violation(name, static_cast<int>(rank), held);
    }
  }
}

void acquired(LockRank rank, const void* lock, const char* name) { tHeld.push_back(Held{rank, lock, name}); }

void released(const void* lock) {
  // Locks need not be let go in the order taken (unique_lock, condition waits).
  const auto it = std::find_if(tHeld.rbegin(), tHeld.rend(), [&](const Held& h) { return h.lock == lock; });
  if (it != tHeld.rend()) {
    tHeld.erase(std::next(it).base());
  }
}

void assertNoLockHeld(const char* what) {
  for (const Held& held : tHeld) {
    if (held.rank != LockRank::QueueTurn) {
      violation(what, static_cast<int>(LockRank::QueueTurn), held);
    }
  }
}

std::size_t heldCount() { return tHeld.size(); }

}  // namespace zerith::lockrank
