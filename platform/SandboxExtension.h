#pragma once

// Files a client hands to the daemon for upload, and the extension tokens
// that stand for them.
//
// A client asks the daemon to upload a file it wrote. The daemon must read
// that file with the client's rights, never its own: it opens the file for
// the client's identity (taken from the socket's credentials) and afterwards
// reads and deletes only through what it opened.
//
// GrantedFile::open refuses, with a reason:
//   - a path that is relative, holds a ".." component, a zero byte, or is
//     longer than PATH_MAX;
//   - a symbolic link anywhere on the path (each folder is opened with
//     O_NOFOLLOW in turn, the file with O_NOFOLLOW);
//   - anything that is not a regular file (folders, FIFOs, sockets, devices
//     are refused from an lstat before they are opened, so that opening a
//     device never has side effects);
//   - a file not owned by the client or without the owner's read bit;
//   - a file larger than kMaxUploadFileBytes.
// When the daemon runs as root it opens the path with the client's file-
// system uid and gid (setfsuid/setfsgid, which affect only the calling
// thread), so folders the client cannot search stop the open too.
//
// readAll reads exactly the size seen at open through the descriptor and
// refuses a file whose size, inode or modification time changed meanwhile.
// remove unlinks the name only while it still names the opened file.
//
// Extension tokens: the session opens the file, issues a token for it and
// hands the token to its backends, which consume it to reach the opened
// file; the session revokes it when the upload is over.

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Value.h"

namespace zerith::sandbox {

inline constexpr std::uint64_t kMaxUploadFileBytes = 64ull << 20;

struct Identity {
  uid_t uid = 0;
  gid_t gid = 0;
  // The daemon's own effective identity.
  static Identity ofProcess();
};

class GrantedFile {
 public:
  // nullptr with the reason in `why` when the file is refused.
  static std::shared_ptr<GrantedFile> open(std::string_view path, const Identity& owner, std::string* why = nullptr);

  ~GrantedFile();
  GrantedFile(const GrantedFile&) = delete;
  GrantedFile& operator=(const GrantedFile&) = delete;

  const std::string& path() const { return path_; }
  std::uint64_t size() const { return static_cast<std::uint64_t>(status_.st_size); }
  const Identity& owner() const { return owner_; }

  // The whole file; nullopt (and why) when it cannot be read whole or
  // changed while being read.
  std::optional<Data> readAll(std::string* why = nullptr) const;
  // Unlinks the file's name while it still names this file.
  bool remove(std::string* why = nullptr) const;

 private:
  GrantedFile() = default;

  int fd_ = -1;
  int directory_ = -1;  // O_PATH descriptor of the folder that holds the name
  std::string name_;
  std::string path_;
  struct stat status_ {};
  Identity owner_;
};

// A new token for `file`; valid until revoked.
std::string issueExtension(std::shared_ptr<GrantedFile> file);
void revokeExtension(const std::string& token);
// The file a token stands for; nullptr for no token or an unknown one.
std::shared_ptr<GrantedFile> consumeExtension(const char* token);

}  // namespace zerith::sandbox
