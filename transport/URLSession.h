#pragma once

// The HTTP session service: sessions with a configuration, data and upload
// tasks, and delegate callbacks delivered on a serial delegate queue.
//
// One transport thread serves every session of the process: it runs
// libcurl's multi interface and posts each callback to the session's delegate
// queue in the order things happened on the wire (response, data chunks,
// completion; after the last completion of an invalidated session, the
// invalidation). No thread is made per request.
//
// Lifetimes. A session holds its delegate weakly while idle. A running task
// keeps its session and the delegate alive until its completion has been
// delivered, and `finishTasksAndInvalidate` keeps the delegate alive until
// the invalidation has been delivered, so an owner may drop its last
// reference at any time without losing a callback that is due.
//
// Errors are Error{kURLErrorDomain, code, description}: the code is
// libcurl's CURLcode (7 could not connect, 28 timed out, 60 peer certificate
// not trusted, ...) with libcurl's message, or one of the negative codes
// below.

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/Error.h"
#include "platform/FileUtil.h"
#include "platform/SerialQueue.h"
#include "platform/Value.h"
#include "transport/ReportingSessionConnectivityInterface.h"

namespace zerith {

inline constexpr const char* kURLErrorDomain = "com.velmar.zerith.URLError";
inline constexpr std::int64_t kURLErrorCancelled = -999;
inline constexpr std::int64_t kURLErrorSessionInvalidated = -998;
// The response body passed the request's maxResponseBytes.
inline constexpr std::int64_t kURLErrorResponseTooLarge = -1103;
inline constexpr std::int64_t kURLErrorCannotWriteBody = -3000;

// The process's main operation queue: the delegate queue of the
// connectivity helpers' sessions. Runs on the transport pool.
const SerialQueue& mainOperationQueue();

enum class NetworkServiceType : int {
  Default = 0,
  Background = 3,  // sockets get a lowered priority (SO_PRIORITY)
};

struct URLSessionConfiguration {
  bool background = false;
  std::string identifier;  // background configurations only
  NetworkServiceType networkServiceType = NetworkServiceType::Default;
  // Discretionary transfers wait while the device runs on battery, for at
  // most `discretionaryMaxDelay` unless external power is required too.
  bool discretionary = false;
  bool requiresPowerPluggedIn = false;
  std::chrono::milliseconds powerCheckInterval{60000};
  std::chrono::milliseconds discretionaryMaxDelay{5 * 60 * 1000};
  // A request made while the device has no route to the server waits for one
  // (first pause `connectivityRetryInterval`, doubling up to
  // `connectivityRetryMaxInterval`) instead of failing; a refused connection
  // still fails at once. The request's own time-out bounds the wait.
  bool waitsForConnectivity = false;
  std::chrono::milliseconds connectivityRetryInterval{1000};
  std::chrono::milliseconds connectivityRetryMaxInterval{60000};
  // Sent as the "X-ZTH-Source-Application" header of every request that
  // does not set it itself.
  std::string sourceApplicationBundleIdentifier;

  static URLSessionConfiguration defaultSessionConfiguration();
  static URLSessionConfiguration backgroundSessionConfigurationWithIdentifier(std::string identifier);
};

class URLSession;
class URLSessionTask;

enum class ResponseDisposition { Cancel, Allow };

// Every callback runs on the session's delegate queue.
class URLSessionDelegate {
 public:
  virtual ~URLSessionDelegate() = default;

  virtual void didBecomeInvalidWithError(URLSession& /*session*/, const std::optional<Error>& /*error*/) {}
  virtual void didSendBodyData(URLSession& /*session*/, URLSessionTask& /*task*/, std::int64_t /*bytesSent*/,
                               std::int64_t /*totalBytesSent*/, std::int64_t /*totalBytesExpectedToSend*/) {}
  // The response's headers are complete (after redirects). Answering Cancel
  // cancels the task; not answering lets it load.
  virtual void didReceiveResponse(URLSession& /*session*/, URLSessionTask& /*dataTask*/, const HTTPURLResponse& /*response*/,
                                  const std::function<void(ResponseDisposition)>& completionHandler) {
    if (completionHandler) {
      completionHandler(ResponseDisposition::Allow);
    }
  }
  // This service never turns a data task into a download task; the callback
  // exists for delegates that want to say so.
  virtual void didBecomeDownloadTask(URLSession& /*session*/, URLSessionTask& /*dataTask*/) {}
  virtual void didReceiveData(URLSession& /*session*/, URLSessionTask& /*dataTask*/, const Data& /*data*/) {}
  virtual void didCompleteWithError(URLSession& /*session*/, URLSessionTask& /*task*/, const std::optional<Error>& /*error*/) {}
};

struct Transfer;

class URLSessionTask : public std::enable_shared_from_this<URLSessionTask> {
 public:
  enum class State { Suspended, Running, Completed };

  struct Token {
   private:
    Token() = default;
    friend class URLSession;
  };
  // Made by URLSession only.
  URLSessionTask(Token, std::shared_ptr<URLSession> session, URLRequest request, std::uint64_t identifier,
                 file::UniqueFd bodyFile);
  ~URLSessionTask();
  URLSessionTask(const URLSessionTask&) = delete;
  URLSessionTask& operator=(const URLSessionTask&) = delete;

  std::uint64_t taskIdentifier() const { return identifier_; }
  std::string taskDescription() const;
  void setTaskDescription(std::string description);
  const URLRequest& originalRequest() const { return request_; }
  URLSession& session() const { return *session_; }
  // The final response once its headers arrived; nullopt before.
  std::optional<HTTPURLResponse> response() const;
  State state() const;
  // Starts a suspended task; does nothing otherwise.
  void resume();
  // Ends the task with kURLErrorCancelled unless it has completed already.
  void cancel();

 private:
  friend class TransferEngine;
  friend class URLSession;

  void setResponse(HTTPURLResponse response);
  void markCompleted();
  // Suspended -> Running; false otherwise.
  bool markRunning();

  const std::shared_ptr<URLSession> session_;
  const URLRequest request_;
  const std::uint64_t identifier_;

  mutable std::mutex mutex_;
  std::string description_;
  std::optional<HTTPURLResponse> response_;
  State state_ = State::Suspended;

  // Transport-thread state (the libcurl handle, buffers, retry timing).
  std::unique_ptr<Transfer> transfer_;
};

class URLSession : public std::enable_shared_from_this<URLSession> {
 public:
  struct Token {
   private:
    Token() = default;
    friend class URLSession;
  };

  static std::shared_ptr<URLSession> sessionWithConfiguration(const URLSessionConfiguration& configuration,
                                                              std::weak_ptr<URLSessionDelegate> delegate,
                                                              SerialQueue delegateQueue);
  URLSession(Token, const URLSessionConfiguration& configuration, std::weak_ptr<URLSessionDelegate> delegate,
             SerialQueue delegateQueue);
  URLSession(const URLSession&) = delete;
  URLSession& operator=(const URLSession&) = delete;

  const URLSessionConfiguration& configuration() const { return configuration_; }
  const SerialQueue& delegateQueue() const { return delegateQueue_; }
  std::string sessionDescription() const;
  void setSessionDescription(std::string description);
  bool hasDelegate() const;

  // A suspended task for the request; nullptr once the session is
  // invalidating.
  std::shared_ptr<URLSessionTask> dataTaskWithRequest(const URLRequest& request);
  // A suspended task posting the bytes of `bodyFile` (read from its start,
  // by offset, so the file may already be unlinked) as the request's body;
  // the request's own body is ignored. nullptr once the session is
  // invalidating or when the descriptor is not a readable regular file.
  std::shared_ptr<URLSessionTask> uploadTaskWithRequest(const URLRequest& request, file::UniqueFd bodyFile);

  // Lets the running tasks finish, then the session becomes invalid and the
  // delegate hears didBecomeInvalidWithError (with no error). No new tasks
  // are made afterwards.
  void finishTasksAndInvalidate();

  // The extra certificate authorities trusted beside the system store, for
  // every session of the process: a PEM file with one or more certificates.
  // An empty path removes them. False (and the previous setting kept) when
  // the file cannot be read or holds no certificate. Without a call, the
  // environment variable ZERITHD_CA_FILE is used when set.
  static bool setExtraCAFile(const std::string& path);
  static std::string extraCAFile();

 private:
  friend class TransferEngine;
  friend class URLSessionTask;

  // A task made by this session has delivered its completion, or was
  // dropped without being started.
  void taskFinished();
  void postInvalidation(std::shared_ptr<URLSessionDelegate> delegate);
  // The delegate for a starting task (empty when gone).
  std::shared_ptr<URLSessionDelegate> delegateForTask() const;
  std::shared_ptr<URLSessionTask> makeTask(const URLRequest& request, file::UniqueFd bodyFile);

  const URLSessionConfiguration configuration_;
  const SerialQueue delegateQueue_;

  mutable std::mutex mutex_;
  std::weak_ptr<URLSessionDelegate> delegate_;
  std::shared_ptr<URLSessionDelegate> retainedDelegate_;  // until the invalidation is delivered
  std::string description_;
  std::size_t running_ = 0;  // tasks made and not yet finished
  std::uint64_t nextTaskIdentifier_ = 0;
  bool invalidating_ = false;
  bool invalidated_ = false;
};

}  // namespace zerith
