#include "tools/zerith/ZerithStatus.h"

#include <algorithm>
#include <cctype>
#include <string_view>
#include <vector>

#include <fmt/format.h>

#include "platform/Json.h"
#include "tools/zerith/ZerithCli.h"
#include "zerith/Zerith.h"

namespace zerith::cli {

namespace {

constexpr std::string_view kDropped = "dropped";
// The counts with a column of their own, in this order: what the backend
// accepted, what it did, where events are now; DROPPED follows. For a
// backend that posts, ACCEPTED = DELIVERED + INBATCH + INFLIGHT + INSPOOL +
// DROPPED once nothing moves.
constexpr const char* kColumns[] = {"accepted", "sent",    "batched",  "spooled", "retried",
                                    "delivered", "inBatch", "inFlight", "inSpool"};

std::string stateName(std::int64_t state) {
  switch (state) {
    case 0: return "undecided";
    case 1: return "disabled";
    case 2: return "enabled";
    case 3: return "sampled out";
    default: return std::to_string(state);
  }
}

// "droppedSampledOut" -> "sampledOut".
std::string reason(std::string_view name) {
  std::string out(name.substr(kDropped.size()));
  if (!out.empty()) {
    out[0] = static_cast<char>(std::tolower(static_cast<unsigned char>(out[0])));
  }
  return out;
}

// The count columns, the dropped total and the reasons of one row.
void addCounts(std::vector<std::string>& row, const ipc::CountList& counts) {
  for (const char* column : kColumns) {
    row.push_back(std::to_string(ipc::countOf(counts, column)));
  }
  std::uint64_t dropped = 0;
  std::string why;
  for (const auto& [name, value] : counts) {
    if (!std::string_view(name).starts_with(kDropped) || name.size() == kDropped.size() || value == 0) {
      continue;
    }
    dropped += value;
    why += fmt::format("{}{} {}", why.empty() ? "" : ", ", reason(name), value);
  }
  row.push_back(std::to_string(dropped));
  row.push_back(why.empty() ? "-" : why);
}

// Columns padded to their widest cell; numbers (all but the first
// `leftColumns` and the last) right-aligned.
std::string render(const std::vector<std::vector<std::string>>& rows, std::size_t leftColumns) {
  std::vector<std::size_t> widths;
  for (const auto& row : rows) {
    widths.resize(std::max(widths.size(), row.size()));
    for (std::size_t i = 0; i < row.size(); ++i) {
      widths[i] = std::max(widths[i], row[i].size());
    }
  }
  std::string out;
  for (const auto& row : rows) {
    std::string line;
    for (std::size_t i = 0; i < row.size(); ++i) {
      const bool last = i + 1 == row.size();
      const bool left = i < leftColumns || last;
      if (i > 0) {
        line += "  ";
      }
      line += left ? fmt::format("{:<{}}", row[i], last ? 0 : widths[i]) : fmt::format("{:>{}}", row[i], widths[i]);
    }
    out += line + '\n';
  }
  return out;
}

std::vector<std::string> header(std::initializer_list<const char*> first) {
  std::vector<std::string> row(first.begin(), first.end());
  for (const char* column : kColumns) {
    std::string upper(column);
    std::transform(upper.begin(), upper.end(), upper.begin(), [](unsigned char c) { return std::toupper(c); });
    row.push_back(upper);
  }
  row.push_back("DROPPED");
  row.push_back("WHY");
  return row;
}

}  // namespace

std::string statusTable(const ipc::DaemonStatus& status) {
  std::string out = fmt::format("Live sessions: {}\n", status.sessions.size());
  std::vector<std::vector<std::string>> live{header({"SESSION", "CLIENT", "BACKEND", "STATE"})};
  for (const auto& session : status.sessions) {
    if (session.backends.empty()) {
      live.push_back({std::to_string(session.sessionID), std::to_string(session.clientType), "-", "no backends"});
      continue;
    }
    for (const auto& backend : session.backends) {
      std::vector<std::string> row{std::to_string(session.sessionID), std::to_string(session.clientType), backend.name,
                                   stateName(backend.state)};
      addCounts(row, backend.counts);
      live.push_back(std::move(row));
    }
  }
  if (live.size() > 1) {
    out += render(live, 4);
  }
  out += "\nEnded sessions, totals by client type and backend:\n";
  std::vector<std::vector<std::string>> ended{header({"CLIENT", "BACKEND", "SESSIONS"})};
  for (const auto& total : status.ended) {
    std::vector<std::string> row{std::to_string(total.clientType), total.backend, std::to_string(total.sessions)};
    addCounts(row, total.counts);
    ended.push_back(std::move(row));
  }
  out += ended.size() > 1 ? render(ended, 2) : std::string("(none)\n");
  if (!status.storebags.empty()) {
    out += "\nSigned storebags refused:";
    for (const auto& [name, value] : status.storebags) {
      out += fmt::format(" {} {}", name, value);
    }
    out += '\n';
  }
  return out;
}

int runStatus(const std::filesystem::path& socket, std::chrono::milliseconds timeout, bool json, std::ostream& out,
              std::ostream& err) {
  Error error;
  const auto session = Zerith::connect(socket, &error);
  if (!session) {
    err << "zerith: the daemon is unreachable: " << error.description << '\n';
    return kExitUnreachable;
  }
  const ZerithReply reply = session->callAndWait(ipc::kFetchDaemonStatus, Dictionary(), timeout);
  if (reply.error) {
    if (!session->isValid()) {
      err << "zerith: the daemon closed the connection (is this user granted com.velmar.private.zerithd?)\n";
      return kExitRefused;
    }
    err << "zerith: status: " << reply.error->description << '\n';
    return kExitStepFailed;
  }
  if (const Value refused = reply["error"]; !refused.isNil()) {
    const Value description = refused["description"];
    err << "zerith: status: " << (description.string() ? *description.string() : json::serialize(refused)) << '\n';
    return kExitRefused;
  }
  std::string why;
  const auto status = ipc::DaemonStatus::fromValue(reply["status"], &why);
  if (!status) {
    err << "zerith: status: the daemon's answer is not a status: " << why << '\n';
    return kExitStepFailed;
  }
  if (json) {
    out << json::serialize(status->toValue()) << '\n';
  } else {
    out << statusTable(*status);
  }
  return 0;
}

}  // namespace zerith::cli
