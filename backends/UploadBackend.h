#pragma once

// The file upload backend: uploads a whole file a client wrote (typically a
// diagnostic log) to the upload server the storebag names, gzip'd, with
// identifying query parameters, and deletes the file when the server's
// answer holds "success". It sends no events.
//
// Profile keys: "post_url" (required: the upload service's base address),
// "display_url".
//
// The file is reached through the extension token the session issued for it
// (platform/SandboxExtension.h: opened with the client's rights, read and
// deleted only through that opening). Without a token of the session the
// backend opens the path itself under the same rules, for the daemon's own
// user.

#include <memory>
#include <optional>
#include <string>

#include "backends/ZerithBackend.h"

namespace zerith {

class UploadBackend : public ZerithBackend {
 public:
  // nullptr when the profile has no "post_url".
  static std::shared_ptr<UploadBackend> initWithName(std::string name, Value profile,
                                                     std::optional<std::string> productFamily);

  // YES when the request was handed to the transport (whatever the server
  // answered); NO when the file was refused or no request could be made.
  // Blocks until the transport's completion has run.
  bool uploadFileAtPath(const std::string& path, const char* extensionToken) override;

  std::optional<std::string> uploadURL() const;
  void setUploadURL(std::optional<std::string> url);

  // The upload address for a file name: the base address, the device
  // identifier, the session number, the description and "<name>.gz".
  std::string uploadAddressForFileName(std::string_view fileName) const;

  // Percent-encoding with the characters a URL query allows unescaped.
  static std::string percentEncodeQuery(std::string_view text);

  struct Token {
   private:
    Token() = default;
    friend class UploadBackend;
  };
  UploadBackend(Token, std::string name, Value profile, std::optional<std::string> productFamily);

 private:
  mutable std::mutex uploadURLMutex_;
  std::optional<std::string> uploadURL_;
};

}  // namespace zerith
