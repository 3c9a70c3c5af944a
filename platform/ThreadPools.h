#pragma once

// What the daemon's waits and its watchdog need of the thread pools.

#include <vector>

#include <asio/io_context.hpp>

namespace zerith {

// Around a wait of the calling thread for work that other threads do (an
// HTTP answer, another thread's storebag fetch): when the thread is one of a
// pool's and every thread of that pool would be waiting, the pool gains a
// thread, so that the pool's queued blocks still run. Elsewhere it does
// nothing.
class PoolWait {
 public:
  PoolWait();
  ~PoolWait();
  PoolWait(const PoolWait&) = delete;
  PoolWait& operator=(const PoolWait&) = delete;

 private:
  void* pool_;
};

// Every socket thread's context (the watchdog's heartbeat visits each).
std::vector<asio::io_context*> socketContexts();

}  // namespace zerith
