#include "transport/URLSession.h"

#include <sys/stat.h>

#include "transport/ExtraTrust.h"
#include "transport/TransferEngine.h"

namespace zerith {

const SerialQueue& mainOperationQueue() {
  // Never destroyed: the transport thread may post to it while the process exits.
  static const auto* queue = new SerialQueue("com.velmar.zerith.mainOperationQueue", Pool::Transport);
  return *queue;
}

URLSessionConfiguration URLSessionConfiguration::defaultSessionConfiguration() { return URLSessionConfiguration{}; }

URLSessionConfiguration URLSessionConfiguration::backgroundSessionConfigurationWithIdentifier(std::string identifier) {
  URLSessionConfiguration configuration;
  configuration.background = true;
  configuration.identifier = std::move(identifier);
  return configuration;
}

// --- URLSessionTask ---

URLSessionTask::URLSessionTask(Token, std::shared_ptr<URLSession> session, URLRequest request, std::uint64_t identifier,
                               file::UniqueFd bodyFile)
    : session_(std::move(session)),
      request_(std::move(request)),
      identifier_(identifier),
      transfer_(std::make_unique<Transfer>()) {
  transfer_->task = this;
  transfer_->bodyFile = std::move(bodyFile);
}

URLSessionTask::~URLSessionTask() {
  // A task made but never started ends here; one that ran ended in the
  // transfer engine.
  if (state_ == State::Suspended) {
    session_->taskFinished();
  }
}

std::string URLSessionTask::taskDescription() const {
  std::lock_guard lock(mutex_);
  return description_;
}

void URLSessionTask::setTaskDescription(std::string description) {
  std::lock_guard lock(mutex_);
  description_ = std::move(description);
}

std::optional<HTTPURLResponse> URLSessionTask::response() const {
  std::lock_guard lock(mutex_);
  return response_;
}

void URLSessionTask::setResponse(HTTPURLResponse response) {
  std::lock_guard lock(mutex_);
  response_ = std::move(response);
}

URLSessionTask::State URLSessionTask::state() const {
  std::lock_guard lock(mutex_);
  return state_;
}

bool URLSessionTask::markRunning() {
  std::lock_guard lock(mutex_);
  if (state_ != State::Suspended) {
    return false;
  }
  state_ = State::Running;
  return true;
}

void URLSessionTask::markCompleted() {
  std::lock_guard lock(mutex_);
  state_ = State::Completed;
}

void URLSessionTask::resume() {
  if (!markRunning()) {
    return;
  }
  TransferEngine::instance().start(shared_from_this());
}

void URLSessionTask::cancel() {
  {
    std::lock_guard lock(mutex_);
    if (state_ == State::Completed) {
      return;
    }
  }
  // A suspended task is started so that it completes (with the cancellation)
  // exactly like any other.
  (void)markRunning();
  TransferEngine::instance().cancel(shared_from_this());
}

// --- URLSession ---

std::shared_ptr<URLSession> URLSession::sessionWithConfiguration(const URLSessionConfiguration& configuration,
                                                                 std::weak_ptr<URLSessionDelegate> delegate,
                                                                 SerialQueue delegateQueue) {
  return std::make_shared<URLSession>(Token{}, configuration, std::move(delegate), std::move(delegateQueue));
}

URLSession::URLSession(Token, const URLSessionConfiguration& configuration, std::weak_ptr<URLSessionDelegate> delegate,
                       SerialQueue delegateQueue)
    : configuration_(configuration), delegateQueue_(std::move(delegateQueue)), delegate_(std::move(delegate)) {}

std::string URLSession::sessionDescription() const {
  std::lock_guard lock(mutex_);
  return description_;
}

void URLSession::setSessionDescription(std::string description) {
  std::lock_guard lock(mutex_);
  description_ = std::move(description);
}

bool URLSession::hasDelegate() const {
  std::lock_guard lock(mutex_);
  return !delegate_.expired();
}

std::shared_ptr<URLSessionTask> URLSession::makeTask(const URLRequest& request, file::UniqueFd bodyFile) {
  std::uint64_t identifier = 0;
  {
    std::lock_guard lock(mutex_);
    if (invalidating_) {
      return nullptr;
    }
    // Counted from here, not from its start: an invalidation that comes
    // between the two waits for this task's completion instead of dropping
    // the delegate the task is about to report to.
    ++running_;
    identifier = ++nextTaskIdentifier_;
  }
  return std::make_shared<URLSessionTask>(URLSessionTask::Token{}, shared_from_this(), request, identifier,
                                          std::move(bodyFile));
}

std::shared_ptr<URLSessionTask> URLSession::dataTaskWithRequest(const URLRequest& request) {
  return makeTask(request, file::UniqueFd());
}

std::shared_ptr<URLSessionTask> URLSession::uploadTaskWithRequest(const URLRequest& request, file::UniqueFd bodyFile) {
  struct stat st {};
  if (!bodyFile || ::fstat(bodyFile.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
    return nullptr;
  }
  URLRequest withoutBody = request;
  withoutBody.body.clear();
  auto task = makeTask(withoutBody, std::move(bodyFile));
  if (task) {
    task->transfer_->bodySize = st.st_size;
  }
  return task;
}

void URLSession::finishTasksAndInvalidate() {
  std::shared_ptr<URLSessionDelegate> delegate;
  {
    std::lock_guard lock(mutex_);
    if (invalidating_) {
      return;
    }
    invalidating_ = true;
    if (running_ > 0) {
      retainedDelegate_ = delegate_.lock();
      return;
    }
    invalidated_ = true;
    delegate = delegate_.lock();
    delegate_.reset();
  }
  postInvalidation(std::move(delegate));
}

void URLSession::taskFinished() {
  std::shared_ptr<URLSessionDelegate> delegate;
  {
    std::lock_guard lock(mutex_);
    --running_;
    if (!invalidating_ || invalidated_ || running_ > 0) {
      return;
    }
    invalidated_ = true;
    delegate = std::move(retainedDelegate_);
    delegate_.reset();
  }
  postInvalidation(std::move(delegate));
}

void URLSession::postInvalidation(std::shared_ptr<URLSessionDelegate> delegate) {
  if (!delegate) {
    return;
  }
  delegateQueue_.async([self = shared_from_this(), delegate = std::move(delegate)] {
    delegate->didBecomeInvalidWithError(*self, std::nullopt);
  });
}

std::shared_ptr<URLSessionDelegate> URLSession::delegateForTask() const {
  std::lock_guard lock(mutex_);
  return delegate_.lock();
}

bool URLSession::setExtraCAFile(const std::string& path) { return ExtraTrust::instance().setFile(path); }

std::string URLSession::extraCAFile() { return ExtraTrust::instance().file(); }

}  // namespace zerith
