#pragma once

// The service's HTTP client: one HTTP session configured for one request
// mode, offering POST and GET to reporting sessions, backends and the
// storebag fetch. The helper is its session's delegate: it gathers each
// task's bytes on its own state queue and calls the caller's completion once
// per task, there, when the task ends.
//
// Modes (fixed for a helper's life):
//   1 (POSTRequestMode): background, discretionary, external power required,
//     background service type; POST by upload from a body file.
//   2 (GETRequestMode): background, discretionary; GET data tasks.
//   4: default configuration; POST data tasks.
//   8: default configuration; GET data tasks.
// Every configuration sends the source application "com.velmar.system.diagnostics"
// and waits for connectivity. Any other mode has no session at all and
// carries no request.
//
// Requests of the wrong method for the mode are logged and dropped: their
// completion never runs. So are mode-1 POSTs whose body file cannot be
// written, unless the request asks to hear of it (completesWhenBodyFails:
// uploads, whose client waits for an answer). A request made after `invalidate` completes at once with
// kURLErrorSessionInvalidated.

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>

#include "platform/SerialQueue.h"
#include "transport/ConnectivityHelperDelegate.h"
#include "transport/ConnectivityHelperTask.h"
#include "transport/ReportingSessionConnectivityInterface.h"
#include "transport/URLSession.h"

namespace zerith {

class ReportingSessionConnectivityHelper final : public ReportingSessionConnectivityInterface,
                                                 public URLSessionDelegate,
                                                 public std::enable_shared_from_this<ReportingSessionConnectivityHelper> {
 public:
  struct Token {
   private:
    Token() = default;
    friend class ReportingSessionConnectivityHelper;
  };

  // initWithDelegate:mode:. Never nullptr.
  static std::shared_ptr<ReportingSessionConnectivityHelper> initWithDelegate(std::weak_ptr<ConnectivityHelperDelegate> delegate,
                                                                              std::uint32_t mode);
  ReportingSessionConnectivityHelper(Token, std::weak_ptr<ConnectivityHelperDelegate> delegate, std::uint32_t mode);
  ~ReportingSessionConnectivityHelper() override;
  ReportingSessionConnectivityHelper(const ReportingSessionConnectivityHelper&) = delete;
  ReportingSessionConnectivityHelper& operator=(const ReportingSessionConnectivityHelper&) = delete;

  // The session configuration of a mode; nullopt for unknown modes.
  static std::optional<URLSessionConfiguration> privateURLSessionConfigWithMode(std::uint32_t mode);

  bool postURLRequestWithCompletionHandler(const URLRequest& request, URLCompletion completion) override;
  void getURLRequestWithCompletionHandler(const URLRequest& request, URLCompletion completion) override;

  // Registers a task: names it "Task_%08x" from the process-wide counter and
  // records it with the completion. Runs synchronously on the state queue.
  void createHelperForTask(URLSessionTask& task, URLCompletion completion);

  // Lets the running tasks finish; then the session becomes invalid and the
  // delegate's keep-alive transaction is released.
  void invalidate();

  static std::uint32_t GETRequestMode() { return 2; }
  static std::uint32_t POSTRequestMode() { return 1; }
  // The folder of mode-1 body files (/tmp/zthstorage under the paths root).
  static std::filesystem::path storageRootFolder();
  // A new body file location: "<UUID>.zthdiag" in the storage root folder.
  static std::filesystem::path composeUniqueContainerURL();
  static void deleteContainerAtURL(const std::filesystem::path& url);
  // Removes body files left by an earlier process (any letter case of the
  // extension, in subfolders too); other files stay.
  static void cleanupStorageRootFolder();

  std::uint32_t mode() const { return mode_; }
  const std::string& sessionDescription() const { return sessionDescription_; }

  // URLSessionDelegate, on the main operation queue.
  void didBecomeInvalidWithError(URLSession& session, const std::optional<Error>& error) override;
  void didSendBodyData(URLSession& session, URLSessionTask& task, std::int64_t bytesSent, std::int64_t totalBytesSent,
                       std::int64_t totalBytesExpectedToSend) override;
  void didReceiveResponse(URLSession& session, URLSessionTask& dataTask, const HTTPURLResponse& response,
                          const std::function<void(ResponseDisposition)>& completionHandler) override;
  void didBecomeDownloadTask(URLSession& session, URLSessionTask& dataTask) override;
  void didReceiveData(URLSession& session, URLSessionTask& dataTask, const Data& data) override;
  void didCompleteWithError(URLSession& session, URLSessionTask& task, const std::optional<Error>& error) override;

 private:
  void startTask(const std::shared_ptr<URLSessionTask>& task, const char* operation, URLCompletion completion);

  std::shared_ptr<URLSession> privateURLSession_;
  std::weak_ptr<ConnectivityHelperDelegate> zerithdSessionDelegate_;
  std::unordered_map<std::string, std::unique_ptr<ConnectivityHelperTask>> tasks_;  // state queue only
  const std::uint32_t mode_;
  const SerialQueue stateQueue_;
  std::string sessionDescription_;
};

}  // namespace zerith
