#pragma once

// The message log: a plain-text trail of what sessions sent, flushed and
// uploaded, one time-stamped line per call, in the retired-logs folder
// (paths::messageLogDir()). At most one current file is kept; every write
// first removes files older than one day and every file superseded by a
// newer one.
//
// Files are named "zerithd_<creation time in seconds>_messageLog.diag". A
// file's creation date is its birth time where the file system records one
// (statx), else the time in its name: the birth time cannot be forged by
// naming a file, and the name still dates files on file systems without
// birth times. A file with neither is never expired by age.
//
// Each line is appended with one write() on a descriptor opened with
// O_APPEND, so lines from several sessions at once never interleave inside a
// line. There is no lock: callers run on their own sessions' queues.

#include <cstdint>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include <fmt/format.h>

namespace zerith {

inline constexpr double kMessageLogExpirySeconds = 86400;

class MessageLog {
 public:
  struct Options {
    // Empty: paths::messageLogDir() at each write.
    std::filesystem::path folder;
    // Seconds since 1970; empty: the system clock.
    std::function<double()> now;
    // Empty: logFileCreationDate.
    std::function<std::optional<double>(const std::filesystem::path& path, std::string_view name)> creationDate;
  };

  MessageLog() = default;
  explicit MessageLog(Options options) : options_(std::move(options)) {}

  // Rotates, then appends "(<date>) <message>\n" to the current file.
  // Failures are logged and never reach the caller.
  void write(std::string_view message) const;

 private:
  Options options_;
};

// printf-style in the fmt manner: one line in the message log.
template <typename... Args>
void writeToLogFile(fmt::format_string<Args...> format, Args&&... args) {
  MessageLog().write(fmt::format(format, std::forward<Args>(args)...));
}

// Removes the file (errors ignored) and logs it with its creation date.
void deleteExpiredLogFile(const std::filesystem::path& path, std::optional<double> creationDate);

// Whether a folder entry is a message log: split at "_" into exactly three
// parts, the first "zerithd" and the third "messageLog.diag".
bool isMessageLogFileName(std::string_view name);
std::string messageLogFileName(std::int64_t creationSeconds);

// The birth time of the file, else the time in its name, else nullopt.
std::optional<double> logFileCreationDate(const std::filesystem::path& path, std::string_view name);
// The time in a log file's name ("zerithd_1700000000_messageLog.diag").
std::optional<double> creationDateFromLogFileName(std::string_view name);

// A date as the log shows it: "2023-11-14 22:13:20 +0000".
std::string dateDescription(double secondsSince1970);

}  // namespace zerith
