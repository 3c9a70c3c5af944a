#include "tools/zerith-storebag/StorebagCacheReport.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>

#include <fmt/format.h>

#include "config/ClientTypes.h"
#include "config/StorebagDiskCache.h"
#include "config/StorebagIssueTimes.h"
#include "config/StorebagVerify.h"
#include "platform/FileUtil.h"
#include "platform/HumanText.h"

namespace zerith {

namespace {

// Client types beyond this have no storebag.
constexpr std::uint32_t kLastClientType = 64;

std::vector<std::uint32_t> clientTypesOf(const std::string& name) {
  std::vector<std::uint32_t> types;
  for (std::uint32_t t = 0; t <= kLastClientType; ++t) {
    if (storebagNameForClientType(t) == name) {
      types.push_back(t);
    }
  }
  return types;
}

CachedStorebag describeFile(const std::filesystem::path& folder, const std::string& name,
                            const std::optional<StorebagIssueTimes>& remembered) {
  CachedStorebag entry;
  entry.name = name;
  entry.clientTypes = clientTypesOf(name);
  if (const Value lastModified = defaultsObjectForKey(storebagMetricsKey(name, "Last-Modified"));
      const std::string* text = lastModified.string()) {
    entry.lastModified = *text;
  }
  getLastLoadedStorebagMetricsWithName(name, &entry.maxAgeSeconds, nullptr, nullptr);
  if (remembered) {
    if (const auto found = remembered->find(name); found != remembered->end()) {
      entry.newestAccepted = found->second;
    }
  }

  const file::RegularFileRead read = file::readRegularFile(folder / name, kMaxStorebagContainerBytes);
  if (!read.bytes) {
    entry.signature = "not checked";
    entry.refused = "the file cannot be read: " + read.why;
    return entry;
  }
  const Data* container = &*read.bytes;
  entry.bytes = container->size();
  entry.saved = Date{static_cast<double>(read.status.st_mtim.tv_sec) +
                     static_cast<double>(read.status.st_mtim.tv_nsec) / 1e9};

  const auto strongKey = frameworkStrongPublicKey();
  const auto verification = verifyStorebagContainer(plist::bytesOf(*container), frameworkPublicKey(), strongKey);
  if (verification.status != StorebagVerifyStatus::Verified) {
    entry.signature = "refused: " + describeStorebagRefusal(verification);
    entry.refused = "its signature: " + describeStorebagRefusal(verification);
    return entry;
  }
  entry.signature = strongKey ? "verified (RSA and Ed25519)" : "verified";
  const StorebagBagCheck check = checkStorebagBag(name, verification.bagBytes);
  entry.issued = check.issued;
  if (const Value version = check.bag["version"]; const std::string* text = version.string()) {
    entry.version = *text;
  }
  switch (check.verdict) {
    case StorebagBagCheck::Verdict::Usable: break;
    case StorebagBagCheck::Verdict::Unusable: entry.refused = "signed but unusable: " + check.unusable; break;
    case StorebagBagCheck::Verdict::MissingIssueTime:
      entry.refused = fmt::format("it has no \"{}\" and {} is set", kStorebagIssueTimeKey, kRequireStorebagIssueTimeKey);
      break;
    case StorebagBagCheck::Verdict::Rollback:
      entry.refused = fmt::format("a rollback: issued before {}, the newest issue time accepted for it",
                                  describeIssueTime(*check.newest));
      break;
  }
  return entry;
}

}  // namespace

std::optional<StorebagCacheReport> reportStorebagCache(const std::filesystem::path& folder, std::string* why) {
  StorebagCacheReport report;
  report.folder = folder;
  std::string timesWhy;
  const auto remembered = rememberedStorebagIssueTimes(&timesWhy);

  std::vector<std::string> names;
  if (DIR* dir = ::opendir(report.folder.c_str())) {
    while (const dirent* entry = ::readdir(dir)) {
      // Dot names are the atomic writer's temporaries, never a storebag.
      if (entry->d_name[0] != '.') {
        names.emplace_back(entry->d_name);
      }
    }
    ::closedir(dir);
  } else if (errno != ENOENT) {
    *why = fmt::format("cannot list {}: {}", report.folder.string(), std::strerror(errno));
    return std::nullopt;
  }
  std::sort(names.begin(), names.end());
  for (const std::string& name : names) {
    report.cached.push_back(describeFile(folder, name, remembered));
  }
  if (!remembered) {
    report.issueTimesProblem = timesWhy;
    return report;
  }
  for (const auto& [name, date] : *remembered) {
    if (!std::binary_search(names.begin(), names.end(), name)) {
      report.rememberedOnly.emplace_back(name, date);
    }
  }
  return report;
}

std::string describeStorebagCache(const StorebagCacheReport& report, Date now) {
  std::string out;
  if (report.cached.empty()) {
    out += fmt::format("No storebag is cached in {}.\n", report.folder.string());
  } else {
    out += fmt::format("Storebags cached in {}:\n", report.folder.string());
  }
  for (const CachedStorebag& bag : report.cached) {
    std::string types;
    for (const std::uint32_t t : bag.clientTypes) {
      types += fmt::format("{}{}", types.empty() ? "" : ", ", t);
    }
    out += fmt::format("\n{} ({})\n", bag.name,
                       types.empty() ? std::string("no client type uses this name")
                                     : fmt::format("client type{} {}", bag.clientTypes.size() == 1 ? "" : "s", types));
    if (bag.saved) {
      const double age = std::fabs(now.secondsSince1970 - bag.saved->secondsSince1970);
      out += fmt::format("  saved      {}, {} ago, {} bytes\n", describeIssueTime(*bag.saved), describeDuration(age),
                         bag.bytes);
      const bool expired = age > bag.maxAgeSeconds;
      out += fmt::format("  max age    {}: {}\n", describeDuration(bag.maxAgeSeconds),
                         expired ? "passed; the next session's fetch uses this copy and asks the server again"
                                 : fmt::format("fresh for {} more", describeDuration(bag.maxAgeSeconds - age)));
    }
    if (bag.lastModified) {
      out += fmt::format("  server's Last-Modified  {}\n", *bag.lastModified);
    }
    out += fmt::format("  signature  {}\n", bag.signature);
    if (bag.version) {
      out += fmt::format("  version    {}\n", *bag.version);
    }
    if (bag.saved && bag.signature.starts_with("verified")) {
      out += fmt::format("  issued     {}\n", bag.issued ? describeIssueTime(*bag.issued) : "(no issue time)");
    }
    if (bag.newestAccepted) {
      out += fmt::format("  newest issue time accepted  {}\n", describeIssueTime(*bag.newestAccepted));
    }
    out += bag.refused ? fmt::format("  the daemon refuses this copy: {}\n", *bag.refused)
                       : std::string("  the daemon uses this copy\n");
  }
  if (report.issueTimesProblem) {
    out += fmt::format("\nThe remembered issue times cannot be read: {}; the daemon counts none remembered.\n",
                       *report.issueTimesProblem);
  }
  if (!report.rememberedOnly.empty()) {
    out += fmt::format("\nIssue times remembered without a cached copy ({}):\n", storebagIssueTimesFile().string());
    for (const auto& [name, date] : report.rememberedOnly) {
      out += fmt::format("  {}  {}\n", name, describeIssueTime(date));
    }
  }
  return out;
}

}  // namespace zerith
