#pragma once

// The client framework's side of a file upload. The framework opens the file
// with the client's own rights (the daemon never opens a path a client
// named), passes the descriptor with the call, and, when the daemon's reply
// says the upload server answered "success", deletes the file itself, in
// the client's process, as long as the path still names the file it opened.

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "ipc/Connection.h"
#include "platform/FileUtil.h"
#include "platform/Value.h"

namespace zerith::ipc {

class ClientUploadFile {
 public:
  // The file a file URL (or a path) names, opened for reading; nullptr with
  // the reason in `why` when the client itself cannot open it.
  static std::shared_ptr<ClientUploadFile> open(const Value& fileURL, std::string* why);

  const std::string& path() const { return path_; }
  // A descriptor of the opened file for one call.
  file::UniqueFd descriptor() const;
  // After the daemon's reply: deletes the file when the reply carries
  // "removeFile" and the path still names the opened file. True when it
  // deleted it.
  bool finish(const std::optional<Dictionary>& reply) const;

 private:
  ClientUploadFile() = default;
  std::string path_;
  file::UniqueFd fd_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
};

// The upload call on `connection`: opens the file, calls with its
// descriptor, deletes it on the daemon's word, then hands the reply on. A
// file the client cannot open fails the call (on the connection's queue)
// without reaching the daemon.
void callUploadFile(Connection& connection, const Value& fileURL, Connection::ReplyHandler handler);

}  // namespace zerith::ipc
