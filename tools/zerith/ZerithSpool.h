#pragma once

// `zerith spool`: what waits in the daemon's spool to be posted again, read
// from the spool folder itself, so that it answers while the daemon is down
// or a collector has been unreachable for days. Per URL: how many batches
// and records, their bytes and the oldest batch's age; batches past
// "spoolMaxAgeSeconds" (the daemon drops them at its next write or retry),
// files the daemon would set aside as unreadable, and what bad/ already
// holds. Nothing in the folder is changed. A readable table by default, one
// JSON line with --json.
//
// The folder is the daemon's (mode 0700): run it as the daemon's user or as
// the superuser.

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "platform/Value.h"

namespace zerith::cli {

struct SpoolListing {
  struct Batch {
    std::string file;
    std::int64_t createdMillis = 0;
    std::uint32_t records = 0;
    std::uint64_t bytes = 0;  // the file's, header included
    std::string url;
  };
  struct Unreadable {
    std::string file;
    std::string why;
  };

  std::filesystem::path folder;
  bool enabled = false;
  std::uint64_t maxBytes = 0;
  std::int64_t maxAgeSeconds = 0;
  std::vector<Batch> batches;  // oldest first
  std::vector<Unreadable> unreadable;
  std::uint64_t setAsideFiles = 0;  // in bad/
  std::uint64_t setAsideBytes = 0;

  Value toValue() const;
};

// The listing of `folder` under the spool settings of the defaults; nullopt
// with the reason when the folder exists but cannot be listed. A folder
// that does not exist is an empty spool.
std::optional<SpoolListing> listSpool(const std::filesystem::path& folder, std::string* why);

// The readable form, ages counted back from `now`.
std::string spoolTable(const SpoolListing& listing, std::chrono::system_clock::time_point now);

// The exit status: 0, or 5 when the folder cannot be listed.
int runSpool(bool json, std::ostream& out, std::ostream& err);

}  // namespace zerith::cli
