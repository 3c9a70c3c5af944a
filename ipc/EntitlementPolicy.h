#pragma once

// Which entitlements a connecting process holds, decided from the socket's
// peer credentials and the policy folder (<root>/etc/zerithd/entitlements.d).
//
// Every "*.plist" file there (XML or binary) is a dictionary:
//   "users":        array of user names or uid numbers
//   "groups":       array of group names or gid numbers
//   "entitlements": dictionary of entitlement -> value
// A peer holds the entitlements of every file that lists its uid, its
// primary gid or one of its supplementary groups; files are taken in name
// order and a later file's value for the same entitlement replaces an
// earlier one. A file that cannot be read, does not pass the structural
// check, has another shape or names an unknown user or group is logged and
// grants nothing. The folder is read afresh for every check, so edits apply
// to the next connection.

#include <filesystem>
#include <string>
#include <vector>

#include "ipc/Connection.h"
#include "platform/Log.h"
#include "platform/Value.h"

namespace zerith::ipc {

// The entitlement that admits a client to the daemon.
inline constexpr const char* kZerithdEntitlement = "com.velmar.private.zerithd";

class EntitlementPolicy {
 public:
  // The folder defaults to paths::entitlementsDir() at the time of the check.
  EntitlementPolicy() = default;
  explicit EntitlementPolicy(std::filesystem::path folder);

  std::filesystem::path folder() const;
  Dictionary entitlementsFor(const PeerCredentials& peer) const;
  // Why each policy file that grants nothing does so ("<path>: not a
  // dictionary; the file grants nothing"), as entitlementsFor logs it, in
  // name order; empty when every file counts (zerithd --check).
  std::vector<std::string> problems() const;

 private:
  Dictionary evaluate(const PeerCredentials* peerOrNull, std::vector<std::string>* problems) const;

  std::optional<std::filesystem::path> folder_;
  log::Logger log_{"ipc"};
};

}  // namespace zerith::ipc
