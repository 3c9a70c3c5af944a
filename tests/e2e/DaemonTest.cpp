// The real daemon against raw sockets: the stop signal, and a runtime folder
// it cannot use. The service manager's watchdog: pings while every pool,
// queue and thread makes progress, none once one of them is wedged. A file
// size limit under the daemon: a write past it fails with EFBIG, handled as
// any failed write.

#include <signal.h>
#include <sys/resource.h>

#include <cerrno>
#include <cstring>
#include <random>
#include <thread>

#include <fmt/format.h>

#include "tests/e2e/E2eFixture.h"
#include "tests/support/Command.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;
using log::Level;

constexpr const char* kDisplayURL = "fetchDisplayURL:";

// A session that answers proves the daemon is alive and serving.
void expectServing(RawFrameSocket& client, std::uint64_t number) {
  ASSERT_TRUE(client.call(kDisplayURL, number));
  const auto reply = client.replyTo(number);
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ((*reply)["args"]["url"], Value("URL not available"));
}

// --- Stopping ----------------------------------------------------------------

TEST_F(E2eTest, StopSignalWithoutSessionsExitsAtOnce) {
  startDaemon();
  EXPECT_EQ(daemon->stop(5s), 0) << daemon->output();
  EXPECT_FALSE(daemon->output().empty());
  EXPECT_EQ(daemon->count("Waiting up to"), 0u);
  const auto notes = daemon->notifications();
  EXPECT_NE(std::find(notes.begin(), notes.end(), "READY=1"), notes.end());
  EXPECT_NE(std::find(notes.begin(), notes.end(), "STOPPING=1"), notes.end());
}

// A misspelt key of its defaults, and a value its reader refuses, are named
// when the daemon starts; the test's own key (the storebag server) is one it
// reads.
TEST_F(E2eTest, DefaultsTheDaemonDoesNotReadOrUseAreNamedAtStart) {
  Defaults("com.velmar.zerith").setObject("spoolEnbled", Value(true));
  Defaults("com.velmar.zerith").setObject("uploadsAtOnce", Value(0));
  startDaemon();
  EXPECT_TRUE(daemon->waitFor("main: zerithd does not read \"spoolEnbled\" in com.velmar.zerith (did you mean "
                              "\"spoolEnabled\"?); it is ignored"))
      << daemon->output();
  EXPECT_TRUE(daemon->waitFor("main: \"uploadsAtOnce\" in com.velmar.zerith is 0, outside 1 to 64; zerithd does not "
                              "use this value"));
  EXPECT_EQ(daemon->count("does not read"), 1u);
}

// --check reads what the daemon reads at start and says what is wrong with
// it, without starting: nothing listens afterwards.
TEST_F(E2eTest, CheckNamesWhatTheDaemonWouldFindWrongWithoutStarting) {
  const auto check = [&] {
    return runCommand(fmt::format("'{}' --root '{}' --check 2>/dev/null", (buildDir() / "daemon" / "zerithd").string(),
                                  root.path().string()));
  };
  root.write("/usr/share/zerith/publicKey.der", "not a key");
  root.write("/etc/zerithd/entitlements.d/10-broken.plist", plist::encodeXml(Value(Array{})));
  root.write("/etc/zerithd/device.plist", "<plist>");
  Defaults("com.velmar.zerith").setObject("uploadsAtOnce", Value(0));
  const CommandResult broken = check();
  EXPECT_EQ(broken.status, 1);
  EXPECT_EQ(broken.output.substr(0, broken.output.find("zerithd: the device file")),
            "zerithd: \"uploadsAtOnce\" in com.velmar.zerith is 0, outside 1 to 64; zerithd does not use this value\n"
            "zerithd: " + (root / "/usr/share/zerith/publicKey.der").string() +
                " is not an RSA public key in DER form: every storebag is refused\n"
                "zerithd: entitlements policy: " + (root / "/etc/zerithd/entitlements.d/10-broken.plist").string() +
                ": not a dictionary; the file grants nothing\n");
  EXPECT_NE(broken.output.find("zerithd: the device file " + (root / "/etc/zerithd/device.plist").string() +
                               " is not used: "),
            std::string::npos)
      << broken.output;
  EXPECT_TRUE(broken.output.ends_with("zerithd: 4 problems\n")) << broken.output;
  EXPECT_FALSE(fs::exists(paths::socketPath()));

  (void)signedStorebag(Value(Dictionary{}));  // installs the public key
  fs::remove(root / "/etc/zerithd/entitlements.d/10-broken.plist");
  // A device file that is a link is followed, as the facts follow it.
  root.write("/etc/zerithd/board.plist", plist::encodeXml(Value(Dictionary{{"ProductType", "Board9,1"}})));
  fs::remove(root / "/etc/zerithd/device.plist");
  fs::create_symlink(root / "/etc/zerithd/board.plist", root / "/etc/zerithd/device.plist");
  Defaults("com.velmar.zerith").removeObject("uploadsAtOnce");
  const CommandResult clean = check();
  EXPECT_EQ(clean.status, 0);
  EXPECT_EQ(clean.output, "zerithd: no problems\n");
}

TEST_F(E2eTest, StopSignalDrainsOpenSessionsAndRefusesNewOnes) {
  startDaemon();
  auto client = RawFrameSocket::connect();
  ASSERT_TRUE(client.has_value());
  expectServing(*client, 1);

  daemon->signal(SIGTERM);
  ASSERT_TRUE(daemon->waitFor("main: Waiting up to"));
  EXPECT_TRUE(daemon->running());
  expectServing(*client, 2);  // the open session goes on while draining

  // A newcomer is not served.
  auto late = RawFrameSocket::connect();
  if (late) {
    late->call(kDisplayURL, 1);
  }
  client->close();
  EXPECT_EQ(daemon->waitForExit(10s), 0) << daemon->output();
  EXPECT_TRUE(daemon->has(Level::Default, kTransactionEnded));
  EXPECT_TRUE(daemon->has(Level::Default, "main: Keep-alive transaction ended, exiting"));
  if (late) {
    EXPECT_FALSE(late->replyTo(1, 5s).has_value());
  }
  EXPECT_EQ(daemon->count("Accepting new Vesk connection"), 1u);
}

TEST_F(E2eTest, StopTimeOutEndsTheDrainOfASessionThatStaysOpen) {
  startDaemon({.arguments = {"--stop-timeout", "0.5"}});
  auto client = RawFrameSocket::connect();
  ASSERT_TRUE(client.has_value());
  expectServing(*client, 1);
  EXPECT_EQ(daemon->stop(10s), 0) << daemon->output();
  EXPECT_TRUE(
      daemon->has(Level::Error, "main: Stop time-out passed with the keep-alive transaction still open, exiting"));
}

TEST_F(E2eTest, SocketThatCannotBeCreatedFailsTheStartWithAClearMessage) {
  // The runtime folder is a file: nothing can listen there.
  root.write("/run/zerithd", "not a folder");
  DaemonProcess failed(root, {.readyTimeout = 5s});
  EXPECT_FALSE(failed.ready());
  EXPECT_EQ(failed.waitForExit(10s), 1);
  EXPECT_TRUE(failed.count("main: Unable to create the runtime folder") > 0 ||
              failed.count("main: Unable to listen on") > 0)
      << failed.output();
}

// --- Watchdog -----------------------------------------------------------------

// The daemon stops pinging once the main operation queue is wedged (through
// its test hook), so that the manager would restart it.
TEST_F(E2eTest, WatchdogPingsWhileServingAndStopsOnceAQueueIsWedged) {
  // A 900 ms watchdog: a ping every 300 ms while all is well.
  startDaemon({.environment = {{"WATCHDOG_USEC", "900000"}, {"ZERITHD_TEST_WEDGE_MAIN_QUEUE_AFTER_MS", "3000"}}});
  ASSERT_TRUE(daemon->waitFor("Watchdog on, pinging every 300 ms")) << daemon->output();
  const auto pings = [&] {
    const auto all = daemon->notifications();
    return std::count_if(all.begin(), all.end(), [](const std::string& m) { return m.find("WATCHDOG=1") != m.npos; });
  };
  for (int i = 0; i < 50 && pings() < 4; ++i) {
    std::this_thread::sleep_for(100ms);
  }
  ASSERT_GE(pings(), 4) << daemon->output();

  ASSERT_TRUE(daemon->waitFor("watchdog: no progress on the main operation queue", 1, 10s)) << daemon->output();
  const auto atStall = pings();
  std::this_thread::sleep_for(2s);  // six ping periods
  EXPECT_EQ(pings(), atStall) << daemon->output();
  // Only the one queue is wedged: the daemon still answers and stops.
  auto client = connect();
  ASSERT_TRUE(client);
  EXPECT_TRUE(client->setSessionInfo(sessionInfo(9), Value(), Value(), false, 10s));
}

// --- Write limit --------------------------------------------------------------

// The signal the daemon would otherwise die of is ignored; it goes on serving.
struct WriteLimitCase {
  const char* name;
  std::uint64_t limit;    // bytes
  std::size_t eventSize;  // 0: no event is sent
  const char* failedWrite;
};

class WriteLimitTest : public E2eTest, public ::testing::WithParamInterface<WriteLimitCase> {};

TEST_P(WriteLimitTest, AWriteBeyondTheLimitFailsAndTheDaemonServesOn) {
  const WriteLimitCase& c = GetParam();
  HttpsTestServer server;
  server.on("/post", {.status = 200});
  serveSignedStorebag(server, collectorStorebag(server.url("/post")));
  startDaemon(trusting());
  // The limit holds before the first HTTPS request (which makes the CA
  // bundle) and before any post. Only the soft limit is lowered, so that it
  // can be lifted again before the daemon exits: a coverage build writes its
  // counters then, and a truncated counter file spoils every later run's.
  rlimit limit{};
  ASSERT_EQ(::prlimit(daemon->pid(), RLIMIT_FSIZE, nullptr, &limit), 0) << std::strerror(errno);
  limit.rlim_cur = c.limit;
  ASSERT_EQ(::prlimit(daemon->pid(), RLIMIT_FSIZE, &limit, nullptr), 0) << std::strerror(errno);

  auto client = startDemoSession(1);
  ASSERT_TRUE(client);
  if (c.eventSize != 0) {
    // Random hex, which compresses poorly.
    std::mt19937_64 random(7);
    std::string blob(c.eventSize, '0');
    for (char& ch : blob) {
      ch = "0123456789abcdef"[random() % 16];
    }
    ASSERT_TRUE(client->sendMessage(event(3, 4, Value(Dictionary{{"blob", blob}})), 10s));
  }
  ASSERT_TRUE(daemon->waitFor(c.failedWrite)) << daemon->output();
  EXPECT_NE(daemon->output().find("File too large"), std::string::npos) << daemon->output();

  // Still alive and answering: another client's session is set up.
  auto other = connect();
  ASSERT_TRUE(other);
  EXPECT_TRUE(other->setSessionInfo(sessionInfo(2), Value(), Value(), false, 10s));
  EXPECT_TRUE(daemon->running());
  limit.rlim_cur = limit.rlim_max;
  EXPECT_EQ(::prlimit(daemon->pid(), RLIMIT_FSIZE, &limit, nullptr), 0) << std::strerror(errno);
}

INSTANTIATE_TEST_SUITE_P(
    Writes, WriteLimitTest,
    ::testing::Values(
        // The system's CA bundle alone is larger than the limit.
        WriteLimitCase{"CaBundleMemfd", 64 * 1024, 0, "cannot make the CA bundle with the extra authorities"},
        // The bundle fits; one event's post body does not.
        WriteLimitCase{"PostBodyFile", 1024 * 1024, 3 * 1024 * 1024, "cannot write the body file"}),
    [](const auto& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace zerith::test
