#pragma once

// The transport thread behind every URLSession of the process: one libcurl
// multi handle driven by one thread, commands posted to it from any thread,
// timers for transfers that wait (for a route, for external power).
//
// Built against libcurl 7.88 (Debian bookworm) with OpenSSL. Relied upon:
// curl_multi_poll / curl_multi_wakeup (7.66 / 7.68), CURLOPT_PROTOCOLS_STR
// and CURLOPT_REDIR_PROTOCOLS_STR (7.85), the OpenSSL back end's cache of the
// loaded CA store per bundle path (7.87; only without a CA folder, hence
// CURLOPT_CAPATH is cleared), CURLOPT_SOCKOPTFUNCTION,
// CURLOPT_XFERINFOFUNCTION, CURLOPT_SEEKFUNCTION, CURLINFO_OS_ERRNO, and the
// "threadsafe" feature for curl_global_init. The engine checks the version
// and the SSL feature at start and logs an error when they are missing.

#include <curl/curl.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "platform/FileUtil.h"
#include "platform/Value.h"
#include "transport/ReportingSessionConnectivityInterface.h"

namespace zerith {

class URLSessionDelegate;
class URLSessionTask;

struct CurlEasyFree {
  void operator()(CURL* c) const { curl_easy_cleanup(c); }
};
struct CurlSlistFree {
  void operator()(curl_slist* l) const { curl_slist_free_all(l); }
};

// A task's transport-thread state. Touched on the transport thread only.
struct Transfer {
  URLSessionTask* task = nullptr;                  // the owner
  std::shared_ptr<URLSessionDelegate> delegate;    // kept while the task runs
  std::unique_ptr<CURL, CurlEasyFree> easy;
  std::unique_ptr<curl_slist, CurlSlistFree> headerList;
  std::array<char, CURL_ERROR_SIZE> errorBuffer{};

  file::UniqueFd bodyFile;  // upload tasks: the body, read by offset
  std::int64_t bodySize = 0;
  std::int64_t readOffset = 0;

  HTTPHeaders responseHeaders;  // of the response being received
  bool responseDelivered = false;
  Data pending;  // received, not yet handed to the delegate queue
  std::uint64_t received = 0;  // body bytes of the current attempt
  bool tooLarge = false;       // the body passed the request's limit and was cut
  std::int64_t lastSent = 0;

  std::optional<std::chrono::steady_clock::time_point> deadline;  // the request's own time-out
  std::optional<std::chrono::steady_clock::time_point> deferredSince;
  std::chrono::milliseconds backoff{0};
  bool waitingForPower = false;
  bool prepared = false;  // delegate and deadline taken
  bool inMulti = false;
  bool finished = false;
};

class TransferEngine {
 public:
  // Created on first use; runs until the process exits.
  static TransferEngine& instance();

  void start(std::shared_ptr<URLSessionTask> task);
  void cancel(std::shared_ptr<URLSessionTask> task);
  // Runs `block` on the transport thread between two turns of its loop (the
  // watchdog's heartbeat). The block must not wait.
  void post(std::function<void()> block);

  struct Impl;

 private:
  TransferEngine();
  std::unique_ptr<Impl> impl_;
};

}  // namespace zerith
