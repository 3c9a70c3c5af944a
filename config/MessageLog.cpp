#include "config/MessageLog.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstring>
#include <ctime>
#include <memory>
#include <system_error>
#include <vector>

#include "platform/FileUtil.h"
#include "config/ConfigLog.h"
#include "platform/Paths.h"
#include "platform/Value.h"

namespace zerith {

namespace {

namespace fs = std::filesystem;

constexpr std::string_view kPrefix = "zerithd";
constexpr std::string_view kSuffix = "messageLog.diag";

std::string describe(std::optional<double> date) { return date ? dateDescription(*date) : std::string("(null)"); }

struct Current {
  fs::path path;
  std::optional<double> date;
};

// Steps 1 and 2: lists the folder (creating it when missing), removes
// expired and superseded log files and answers the newest one left.
std::optional<Current> rotate(const fs::path& folder, double now, const MessageLog::Options& options) {
  // readdir rather than directory_iterator: the iterator builds and parses
  // a full path per entry, which made listing a folder of 100 files cost
  // more than all the system calls of an append together.
  std::vector<std::string> names;
  std::unique_ptr<DIR, int (*)(DIR*)> dir(::opendir(folder.c_str()), ::closedir);
  if (!dir && errno == ENOENT) {
    configLogger().info("writeToLogFile: Creating zerithd log directory at {}", folder.string());
    std::error_code createError;
    fs::create_directories(folder, createError);
  } else if (!dir) {
    configLogger().error("writeToLogFile: Error reading from log directory: {}",
                   std::error_code(errno, std::generic_category()).message());
  } else {
    while (const dirent* entry = ::readdir(dir.get())) {
      const std::string_view name = entry->d_name;
      if (name != "." && name != "..") {
        names.emplace_back(name);
      }
    }
  }
  // Listing order is the file system's; sort for a deterministic tie-break.
  std::sort(names.begin(), names.end());

  std::optional<Current> current;
  for (const std::string& name : names) {
    if (!isMessageLogFileName(name)) {
      continue;
    }
    const fs::path path = folder / name;
    const std::optional<double> date =
        options.creationDate ? options.creationDate(path, name) : logFileCreationDate(path, name);
    if (date && now - *date > kMessageLogExpirySeconds) {
      deleteExpiredLogFile(path, date);
    } else if (current) {
      // A file without a date counts as older than any dated one.
      if (date && (!current->date || *date > *current->date)) {
        deleteExpiredLogFile(current->path, current->date);
        current = Current{path, date};
      } else {
        deleteExpiredLogFile(path, date);
      }
    } else {
      current = Current{path, date};
    }
  }
  return current;
}

// Step 3: a new empty file named with the current time.
std::optional<fs::path> startNewFile(const fs::path& folder, double now) {
  const fs::path path = folder / messageLogFileName(static_cast<std::int64_t>(now));
  file::UniqueFd fd(::open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
  if (::access(path.c_str(), F_OK) != 0) {
    configLogger().error("writeToLogFile: Failed to create new zerithd log file {}", path.string());
    return std::nullopt;
  }
  configLogger().info("writeToLogFile: Created new zerithd log file {} ({})", path.string(), dateDescription(now));
  return path;
}

enum class AppendResult { Written, Vanished, Failed };

AppendResult appendLine(const fs::path& path, std::string_view line) {
  file::UniqueFd fd(::open(path.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC));
  if (!fd) {
    if (errno == ENOENT) {
      return AppendResult::Vanished;
    }
    configLogger().error("writeToLogFile: Failed to write log message to {}: {}", path.string(), std::strerror(errno));
    return AppendResult::Failed;
  }
  // One write carries the whole line; a short write (a full disk, a signal)
  // is completed rather than lost.
  while (!line.empty()) {
    const ssize_t n = ::write(fd.get(), line.data(), line.size());
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      configLogger().error("writeToLogFile: Failed to write log message to {}: {}", path.string(),
                     n < 0 ? std::strerror(errno) : "nothing written");
      return AppendResult::Failed;
    }
    line.remove_prefix(static_cast<std::size_t>(n));
  }
  return AppendResult::Written;
}

}  // namespace

void MessageLog::write(std::string_view message) const {
  const fs::path folder = options_.folder.empty() ? paths::messageLogDir() : options_.folder;
  // A concurrent writer may remove the file this one chose (it found a newer
  // one); the choice is then made again, a bounded number of times.
  for (int attempt = 0; attempt < 3; ++attempt) {
    const double now = options_.now ? options_.now() : Date::now().secondsSince1970;
    fs::path path;
    if (auto current = rotate(folder, now, options_)) {
      path = current->path;
    } else if (auto created = startNewFile(folder, now)) {
      path = *created;
    } else {
      return;
    }
    std::string line;
    line.reserve(message.size() + 40);
    line.append("(").append(dateDescription(now)).append(") ").append(message).append("\n");
    switch (appendLine(path, line)) {
      case AppendResult::Written:
        configLogger().info("writeToLogFile: Saved log message to {}", path.string());
        return;
      case AppendResult::Failed:
        return;
      case AppendResult::Vanished:
        continue;
    }
  }
  configLogger().error("writeToLogFile: Gave up writing log message: the log file kept disappearing");
}

void deleteExpiredLogFile(const fs::path& path, std::optional<double> creationDate) {
  std::error_code ignored;
  fs::remove(path, ignored);
  configLogger().info("writeToLogFile: Deleted expired zerithd log file {} ({})", path.string(), describe(creationDate));
}

bool isMessageLogFileName(std::string_view name) {
  const auto first = name.find('_');
  if (first == std::string_view::npos) {
    return false;
  }
  const auto second = name.find('_', first + 1);
  if (second == std::string_view::npos || name.find('_', second + 1) != std::string_view::npos) {
    return false;
  }
  return name.substr(0, first) == kPrefix && name.substr(second + 1) == kSuffix;
}

std::string messageLogFileName(std::int64_t creationSeconds) {
  return fmt::format("{}_{}_{}", kPrefix, creationSeconds, kSuffix);
}

std::optional<double> creationDateFromLogFileName(std::string_view name) {
  if (!isMessageLogFileName(name)) {
    return std::nullopt;
  }
  const auto first = name.find('_');
  const std::string_view middle = name.substr(first + 1, name.find('_', first + 1) - first - 1);
  std::int64_t seconds = 0;
  const auto [end, ec] = std::from_chars(middle.data(), middle.data() + middle.size(), seconds);
  if (ec != std::errc() || end != middle.data() + middle.size() || middle.empty()) {
    return std::nullopt;
  }
  return static_cast<double>(seconds);
}

std::optional<double> logFileCreationDate(const fs::path& path, std::string_view name) {
  struct statx stx {};
  if (::statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BTIME, &stx) == 0 && (stx.stx_mask & STATX_BTIME)) {
    return static_cast<double>(stx.stx_btime.tv_sec) + stx.stx_btime.tv_nsec / 1e9;
  }
  return creationDateFromLogFileName(name);
}

std::string dateDescription(double secondsSince1970) {
  const auto seconds = static_cast<std::time_t>(std::floor(secondsSince1970));
  std::tm utc{};
  if (::gmtime_r(&seconds, &utc) == nullptr) {
    return "(invalid date)";
  }
  char text[64];
  const std::size_t n = std::strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S +0000", &utc);
  return std::string(text, n);
}

}  // namespace zerith
