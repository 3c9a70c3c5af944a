#pragma once

// The daemon's status as the status call answers it (`zerith status`): per
// live session and backend what became of its events, and the totals of
// ended sessions per client type and backend.
//
// On the wire (the reply's "status" argument):
//   {"sessions": [{"sessionID": u32, "sessionIDString": string, "clientType": int,
//                  "backends": [{"name": string, "state": int, "counts": {name: u64}}]}],
//    "ended":    [{"clientType": int, "backend": string, "sessions": u64, "counts": {name: u64}}],
//    "storebags": {"counts": {name: u64}}}   (absent from older daemons)
// Count names are the backends' counter names ("sent", "droppedFiltered");
// names this side does not know are kept as they are, so an older tool
// shows a newer daemon's counts.
//
// The reply comes from a socket: fromValue checks every element before it
// is used and refuses the whole status on the first one that does not fit.

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/Value.h"

namespace zerith::ipc {

// The operation and the entitlement a peer needs for it (in addition to the
// one that admits it to the daemon).
inline constexpr const char* kFetchDaemonStatus = "fetchDaemonStatusWithCompletionHandler:";
inline constexpr const char* kDaemonStatusEntitlement = "com.velmar.private.zerithd.status";
// The reply's argument.
inline constexpr const char* kStatusArgument = "status";

// Limits of what fromValue accepts.
inline constexpr std::size_t kStatusMaxNameBytes = 256;
inline constexpr std::size_t kStatusMaxCounts = 64;

using CountList = std::vector<std::pair<std::string, std::uint64_t>>;

struct BackendStatus {
  std::string name;
  std::int64_t state = 0;
  CountList counts;
};

struct SessionStatus {
  std::uint32_t sessionID = 0;
  std::string sessionIDString;
  std::int64_t clientType = 0;
  std::vector<BackendStatus> backends;
};

struct EndedTotals {
  std::int64_t clientType = 0;
  std::string backend;
  std::uint64_t sessions = 0;
  CountList counts;
};

struct DaemonStatus {
  std::vector<SessionStatus> sessions;
  std::vector<EndedTotals> ended;
  // Signed storebags the daemon refused ("rollbacksRefused", ...).
  CountList storebags;

  Value toValue() const;
  // nullopt, with `why`, when `v` is not a status of the shape above.
  static std::optional<DaemonStatus> fromValue(const Value& v, std::string* why = nullptr);
};

// The value of `name` in `counts`, 0 when absent.
std::uint64_t countOf(const CountList& counts, std::string_view name);

}  // namespace zerith::ipc
