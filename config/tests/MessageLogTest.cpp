#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <fstream>
#include <functional>
#include <regex>
#include <set>
#include <thread>
#include <vector>

#include "config/MessageLog.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/Value.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

namespace fs = std::filesystem;
using log::Level;

constexpr double kNow = 1700000000;  // 2023-11-14 22:13:20 UTC
constexpr double kHour = 3600;

std::vector<std::string> linesOf(const fs::path& path) {
  std::vector<std::string> lines;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    lines.push_back(line);
  }
  return lines;
}

std::set<std::string> namesIn(const fs::path& folder) {
  std::set<std::string> names;
  for (const auto& entry : fs::directory_iterator(folder)) {
    names.insert(entry.path().filename().string());
  }
  return names;
}

class MessageLogTest : public ::testing::Test {
 protected:
  // Ages come from the names here: birth times of files made by a test are
  // all "now".
  MessageLog byName() const {
    return MessageLog({{}, [] { return kNow; }, [](const fs::path&, std::string_view name) {
                         return creationDateFromLogFileName(name);
                       }});
  }
  std::string fileAged(double hours) const {
    const std::string name = messageLogFileName(static_cast<std::int64_t>(kNow - hours * kHour));
    root_.write("/var/log/faultkeep/retired/" + name, "old line\n");
    return name;
  }
  fs::path folder() const { return paths::messageLogDir(); }

  test::TempRoot root_;
  log::LogCapture capture_;
  const std::string newName_ = messageLogFileName(static_cast<std::int64_t>(kNow));
};

// Files of the given ages (hours) before a write: which one is written,
// which are deleted as expired (with their dates), and whether a new one
// is started. A day old is not yet expired.
TEST_F(MessageLogTest, ExpiredFilesAreDeletedAndTheNewestCurrentOneIsWritten) {
  const struct {
    const char* name;
    std::vector<double> ages;
    int written;  // index into ages, or -1 for a new file
    std::vector<std::pair<int, const char*>> deleted;
  } rows[] = {
      {"of two current files the older goes", {20, 10}, 1, {{0, "2023-11-14 02:13:20 +0000"}}},
      {"older than a day", {25}, -1, {{0, "2023-11-13 21:13:20 +0000"}}},
      {"exactly a day", {24}, 0, {}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fs::remove_all(folder());
    capture_.clear();
    std::vector<std::string> names;
    for (const double age : row.ages) names.push_back(fileAged(age));
    byName().write("line");
    const std::string written = row.written < 0 ? newName_ : names[static_cast<std::size_t>(row.written)];
    EXPECT_EQ(namesIn(folder()), std::set<std::string>{written});
    std::vector<std::string> lines{"(2023-11-14 22:13:20 +0000) line"};
    if (row.written >= 0) lines.insert(lines.begin(), "old line");
    EXPECT_EQ(linesOf(folder() / written), lines);
    for (const auto& [index, date] : row.deleted) {
      EXPECT_TRUE(capture_.has(Level::Default, "writeToLogFile: Deleted expired zerithd log file " +
                                                   (folder() / names[static_cast<std::size_t>(index)]).string() + " (" +
                                                   date + ")"));
    }
    EXPECT_EQ(capture_.count("Deleted expired"), row.deleted.size());
    EXPECT_EQ(capture_.count("Created new zerithd log file"), row.written < 0 ? 1u : 0u);
    EXPECT_TRUE(capture_.has(Level::Default, "writeToLogFile: Saved log message to " + (folder() / written).string()));
  }
}

TEST_F(MessageLogTest, ForeignNamesAreLeftAlone) {
  const std::set<std::string> foreign = {"zerithd_messageLog.diag", "other_1_messageLog.diag",
                                         "zerithd_1_2_messageLog.diag", "zerithd_1_messageLog.diag.bak",
                                         "Zerithd_1_messageLog.diag"};
  for (const auto& name : foreign) {
    root_.write("/var/log/faultkeep/retired/" + name, "x\n");
  }
  byName().write("mine");
  std::set<std::string> expected = foreign;
  expected.insert(newName_);
  EXPECT_EQ(namesIn(folder()), expected);
  EXPECT_EQ(capture_.count("Deleted expired"), 0u);
}

TEST_F(MessageLogTest, FileWithoutCreationDateIsNeverExpiredButLosesToADatedOne) {
  root_.write("/var/log/faultkeep/retired/zerithd_undated_messageLog.diag", "");
  byName().write("one");
  EXPECT_EQ(linesOf(folder() / "zerithd_undated_messageLog.diag"),
            std::vector<std::string>{"(2023-11-14 22:13:20 +0000) one"});

  const std::string dated = fileAged(23);
  byName().write("two");
  EXPECT_EQ(namesIn(folder()), std::set<std::string>{dated});
  EXPECT_TRUE(capture_.has(Level::Default, "writeToLogFile: Deleted expired zerithd log file " +
                                               (folder() / "zerithd_undated_messageLog.diag").string() + " ((null))"));
}

TEST_F(MessageLogTest, BirthTimeWinsOverTheTimeInTheName) {
  // With the real clock and creation dates: a file whose name says 25 hours
  // but which was born just now is current, not expired.
  const std::string name = messageLogFileName(static_cast<std::int64_t>(Date::now().secondsSince1970 - 25 * kHour));
  root_.write("/var/log/faultkeep/retired/" + name, "");
  struct statx stx {};
  ASSERT_EQ(::statx(AT_FDCWD, (folder() / name).c_str(), 0, STATX_BTIME, &stx), 0);
  if (!(stx.stx_mask & STATX_BTIME)) {
    GTEST_SKIP() << "this file system records no birth times";
  }
  writeToLogFile("[{} -> sendMessageWithDictionary] {}", "httpsPost", "sent");
  EXPECT_EQ(namesIn(folder()), std::set<std::string>{name});
  const auto lines = linesOf(folder() / name);
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_TRUE(std::regex_match(
      lines[0], std::regex(R"(\(\d{4}-\d\d-\d\d \d\d:\d\d:\d\d \+0000\) \[httpsPost -> sendMessageWithDictionary\] sent)")))
      << lines[0];
}

// A folder that cannot be listed (a file in its place) or made (a dangling
// link under its name), or a current file that cannot be opened (a folder
// under its name): reported, nothing saved, nothing crashes.
TEST_F(MessageLogTest, FailuresToListMakeOrWriteAreReportedAndNothingIsSaved) {
  const struct {
    const char* name;
    std::function<void()> spoil;
    std::vector<std::string> errors;
    const char* note = "";  // another line the write logs first
  } rows[] = {
      {"file instead of the folder", [&] { root_.write("/var/log/faultkeep/retired", "a file"); },
       {"writeToLogFile: Error reading from log directory: Not a directory",
        "writeToLogFile: Failed to create new zerithd log file " + (folder() / newName_).string()}},
      {"dangling link instead of the folder",
       [&] {
         fs::create_directories(folder().parent_path());
         fs::create_symlink(root_ / "/missing/retired", folder());
       },
       {"writeToLogFile: Failed to create new zerithd log file " + (folder() / newName_).string()},
       "writeToLogFile: Creating zerithd log directory at"},
      {"folder instead of the file", [&] { fs::create_directories(folder() / newName_); },
       {"writeToLogFile: Failed to write log message to " + (folder() / newName_).string() + ": Is a directory"}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fs::remove_all(folder().parent_path());
    capture_.clear();
    row.spoil();
    byName().write("lost");
    for (const auto& error : row.errors) {
      EXPECT_TRUE(capture_.has(Level::Error, error)) << error;
    }
    EXPECT_TRUE(capture_.contains(row.note));
    EXPECT_EQ(capture_.count("Saved log message"), 0u);
  }
}

TEST_F(MessageLogTest, ConcurrentAppendsNeverInterleaveInsideALine) {
  byName().write("start");
  constexpr int kThreads = 8;
  constexpr int kLines = 150;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      const MessageLog log = byName();
      for (int i = 0; i < kLines; ++i) {
        // Lengths up to 12 KB: far beyond any single page.
        const std::size_t length = static_cast<std::size_t>((t * 7919 + i * 104729) % 12000);
        log.write("T" + std::to_string(t) + "-" + std::to_string(i) + "-" + std::to_string(length) + ":" +
                  std::string(length, static_cast<char>('a' + t)));
      }
    });
  }
  for (auto& th : threads) {
    th.join();
  }
  const auto lines = linesOf(folder() / newName_);
  ASSERT_EQ(lines.size(), static_cast<std::size_t>(1 + kThreads * kLines));
  const std::regex shape(R"(\(2023-11-14 22:13:20 \+0000\) T(\d)-(\d+)-(\d+):([a-h]*))");
  std::set<std::string> seen;
  for (std::size_t i = 1; i < lines.size(); ++i) {
    std::smatch m;
    ASSERT_TRUE(std::regex_match(lines[i], m, shape)) << lines[i].substr(0, 80);
    const int t = std::stoi(m[1]);
    EXPECT_EQ(m[4].length(), std::stol(m[3]));
    EXPECT_EQ(m[4].str().find_first_not_of(static_cast<char>('a' + t)), std::string::npos);
    seen.insert(m[1].str() + "-" + m[2].str());
  }
  EXPECT_EQ(seen.size(), static_cast<std::size_t>(kThreads * kLines));
}

TEST(MessageLogNamesTest, ThreePartNamesAndTheirDates) {
  EXPECT_TRUE(isMessageLogFileName("zerithd_1700000000_messageLog.diag"));
  EXPECT_TRUE(isMessageLogFileName("zerithd__messageLog.diag"));  // three parts, the middle empty
  EXPECT_FALSE(isMessageLogFileName("zerithd_1_messageLog.diag.gz"));  // the other foreign names: ForeignNamesAreLeftAlone
  EXPECT_EQ(messageLogFileName(1700000000), "zerithd_1700000000_messageLog.diag");
  EXPECT_EQ(creationDateFromLogFileName("zerithd_1700000000_messageLog.diag"), 1700000000.0);
  EXPECT_EQ(creationDateFromLogFileName("zerithd__messageLog.diag"), std::nullopt);
  EXPECT_EQ(creationDateFromLogFileName("zerithd_12abc_messageLog.diag"), std::nullopt);
  EXPECT_EQ(creationDateFromLogFileName("zerithd_99999999999999999999_messageLog.diag"), std::nullopt);
  EXPECT_EQ(dateDescription(0), "1970-01-01 00:00:00 +0000");
  EXPECT_EQ(dateDescription(1700000000.75), "2023-11-14 22:13:20 +0000");
}

}  // namespace
}  // namespace zerith
