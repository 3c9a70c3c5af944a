#include "platform/SerialQueue.h"

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

#include <asio/executor_work_guard.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

#include "platform/Executors.h"
#include "platform/LockRank.h"
#include "platform/ThreadPools.h"

namespace zerith {

namespace {

struct ThreadPool;
thread_local ThreadPool* tPool = nullptr;

// A pool whose threads may wait for a queue's turn, and the turn may need a
// thread of the same pool (a sync onto a queue whose queued blocks wait for
// a drainer). When every thread of the pool would be waiting so, one more
// thread joins: a pool never starves itself. Threads are not taken away
// again; their number stays at the most that ever waited at once, plus one.
struct ThreadPool {
  asio::io_context context;
  asio::executor_work_guard<asio::io_context::executor_type> work{context.get_executor()};
  std::atomic<unsigned> threads{0};
  std::atomic<unsigned> waiting{0};

  explicit ThreadPool(unsigned count) {
    for (unsigned i = 0; i < count; ++i) {
      addThread();
    }
  }

  void addThread() {
    threads.fetch_add(1);
    std::thread([this] {
      tPool = this;
      context.run();
    }).detach();
  }

  // Around a wait of the calling thread for a turn of a queue of this pool.
  bool willWait() {
    if (tPool != this) {
      return false;
    }
    if (waiting.fetch_add(1) + 1 >= threads.load()) {
      addThread();
    }
    return true;
  }
  void doneWaiting() { waiting.fetch_sub(1); }
};

ThreadPool& threadPool(Pool pool) {
  // Leaked on purpose: detached pool threads may run until the process ends.
  static ThreadPool* general = new ThreadPool(std::max(8u, 2 * std::thread::hardware_concurrency()));
  static ThreadPool* transport = new ThreadPool(2);
  return pool == Pool::Transport ? *transport : *general;
}

thread_local std::vector<const SerialQueue::State*> tCurrentQueues;

struct CurrentScope {
  explicit CurrentScope(const SerialQueue::State* s) { tCurrentQueues.push_back(s); }
  ~CurrentScope() { tCurrentQueues.pop_back(); }
};

}  // namespace

asio::io_context& ioContext(Pool pool) { return threadPool(pool).context; }

PoolWait::PoolWait() : pool_(tPool != nullptr && tPool->willWait() ? tPool : nullptr) {}

PoolWait::~PoolWait() {
  if (pool_ != nullptr) {
    static_cast<ThreadPool*>(pool_)->doneWaiting();
  }
}

namespace {

thread_local bool tSocketThread = false;

struct SocketThreads {
  std::vector<std::unique_ptr<asio::io_context>> contexts;
  std::atomic<unsigned> next{0};

  SocketThreads() {
    const unsigned count = std::clamp(std::thread::hardware_concurrency(), 2u, 4u);
    for (unsigned i = 0; i < count; ++i) {
      // A hint of one: the scheduler never wakes another thread for the
      // reactor, and no other thread ever runs this context.
      contexts.push_back(std::make_unique<asio::io_context>(1));
      asio::io_context* context = contexts.back().get();
      std::thread([context] {
        tSocketThread = true;
        auto work = asio::make_work_guard(*context);
        context->run();
      }).detach();
    }
  }
};

}  // namespace

namespace {

SocketThreads& socketThreads() {
  // Leaked on purpose, as the pools are.
  static SocketThreads* threads = new SocketThreads();
  return *threads;
}

}  // namespace

asio::io_context& socketContext() {
  SocketThreads& threads = socketThreads();
  return *threads.contexts[threads.next.fetch_add(1) % threads.contexts.size()];
}

std::vector<asio::io_context*> socketContexts() {
  std::vector<asio::io_context*> contexts;
  for (const auto& context : socketThreads().contexts) {
    contexts.push_back(context.get());
  }
  return contexts;
}

bool onSocketThread() { return tSocketThread; }

struct SerialQueue::State : std::enable_shared_from_this<SerialQueue::State> {
  struct Ticket {
    bool granted = false;
  };
  struct Item {
    std::function<void()> block;
    Ticket* ticket = nullptr;  // a waiting sync caller
  };

  std::string label;
  asio::io_context* context = nullptr;
  ThreadPool* pool = nullptr;
  std::mutex mutex;
  std::condition_variable granted;
  std::deque<Item> items;
  bool active = false;  // a drainer or a sync caller owns the queue

  void schedule() {
    asio::post(*context, [self = shared_from_this()] { self->drain(); });
  }

  void drain() {
    for (int n = 0;; ++n) {
      Item item;
      {
        std::unique_lock lock(mutex);
        if (items.empty()) {
          active = false;
          return;
        }
        item = std::move(items.front());
        items.pop_front();
        if (item.ticket) {
          // Ownership passes to the sync caller, which runs on its own thread.
          item.ticket->granted = true;
          granted.notify_all();
          return;
        }
      }
      {
        CurrentScope scope(this);
        item.block();
      }
      if (n >= 32) {
        schedule();  // give other queues a turn; still active
        return;
      }
    }
  }

  void release() {
    std::unique_lock lock(mutex);
    if (items.empty()) {
      active = false;
    } else {
      schedule();
    }
  }
};

struct SerialQueue::Timer::Impl {
  explicit Impl(asio::io_context& c) : timer(c) {}
  asio::steady_timer timer;
};

SerialQueue::SerialQueue(std::string label, Pool pool) : state_(std::make_shared<State>()) {
  state_->label = std::move(label);
  state_->pool = &threadPool(pool);
  state_->context = &state_->pool->context;
}

const std::string& SerialQueue::label() const { return state_->label; }

void SerialQueue::async(std::function<void()> block) const {
  std::unique_lock lock(state_->mutex);
  state_->items.push_back({std::move(block), nullptr});
  if (!state_->active) {
    state_->active = true;
    state_->schedule();
  }
}

SerialQueue::Turn::Turn(const SerialQueue& queue) : state_(queue.state_.get()) {
  if (queue.isCurrent()) {
    std::fprintf(stderr, "zerith: sync onto queue '%s' from its own block would deadlock\n", state_->label.c_str());
    std::abort();
  }
  if constexpr (kLockRanksChecked) {
    // A turn may have to wait for the queue's blocks, which may take any lock.
    lockrank::willAcquire(LockRank::QueueTurn, state_, state_->label.c_str(), false);
    // The transport's completions and bookkeeping hand work on; they never
    // wait for a queue: the blocks they would wait for may wait for an HTTP
    // answer that only this pool delivers.
    if (tPool == &threadPool(Pool::Transport)) {
      std::fprintf(stderr, "zerith: a transport pool thread waits for a turn of queue '%s'\n", state_->label.c_str());
      std::abort();
    }
  }
  std::unique_lock lock(state_->mutex);
  if (!state_->active && state_->items.empty()) {
    state_->active = true;
  } else {
    State::Ticket ticket;
    state_->items.push_back({nullptr, &ticket});
    if (!state_->active) {
      state_->active = true;
      state_->schedule();
    }
    // The drainer that grants the turn needs a thread of the pool.
    const bool counted = state_->pool->willWait();
    state_->granted.wait(lock, [&] { return ticket.granted; });
    if (counted) {
      state_->pool->doneWaiting();
    }
  }
  tCurrentQueues.push_back(state_);
}

SerialQueue::Turn::Turn(const SerialQueue& queue, std::try_to_lock_t) : state_(nullptr) {
  if (queue.isCurrent()) {
    return;
  }
  State* state = queue.state_.get();
  std::unique_lock lock(state->mutex);
  if (state->active || !state->items.empty()) {
    return;
  }
  state->active = true;
  state_ = state;
  tCurrentQueues.push_back(state_);
}

SerialQueue::Turn::~Turn() {
  if (!state_) {
    return;
  }
  tCurrentQueues.pop_back();
  state_->release();
}

void SerialQueue::Timer::cancel() {
  if (impl_) {
    asio::post(impl_->timer.get_executor(), [impl = impl_] { impl->timer.cancel(); });
  }
}

SerialQueue::Timer SerialQueue::after(std::chrono::steady_clock::duration delay, std::function<void()> block) const {
  auto impl = std::make_shared<Timer::Impl>(*state_->context);
  impl->timer.expires_after(delay);
  impl->timer.async_wait([impl, queue = *this, block = std::move(block)](const std::error_code& ec) mutable {
    if (!ec) {
      queue.async(std::move(block));
    }
  });
  return Timer(impl);
}

bool SerialQueue::isCurrent() const {
  return std::find(tCurrentQueues.begin(), tCurrentQueues.end(), state_.get()) != tCurrentQueues.end();
}

void SerialQueue::assertCurrent() const {
  if (!isCurrent()) {
    std::fprintf(stderr, "zerith: expected to run on queue '%s'\n", state_->label.c_str());
    std::abort();
  }
}

}  // namespace zerith
