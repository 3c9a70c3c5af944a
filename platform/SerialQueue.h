#pragma once

// Serial queues on a shared thread pool.
//
// A queue runs one block at a time, in submission order. `async` queues a
// block; `sync` runs the block on the *calling* thread once every block
// submitted before it has run and the queue is free (no hand-off to another
// thread: a hop costs tens of microseconds where a free lock costs
// nanoseconds); `after` queues a block once a delay has passed.
//
// A SerialQueue object is a handle: copies refer to the same queue. Pending
// blocks keep the queue alive after its last handle is gone.

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <type_traits>
#include <utility>

namespace zerith {

enum class Pool {
  General,    // sessions, connections, backends
  Transport,  // HTTP bookkeeping; never blocks on other work
};

class SerialQueue {
 public:
  explicit SerialQueue(std::string label, Pool pool = Pool::General);

  const std::string& label() const;

  void async(std::function<void()> block) const;

  template <typename F>
  auto sync(F&& block) const -> std::invoke_result_t<F> {
    Turn turn(*this);
    return std::forward<F>(block)();
  }

  // Runs `block` on the calling thread, as sync does, when the queue is free
  // at this moment, and returns true; returns false without running it when
  // a block of the queue is running or waiting (or the caller is inside
  // one). Never waits, so threads of the pool that the queue's own blocks
  // need can use it without starving them.
  template <typename F>
  bool runIfFree(F&& block) const {
    Turn turn(*this, std::try_to_lock);
    if (!turn.owns()) {
      return false;
    }
    std::forward<F>(block)();
    return true;
  }

  class Timer {
   public:
    void cancel();
    struct Impl;
    explicit Timer(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}
    Timer() = default;

   private:
    std::shared_ptr<Impl> impl_;
  };
  // Queues `block` after `delay`; the returned handle can cancel it.
  Timer after(std::chrono::steady_clock::duration delay, std::function<void()> block) const;

  // True while the calling thread runs a block of this queue (also inside a
  // nested sync onto another queue).
  bool isCurrent() const;
  // Aborts with a message when the caller is not on this queue.
  void assertCurrent() const;

  struct State;

 private:
  // Holds the queue for the duration of a sync block.
  class Turn {
   public:
    explicit Turn(const SerialQueue& queue);
    // Takes the queue only if it is free now; owns() tells.
    Turn(const SerialQueue& queue, std::try_to_lock_t);
    ~Turn();
    bool owns() const { return state_ != nullptr; }
    Turn(const Turn&) = delete;
    Turn& operator=(const Turn&) = delete;

   private:
    State* state_;
  };

  std::shared_ptr<State> state_;
};

}  // namespace zerith
