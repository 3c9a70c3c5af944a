#include "ipc/ClientUploadFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "ipc/ClientSessionWire.h"
#include "ipc/Frame.h"
#include "platform/Log.h"

namespace zerith::ipc {

std::shared_ptr<ClientUploadFile> ClientUploadFile::open(const Value& fileURL, std::string* why) {
  const std::string path = wire::filePathOfURL(fileURL.string() ? *fileURL.string() : std::string());
  std::shared_ptr<ClientUploadFile> file(new ClientUploadFile);
  file->path_ = path;
  // Non-blocking: a FIFO or device named here must not hang the client; the
  // daemon refuses anything but a regular file.
  file->fd_ = file::UniqueFd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  struct stat status {};
  if (!file->fd_ || ::fstat(file->fd_.get(), &status) != 0) {
    *why = "cannot open " + log::escaped(path) + " for upload: " + std::strerror(errno);
    return nullptr;
  }
  file->device_ = status.st_dev;
  file->inode_ = status.st_ino;
  return file;
}

file::UniqueFd ClientUploadFile::descriptor() const { return file::UniqueFd(::fcntl(fd_.get(), F_DUPFD_CLOEXEC, 0)); }

bool ClientUploadFile::finish(const std::optional<Dictionary>& reply) const {
  if (!reply || !reply->get(wire::kRemoveFile).boolValue()) {
    return false;
  }
  struct stat now {};
  if (::lstat(path_.c_str(), &now) != 0 || now.st_dev != device_ || now.st_ino != inode_) {
    return false;  // gone or replaced meanwhile: someone else's file now
  }
  return ::unlink(path_.c_str()) == 0;
}

void callUploadFile(Connection& connection, const Value& fileURL, Connection::ReplyHandler handler) {
  std::string why;
  const auto file = ClientUploadFile::open(fileURL, &why);
  if (!file) {
    connection.queue().async([handler = std::move(handler), why] {
      if (handler) {
        handler(std::nullopt, Error{kErrorDomain, -1, why});
      }
    });
    return;
  }
  std::vector<file::UniqueFd> descriptors;
  descriptors.push_back(file->descriptor());
  // Always a call, also when the caller wants no answer: the reply is what
  // deletes the file.
  connection.call(wire::kUploadFile, wire::uploadFileArgs(fileURL, Value()), std::move(descriptors),
                  [file, handler = std::move(handler)](std::optional<Dictionary> reply, std::optional<Error> error) {
                    file->finish(reply);
                    if (handler) {
                      handler(std::move(reply), std::move(error));
                    }
                  });
}

}  // namespace zerith::ipc
