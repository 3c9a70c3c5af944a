#include "config/StorebagIssueTimes.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstring>
#include <ctime>
#include <mutex>
#include <thread>

#include <fmt/format.h>

#include "config/ConfigLog.h"
#include "config/StorebagDiskCache.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"

namespace zerith {

namespace {

// One dictionary of names and dates.
plist::Limits issueTimesLimits() { return plist::Limits{kMaxStorebagIssueTimesBytes, 2, 4096}; }

// The lock file beside the times: held while a process reads, changes and
// replaces them. Waits at most about a second for another holder.
class IssueTimesLock {
 public:
  IssueTimesLock() {
    const auto file = storebagIssueTimesFile();
    std::error_code ec;
    std::filesystem::create_directories(file.parent_path(), ec);
    fd_.reset(::open((file.string() + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644));
    if (!fd_) {
      error_ = fmt::format("cannot open '{}.lock': {}", file.string(), std::strerror(errno));
      return;
    }
    constexpr int kAttempts = 100;
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
      if (::flock(fd_.get(), LOCK_EX | LOCK_NB) == 0) {
        return;
      }
      if (errno != EWOULDBLOCK && errno != EINTR) {
        break;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    error_ = fmt::format("'{}.lock' is held by another process", file.string());
    fd_.reset();
  }
  // Empty when the lock is held.
  const std::string& error() const { return error_; }

 private:
  file::UniqueFd fd_;  // closing it releases the lock
  std::string error_;
};

// The remembered times; nullopt with `why` when the file exists but fails
// its checks. A missing file is an empty set.
std::optional<StorebagIssueTimes> readIssueTimes(std::string& why) {
  const auto path = storebagIssueTimesFile();
  std::error_code ec;
  if (!std::filesystem::exists(path, ec)) {
    return StorebagIssueTimes{};
  }
  const auto bytes = file::readAll(path, kMaxStorebagIssueTimesBytes);
  if (!bytes) {
    why = fmt::format("cannot read '{}' (unreadable, or larger than {} bytes)", path.string(),
                      kMaxStorebagIssueTimesBytes);
    return std::nullopt;
  }
  auto times = decodeStorebagIssueTimes(plist::bytesOf(*bytes), &why);
  if (!times) {
    why = fmt::format("'{}' is unusable: {}", path.string(), why);
  }
  return times;
}

bool writeIssueTimes(const StorebagIssueTimes& times, std::string& why) {
  const auto path = storebagIssueTimesFile();
  errno = 0;
  if (file::writeAtomically(path, encodeStorebagIssueTimes(times), std::filesystem::perms(0644))) {
    return true;
  }
  why = fmt::format("cannot write '{}': {}", path.string(), errno ? std::strerror(errno) : "write failed");
  return false;
}

}  // namespace

std::filesystem::path storebagIssueTimesFile() { return paths::resolve("/var/lib/zerithd/storebag-issue-times.plist"); }

std::optional<StorebagIssueTimes> decodeStorebagIssueTimes(plist::Bytes bytes, std::string* why) {
  std::string error;
  const auto decoded = plist::decode(bytes, issueTimesLimits(), &error);
  if (!decoded || !decoded->isDict()) {
    if (why) {
      *why = decoded ? "not a dictionary" : error;
    }
    return std::nullopt;
  }
  StorebagIssueTimes times;
  for (const auto& [name, value] : *decoded->dict()) {
    const auto date = value.date();
    if (name.empty() || !date || !std::isfinite(date->secondsSince1970)) {
      if (why) {
        *why = fmt::format("the entry '{}' is not a storebag name with a date", name);
      }
      return std::nullopt;
    }
    times[name] = *date;
  }
  return times;
}

Data encodeStorebagIssueTimes(const StorebagIssueTimes& times) {
  Dictionary d;
  for (const auto& [name, date] : times) {
    d.set(name, Value(date));
  }
  return plist::encodeBinary(Value(std::move(d)));
}

std::optional<Date> storebagIssueTime(const Value& bag, std::string* unusable) {
  const Value issued = bag[kStorebagIssueTimeKey];
  if (issued.isNil()) {
    return std::nullopt;
  }
  const auto date = issued.date();
  if (!date || !std::isfinite(date->secondsSince1970)) {
    if (unusable) {
      *unusable = fmt::format("its \"{}\" is {}, not a date", kStorebagIssueTimeKey, issued.description());
    }
    return std::nullopt;
  }
  return date;
}

bool storebagIssueTimeRequired() { return defaultsObjectForKey(kRequireStorebagIssueTimeKey).boolValue(); }

std::optional<StorebagIssueTimes> rememberedStorebagIssueTimes(std::string* why) {
  std::lock_guard inProcess(ZerithdUtil::lock());
  std::string error;
  auto times = readIssueTimes(error);
  if (!times && why) {
    *why = std::move(error);
  }
  return times;
}

std::optional<Date> rememberedStorebagIssueTime(const std::string& name) {
  std::string why;
  const auto times = rememberedStorebagIssueTimes(&why);
  if (!times) {
    configLogger().error("rememberedStorebagIssueTime: {}; no issue time is remembered for storebag '{}'", why, name);
    return std::nullopt;
  }
  const auto found = times->find(name);
  return found == times->end() ? std::nullopt : std::optional<Date>(found->second);
}

bool rememberStorebagIssueTime(const std::string& name, Date issued) {
  std::lock_guard inProcess(ZerithdUtil::lock());
  const IssueTimesLock lock;
  std::string why = lock.error();
  if (why.empty()) {
    auto times = readIssueTimes(why);
    if (!times) {
      // A damaged file is replaced: the times it held are lost either way.
      configLogger().error("rememberStorebagIssueTime: {}; it is written afresh", why);
      times.emplace();
      why.clear();
    }
    const auto found = times->find(name);
    if (found != times->end() && found->second >= issued) {
      return true;
    }
    (*times)[name] = issued;
    if (writeIssueTimes(*times, why)) {
      return true;
    }
  }
  configLogger().error("rememberStorebagIssueTime: issue time {} of storebag '{}' not remembered: {}",
                       describeIssueTime(issued), name, why);
  return false;
}

bool forgetStorebagIssueTime(const std::string& name, std::optional<Date>& forgotten, std::string* error) {
  std::lock_guard inProcess(ZerithdUtil::lock());
  forgotten.reset();
  const IssueTimesLock lock;
  std::string why = lock.error();
  if (why.empty()) {
    auto times = readIssueTimes(why);
    if (times) {
      const auto found = times->find(name);
      if (found == times->end()) {
        return true;
      }
      forgotten = found->second;
      times->erase(found);
      if (writeIssueTimes(*times, why)) {
        return true;
      }
      forgotten.reset();
    }
  }
  if (error) {
    *error = why;
  }
  return false;
}

std::string describeIssueTime(Date date) {
  const auto seconds = static_cast<std::time_t>(std::floor(date.secondsSince1970));
  std::tm tm{};
  gmtime_r(&seconds, &tm);
  return fmt::format("{:04}-{:02}-{:02} {:02}:{:02}:{:02} +0000", tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday,
                     tm.tm_hour, tm.tm_min, tm.tm_sec);
}

}  // namespace zerith
