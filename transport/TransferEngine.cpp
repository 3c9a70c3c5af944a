#include "transport/TransferEngine.h"

#include <malloc.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <limits>
#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/Log.h"
#include "platform/SerialQueue.h"
#include "transport/DeviceConditions.h"
#include "transport/ExtraTrust.h"
#include "transport/ResponseHead.h"
#include "transport/URLSession.h"

namespace zerith {

namespace {

using Clock = std::chrono::steady_clock;

const log::Logger& logger() {
  static const auto* l = new log::Logger("transport");  // used by the transport thread until exit
  return *l;
}

// TC_PRIO_BULK: the band below best effort in the kernel's default queueing.
constexpr int kBackgroundSocketPriority = 2;
// Received bytes are handed to the delegate queue once per turn of the
// transport loop, or earlier when this many are waiting.
constexpr std::size_t kFlushThreshold = 1 << 20;
// Open connections kept for reuse: enough for the posts of every session
// that sends at once.
constexpr long kCachedConnections = 32;
// Least time between two returns of free memory to the system.
constexpr auto kTrimInterval = std::chrono::seconds(1);
// Parallel connections to one server (host and port).
constexpr long kConnectionsPerServer = 6;
constexpr const char* kSourceApplicationHeader = "X-ZTH-Source-Application";

struct MultiFree {
  void operator()(CURLM* m) const { curl_multi_cleanup(m); }
};

Error curlError(CURLcode code, const char* message) {
  return Error{kURLErrorDomain, static_cast<std::int64_t>(code),
               message && *message ? std::string(message) : std::string(curl_easy_strerror(code))};
}

// A header line as libcurl takes it; line breaks and NULs in names or values
// would start a header of their own, so they become spaces.
std::string headerLine(const std::string& name, const std::string& value) {
  std::string line = value.empty() ? name + ";" : name + ": " + value;
  for (char& c : line) {
    if (c == '\r' || c == '\n' || c == '\0') {
      c = ' ';
    }
  }
  return line;
}

bool isToken(const std::string& s) {
  return !s.empty() && std::all_of(s.begin(), s.end(), [](unsigned char c) {
    return std::isalnum(c) || std::string_view("!#$%&'*+-.^_`|~").find(static_cast<char>(c)) != std::string_view::npos;
  });
}

// A connection that failed because the device has no route to the server
// (as opposed to a server that refused, or a name that does not exist while
// the device is online).
bool failedForLackOfRoute(CURLcode code, long osErrno) {
  if (code == CURLE_COULDNT_CONNECT) {
    return osErrno == ENETUNREACH || osErrno == EHOSTUNREACH || osErrno == ENETDOWN;
  }
  if (code == CURLE_COULDNT_RESOLVE_HOST) {
    return !hasDefaultRoute();
  }
  return false;
}

// Delegate callbacks made in the current turn of the transport loop for one
// session's delegate queue, in the order they were made. Transport thread
// only.
struct Gathered {
  const URLSession* session;
  SerialQueue queue;
  std::vector<std::function<void()>> blocks;
};
thread_local std::vector<Gathered> tGathered;

}  // namespace

struct TransferEngine::Impl {
  std::unique_ptr<CURLM, MultiFree> multi;
  std::thread thread;
  std::mutex mutex;
  std::deque<std::function<void()>> commands;
  bool stopping = false;

  // Transport thread only.
  std::unordered_map<CURL*, std::shared_ptr<URLSessionTask>> active;
  // Tasks completed in this turn of the loop, told to their sessions after
  // the turn's callbacks have been handed over.
  std::vector<std::shared_ptr<URLSessionTask>> finishedTasks;
  std::multimap<Clock::time_point, std::function<void()>> timers;
  // Transfers finished since the allocator last gave its free pages back.
  std::size_t finishedSinceTrim = 0;
  Clock::time_point lastTrim{};

  Impl() {
    curl_global_init(CURL_GLOBAL_DEFAULT);
    const curl_version_info_data* info = curl_version_info(CURLVERSION_NOW);
    if (info->version_num < 0x075700 || !(info->features & CURL_VERSION_SSL)) {
      logger().error("URLSession: libcurl {} lacks what the transport needs (7.87 or later with TLS)", info->version);
    }
    multi.reset(curl_multi_init());
    // Finished transfers leave their connection open in the multi handle's
    // cache for the next request to the same server. libcurl's default size
    // of that cache is four times the transfers under way at the moment a
    // connection is returned, so after a burst of parallel posts it closed
    // the connections it had just opened and the next burst paid a TLS
    // handshake for every few posts. A fixed size keeps them.
    curl_multi_setopt(multi.get(), CURLMOPT_MAXCONNECTS, kCachedConnections);
    // Without a bound every post that finds no idle connection opens one:
    // under load the transfer thread fell behind with TLS handshakes, posts
    // piled up, each pile-up opened more connections (hundreds, each with
    // its own TLS context), and handshakes took most of the daemon's CPU.
    // Bounded, a post waits in libcurl's queue for a connection of the same
    // server to come free and goes out on it without a new handshake.
    curl_multi_setopt(multi.get(), CURLMOPT_MAX_HOST_CONNECTIONS, kConnectionsPerServer);
    thread = std::thread([this] { run(); });
    // Stops the thread before OpenSSL's own exit handler runs (registered
    // earlier, so it runs later).
    std::atexit([] { TransferEngine::instance().impl_->shutdown(); });
  }

  void post(std::function<void()> command) {
    {
      std::lock_guard lock(mutex);
      if (stopping) {
        return;
      }
      commands.push_back(std::move(command));
    }
    curl_multi_wakeup(multi.get());
  }

  void shutdown() {
    {
      std::lock_guard lock(mutex);
      stopping = true;
    }
    curl_multi_wakeup(multi.get());
    if (thread.joinable() && thread.get_id() != std::this_thread::get_id()) {
      thread.join();
    }
  }

  void run() {
    for (;;) {
      std::deque<std::function<void()>> batch;
      {
        std::lock_guard lock(mutex);
        if (stopping) {
          return;
        }
        batch.swap(commands);
      }
      for (auto& command : batch) {
        command();
      }
      runDueTimers();
      int running = 0;
      curl_multi_perform(multi.get(), &running);
      int left = 0;
      while (CURLMsg* message = curl_multi_info_read(multi.get(), &left)) {
        if (message->msg == CURLMSG_DONE) {
          CURL* easy = message->easy_handle;
          const CURLcode result = message->data.result;
          finished(easy, result);
          ++finishedSinceTrim;
        }
      }
      const auto trimDue = trimIfDue();
      for (auto& [easy, task] : active) {
        flush(*task, *task->transfer_);
      }
      handOver();
      // Idle (no transfer, no timer) the thread sleeps until a command wakes
      // it: an idle daemon has no wake-ups. With transfers under way
      // libcurl shortens the wait to its own time-outs.
      int waitMs = active.empty() ? std::numeric_limits<int>::max() : 1000;
      if (!timers.empty()) {
        const auto until = std::chrono::ceil<std::chrono::milliseconds>(timers.begin()->first - Clock::now()).count();
        waitMs = static_cast<int>(std::clamp<long long>(until, 0, waitMs));
      }
      if (trimDue) {
        const auto until = std::chrono::ceil<std::chrono::milliseconds>(*trimDue - Clock::now()).count();
        waitMs = static_cast<int>(std::clamp<long long>(until, 0, waitMs));
      }
      curl_multi_poll(multi.get(), nullptr, 0, waitMs, nullptr);
    }
  }

  // Every request body, envelope and record of a batch is allocated on the
  // threads that build and post it and freed after its transfer: the free
  // memory stays with the allocator's per-thread arenas, scattered between
  // live blocks, and the daemon's private memory crept up with the number of
  // events sent. After transfers have finished, at most once a second, the
  // free pages go back to the system (malloc_trim walks every arena; about
  // a millisecond here, on this thread, never on a sender's). Returns when
  // the next trim is due while one is owed, so that the thread wakes once
  // for it after the last transfer and then sleeps.
  std::optional<Clock::time_point> trimIfDue() {
    if (finishedSinceTrim == 0) {
      return std::nullopt;
    }
    const auto now = Clock::now();
    const auto due = lastTrim + kTrimInterval;
    if (now < due) {
      return due;
    }
    ::malloc_trim(0);
    lastTrim = now;
    finishedSinceTrim = 0;
    return std::nullopt;
  }

  void runDueTimers() {
    const auto now = Clock::now();
    while (!timers.empty() && timers.begin()->first <= now) {
      auto block = std::move(timers.begin()->second);
      timers.erase(timers.begin());
      block();
    }
  }

  void after(Clock::time_point when, std::function<void()> block) { timers.emplace(when, std::move(block)); }

  // Posts a delegate callback for the task to its session's delegate queue.
  // The callbacks are gathered per session over one turn of the loop and
  // handed over at its end (handOver): a post's progress, response, data and
  // completion, and those of the session's other transfers of the turn, reach
  // its delegate queue as one block, one hand-off (and at most one wake-up of
  // the queue's pool) instead of one per callback. Each queue still gets its
  // callbacks in the order they were made.
  template <typename F>
  static void deliver(URLSessionTask& task, Transfer& t, F&& callback) {
    if (!t.delegate) {
      return;
    }
    std::function<void()> block = [self = task.shared_from_this(), delegate = t.delegate,
                                   callback = std::forward<F>(callback)]() {
      callback(*delegate, self->session(), *self);
    };
    const URLSession* session = &task.session();
    for (Gathered& gathered : tGathered) {
      if (gathered.session == session) {
        gathered.blocks.push_back(std::move(block));
        return;
      }
    }
    tGathered.push_back(Gathered{session, session->delegateQueue(), {}});
    tGathered.back().blocks.push_back(std::move(block));
  }

  // At the end of a turn: every session's gathered callbacks go to its
  // delegate queue as one block; then the sessions hear of their finished tasks, so that an
  // invalidation this lets go is queued after the last task's completion.
  void handOver() {
    std::vector<Gathered> gathered;
    gathered.swap(tGathered);
    for (Gathered& g : gathered) {
      if (g.blocks.size() == 1) {
        g.queue.async(std::move(g.blocks.front()));
        continue;
      }
      g.queue.async([blocks = std::move(g.blocks)] {
        for (const auto& block : blocks) {
          block();
        }
      });
    }
    std::vector<std::shared_ptr<URLSessionTask>> done;
    done.swap(finishedTasks);
    for (const auto& task : done) {
      task->session().taskFinished();
    }
  }

  static void prepare(URLSessionTask& task, Transfer& t) {
    if (t.prepared) {
      return;
    }
    t.prepared = true;
    t.delegate = task.session().delegateForTask();
    if (task.originalRequest().timeoutSeconds > 0) {
      t.deadline = Clock::now() + std::chrono::duration_cast<Clock::duration>(
                                      std::chrono::duration<double>(task.originalRequest().timeoutSeconds));
    }
  }

  // Starts (or starts again) a resumed task, unless it has to wait.
  void begin(const std::shared_ptr<URLSessionTask>& task) {
    Transfer& t = *task->transfer_;
    if (t.finished) {
      return;
    }
    prepare(*task, t);
    const auto now = Clock::now();
    const URLSessionConfiguration& config = task->session().configuration();
    if (t.deadline && now >= *t.deadline) {
      complete(task, Error{kURLErrorDomain, CURLE_OPERATION_TIMEDOUT,
                           t.waitingForPower ? "Timeout was reached while waiting for external power"
                                             : "Timeout was reached while waiting for connectivity"});
      return;
    }
    if ((config.discretionary || config.requiresPowerPluggedIn) && onBatteryPower()) {
      if (!t.deferredSince) {
        t.deferredSince = now;
      }
      const bool mayGo = !config.requiresPowerPluggedIn && now - *t.deferredSince >= config.discretionaryMaxDelay;
      if (!mayGo) {
        auto when = now + config.powerCheckInterval;
        if (!config.requiresPowerPluggedIn) {
          when = std::min(when, *t.deferredSince + config.discretionaryMaxDelay);
        }
        if (t.deadline) {
          when = std::min(when, *t.deadline);
        }
        t.waitingForPower = true;
        logger().debug("URLSession: task <{}> waits while the device runs on battery", task->taskDescription());
        after(when, [this, task] { begin(task); });
        return;
      }
    }
    t.waitingForPower = false;
    if (!t.easy && !setUp(task, t)) {
      return;
    }
    t.responseHeaders.clear();
    t.received = 0;
    t.readOffset = 0;
    t.lastSent = 0;
    t.errorBuffer[0] = '\0';
    if (t.deadline) {
      const auto remaining = std::chrono::ceil<std::chrono::milliseconds>(*t.deadline - now).count();
      curl_easy_setopt(t.easy.get(), CURLOPT_TIMEOUT_MS, static_cast<long>(std::max<long long>(1, remaining)));
    }
    if (const CURLMcode rc = curl_multi_add_handle(multi.get(), t.easy.get()); rc != CURLM_OK) {
      complete(task, Error{kURLErrorDomain, CURLE_FAILED_INIT, curl_multi_strerror(rc)});
      return;
    }
    t.inMulti = true;
    active[t.easy.get()] = task;
  }

  // The libcurl handle for a task; completes the task with an error when the
  // request cannot be expressed.
  bool setUp(const std::shared_ptr<URLSessionTask>& task, Transfer& t) {
    const URLRequest& request = task->originalRequest();
    const URLSessionConfiguration& config = task->session().configuration();
    if (!isToken(request.httpMethod)) {
      complete(task, Error{kURLErrorDomain, CURLE_BAD_FUNCTION_ARGUMENT, "Invalid HTTP method \"" + request.httpMethod + "\""});
      return false;
    }
    t.easy.reset(curl_easy_init());
    CURL* e = t.easy.get();
    if (!e) {
      complete(task, curlError(CURLE_FAILED_INIT, nullptr));
      return false;
    }
    curl_easy_setopt(e, CURLOPT_ERRORBUFFER, t.errorBuffer.data());
    curl_easy_setopt(e, CURLOPT_URL, request.url.c_str());
    curl_easy_setopt(e, CURLOPT_NOSIGNAL, 1L);
    // Never file://, never anything but the web, also after a redirect.
    curl_easy_setopt(e, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(e, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(e, CURLOPT_FOLLOWLOCATION, 1L);
    curl_easy_setopt(e, CURLOPT_MAXREDIRS, 10L);
    curl_easy_setopt(e, CURLOPT_HEADERFUNCTION, &Impl::onHeader);
    curl_easy_setopt(e, CURLOPT_HEADERDATA, &t);
    curl_easy_setopt(e, CURLOPT_WRITEFUNCTION, &Impl::onData);
    curl_easy_setopt(e, CURLOPT_WRITEDATA, &t);

    const std::string& method = request.httpMethod;
    const bool hasBody = t.bodyFile || !(method == "GET" || method == "HEAD");
    if (method == "GET" && !t.bodyFile) {
      curl_easy_setopt(e, CURLOPT_HTTPGET, 1L);
    } else if (method == "HEAD" && !t.bodyFile) {
      curl_easy_setopt(e, CURLOPT_NOBODY, 1L);
    } else {
      curl_easy_setopt(e, CURLOPT_POST, 1L);
      if (method != "POST") {
        curl_easy_setopt(e, CURLOPT_CUSTOMREQUEST, method.c_str());
      }
      if (t.bodyFile) {
        curl_easy_setopt(e, CURLOPT_READFUNCTION, &Impl::onRead);
        curl_easy_setopt(e, CURLOPT_READDATA, &t);
        curl_easy_setopt(e, CURLOPT_SEEKFUNCTION, &Impl::onSeek);
        curl_easy_setopt(e, CURLOPT_SEEKDATA, &t);
        curl_easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(t.bodySize));
      } else {
        // The request (and so its body) lives as long as the task.
        static const char kEmpty[] = "";
        curl_easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(request.body.size()));
        curl_easy_setopt(e, CURLOPT_POSTFIELDS,
                         request.body.empty() ? kEmpty : reinterpret_cast<const char*>(request.body.data()));
      }
      curl_easy_setopt(e, CURLOPT_NOPROGRESS, 0L);
      curl_easy_setopt(e, CURLOPT_XFERINFOFUNCTION, &Impl::onProgress);
      curl_easy_setopt(e, CURLOPT_XFERINFODATA, &t);
    }

    curl_slist* list = nullptr;
    const auto add = [&list](const std::string& line) {
      if (curl_slist* grown = curl_slist_append(list, line.c_str())) {
        list = grown;
      }
    };
    for (const auto& [name, value] : request.headers) {
      add(headerLine(name, value));
    }
    if (hasBody) {
      // No "Expect: 100-continue" round trip, and no form content type the
      // caller did not ask for.
      if (!request.valueForHTTPHeaderField("Expect")) {
        add("Expect:");
      }
      if (!request.valueForHTTPHeaderField("Content-Type")) {
        add("Content-Type:");
      }
    }
    if (request.ignoreLocalCache) {
      if (!request.valueForHTTPHeaderField("Cache-Control")) {
        add("Cache-Control: no-cache");
      }
      if (!request.valueForHTTPHeaderField("Pragma")) {
        add("Pragma: no-cache");
      }
    }
    if (!config.sourceApplicationBundleIdentifier.empty() && !request.valueForHTTPHeaderField(kSourceApplicationHeader)) {
      add(headerLine(kSourceApplicationHeader, config.sourceApplicationBundleIdentifier));
    }
    t.headerList.reset(list);
    curl_easy_setopt(e, CURLOPT_HTTPHEADER, list);

    if (config.networkServiceType == NetworkServiceType::Background) {
      curl_easy_setopt(e, CURLOPT_SOCKOPTFUNCTION, &Impl::onSocket);
    }
    // Verification uses one CA bundle file, so that libcurl's cache of the
    // loaded store applies (a CA folder beside it would disable the cache).
    curl_easy_setopt(e, CURLOPT_CAPATH, nullptr);
    bool failed = false;
    const std::string bundle = ExtraTrust::instance().bundlePath(failed);
    if (failed) {
      complete(task, Error{kURLErrorDomain, CURLE_SSL_CACERT_BADFILE, "The CA bundle with the extra authorities cannot be made"});
      return false;
    }
    if (!bundle.empty()) {
      curl_easy_setopt(e, CURLOPT_CAINFO, bundle.c_str());
    }
    return true;
  }

  void finished(CURL* easy, CURLcode result) {
    const auto it = active.find(easy);
    if (it == active.end()) {
      return;
    }
    const std::shared_ptr<URLSessionTask> task = it->second;
    active.erase(it);
    Transfer& t = *task->transfer_;
    curl_multi_remove_handle(multi.get(), easy);
    t.inMulti = false;
    long osErrno = 0;
    curl_easy_getinfo(easy, CURLINFO_OS_ERRNO, &osErrno);
    const URLSessionConfiguration& config = task->session().configuration();
    if (result != CURLE_OK && config.waitsForConnectivity && !t.responseDelivered && failedForLackOfRoute(result, osErrno)) {
      t.backoff = t.backoff.count() == 0 ? config.connectivityRetryInterval
                                         : std::min(t.backoff * 2, config.connectivityRetryMaxInterval);
      auto when = Clock::now() + t.backoff;
      if (t.deadline) {
        when = std::min(when, *t.deadline);
      }
      logger().debug("URLSession: task <{}> has no route to its server ({}), next attempt in {} ms", task->taskDescription(),
                     t.errorBuffer[0] ? t.errorBuffer.data() : curl_easy_strerror(result), t.backoff.count());
      after(when, [this, task] { begin(task); });
      return;
    }
    std::optional<Error> error;
    if (t.tooLarge) {
      const std::size_t limit = task->originalRequest().maxResponseBytes;
      logger().error("URLSession: task <{}> cut: the answer from {} passed the limit of {} bytes", task->taskDescription(),
                     task->originalRequest().url, limit);
      error = Error{kURLErrorDomain, kURLErrorResponseTooLarge,
                    fmt::format("The response is larger than the limit of {} bytes", limit)};
    } else if (result != CURLE_OK) {
      error = curlError(result, t.errorBuffer.data());
    }
    complete(task, std::move(error));
  }

  void complete(const std::shared_ptr<URLSessionTask>& task, std::optional<Error> error) {
    Transfer& t = *task->transfer_;
    if (t.finished) {
      return;
    }
    prepare(*task, t);
    t.finished = true;
    if (t.inMulti) {
      active.erase(t.easy.get());
      curl_multi_remove_handle(multi.get(), t.easy.get());
      t.inMulti = false;
    }
    flush(*task, t);
    if (!t.responseDelivered && t.easy) {
      long status = 0;
      curl_easy_getinfo(t.easy.get(), CURLINFO_RESPONSE_CODE, &status);
      if (status > 0) {
        deliverResponse(*task, t);
      }
    }
    task->markCompleted();
    deliver(*task, t, [error = std::move(error)](URLSessionDelegate& d, URLSession& s, URLSessionTask& k) {
      d.didCompleteWithError(s, k, error);
    });
    t.easy.reset();
    t.headerList.reset();
    t.bodyFile.reset();
    t.delegate.reset();
    finishedTasks.push_back(task);  // handOver tells the session
  }

  void cancelTask(const std::shared_ptr<URLSessionTask>& task) {
    complete(task, Error{kURLErrorDomain, kURLErrorCancelled, "cancelled"});
  }

  static void deliverResponse(URLSessionTask& task, Transfer& t) {
    long status = 0;
    curl_easy_getinfo(t.easy.get(), CURLINFO_RESPONSE_CODE, &status);
    char* effectiveURL = nullptr;
    curl_easy_getinfo(t.easy.get(), CURLINFO_EFFECTIVE_URL, &effectiveURL);
    HTTPURLResponse response{status, effectiveURL ? effectiveURL : task.originalRequest().url, t.responseHeaders};
    task.setResponse(response);
    t.responseDelivered = true;
    deliver(task, t, [response = std::move(response)](URLSessionDelegate& d, URLSession& s, URLSessionTask& k) {
      d.didReceiveResponse(s, k, response, [weak = k.weak_from_this()](ResponseDisposition disposition) {
        if (disposition == ResponseDisposition::Cancel) {
          if (auto task = weak.lock()) {
            task->cancel();
          }
        }
      });
    });
  }

  static void flush(URLSessionTask& task, Transfer& t) {
    if (t.pending.empty()) {
      return;
    }
    Data chunk;
    chunk.swap(t.pending);
    deliver(task, t, [chunk = std::move(chunk)](URLSessionDelegate& d, URLSession& s, URLSessionTask& k) {
      d.didReceiveData(s, k, chunk);
    });
  }

  // libcurl callbacks, on the transport thread.

  static size_t onHeader(char* buffer, size_t size, size_t count, void* userdata) {
    auto& t = *static_cast<Transfer*>(userdata);
    const size_t n = size * count;
    if (!t.responseDelivered) {  // trailers after the body are not part of the head
      parseResponseHeadLine(std::string_view(buffer, n), t.responseHeaders);
    }
    return n;
  }

  static size_t onData(char* data, size_t size, size_t count, void* userdata) {
    auto& t = *static_cast<Transfer*>(userdata);
    const size_t n = size * count;
    // Cut at the limit while the body streams in: a short count makes libcurl
    // end the transfer, and nothing past the limit is kept.
    const std::size_t limit = t.task->originalRequest().maxResponseBytes;
    curl_off_t announced = -1;
    curl_easy_getinfo(t.easy.get(), CURLINFO_CONTENT_LENGTH_DOWNLOAD_T, &announced);
    if (t.received + n > limit || (announced > 0 && static_cast<std::uint64_t>(announced) > limit)) {
      t.tooLarge = true;
      Data().swap(t.pending);
      return n == 0 ? 1 : 0;
    }
    t.received += n;
    if (!t.responseDelivered) {
      deliverResponse(*t.task, t);
    }
    t.pending.insert(t.pending.end(), reinterpret_cast<const std::uint8_t*>(data), reinterpret_cast<const std::uint8_t*>(data) + n);
    if (t.pending.size() >= kFlushThreshold) {
      flush(*t.task, t);
    }
    return n;
  }

  static size_t onRead(char* buffer, size_t size, size_t count, void* userdata) {
    auto& t = *static_cast<Transfer*>(userdata);
    for (;;) {
      const ssize_t n = ::pread(t.bodyFile.get(), buffer, size * count, static_cast<off_t>(t.readOffset));
      if (n >= 0) {
        t.readOffset += n;
        return static_cast<size_t>(n);
      }
      if (errno != EINTR) {
        return CURL_READFUNC_ABORT;
      }
    }
  }

  static int onSeek(void* userdata, curl_off_t offset, int origin) {
    auto& t = *static_cast<Transfer*>(userdata);
    if (origin != SEEK_SET || offset < 0 || offset > t.bodySize) {
      return CURL_SEEKFUNC_CANTSEEK;
    }
    t.readOffset = offset;
    return CURL_SEEKFUNC_OK;
  }

  static int onProgress(void* userdata, curl_off_t, curl_off_t, curl_off_t expected, curl_off_t sent) {
    auto& t = *static_cast<Transfer*>(userdata);
    if (sent > t.lastSent) {
      const std::int64_t delta = sent - t.lastSent;
      t.lastSent = sent;
      deliver(*t.task, t, [delta, sent, expected](URLSessionDelegate& d, URLSession& s, URLSessionTask& k) {
        d.didSendBodyData(s, k, delta, sent, expected);
      });
    }
    return 0;
  }

  static int onSocket(void*, curl_socket_t fd, curlsocktype purpose) {
    if (purpose == CURLSOCKTYPE_IPCXN) {
      const int priority = kBackgroundSocketPriority;
      ::setsockopt(fd, SOL_SOCKET, SO_PRIORITY, &priority, sizeof(priority));
    }
    return CURL_SOCKOPT_OK;
  }
};

TransferEngine& TransferEngine::instance() {
  static auto* engine = new TransferEngine();  // the process's one transport thread; never torn down
  return *engine;
}

TransferEngine::TransferEngine() : impl_(std::make_unique<Impl>()) {}

void TransferEngine::start(std::shared_ptr<URLSessionTask> task) {
  impl_->post([impl = impl_.get(), task = std::move(task)] { impl->begin(task); });
}

void TransferEngine::post(std::function<void()> block) { impl_->post(std::move(block)); }

void TransferEngine::cancel(std::shared_ptr<URLSessionTask> task) {
  impl_->post([impl = impl_.get(), task = std::move(task)] { impl->cancelTask(task); });
}

}  // namespace zerith
