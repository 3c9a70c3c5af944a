// scripts/install staged into a temporary DESTDIR: what the package test
// (scripts/test-packages) does not use: the units' settings as systemd-analyze
// and the daemon's paths see them, the folders' owners and modes made by
// systemd's own tools, and the install script's refusals.

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "platform/Paths.h"
#include "tests/support/Command.h"

namespace zerith::packaging::test {
namespace {

namespace fs = std::filesystem;

using namespace zerith::test;

// Runs a command line, bounded in time, with its standard error in the output.
CommandResult run(const std::string& command) { return runCommand(command + " 2>&1"); }

// The last value of `key` in a unit file's lines "key=value".
std::string unitValue(const std::string& unit, const std::string& key) {
  std::string value;
  std::istringstream lines(unit);
  for (std::string line; std::getline(lines, line);) {
    if (line.rfind(key + "=", 0) == 0) {
      value = line.substr(key.size() + 1);
    }
  }
  return value;
}

class InstalledTree : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    char pattern[] = "/tmp/zerith-install-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    stage_ = new fs::path(pattern);
    const CommandResult install =
        run(shellQuote(std::string(ZERITH_TREE_SOURCE) + "/scripts/install") + " --no-build --build-dir " +
            shellQuote(ZERITH_TREE_BUILD) + " --destdir " + shellQuote(stage_->string()));
    ASSERT_EQ(install.status, 0) << install.output;
  }
  static void TearDownTestSuite() {
    if (stage_) {
      std::error_code ignored;
      fs::remove_all(*stage_, ignored);
      delete stage_;
      stage_ = nullptr;
    }
  }
  void SetUp() override { ASSERT_NE(stage_, nullptr); }

  static fs::path at(const std::string& absolute) { return *stage_ / fs::path(absolute).relative_path(); }
  static std::string service() { return readText(at("/usr/lib/systemd/system/zerithd.service")); }
  static std::string socket() { return readText(at("/usr/lib/systemd/system/zerithd.socket")); }

  static fs::path* stage_;
};

fs::path* InstalledTree::stage_ = nullptr;

TEST_F(InstalledTree, NothingOfTheBuildFolderLeaksIntoTheInstalledDaemon) {
  const CommandResult dynamic = run("readelf -d " + shellQuote(at("/usr/sbin/zerithd").string()));
  EXPECT_EQ(dynamic.status, 0) << dynamic.output;
  EXPECT_EQ(dynamic.output.find(ZERITH_TREE_BUILD), std::string::npos) << dynamic.output;
}

TEST_F(InstalledTree, TheUnitsGiveTheDaemonThePathsItUses) {
  const std::string svc = service();
  const std::string sock = socket();
  paths::setRoot("/");
  // The package test runs the daemon from these units and a client on the
  // default socket path; what it cannot see is checked here.
  EXPECT_EQ(unitValue(sock, "ListenStream"), paths::socketPath().string());
  EXPECT_EQ(unitValue(sock, "SocketMode"), "0666");
  EXPECT_EQ(unitValue(svc, "Type"), "notify");
  EXPECT_EQ(unitValue(svc, "Requires"), "zerithd.socket");
  // The daemon's own paths: its cache folder is where the unit puts it.
  ::setenv("CACHE_DIRECTORY", ("/var/cache/" + unitValue(svc, "CacheDirectory")).c_str(), 1);
  EXPECT_EQ(paths::storebagCacheDir(), fs::path("/var/cache/zerithd/storebags"));
  ::unsetenv("CACHE_DIRECTORY");
  EXPECT_EQ(paths::defaultsDir(), fs::path("/var/lib/" + unitValue(svc, "StateDirectory") + "/defaults"));
  EXPECT_NE(unitValue(svc, "LogsDirectory").find(paths::messageLogDir().lexically_relative("/var/log").string()),
            std::string::npos);
}

TEST_F(InstalledTree, SystemdWaitsLongerThanTheDaemonDrainsBeforeItKills) {
  // SIGTERM goes to the daemon, which waits up to --stop-timeout for the
  // sessions' keep-alive transaction; systemd's SIGKILL must come later.
  const std::string svc = service();
  std::smatch m;
  const std::string exec = unitValue(svc, "ExecStart");
  ASSERT_TRUE(std::regex_search(exec, m, std::regex("--stop-timeout ([0-9.]+)"))) << exec;
  const double drain = std::stod(m[1]);
  const std::string stop = unitValue(svc, "TimeoutStopSec");
  ASSERT_TRUE(std::regex_match(stop, m, std::regex("([0-9]+)s?"))) << stop;
  EXPECT_GT(std::stod(m[1]), drain + 5);
  EXPECT_EQ(unitValue(svc, "KillMode"), "mixed");
  EXPECT_EQ(unitValue(svc, "KillSignal"), "SIGTERM");
}

TEST_F(InstalledTree, TheUnitsPassSystemdAnalyzeVerify) {
  if (!onPath("systemd-analyze")) {
    GTEST_SKIP() << "systemd-analyze is not installed here; the units were not verified";
  }
  // This machine has no /usr/sbin/zerithd: a copy of the units names the
  // staged daemon instead, everything else as installed.
  const fs::path units = *stage_ / "verify";
  fs::create_directories(units);
  std::string svc = service();
  const std::string installed = "ExecStart=/usr/sbin/zerithd";
  const auto at = svc.find(installed);
  ASSERT_NE(at, std::string::npos);
  svc.replace(at, installed.size(), "ExecStart=" + InstalledTree::at("/usr/sbin/zerithd").string());
  std::ofstream(units / "zerithd.service") << svc;
  fs::copy_file(InstalledTree::at("/usr/lib/systemd/system/zerithd.socket"), units / "zerithd.socket");
  const CommandResult verify =
      run("systemd-analyze verify --man=no " + shellQuote((units / "zerithd.socket").string()) + " " +
          shellQuote((units / "zerithd.service").string()));
  EXPECT_EQ(verify.status, 0) << verify.output;
  EXPECT_EQ(verify.output, "") << "systemd-analyze warned";
}

TEST_F(InstalledTree, SysusersAndTmpfilesMakeTheUserTheGroupAndItsFolders) {
  if (!onPath("systemd-sysusers") || !onPath("systemd-tmpfiles")) {
    GTEST_SKIP() << "systemd-sysusers or systemd-tmpfiles is not installed "
                    "here; the snippets were not applied";
  }
  // Applied to the staged tree as its root, never to this machine.
  const std::string root = shellQuote(stage_->string());
  const CommandResult users =
      run("systemd-sysusers --root=" + root + " " + shellQuote(at("/usr/lib/sysusers.d/zerithd.conf").string()));
  ASSERT_EQ(users.status, 0) << users.output;
  const std::string passwd = readText(at("/etc/passwd"));
  std::smatch m;
  ASSERT_TRUE(std::regex_search(
      passwd, m, std::regex("^zerithd:x:([0-9]+):([0-9]+):[^:]*:/var/lib/zerithd:([^\n]*)$", std::regex::multiline)))
      << passwd;
  const uid_t uid = static_cast<uid_t>(std::stoul(m[1]));
  EXPECT_NE(uid, 0u);
  EXPECT_NE(m[3].str().find("nologin"), std::string::npos) << "the service user has a login shell";
  const std::string group = readText(at("/etc/group"));
  EXPECT_TRUE(std::regex_search(group, std::regex("^zerith:x:[0-9]+:", std::regex::multiline))) << group;

  const CommandResult folders = run("systemd-tmpfiles --create --root=" + root + " " +
                                    shellQuote(at("/usr/lib/tmpfiles.d/zerithd.conf").string()));
  ASSERT_EQ(folders.status, 0) << folders.output;
  paths::setRoot("/");
  struct Expected {
    fs::path path;
    bool owned;  // by the service user, else by root
    mode_t mode;
  };
  const std::vector<Expected> expected{
      {paths::defaultsDir(), true, 0750},
      {paths::spoolDir(), true, 0700},
      {"/var/cache/zerithd/storebags", true, 0750},
      {paths::messageLogDir(), true, 0750},
      {"/var/log/zerithd", true, 0750},
      {paths::socketPath().parent_path(), false, 0755},
      {paths::entitlementsDir(), false, 0755},
  };
  for (const auto& e : expected) {
    struct stat st {};
    ASSERT_EQ(::stat(at(e.path.string()).c_str(), &st), 0) << e.path << " was not made";
    EXPECT_TRUE(S_ISDIR(st.st_mode)) << e.path;
    EXPECT_EQ(st.st_uid, e.owned ? uid : 0u) << e.path;
    EXPECT_EQ(st.st_mode & 07777, e.mode) << e.path;
  }
}

TEST(InstallScript, RefusesAnUnknownOptionAndAnInstallWithoutRootOrStagingFolder) {
  const std::string script = shellQuote(std::string(ZERITH_TREE_SOURCE) + "/scripts/install");
  const CommandResult unknown = run(script + " --frobnicate");
  EXPECT_EQ(unknown.status, 2);
  EXPECT_NE(unknown.output.find("unknown option --frobnicate"), std::string::npos) << unknown.output;
  const CommandResult missing = run(script + " --no-build --build-dir /nonexistent --destdir /tmp/zerith-never-made");
  EXPECT_EQ(missing.status, 1);
  EXPECT_NE(missing.output.find("/nonexistent/daemon/zerithd is missing"), std::string::npos) << missing.output;
  EXPECT_FALSE(fs::exists("/tmp/zerith-never-made"));
}

}  // namespace
}  // namespace zerith::packaging::test
