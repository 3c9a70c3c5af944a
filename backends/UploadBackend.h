#pragma once

// The file upload backend: uploads a whole file a client wrote (typically a
// diagnostic log) to the upload server the storebag names, gzip'd, with
// identifying query parameters. It sends no events.
//
// Profile keys: "post_url" (required: the upload service's base address;
// the https rule of event posts applies), "display_url".
//
// The file is read through the descriptor the client passed with the call
// (platform/SandboxExtension.h); the daemon never opens a path a client
// named. When the server's answer holds "success" the backend says so, and
// the client framework deletes the file in the client's process.
//
// Uploads never hold a thread while they wait: an upload is an exchange
// that runs on the transport and completes through its completion. At most
// `atOnce` uploads run in the process and `perClient` per client user; the
// rest wait their turn in a bounded queue, without a thread, or are refused
// (NO and a log line) when that queue is full too. Every request has one
// time limit from its arrival to its answer (waiting included): at the limit
// it ends with NO, and so does an upload whose body file cannot be written.

#include <chrono>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>

#include "backends/ZerithBackend.h"

namespace zerith {

struct UploadLimits {
  std::chrono::milliseconds timeLimit{std::chrono::seconds(120)};
  std::size_t atOnce = 4;      // uploads running in the process
  std::size_t perClient = 2;   // uploads running for one client user
  std::size_t waiting = 32;    // uploads waiting their turn in the process
  std::size_t waitingPerClient = 8;

  // The defaults keys "uploadTimeoutSeconds", "uploadsAtOnce" and
  // "uploadsPerClient" (com.velmar.zerith), read for each request; a value
  // of the wrong kind or out of range keeps the default.
  static UploadLimits fromDefaults();
};

// Uploads running and waiting now, for status and tests.
struct UploadLoad {
  std::size_t running = 0;
  std::size_t waiting = 0;
};
UploadLoad uploadLoad();

class UploadBackend : public ZerithBackend {
 public:
  // nullptr when the profile has no "post_url".
  static std::shared_ptr<UploadBackend> initWithName(std::string name, Value profile,
                                                     std::optional<std::string> productFamily);

  // Takes the file (completion's `taken`) when it could be read and posted;
  // NO when the file was refused, no request could be made, the body file
  // could not be written, the queue was full or the time limit passed.
  void uploadFileAtPath(const UploadRequest& request, UploadCompletion completion) override;

  std::optional<std::string> uploadURL() const;
  void setUploadURL(std::optional<std::string> url);

  // The upload address for a file name: the base address, the device
  // identifier, the session number, the description and "<name>.gz".
  std::string uploadAddressForFileName(std::string_view fileName) const;

  // Percent-encoding with the characters a URL query allows unescaped.
  static std::string percentEncodeQuery(std::string_view text);

  // One upload request on its way (the gate's unit).
  struct Exchange;

  struct Token {
   private:
    Token() = default;
    friend class UploadBackend;
  };
  UploadBackend(Token, std::string name, Value profile, std::optional<std::string> productFamily);

 private:
  void run(const std::shared_ptr<Exchange>& exchange);

  mutable std::mutex uploadURLMutex_;
  std::optional<std::string> uploadURL_;
};

}  // namespace zerith
