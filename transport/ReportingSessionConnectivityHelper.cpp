#include "transport/ReportingSessionConnectivityHelper.h"

#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <system_error>

#include <fmt/format.h>

#include "platform/RemoveFiles.h"
#include "platform/Crypto.h"
#include "platform/FileUtil.h"
#include "platform/Log.h"
#include "platform/Paths.h"

namespace zerith {

namespace fs = std::filesystem;

namespace {

const log::Logger& logger() {
  static const auto* l = new log::Logger("transport");
  return *l;
}

constexpr const char* kSourceApplication = "com.velmar.system.diagnostics";
constexpr const char* kBodyFileExtension = "zthdiag";
constexpr std::uint32_t kDataPOSTMode = 4;
constexpr std::uint32_t kDataGETMode = 8;

// One sequence of task descriptions for every helper of the process.
std::atomic<std::uint32_t> gTaskCounter{0};

std::string describe(const std::optional<Error>& error) {
  if (!error) {
    return "(null)";
  }
  return fmt::format("Error Domain={} Code={} \"{}\"", error->domain, error->code, error->description);
}

std::string describe(const std::optional<HTTPURLResponse>& response) {
  if (!response) {
    return "(null)";
  }
  return fmt::format("<HTTPURLResponse URL: {} Status Code: {}>", response->url, response->statusCode);
}

// Writes the body to a new file and returns it opened for reading; an
// invalid descriptor (and no file left behind) when that fails.
file::UniqueFd writeBodyFile(const fs::path& path, const Data& body) {
  std::error_code ec;
  fs::create_directories(path.parent_path(), ec);
  file::UniqueFd fd(::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
  if (!fd) {
    return fd;
  }
  std::size_t written = 0;
  while (written < body.size()) {
    const ssize_t n = ::write(fd.get(), body.data() + written, body.size() - written);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      const int error = n < 0 ? errno : EIO;  // the caller reports it
      fd.reset();
      fs::remove(path, ec);
      errno = error;
      return fd;
    }
    written += static_cast<std::size_t>(n);
  }
  return fd;
}

}  // namespace

std::shared_ptr<ReportingSessionConnectivityHelper> ReportingSessionConnectivityHelper::initWithDelegate(
    std::weak_ptr<ConnectivityHelperDelegate> delegate, std::uint32_t mode) {
  auto helper = std::make_shared<ReportingSessionConnectivityHelper>(Token{}, std::move(delegate), mode);
  const auto configuration = privateURLSessionConfigWithMode(mode);
  if (configuration) {
    helper->privateURLSession_ = URLSession::sessionWithConfiguration(
        *configuration, std::weak_ptr<URLSessionDelegate>(helper), mainOperationQueue());
    helper->sessionDescription_ = configuration->background ? configuration->identifier : crypto::newUUIDString();
    helper->privateURLSession_->setSessionDescription(helper->sessionDescription_);
  } else {
    helper->sessionDescription_ = crypto::newUUIDString();
  }
  // "delegate" tells whether the HTTP session has its delegate (1) or, for
  // modes without a session, not (0).
  logger().debug("QFURLSession created with ID <{}>, delegate {}", helper->sessionDescription_,
                 helper->privateURLSession_ && helper->privateURLSession_->hasDelegate() ? 1 : 0);
  return helper;
}

ReportingSessionConnectivityHelper::ReportingSessionConnectivityHelper(Token, std::weak_ptr<ConnectivityHelperDelegate> delegate,
                                                                       std::uint32_t mode)
    : zerithdSessionDelegate_(std::move(delegate)),
      mode_(mode),
      stateQueue_("com.velmar.ConnectivityHelperStateQueue", Pool::Transport) {
  tasks_.reserve(5);
}

ReportingSessionConnectivityHelper::~ReportingSessionConnectivityHelper() {
  logger().debug("QFURLSession dealloced with ID <{}>", sessionDescription_);
}

std::optional<URLSessionConfiguration> ReportingSessionConnectivityHelper::privateURLSessionConfigWithMode(std::uint32_t mode) {
  URLSessionConfiguration configuration;
  switch (mode) {
    case 1:
      configuration = URLSessionConfiguration::backgroundSessionConfigurationWithIdentifier(crypto::newUUIDString());
      configuration.networkServiceType = NetworkServiceType::Background;
      configuration.discretionary = true;
      configuration.requiresPowerPluggedIn = true;
      break;
    case 2:
      configuration = URLSessionConfiguration::backgroundSessionConfigurationWithIdentifier(crypto::newUUIDString());
      configuration.discretionary = true;
      break;
    case kDataPOSTMode:
    case kDataGETMode:
      configuration = URLSessionConfiguration::defaultSessionConfiguration();
      break;
    default:
      return std::nullopt;
  }
  configuration.sourceApplicationBundleIdentifier = kSourceApplication;
  configuration.waitsForConnectivity = true;
  return configuration;
}

void ReportingSessionConnectivityHelper::startTask(const std::shared_ptr<URLSessionTask>& task, const char* operation,
                                                   URLCompletion completion) {
  if (!task) {
    // The session is invalid: answer rather than leave a waiting caller hanging.
    logger().error("{}: QFURLSession with ID <{}> is invalidated, request not sent", operation, sessionDescription_);
    if (completion) {
      stateQueue_.async([completion = std::move(completion)] {
        completion(Data{}, std::nullopt,
                   Error{kURLErrorDomain, kURLErrorSessionInvalidated, "The HTTP session has been invalidated"});
      });
    }
    return;
  }
  if (stateQueue_.isCurrent()) {
    createHelperForTask(*task, std::move(completion));
    task->resume();
    return;
  }
  // Registered and started in a turn of the state queue, never by waiting
  // for one: a completion runs on its own helper's state queue and may start
  // the next post through another session's helper (a backend's posts in
  // flight are shared by its sessions). Two such completions waiting for each
  // other's state queue stopped both for good, and every post behind them.
  // The turn is taken right here when the queue is free (a batch that fills
  // on a socket thread starts its post without waking a transport thread),
  // else the start is queued behind what the queue is doing.
  auto start = [self = shared_from_this(), task, completion = std::move(completion)]() mutable {
    self->createHelperForTask(*task, std::move(completion));
    task->resume();
  };
  if (!stateQueue_.runIfFree(start)) {
    stateQueue_.async(std::move(start));
  }
}

bool ReportingSessionConnectivityHelper::postURLRequestWithCompletionHandler(const URLRequest& request, URLCompletion completion) {
  if (mode_ == kDataPOSTMode) {
    startTask(privateURLSession_->dataTaskWithRequest(request), "postURLRequestWithCompletionHandler", std::move(completion));
    return true;
  }
  if (mode_ == POSTRequestMode()) {
    const fs::path container = composeUniqueContainerURL();
    file::UniqueFd body = writeBodyFile(container, request.body);
    if (!body) {
      // A full storage folder, the file size limit (EFBIG), no descriptor left.
      // The caller logs the loss at a bounded rate (a full disk fails every post).
      const int err = errno;
      logger().debug("postURLRequestWithCompletionHandler: cannot write the body file {}: {}", container.string(),
                     std::strerror(err));
      if (request.completesWhenBodyFails && completion) {
        stateQueue_.async([completion = std::move(completion), err] {
          completion(Data(), std::nullopt,
                     Error{kURLErrorDomain, kURLErrorCannotWriteBody,
                           fmt::format("the body file cannot be written ({})", std::strerror(err))});
        });
      }
      return false;  // no task; the caller counts the loss (or hears it above)
    }
    URLRequest copy = request;
    copy.body.clear();
    startTask(privateURLSession_->uploadTaskWithRequest(copy, std::move(body)), "postURLRequestWithCompletionHandler",
              std::move(completion));
    // The open descriptor carries the upload from here on.
    deleteContainerAtURL(container);
    return true;
  }
  logger().error("postURLRequestWithCompletionHandler: wrong mode for POST operation detected {}", mode_);
  return false;
}

void ReportingSessionConnectivityHelper::getURLRequestWithCompletionHandler(const URLRequest& request, URLCompletion completion) {
  if (mode_ == GETRequestMode() || mode_ == kDataGETMode) {
    startTask(privateURLSession_->dataTaskWithRequest(request), "getURLRequestWithCompletionHandler", std::move(completion));
    return;
  }
  logger().error("getURLRequestWithCompletionHandler: wrong mode for GET operation detected {}", mode_);
}

void ReportingSessionConnectivityHelper::createHelperForTask(URLSessionTask& task, URLCompletion completion) {
  const auto registerTask = [&] {
    const std::uint32_t number = gTaskCounter.fetch_add(1, std::memory_order_relaxed) + 1;
    const std::string description = fmt::format("Task_{:08x}", number);
    task.setTaskDescription(description);
    tasks_[description] = std::make_unique<ConnectivityHelperTask>(description, std::move(completion));
    logger().debug("createHelperForTask: created helperTask for task <{}>", description);
  };
  // A completion (which runs on the state queue) may send the next request.
  if (stateQueue_.isCurrent()) {
    registerTask();
  } else {
    stateQueue_.sync(registerTask);
  }
}

void ReportingSessionConnectivityHelper::invalidate() {
  if (privateURLSession_) {
    privateURLSession_->finishTasksAndInvalidate();
  }
  logger().debug("ReportingSessionConnectivityHelper:invalidate: QFURLSession with ID <{}>", sessionDescription_);
}

fs::path ReportingSessionConnectivityHelper::storageRootFolder() { return paths::uploadStorageDir(); }

fs::path ReportingSessionConnectivityHelper::composeUniqueContainerURL() {
  return storageRootFolder() / fmt::format("{}.{}", crypto::newUUIDString(), kBodyFileExtension);
}

void ReportingSessionConnectivityHelper::deleteContainerAtURL(const fs::path& url) {
  std::error_code ec;
  fs::remove(url, ec);
}

void ReportingSessionConnectivityHelper::cleanupStorageRootFolder() {
  if (POSTRequestMode() != 1) {
    return;
  }
  const fs::path folder = storageRootFolder();
  std::error_code ec;
  fs::create_directories(folder, ec);
  const std::regex pattern(fmt::format("^.*\\.{}$", kBodyFileExtension), std::regex::ECMAScript | std::regex::icase);
  removeFilesMatchingRegex(pattern, folder);
}

// --- delegate callbacks (main operation queue) ---

void ReportingSessionConnectivityHelper::didBecomeInvalidWithError(URLSession& session, const std::optional<Error>& error) {
  stateQueue_.async([self = shared_from_this(), description = session.sessionDescription(), error] {
    if (auto delegate = self->zerithdSessionDelegate_.lock()) {
      delegate->releaseVeskTransaction();
    }
    logger().debug("didBecomeInvalidWithError: session <{}> invalidated with error {}", description, describe(error));
  });
}

void ReportingSessionConnectivityHelper::didSendBodyData(URLSession& session, URLSessionTask& task, std::int64_t,
                                                         std::int64_t totalBytesSent, std::int64_t totalBytesExpectedToSend) {
  logger().debug("didSendBodyData: for <session>:<task> <{}>:<{}>: Sent {} out of {}", session.sessionDescription(),
                 task.taskDescription(), totalBytesSent, totalBytesExpectedToSend);
}

void ReportingSessionConnectivityHelper::didReceiveResponse(URLSession& session, URLSessionTask& dataTask, const HTTPURLResponse&,
                                                            const std::function<void(ResponseDisposition)>& completionHandler) {
  logger().debug("didReceiveResponse: for <session>:<task> <{}>:<{}>", session.sessionDescription(), dataTask.taskDescription());
  if (completionHandler) {
    completionHandler(ResponseDisposition::Allow);
  }
}

void ReportingSessionConnectivityHelper::didBecomeDownloadTask(URLSession& session, URLSessionTask&) {
  logger().error("didBecomeDownloadTask: session <{}> has become downoad task. SHOULD NEVER HAPPEN!!!", session.sessionDescription());
}

void ReportingSessionConnectivityHelper::didReceiveData(URLSession& session, URLSessionTask& dataTask, const Data& data) {
  stateQueue_.async([self = shared_from_this(), session = session.sessionDescription(), task = dataTask.taskDescription(), data] {
    logger().debug("didReceiveData: received {} bytes for <session>:<task> <{}>:<{}>", data.size(), session, task);
    if (const auto it = self->tasks_.find(task); it != self->tasks_.end()) {
      it->second->appendReceivedData(data);
    }
  });
}

void ReportingSessionConnectivityHelper::didCompleteWithError(URLSession& session, URLSessionTask& task,
                                                              const std::optional<Error>& error) {
  stateQueue_.async([self = shared_from_this(), session = session.sessionDescription(), description = task.taskDescription(),
                     response = task.response(), error] {
    logger().debug("didCompleteWithError: for <session>:<task> <{}>:<{}> with response {}, error {}", session, description,
                   describe(response), describe(error));
    auto node = self->tasks_.extract(description);
    if (node.empty()) {
      return;
    }
    // The record leaves the table first: the completion may register the next
    // task; it is released (and says so) after the completion has run.
    const ConnectivityHelperTask& record = *node.mapped();
    if (record.completionHandler()) {
      record.completionHandler()(record.receivedData(), response, error);
    }
  });
}

}  // namespace zerith
