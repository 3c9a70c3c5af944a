#pragma once

// Files a client hands to the daemon for upload.
//
// The extension token that lets the daemon read a client's file is, here,
// the open descriptor itself: the client framework opens the file with the
// client's own rights and passes the descriptor with the call (SCM_RIGHTS).
// The daemon never opens a path a client named; the path travels only as
// the file's name for the upload address and the logs. Whatever happens to
// the file afterwards (deleting it once the server has it) is done by the
// client framework, in the client's process, on the daemon's word.
//
// GrantedFile::adopt refuses, with a reason:
//   - no descriptor, or one the daemon cannot examine;
//   - anything that is not a regular file (a folder, FIFO, socket, device);
//   - a descriptor not open for reading;
//   - a file larger than kMaxUploadFileBytes.
// readAll reads exactly the size seen at adopt through the descriptor (from
// offset 0, whatever the client's offset) and refuses a file whose size,
// inode or modification time changed meanwhile.

#include <sys/stat.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/FileUtil.h"
#include "platform/Value.h"

namespace zerith::sandbox {

inline constexpr std::uint64_t kMaxUploadFileBytes = 64ull << 20;

class GrantedFile {
 public:
  // nullptr with the reason in `why` when the file is refused. `descriptor`
  // is shared with the message it came with; the file keeps it open.
  static std::shared_ptr<GrantedFile> adopt(std::shared_ptr<const file::UniqueFd> descriptor, std::string name,
                                            std::string* why = nullptr);

  // The file's name as the client gave it (the last path component).
  const std::string& name() const { return name_; }
  std::uint64_t size() const { return static_cast<std::uint64_t>(status_.st_size); }

  // The whole file; nullopt (and why) when it cannot be read whole or
  // changed while being read.
  std::optional<Data> readAll(std::string* why = nullptr) const;

 private:
  GrantedFile() = default;

  std::shared_ptr<const file::UniqueFd> descriptor_;
  std::string name_;
  struct stat status_ {};
};

}  // namespace zerith::sandbox
