#pragma once

// The certificate authorities trusted beside the system store, for every
// TLS connection of the process (URLSession::setExtraCAFile). Process-wide by
// design: the daemon sets it once from its command line.
//
// libcurl keeps one verification store per CA bundle path and reuses it
// across connections (loading the system bundle costs about 25 ms, far more
// than a handshake). So the extra authorities are not added to a store
// libcurl hands out; instead they go into a bundle of their own: the system
// bundle followed by the extra certificates, in an in-memory file whose path
// is new whenever the setting or the system bundle changes.

#include <sys/types.h>

#include <ctime>
#include <mutex>
#include <string>
#include <vector>

#include "platform/FileUtil.h"

namespace zerith {

class ExtraTrust {
 public:
  static ExtraTrust& instance();

  // Loads every certificate of a PEM file; "" removes them. False (and the
  // previous set kept) when the file cannot be read or holds none.
  bool setFile(const std::string& path);
  std::string file() const;

  // The CA bundle a connection should verify against: "" when there are no
  // extra authorities (libcurl's system bundle applies), else the combined
  // bundle's path. "" with `failed` set when the combined bundle cannot be
  // made.
  std::string bundlePath(bool& failed);

 private:
  ExtraTrust();
  bool setFileLocked(const std::string& path);

  mutable std::mutex mutex_;
  std::string path_;
  std::string extraPem_;  // the extra certificates, re-encoded
  std::string systemBundle_;

  std::string bundle_;  // current combined bundle ("" when none made yet)
  struct timespec systemModified_ {};
  off_t systemSize_ = -1;
  // Every bundle handed out stays open: a path must never name other
  // contents later, or libcurl's cached store for it would be wrong.
  std::vector<file::UniqueFd> bundles_;
};

}  // namespace zerith
