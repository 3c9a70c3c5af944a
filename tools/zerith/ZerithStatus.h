#pragma once

// `zerith status`: what became of the events of the daemon's sessions, per
// live session and backend, and the totals of ended sessions per client type
// and backend. A readable table by default, the status as one JSON line with
// --json. Needs the entitlement com.velmar.private.zerithd.status.

#include <chrono>
#include <filesystem>
#include <ostream>
#include <string>

#include "ipc/DaemonStatus.h"

namespace zerith::cli {

// The exit status: 0, 3 daemon unreachable, 4 refused (no entitlement, or
// the daemon closed the connection), 5 no answer in time or an answer that
// is not a status.
int runStatus(const std::filesystem::path& socket, std::chrono::milliseconds timeout, bool json, std::ostream& out,
              std::ostream& err);

// The two tables of the readable form.
std::string statusTable(const ipc::DaemonStatus& status);

}  // namespace zerith::cli
