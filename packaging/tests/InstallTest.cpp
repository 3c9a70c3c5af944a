// scripts/install staged into a temporary DESTDIR: the installed tree, the
// units as systemd-analyze sees them, the sysusers and tmpfiles snippets
// applied by systemd's own tools to that tree, and the installed daemon.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>

#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "ipc/Frame.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tests/support/Command.h"
#include "tests/support/RawFrameSocket.h"
#include "tests/support/TempRoot.h"

namespace zerith::packaging::test {
namespace {

namespace fs = std::filesystem;

using namespace zerith::test;

// Runs a command line, bounded in time, with its standard error in the output.
CommandResult run(const std::string& command) { return runCommand(command + " 2>&1"); }

// The values of `key` in a unit file's lines "key=value".
std::vector<std::string> unitValues(const std::string& unit, const std::string& key) {
  std::vector<std::string> values;
  std::istringstream lines(unit);
  std::string line;
  while (std::getline(lines, line)) {
    if (line.rfind(key + "=", 0) == 0) {
      values.push_back(line.substr(key.size() + 1));
    }
  }
  return values;
}

std::string unitValue(const std::string& unit, const std::string& key) {
  const auto values = unitValues(unit, key);
  return values.empty() ? std::string() : values.back();
}

class InstalledTree : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    char pattern[] = "/tmp/zerith-install-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    stage_ = new fs::path(pattern);
    const CommandResult install = run(shellQuote(std::string(ZERITH_TREE_SOURCE) + "/scripts/install") + " --no-build --build-dir " +
                            shellQuote(ZERITH_TREE_BUILD) + " --destdir " + shellQuote(stage_->string()));
    ASSERT_EQ(install.status, 0) << install.output;
    installOutput_ = new std::string(install.output);
  }
  static void TearDownTestSuite() {
    if (stage_) {
      std::error_code ignored;
      fs::remove_all(*stage_, ignored);
      delete stage_;
      stage_ = nullptr;
    }
    delete installOutput_;
    installOutput_ = nullptr;
  }
  void SetUp() override { ASSERT_NE(stage_, nullptr); }

  static fs::path at(const std::string& absolute) { return *stage_ / fs::path(absolute).relative_path(); }
  static std::string service() { return readText(at("/usr/lib/systemd/system/zerithd.service")); }
  static std::string socket() { return readText(at("/usr/lib/systemd/system/zerithd.socket")); }
  // Where the install put the framework (a multiarch folder or plain lib).
  static fs::path libraryDir() {
    return fs::exists(at("/usr/lib/x86_64-linux-gnu/libzerith.so.8")) ? at("/usr/lib/x86_64-linux-gnu") : at("/usr/lib");
  }

  static fs::path* stage_;
  static std::string* installOutput_;
};

fs::path* InstalledTree::stage_ = nullptr;
std::string* InstalledTree::installOutput_ = nullptr;

bool executable(const fs::path& p) {
  struct stat st {};
  return ::stat(p.c_str(), &st) == 0 && S_ISREG(st.st_mode) && (st.st_mode & S_IXOTH);
}

TEST_F(InstalledTree, HoldsTheProgramsTheFrameworkTheUnitsAndTheSnippetsInTheirFhsPlaces) {
  EXPECT_TRUE(executable(at("/usr/sbin/zerithd")));
  for (const char* tool : {"zerith", "zerith-defaults", "zerith-storebag"}) {
    EXPECT_TRUE(executable(at(std::string("/usr/bin/") + tool))) << tool;
  }
  EXPECT_TRUE(fs::exists(libraryDir() / "libzerith.so.8"));
  EXPECT_TRUE(fs::exists(at("/usr/include/zerith/Zerith.h")));
  EXPECT_TRUE(fs::exists(at("/usr/share/zerith/Info.plist")));
  EXPECT_TRUE(fs::is_directory(at("/etc/zerithd/entitlements.d")));
  EXPECT_TRUE(fs::is_empty(at("/etc/zerithd/entitlements.d"))) << "no policy is turned on by the install";
  EXPECT_TRUE(fs::exists(at("/usr/share/doc/zerithd/examples/50-zerith-group.plist")));
  EXPECT_TRUE(fs::exists(at("/usr/lib/sysusers.d/zerithd.conf")));
  EXPECT_TRUE(fs::exists(at("/usr/lib/tmpfiles.d/zerithd.conf")));
  // Nothing of the build folder leaks into the installed programs.
  const CommandResult dynamic = run("readelf -d " + shellQuote(at("/usr/sbin/zerithd").string()));
  EXPECT_EQ(dynamic.output.find(ZERITH_TREE_BUILD), std::string::npos) << dynamic.output;
}

TEST_F(InstalledTree, TheUnitsStartTheInstalledDaemonOnTheServiceSocketAsItsOwnUser) {
  const std::string svc = service();
  const std::string sock = socket();
  paths::setRoot("/");
  EXPECT_EQ(unitValue(sock, "ListenStream"), paths::socketPath().string());
  EXPECT_EQ(unitValue(sock, "SocketMode"), "0666");
  EXPECT_EQ(unitValue(svc, "Type"), "notify");
  EXPECT_EQ(unitValue(svc, "User"), "zerithd");
  EXPECT_EQ(unitValue(svc, "Requires"), "zerithd.socket");
  const std::string exec = unitValue(svc, "ExecStart");
  EXPECT_EQ(exec.rfind("/usr/sbin/zerithd --root / ", 0), 0u) << exec;
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
  const CommandResult verify = run("systemd-analyze verify --man=no " + shellQuote((units / "zerithd.socket").string()) + " " +
                         shellQuote((units / "zerithd.service").string()));
  EXPECT_EQ(verify.status, 0) << verify.output;
  EXPECT_EQ(verify.output, "") << "systemd-analyze warned";
}

TEST_F(InstalledTree, SysusersAndTmpfilesMakeTheUserTheGroupAndItsFolders) {
  if (!onPath("systemd-sysusers") || !onPath("systemd-tmpfiles")) {
    GTEST_SKIP() << "systemd-sysusers or systemd-tmpfiles is not installed here; the snippets were not applied";
  }
  // Applied to the staged tree as its root, never to this machine.
  const std::string root = shellQuote(stage_->string());
  const CommandResult users = run("systemd-sysusers --root=" + root + " " + shellQuote(at("/usr/lib/sysusers.d/zerithd.conf").string()));
  ASSERT_EQ(users.status, 0) << users.output;
  const std::string passwd = readText(at("/etc/passwd"));
  std::smatch m;
  ASSERT_TRUE(std::regex_search(passwd, m, std::regex("^zerithd:x:([0-9]+):([0-9]+):[^:]*:/var/lib/zerithd:([^\n]*)$",
                                                      std::regex::multiline)))
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

TEST_F(InstalledTree, TheInstalledDaemonRunsWithTheInstalledFramework) {
  const std::string lib = libraryDir().string();
  const CommandResult help = run("env LD_LIBRARY_PATH=" + shellQuote(lib) + " " + shellQuote(at("/usr/sbin/zerithd").string()) + " --help");
  EXPECT_EQ(help.status, 0) << help.output;
  EXPECT_NE(help.output.find("--stop-timeout"), std::string::npos) << help.output;
}

// Waits until the file that `inotify` watches holds `text`.
bool waitForText(int inotify, const fs::path& file, const std::string& text, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (readText(file).find(text) == std::string::npos) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()).count();
    pollfd p{inotify, POLLIN, 0};
    if (left <= 0 || ::poll(&p, 1, static_cast<int>(left)) <= 0) {
      return readText(file).find(text) != std::string::npos;
    }
    char events[4096];
    (void)!::read(inotify, events, sizeof(events));
  }
  return true;
}

TEST_F(InstalledTree, TheInstalledDaemonServesOnTheSocketTheServiceManagerPassesIn) {
  // As zerithd.socket does: something else listens, the daemon starts on
  // the first connection and takes the listening socket over.
  if (!onPath("systemd-socket-activate")) {
    GTEST_SKIP() << "systemd-socket-activate is not installed here; socket activation was not tried";
  }
  TempRoot root;
  const Value policy(Dictionary{{"users", Value(Array{Value(static_cast<unsigned long long>(::getuid()))})},
                                {"entitlements", Value(Dictionary{{"com.velmar.private.zerithd", Value(true)}})}});
  root.write("/etc/zerithd/entitlements.d/test.plist", plist::encodeXml(policy));
  const fs::path socketPath = paths::socketPath();
  fs::create_directories(socketPath.parent_path());
  // The activator's and the daemon's output; the activator says when it
  // listens.
  const fs::path log = root.path() / "daemon.log";
  std::ofstream(log).close();
  file::UniqueFd inotify(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  ASSERT_TRUE(inotify);
  ASSERT_GE(::inotify_add_watch(inotify.get(), log.c_str(), IN_MODIFY), 0);

  const std::string lib = libraryDir().string();
  const std::vector<std::string> argv{"systemd-socket-activate", "-l", socketPath.string(),
                                      "-E", "LD_LIBRARY_PATH=" + lib,
                                      at("/usr/sbin/zerithd").string(), "--root", root.path().string(),
                                      "--stop-timeout", "5"};
  const pid_t pid = ::fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    const int out = ::open(log.c_str(), O_WRONLY | O_APPEND);
    ::dup2(out, STDOUT_FILENO);
    ::dup2(out, STDERR_FILENO);
    std::vector<char*> args;
    for (const auto& a : argv) {
      args.push_back(const_cast<char*>(a.c_str()));
    }
    args.push_back(nullptr);
    ::execvp(args[0], args.data());
    ::_exit(127);
  }
  const auto stopDaemon = [&] {
    file::UniqueFd exited(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    ::kill(pid, SIGTERM);
    pollfd p{exited.get(), POLLIN, 0};
    int status = 0;
    if (!exited || ::poll(&p, 1, 10000) <= 0) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, &status, 0);
      return -1;
    }
    ::waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  };
  ASSERT_TRUE(waitForText(inotify.get(), log, "Listening on " + socketPath.string(), std::chrono::seconds(10)))
      << (stopDaemon(), readText(log));

  auto client = RawFrameSocket::connect();
  ASSERT_TRUE(client.has_value()) << (stopDaemon(), readText(log));
  ASSERT_TRUE(client->call("fetchDisplayURL:", 1));
  const auto reply = client->read(std::chrono::seconds(15));
  client.reset();
  const int status = stopDaemon();
  const std::string output = readText(log);
  ASSERT_TRUE(reply.has_value()) << output;
  EXPECT_EQ((*reply)["reply"], Value(1));
  EXPECT_EQ((*reply)["args"]["url"], Value("URL not available"));
  EXPECT_NE(output.find("Listener: using the socket passed by the service manager (fd 3)"), std::string::npos)
      << output;
  EXPECT_EQ(status, 0) << output;
  EXPECT_NE(output.find("main: Received signal 15, no longer accepting connections"), std::string::npos) << output;
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
