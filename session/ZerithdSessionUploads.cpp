// A session's uploads: files a client hands over, by path or descriptor,
// and log data, given to the upload backend.

#include "session/ZerithdSession.h"
#include "session/ZerithdSessionHelpers.h"

#include <fmt/format.h>

#include "backends/UploadBackend.h"
#include "config/MessageLog.h"
#include "ipc/ClientSessionReplyProxy.h"
#include "ipc/ClientSessionWire.h"
#include "ipc/Connection.h"
#include "platform/Defaults.h"
#include "platform/SandboxExtension.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

using session_detail::logger;

// --- Uploads -------------------------------------------------------------------------

void ZerithdSession::uploadFileAtPath(const Value& fileURL, const Value& /*extensionToken*/,
                                      BoolCompletion completionHandler) {
  // Without the descriptor (the token a client framework passes with the
  // call) there is nothing the daemon may read.
  uploadFileWithDescriptor(fileURL, nullptr, [completionHandler = std::move(completionHandler)](bool ok, bool) {
    if (completionHandler) {
      completionHandler(ok);
    }
  });
}

void ZerithdSession::uploadFileWithDescriptor(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                              UploadCompletion completion) {
  logger().debug("uploadFileAtPath: Uploading file for session {}", sessionID());
  uploadFileWithURL(fileURL, std::move(descriptor), std::move(completion));
}

void ZerithdSession::uploadFileWithURL(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                       UploadCompletion completion) {
  const std::string url = fileURL.string() ? *fileURL.string() : std::string();
  const std::string path = ipc::wire::filePathOfURL(url);
  const std::string shownPath = log::escaped(path);
  const std::string absoluteURL = log::escaped(url.starts_with("file://") ? url : "file://" + path);

  // What the backends hear about once all have answered.
  struct Answers {
    std::mutex mutex;
    std::size_t outstanding = 0;
    bool uploaded = false;
    bool removeFile = false;
  };
  auto answers = std::make_shared<Answers>();
  const auto done = [answers, shownPath, absoluteURL, completion = std::move(completion)]() {
    const bool uploaded = answers->uploaded;
    if (uploaded) {
      logger().debug("uploadFileWithURL: File upload successful for {}", shownPath);
    } else {
      logger().error("uploadFileWithURL: File upload failed for {}", shownPath);
    }
    writeToLogFile("[uploadFileWithURL] Upload {} for file {}", uploaded ? "succeeded" : "failed", absoluteURL);
    if (completion) {
      completion(uploaded, uploaded && answers->removeFile);
    }
  };

  // The file is read only through the descriptor the client passed; the
  // path is the file's name, nothing more.
  std::string why;
  UploadRequest request;
  request.name = ipc::wire::lastPathComponent(path);
  request.deadline = std::chrono::steady_clock::now() + UploadLimits::fromDefaults().timeLimit;
  request.file = sandbox::GrantedFile::adopt(std::move(descriptor), request.name, &why);
  if (const auto connection = connection_.lock()) {
    request.client = connection->peer().uid;
  }
  const auto set = backends();
  if (!request.file) {
    logger().error("uploadFileWithURL: Refusing to upload {}: {}", shownPath, why);
  }
  if (!request.file || !set || set->empty()) {
    done();
    return;
  }
  answers->outstanding = set->size();
  for (const auto& [name, backend] : *set) {
    // Every backend is asked, also after one has taken the file; the answer
    // leaves once all have answered, from whichever thread answered last.
    backend->uploadFileAtPath(request, [answers, done](bool taken, bool serverSucceeded) {
      {
        std::lock_guard lock(answers->mutex);
        answers->uploaded = answers->uploaded || taken;
        answers->removeFile = answers->removeFile || serverSucceeded;
        if (--answers->outstanding > 0) {
          return;
        }
      }
      done();
    });
  }
}

void ZerithdSession::uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) {
  bool uploaded = false;
  if (const auto set = backends()) {
    for (const auto& [name, backend] : *set) {
      uploaded = backend->uploadLogData(logData) || uploaded;
    }
  }
  if (uploaded) {
    logger().debug("uploadLogData: Log data array upload successful");
  } else {
    logger().error("uploadLogData: Log data array upload failed");
  }
  // No error object is ever passed: the reasons stay in the backends' logs.
  if (completionHandler) {
    completionHandler(uploaded, std::nullopt);
  }
}

}  // namespace zerith
