// The journal form of the log: what a service started by systemd writes to
// the standard error that the journal reads, checked by pointing
// JOURNAL_STREAM at a real file that stands in for the journal's stream.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "platform/Log.h"

namespace zerith::log {
namespace {

// Standard error goes to a fresh file for the test's lifetime; JOURNAL_STREAM
// is set as given ("match" puts in the file's own device and inode).
class StderrToFile {
 public:
  explicit StderrToFile(const std::string& journalStream) {
    path_ = std::filesystem::temp_directory_path() / ("zerith-log-" + std::to_string(::getpid()) + ".txt");
    const int fd = ::open(path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    EXPECT_GE(fd, 0);
    std::fflush(stderr);
    saved_ = ::dup(STDERR_FILENO);
    ::dup2(fd, STDERR_FILENO);
    ::close(fd);
    std::string value = journalStream;
    if (value == "match") {
      struct stat st {};
      ::fstat(STDERR_FILENO, &st);
      value = std::to_string(st.st_dev) + ":" + std::to_string(st.st_ino);
    }
    ::setenv("JOURNAL_STREAM", value.c_str(), 1);
  }
  ~StderrToFile() {
    ::unsetenv("JOURNAL_STREAM");
    configure({.debug = false, .journal = false});
    std::fflush(stderr);
    ::dup2(saved_, STDERR_FILENO);
    ::close(saved_);
    std::filesystem::remove(path_);
  }
  std::string text() const {
    std::fflush(stderr);
    std::ifstream in(path_);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
  }

 private:
  std::filesystem::path path_;
  int saved_ = -1;
};

// Each line carries its journal priority (err, info, debug); debug lines
// only when asked for; every line of a message keeps its priority.
TEST(LogJournal, LinesCarryTheirJournalPriorities) {
  for (const bool debug : {true, false}) {
    StderrToFile out("match");
    configure({.debug = debug, .journal = std::nullopt});
    const Logger logger("journaltest");
    logger.error("the disk\nis full");
    logger.info("listening");
    logger.debug("a detail");
    EXPECT_EQ(out.text(), std::string("<3>journaltest: the disk\n<3>journaltest: is full\n<6>journaltest: listening\n") +
                              (debug ? "<7>journaltest: a detail\n" : ""))
        << "debug " << debug;
  }
}

// A variable inherited from a service by a process whose standard error goes
// elsewhere, or a value that is not "<device>:<inode>", leaves the plain form.
class LogJournalNotOurs : public ::testing::TestWithParam<const char*> {};

TEST_P(LogJournalNotOurs, PlainLinesWithTimeStamps) {
  StderrToFile out(GetParam());
  configure({.debug = false, .journal = std::nullopt});
  Logger("journaltest").error("the disk is full");
  const std::string text = out.text();
  EXPECT_EQ(text.find("<3>"), std::string::npos) << text;
  EXPECT_NE(text.find("journaltest[error] the disk is full"), std::string::npos) << text;
}

INSTANTIATE_TEST_SUITE_P(Values, LogJournalNotOurs, ::testing::Values("1:1", "", "garbage", "12:34:56", "12:"));

}  // namespace
}  // namespace zerith::log
