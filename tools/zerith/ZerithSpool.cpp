#include "tools/zerith/ZerithSpool.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <map>

#include <fmt/chrono.h>
#include <fmt/format.h>

#include "backends/Spool.h"
#include "platform/FileUtil.h"
#include "platform/HumanText.h"
#include "platform/Json.h"
#include "platform/Paths.h"
#include "tools/zerith/ZerithCli.h"

namespace zerith::cli {

namespace fs = std::filesystem;

namespace {

constexpr std::string_view kSpoolSuffix = ".zspool";
// A write under way (or one a crash cut short, which the daemon removes when
// it starts): never a batch yet.
constexpr std::string_view kTemporaryPrefix = ".tmp-";

std::vector<std::string> namesIn(DIR* dir) {
  std::vector<std::string> names;
  while (const dirent* entry = ::readdir(dir)) {
    const std::string_view name = entry->d_name;
    if (name != "." && name != "..") {
      names.emplace_back(name);
    }
  }
  std::sort(names.begin(), names.end());
  return names;
}

// The batch in one file, or why the daemon would set it aside; nullopt in
// both when the file went meanwhile (its batch was posted or dropped).
struct FileOutcome {
  std::optional<SpoolListing::Batch> batch;
  std::optional<std::string> why;
};

FileOutcome readBatch(const fs::path& path, const std::string& name) {
  if (!name.ends_with(kSpoolSuffix) || name.size() == kSpoolSuffix.size()) {
    return {std::nullopt, "not a spool file name or not a regular file"};
  }
  const file::RegularFileRead read = file::readRegularFile(path, kSpoolHeaderSize + kSpoolMaxBodySize);
  if (!read.bytes) {
    return read.error == ENOENT ? FileOutcome{} : FileOutcome{std::nullopt, read.why};
  }
  std::string why;
  auto batch = decodeSpoolFile(*read.bytes, &why);
  if (!batch) {
    return {std::nullopt, why};
  }
  return {SpoolListing::Batch{name, batch->createdMillis, batch->recordCount, read.bytes->size(), std::move(batch->url)},
          {}};
}

void countSetAside(const fs::path& bad, SpoolListing& listing) {
  DIR* dir = ::opendir(bad.c_str());
  if (!dir) {
    return;
  }
  for (const std::string& name : namesIn(dir)) {
    struct stat st {};
    if (::fstatat(::dirfd(dir), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(st.st_mode)) {
      ++listing.setAsideFiles;
      listing.setAsideBytes += static_cast<std::uint64_t>(st.st_size);
    }
  }
  ::closedir(dir);
}

std::string utcText(std::int64_t millis) {
  const std::chrono::sys_seconds at{std::chrono::seconds(millis / 1000)};
  return fmt::format("{:%Y-%m-%d %H:%M:%S} UTC", at);
}

}  // namespace

Value SpoolListing::toValue() const {
  Array batchValues;
  for (const Batch& b : batches) {
    batchValues.emplace_back(Dictionary{{"file", b.file},
                                        {"createdMillis", static_cast<long long>(b.createdMillis)},
                                        {"records", b.records},
                                        {"bytes", static_cast<unsigned long long>(b.bytes)},
                                        {"url", b.url}});
  }
  Array unreadableValues;
  for (const Unreadable& u : unreadable) {
    unreadableValues.emplace_back(Dictionary{{"file", u.file}, {"why", u.why}});
  }
  return Value(Dictionary{
      {"folder", folder.string()},
      {"enabled", enabled},
      {"maxBytes", static_cast<unsigned long long>(maxBytes)},
      {"maxAgeSeconds", static_cast<long long>(maxAgeSeconds)},
      {"batches", std::move(batchValues)},
      {"unreadable", std::move(unreadableValues)},
      {"setAside", Dictionary{{"files", static_cast<unsigned long long>(setAsideFiles)},
                              {"bytes", static_cast<unsigned long long>(setAsideBytes)}}},
  });
}

std::optional<SpoolListing> listSpool(const fs::path& folder, std::string* why) {
  const SpoolConfig config = SpoolConfig::fromDefaults();
  SpoolListing listing;
  listing.folder = folder;
  listing.enabled = config.enabled;
  listing.maxBytes = config.maxBytes;
  listing.maxAgeSeconds = config.maxAgeSeconds;
  DIR* dir = ::opendir(folder.c_str());
  if (!dir) {
    if (errno == ENOENT) {
      return listing;
    }
    *why = fmt::format("cannot list {}: {}", folder.string(), std::strerror(errno));
    if (errno == EACCES) {
      *why += " (the folder is the daemon's: run as its user or as the superuser)";
    }
    return std::nullopt;
  }
  const std::vector<std::string> names = namesIn(dir);
  ::closedir(dir);
  for (const std::string& name : names) {
    if (name == "bad" || name.starts_with(kTemporaryPrefix)) {
      continue;
    }
    FileOutcome outcome = readBatch(folder / name, name);
    if (outcome.batch) {
      listing.batches.push_back(std::move(*outcome.batch));
    } else if (outcome.why) {
      listing.unreadable.push_back({name, std::move(*outcome.why)});
    }
  }
  countSetAside(folder / "bad", listing);
  return listing;
}

std::string spoolTable(const SpoolListing& listing, std::chrono::system_clock::time_point now) {
  const std::int64_t nowMillis =
      std::chrono::duration_cast<std::chrono::milliseconds>(now.time_since_epoch()).count();
  const auto ageSeconds = [nowMillis](std::int64_t createdMillis) { return (nowMillis - createdMillis) / 1000; };
  std::string out = fmt::format("Spool {}: ", listing.folder.string());
  if (listing.enabled) {
    out += fmt::format("spooling on, up to {}, batches kept {}\n", describeByteCount(listing.maxBytes),
                       describeDuration(listing.maxAgeSeconds));
  } else {
    out += "spooling is off (spoolEnabled is not true)";
    out += listing.batches.empty() ? "\n" : "; the batches below stay until it is on again\n";
  }

  if (listing.batches.empty()) {
    out += "No batch waits.\n";
  } else {
    struct Row {
      std::uint64_t batches = 0;
      std::uint64_t records = 0;
      std::uint64_t bytes = 0;
      std::int64_t oldestMillis = 0;
    };
    std::map<std::string, Row> byURL;
    std::uint64_t records = 0;
    std::uint64_t bytes = 0;
    std::size_t expired = 0;
    for (const auto& b : listing.batches) {
      Row& row = byURL[b.url];
      row.oldestMillis = row.batches == 0 ? b.createdMillis : std::min(row.oldestMillis, b.createdMillis);
      ++row.batches;
      row.records += b.records;
      row.bytes += b.bytes;
      records += b.records;
      bytes += b.bytes;
      if (ageSeconds(b.createdMillis) > listing.maxAgeSeconds) {
        ++expired;
      }
    }
    const std::int64_t oldest =
        std::min_element(listing.batches.begin(), listing.batches.end(), [](const auto& a, const auto& b) {
          return a.createdMillis < b.createdMillis;
        })->createdMillis;
    out += fmt::format("{} batch{}, {} record{}, {}; the oldest made {} ({} ago)\n\n", listing.batches.size(),
                       listing.batches.size() == 1 ? "" : "es", records, records == 1 ? "" : "s", describeByteCount(bytes),
                       utcText(oldest), describeDuration(ageSeconds(oldest)));

    std::vector<std::pair<std::string, Row>> rows(byURL.begin(), byURL.end());
    std::stable_sort(rows.begin(), rows.end(),
                     [](const auto& a, const auto& b) { return a.second.oldestMillis < b.second.oldestMillis; });
    std::vector<std::array<std::string, 5>> cells{{"URL", "BATCHES", "RECORDS", "BYTES", "OLDEST"}};
    for (const auto& [url, row] : rows) {
      cells.push_back({url, std::to_string(row.batches), std::to_string(row.records), describeByteCount(row.bytes),
                       describeDuration(ageSeconds(row.oldestMillis))});
    }
    std::array<std::size_t, 5> widths{};
    for (const auto& line : cells) {
      for (std::size_t i = 0; i < line.size(); ++i) {
        widths[i] = std::max(widths[i], line[i].size());
      }
    }
    for (const auto& line : cells) {
      out += fmt::format("{:<{}}  {:>{}}  {:>{}}  {:>{}}  {}\n", line[0], widths[0], line[1], widths[1], line[2],
                         widths[2], line[3], widths[3], line[4]);
    }
    if (expired > 0) {
      out += fmt::format("\n{} batch{} past the age of {}: the daemon drops {} at its next write or retry.\n",
                         expired, expired == 1 ? " is" : "es are", describeDuration(listing.maxAgeSeconds),
                         expired == 1 ? "it" : "them");
    }
  }
  if (!listing.unreadable.empty()) {
    out += "\nUnreadable, set aside to bad/ when the daemon next reads the folder:\n";
    for (const auto& u : listing.unreadable) {
      out += fmt::format("  {}: {}\n", u.file, u.why);
    }
  }
  if (listing.setAsideFiles > 0) {
    out += fmt::format("\nbad/ holds {} file{} ({}) set aside earlier; the daemon never reads them again.\n",
                       listing.setAsideFiles, listing.setAsideFiles == 1 ? "" : "s", describeByteCount(listing.setAsideBytes));
  }
  return out;
}

int runSpool(bool json, std::ostream& out, std::ostream& err) {
  std::string why;
  const auto listing = listSpool(paths::spoolDir(), &why);
  if (!listing) {
    err << "zerith: spool: " << why << '\n';
    return kExitStepFailed;
  }
  if (json) {
    out << json::serialize(listing->toValue()) << '\n';
  } else {
    out << spoolTable(*listing, std::chrono::system_clock::now());
  }
  return 0;
}

}  // namespace zerith::cli
