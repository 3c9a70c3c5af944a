#include "bench/pipeline/LoadGenerator.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <optional>
#include <thread>

#include "bench/pipeline/BenchEvent.h"

namespace zerith::bench {

namespace {

using Clock = std::chrono::steady_clock;

// When a client's event `i` is due, under pacing.
class Pacer {
 public:
  Pacer(const LoadOptions& o, Clock::time_point start)
      : start_(start), interval_(o.eventsPerSecond > 0 ? o.clients / o.eventsPerSecond : 0) {}
  void wait(std::uint64_t i) const {
    if (interval_ > 0) {
      std::this_thread::sleep_until(start_ + std::chrono::duration_cast<Clock::duration>(
                                                 std::chrono::duration<double>(interval_ * static_cast<double>(i))));
    }
  }

 private:
  Clock::time_point start_;
  double interval_;
};

// Runs one function per client on its own thread; the result's time spans
// from the common start to the last client's end.
template <typename PerClient>
LoadResult runClients(const LoadOptions& o, PerClient&& perClient) {
  std::atomic<std::uint64_t> accepted{0};
  std::atomic<std::uint64_t> refused{0};
  std::mutex errorMutex;
  std::string error;
  const auto start = Clock::now() + std::chrono::milliseconds(5);
  std::vector<std::thread> threads;
  for (int c = 0; c < o.clients; ++c) {
    threads.emplace_back([&, c] {
      std::this_thread::sleep_until(start);
      std::string why = perClient(c, Pacer(o, start), accepted, refused);
      if (!why.empty()) {
        std::lock_guard lock(errorMutex);
        error = why;
      }
    });
  }
  for (auto& t : threads) {
    t.join();
  }
  LoadResult r;
  r.seconds = std::chrono::duration<double>(Clock::now() - start).count();
  r.accepted = accepted;
  r.refused = refused;
  r.error = error;
  return r;
}

}  // namespace

namespace {

// Sends a client's events one-way, then flushes its session and waits for the
// flush's completion.
std::string sendOneWay(const LoadOptions& o, Zerith& session, std::uint64_t first, const Pacer& pacer,
                       std::atomic<std::uint64_t>& accepted, std::atomic<std::uint64_t>& refused) {
  std::uint64_t sent = 0;
  // The sends returned so far join the total however this client ends.
  struct Tally {
    std::uint64_t& sent;
    std::atomic<std::uint64_t>& accepted;
    ~Tally() { accepted.fetch_add(sent); }
  } tally{sent, accepted};
  for (std::uint64_t i = 0; i < o.eventsPerClient; ++i) {
    pacer.wait(i);
    if (!session.isValid()) {
      return "the connection to zerithd was invalidated";
    }
    session.sendMessageWithDictionary(
        Value(Dictionary{{kZerithMessageParametersCategory, Value(unsigned{kEventCategory})},
                         {kZerithMessageParametersType, Value(unsigned{kEventType})},
                         {kZerithMessageParametersPayload, eventPayload(first + i)}}),
        nullptr);
    ++sent;
  }
  // Shared with the completion, which may still run after a time-out.
  struct Flush {
    std::mutex mutex;
    std::condition_variable done;
    bool finished = false;
    std::optional<std::string> error;
  };
  auto flush = std::make_shared<Flush>();
  session.flushMessagesWithCompletion([flush](Value, std::optional<Error> error) {
    std::lock_guard lock(flush->mutex);
    flush->finished = true;
    if (error) {
      flush->error = error->description;
    }
    flush->done.notify_one();
  });
  std::unique_lock lock(flush->mutex);
  if (!flush->done.wait_for(lock, std::chrono::seconds(60), [&] { return flush->finished; })) {
    refused.fetch_add(1);
    return "flushMessagesWithCompletion: no completion after 60 s";
  }
  if (flush->error) {
    refused.fetch_add(1);
    return "flushMessagesWithCompletion: " + *flush->error;
  }
  if (!session.isValid()) {
    return "the connection to zerithd was invalidated";
  }
  return {};
}

}  // namespace

LoadResult runZerithdLoad(const LoadOptions& o, std::vector<std::unique_ptr<Zerith>>& sessions) {
  if (static_cast<int>(sessions.size()) < o.clients) {
    return {.error = "fewer sessions than clients"};
  }
  if (!o.replies) {
    return runClients(o, [&](int c, const Pacer& pacer, std::atomic<std::uint64_t>& accepted,
                             std::atomic<std::uint64_t>& refused) -> std::string {
      return sendOneWay(o, *sessions[static_cast<std::size_t>(c)], static_cast<std::uint64_t>(c) * o.eventsPerClient,
                        pacer, accepted, refused);
    });
  }
  return runClients(o, [&](int c, const Pacer& pacer, std::atomic<std::uint64_t>& accepted,
                           std::atomic<std::uint64_t>& refused) -> std::string {
    Zerith& session = *sessions[static_cast<std::size_t>(c)];
    // Shared with the completions, which may still run after this client
    // gave up (a connection that goes away fails its calls later).
    struct Window {
      std::mutex mutex;
      std::condition_variable answered;
      std::uint64_t outstanding = 0;
      std::uint64_t replies = 0;
    };
    auto window = std::make_shared<Window>();
    // The replies counted so far join the total however this client ends.
    struct Tally {
      std::shared_ptr<Window> window;
      std::atomic<std::uint64_t>& accepted;
      ~Tally() {
        std::lock_guard lock(window->mutex);
        accepted.fetch_add(window->replies);
      }
    } tally{window, accepted};
    const std::uint64_t first = static_cast<std::uint64_t>(c) * o.eventsPerClient;
    for (std::uint64_t i = 0; i < o.eventsPerClient; ++i) {
      pacer.wait(i);
      const Value message(Dictionary{{kZerithMessageParametersCategory, Value(unsigned{kEventCategory})},
                                     {kZerithMessageParametersType, Value(unsigned{kEventType})},
                                     {kZerithMessageParametersPayload, eventPayload(first + i)}});
      {
        std::unique_lock lock(window->mutex);
        if (!window->answered.wait_for(lock, std::chrono::seconds(60), [&] {
              return window->outstanding < static_cast<std::uint64_t>(o.window);
            })) {
          return "no reply from zerithd for 60 s";
        }
        ++window->outstanding;
      }
      if (!session.isValid()) {
        return "the connection to zerithd was invalidated";
      }
      session.sendMessageWithDictionary(message, [window](Value) {
        // A nil result is the answer of a backend that batched the event:
        // the daemon took it either way. A failed call also arrives here as
        // nil; the collector's count tells.
        std::lock_guard lock(window->mutex);
        ++window->replies;
        --window->outstanding;
        window->answered.notify_one();
      });
    }
    std::unique_lock lock(window->mutex);
    if (!window->answered.wait_for(lock, std::chrono::seconds(60), [&] { return window->outstanding == 0; })) {
      return "replies missing from zerithd after 60 s";
    }
    lock.unlock();
    if (!session.isValid()) {
      return "the connection to zerithd was invalidated";
    }
    // The last partial batch goes out with the client's flush.
    if (auto flushed = session.flushMessages(std::chrono::seconds(60)); !flushed) {
      refused.fetch_add(1);
      return "flushMessages: " + flushed.error->description;
    }
    return {};
  });
}

std::vector<int> openPeerConnections(const std::filesystem::path& socketPath, int count) {
  std::vector<int> fds;
  for (int i = 0; i < count; ++i) {
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, socketPath.c_str(), sizeof(addr.sun_path) - 1);
    if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
      if (fd >= 0) {
        ::close(fd);
      }
      break;
    }
    fds.push_back(fd);
  }
  return fds;
}

LoadResult runPeerLoad(const LoadOptions& o, const std::filesystem::path& socketPath) {
  return runClients(o, [&](int c, const Pacer& pacer, std::atomic<std::uint64_t>& accepted,
                           std::atomic<std::uint64_t>& refused) -> std::string {
    const auto fds = openPeerConnections(socketPath, 1);
    if (fds.empty()) {
      return "cannot connect to the peer's socket";
    }
    const int fd = fds.front();
    const std::uint64_t first = static_cast<std::uint64_t>(c) * o.eventsPerClient;
    std::string why;
    for (std::uint64_t i = 0; i < o.eventsPerClient && why.empty(); ++i) {
      pacer.wait(i);
      const std::string line = eventJsonLine(first + i);
      std::size_t done = 0;
      while (done < line.size()) {
        const ssize_t n = ::send(fd, line.data() + done, line.size() - done, MSG_NOSIGNAL);
        if (n <= 0) {
          refused.fetch_add(1);
          why = "the peer closed its socket";
          break;
        }
        done += static_cast<std::size_t>(n);
      }
      if (done == line.size()) {
        accepted.fetch_add(1, std::memory_order_relaxed);
      }
    }
    ::close(fd);
    return why;
  });
}

}  // namespace zerith::bench
