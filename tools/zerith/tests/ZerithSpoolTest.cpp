#include "tools/zerith/ZerithSpool.h"

#include <gtest/gtest.h>

#include <fstream>

#include <fmt/format.h>

#include "backends/Spool.h"
#include "platform/Defaults.h"
#include "platform/Json.h"
#include "platform/Paths.h"
#include "tests/support/TempRoot.h"
#include "tools/zerith/tests/RunCli.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;

// 2026-11-26 12:00:00 UTC.
constexpr std::int64_t kNoonMillis = 1795694400000;
constexpr std::int64_t kHourMillis = 3600 * 1000;

struct SpoolFolder : ::testing::Test {
  TempRoot root;
  // The daemon's own writer, so that the listing reads what it writes.
  SpoolStore store{paths::spoolDir(), 1 << 20, 365 * 24 * 3600};

  void SetUp() override {
    std::string why;
    ASSERT_TRUE(store.open(&why)) << why;
  }

  std::string spool(const std::string& url, std::uint32_t records, std::int64_t createdMillis) {
    const auto outcome = store.write(SpoolBatch{createdMillis, records, url, {{"Content-Type", "application/json"}},
                                                Data(100 * records, '{')});
    EXPECT_TRUE(outcome.written) << outcome.why;
    return outcome.name;
  }

  // `zerith spool` under this test's root.
  static CliResult spoolCommand(std::vector<std::string> more = {}) {
    more.insert(more.begin(), {"--root", paths::root().string(), "spool"});
    return runCli(more);
  }
};

TEST_F(SpoolFolder, ListsWhatWaitsPerURLAndWhatTheDaemonWouldSetAside) {
  Defaults("com.velmar.zerith").setObject("spoolEnabled", Value(true));
  Defaults("com.velmar.zerith").setObject("spoolMaxAgeSeconds", Value(3 * 3600));
  const std::string first = spool("https://a.example/post", 3, kNoonMillis - 4 * kHourMillis - 5 * 60 * 1000);
  spool("https://b.example/post", 1, kNoonMillis - 2 * kHourMillis);
  spool("https://a.example/post", 2, kNoonMillis - 30 * 1000);

  // A flipped body byte fails the checksum; a stray file, a link (the tool
  // runs as root), a write under way and the files already set aside are no
  // batches.
  const fs::path folder = paths::spoolDir();
  fs::copy_file(folder / first, folder / "0-0.zspool");
  {
    std::fstream f(folder / "0-0.zspool", std::ios::in | std::ios::out | std::ios::binary);
    f.seekp(static_cast<std::streamoff>(kSpoolHeaderSize + 10));
    f.put('x');
  }
  std::ofstream(folder / "notes.txt") << "hello";
  fs::create_symlink("/etc/passwd", folder / "1-1.zspool");
  std::ofstream(folder / ".tmp-123") << "half a batch";
  fs::create_directories(folder / "bad");
  std::ofstream(folder / "bad" / "old.zspool") << std::string(2048, 'b');

  std::string why;
  const auto listing = cli::listSpool(folder, &why);
  ASSERT_TRUE(listing) << why;
  EXPECT_EQ(listing->batches.size(), 3u);
  EXPECT_EQ(listing->batches.front().file, first) << "oldest first";
  const auto at = std::chrono::system_clock::time_point(std::chrono::milliseconds(kNoonMillis));
  EXPECT_EQ(cli::spoolTable(*listing, at),
            "Spool " + folder.string() + ": spooling on, up to 64.0 MiB, batches kept 3 h\n"
            "3 batches, 6 records, 906 B; the oldest made 2026-11-26 07:55:00 UTC (4 h 5 min ago)\n\n"
            "URL                     BATCHES  RECORDS  BYTES  OLDEST\n"
            "https://a.example/post        2        5  704 B  4 h 5 min\n"
            "https://b.example/post        1        1  202 B  2 h\n\n"
            "1 batch is past the age of 3 h: the daemon drops it at its next write or retry.\n\n"
            "Unreadable, set aside to bad/ when the daemon next reads the folder:\n"
            "  0-0.zspool: checksum mismatch\n"
            "  1-1.zspool: a symbolic link, which is not followed\n"
            "  notes.txt: not a spool file name or not a regular file\n\n"
            "bad/ holds 1 file (2.0 KiB) set aside earlier; the daemon never reads them again.\n");

  // The listing changed nothing: the daemon's own reader still finds every file.
  EXPECT_TRUE(fs::exists(folder / "0-0.zspool"));
  EXPECT_TRUE(fs::exists(folder / ".tmp-123"));
  SpoolStore reopened(folder, 1 << 20, 365 * 24 * 3600);
  ASSERT_TRUE(reopened.open(&why)) << why;
  EXPECT_EQ(reopened.size(), 4u) << "the three batches and the one with a bad body";
}

TEST_F(SpoolFolder, TheJsonLineCarriesEveryBatchAndTheSettings) {
  const std::string name = spool("https://a.example/post", 2, kNoonMillis);
  const CliResult r = spoolCommand({"--json"});
  ASSERT_EQ(r.status, 0);
  const auto parsed = nlohmann::json::parse(r.out);
  EXPECT_EQ(parsed["enabled"], false);
  EXPECT_EQ(parsed["maxAgeSeconds"], SpoolConfig::kDefaultMaxAgeSeconds);
  EXPECT_EQ(parsed["batches"], nlohmann::json::parse(fmt::format(
                                   R"([{{"file":"{}","createdMillis":{},"records":2,"bytes":{},"url":"https://a.example/post"}}])",
                                   name, kNoonMillis, fs::file_size(paths::spoolDir() / name))));
  EXPECT_EQ(parsed["setAside"], nlohmann::json::parse(R"({"files":0,"bytes":0})"));
}

TEST_F(SpoolFolder, SpoolingOffOrNoFolderOrAFolderThatCannotBeListed) {
  spool("https://a.example/post", 1, kNoonMillis);
  CliResult r = spoolCommand();
  EXPECT_EQ(r.status, 0);
  EXPECT_NE(r.out.find("spooling is off (spoolEnabled is not true); the batches below stay until it is on again\n"),
            std::string::npos)
      << r.out;

  fs::remove_all(paths::spoolDir());
  r = spoolCommand();
  EXPECT_EQ(r.status, 0);
  EXPECT_NE(r.out.find("No batch waits.\n"), std::string::npos) << r.out;

  std::ofstream(paths::spoolDir()) << "a file where the folder should be";
  r = spoolCommand();
  EXPECT_EQ(r.status, cli::kExitStepFailed);
  EXPECT_EQ(r.err, "zerith: spool: cannot list " + paths::spoolDir().string() + ": Not a directory\n");
}

}  // namespace
}  // namespace zerith::test
