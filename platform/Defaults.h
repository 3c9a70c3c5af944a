#pragma once

// User defaults: one domain ("com.velmar.zerith", "com.velmar.timed", ...) is
// an XML property list `<domain>.plist` in the defaults folder.
//
// Reads see other processes' writes without a restart: the file is re-read
// whenever its identity (inode, size, modification time) changed. Writes are
// atomic (temporary file, fsync, rename) and serialised between processes by
// an advisory lock on `<domain>.plist.lock`. A file that fails the structural
// check or does not parse to a dictionary is logged, read as empty, and moved
// aside to `<domain>.plist.corrupt` by the next write instead of being lost.

#include <filesystem>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace zerith {

class Defaults {
 public:
  explicit Defaults(std::string domain);

  const std::string& domain() const { return domain_; }
  std::filesystem::path path() const;

  // nil when the domain has no such key (or no file).
  Value objectForKey(std::string_view key) const;
  // A nil value removes the key. Returns false when the write failed (logged).
  bool setObject(std::string_view key, const Value& value) const;
  bool removeObject(std::string_view key) const { return setObject(key, Value()); }
  // The whole domain as a dictionary (empty when there is none).
  Value dictionary() const;

 private:
  std::string domain_;
};

}  // namespace zerith
