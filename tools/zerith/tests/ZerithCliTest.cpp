#include "tools/zerith/ZerithCli.h"
#include "tools/zerith/ZerithStatus.h"

#include <unistd.h>

#include <fstream>
#include <gtest/gtest.h>

#include "client/tests/TestDaemon.h"
#include "config/tests/ScopedEnv.h"
#include "ipc/EntitlementPolicy.h"
#include "platform/Json.h"
#include "tools/zerith/tests/RunCli.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

struct CliFixture : DaemonFixture {
  std::vector<std::string> session(std::initializer_list<std::string> more) {
    std::vector<std::string> args{"--root", root.path().string(), "--timeout", "5000", "session", "--client-type", "7",
                                  "--session-id", "1"};
    args.insert(args.end(), more);
    return args;
  }
};

TEST_F(CliFixture, AScriptedSessionPrintsOneJsonLinePerStep) {
  const auto r = runCli(session({"--user-info", R"({"clientName":"mail"})", "--hierarchy-token", "T", "--hierarchy-level",
                                 "2", "--category", "1", "--type", "2", "--payload", R"({"k":"v"})", "--step", "set-info",
                                 "--step", "start", "--step", "display-url", "--step", "send", "--step", "flush", "--step",
                                 "finish"}));
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out,
            "{\"step\":\"set-info\"}\n"
            "{\"step\":\"start\",\"backends\":[\"httpsPost\",\"dashboard\"]}\n"
            "{\"step\":\"display-url\",\"url\":\"https://display.example/session\"}\n"
            "{\"step\":\"send\",\"result\":\"sent\"}\n"
            "{\"step\":\"flush\",\"result\":\"flushed\"}\n"
            "{\"step\":\"finish\"}\n");
  const auto calls = daemon->waitForClient().session->log.calls();
  ASSERT_EQ(calls.size(), 6u);
  EXPECT_EQ(calls[0].args.get("sessionInfo"),
            Value(Dictionary{{"sessionID", 1u}, {"clientType", 7u}, {"hierarchyToken", Dictionary{{"tokenID", "T"}, {"level", 2u}}}}));
  EXPECT_EQ(calls[0].args.get("userInfo"), Value(Dictionary{{"clientName", "mail"}}));
  EXPECT_EQ(calls[3].args.get("message"), Value(Dictionary{{"category", 1u}, {"type", 2u}, {"payload", Dictionary{{"k", "v"}}}}));
}

TEST_F(CliFixture, StepArgumentsReachTheSession) {
  // The framework opens an upload's file itself: it has to exist.
  const std::string upload = (root.path() / "f.log").string();
  std::ofstream(upload) << "log";
  const auto r = runCli(session({"--step", R"(send={"category":3,"type":4,"payload":{}})", "--step",
                                 R"(one-shot={"category":5,"type":6,"payload":{"x":1}})", "--step", "shared-key=k=[1]",
                                 "--step", "shared-key=gone=null", "--step", "digest-key=AAH/:3", "--step",
                                 "upload-file=" + upload}));
  EXPECT_EQ(r.status, 0) << r.err;
  const auto calls = daemon->waitForClient().session->log.calls();
  ASSERT_EQ(calls.size(), 7u);
  EXPECT_EQ(calls[0].operation, "setSessionInfo");  // implied: the steps need the session's info
  EXPECT_EQ(calls[2].args.get("category"), Value(5u));
  EXPECT_EQ(calls[2].args.get("payload"), Value(Dictionary{{"x", 1}}));
  EXPECT_EQ(Value(calls[3].args), Value(Dictionary{{"key", "k"}, {"value", Array{Value(1)}}}));
  EXPECT_EQ(Value(calls[4].args), Value(Dictionary{{"key", "gone"}, {"value", Value()}}));
  EXPECT_EQ(Value(calls[5].args), Value(Dictionary{{"digestKey", Data{0, 1, 255}}, {"algorithm", 3}}));
}

TEST_F(CliFixture, SessionInfoEntriesOverrideTheOptions) {
  // The extra entries are copied out of a parsed JSON value; the sanitizer
  // build catches a loop over a dictionary that is already gone.
  const auto r = runCli(session({"--client-version", "3", "--session-info",
                                 R"({"clientVersion":4,"batchEvent":true,"note":"a longer text than any small string"})",
                                 "--step", "set-info"}));
  EXPECT_EQ(r.status, 0) << r.err;
  const auto calls = daemon->waitForClient().session->log.calls();
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].args.get("sessionInfo"),
            Value(Dictionary{{"sessionID", 1u}, {"clientType", 7u}, {"clientVersion", 4}, {"batchEvent", true},
                             {"note", "a longer text than any small string"}}));
  EXPECT_EQ(runCli(session({"--session-info", "{}", "--step", "set-info"})).status, 0);
}

TEST_F(CliFixture, SetInfoRunsFirstUnlessTheScriptPlacesIt) {
  auto r = runCli(session({"--step", "display-url"}));
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out, "{\"step\":\"set-info\"}\n{\"step\":\"display-url\",\"url\":\"https://display.example/session\"}\n");
  auto calls = daemon->waitForClient().session->log.calls();
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(calls[0].args.get("sessionInfo")["clientType"], Value(7u));

  // Placed by the script: exactly where it stands. Nothing needs it: none.
  r = runCli(session({"--step", "start", "--step", "set-info", "--step", "finish"}));
  EXPECT_EQ(r.status, 0) << r.err;
  auto second = daemon->waitForClient(2).session;
  ASSERT_TRUE(second->log.waitFor(3));
  calls = second->log.calls();
  ASSERT_EQ(calls.size(), 3u);
  EXPECT_EQ(calls[0].operation, "startConfig");
  r = runCli(session({"--step", R"(one-shot={"category":1,"type":2})", "--step", "finish"}));
  EXPECT_EQ(r.status, 0) << r.err;
  auto third = daemon->waitForClient(3).session;
  ASSERT_TRUE(third->log.waitFor(2));
  calls = third->log.calls();
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(calls[0].operation, "sendMessageWithSessionInfo");
}

TEST_F(CliFixture, AnswersThatMeanFailureEndTheScriptWithStatus5) {
  daemon->prepare = [](ipc::test::RecordingSession& s) {
    s.backends = Value();  // a start without a storebag answers nothing
  };
  auto r = runCli(session({"--step", "start", "--step", "finish"}));
  EXPECT_EQ(r.status, cli::kExitStepFailed);
  const std::string why = R"(the daemon has no storebag \"dravon\" for client type 7; its log says why (no storebag server set, server unreachable, signature refused))";
  EXPECT_EQ(r.out, "{\"step\":\"set-info\"}\n{\"step\":\"start\",\"failure\":\"" + why + "\"}\n");
  EXPECT_EQ(r.err, "zerith: start: the daemon has no storebag \"dravon\" for client type 7; its log says why (no storebag "
                   "server set, server unreachable, signature refused)\n");
  EXPECT_EQ(daemon->waitForClient().session->log.calls().size(), 2u);  // finish never ran

  daemon->prepare = [](ipc::test::RecordingSession& s) {
    s.flushError = Error{"com.velmar.zerith.ErrorDomain", 7, "backend httpsPost: HTTP status 503"};
  };
  r = runCli(session({"--step", "flush", "--step", "finish"}));
  EXPECT_EQ(r.status, cli::kExitStepFailed);
  EXPECT_EQ(r.err, "zerith: flush: backend httpsPost: HTTP status 503\n");
  daemon->waitForClient(2);

  daemon->prepare = [](ipc::test::RecordingSession&) {};
  r = runCli(session({"--step", R"(upload-log=["a"])", "--step", "finish"}));
  EXPECT_EQ(r.status, cli::kExitStepFailed);
  EXPECT_NE(r.out.find("{\"step\":\"upload-log\",\"success\":false,\"error\":{\"domain\":\"com.velmar.zerith.ErrorDomain\",\"code\":-1,\"description\":\"no upload backend\"}}\n"),
            std::string::npos) << r.out;
  EXPECT_EQ(r.err, "zerith: upload-log: no upload backend\n");
}

TEST_F(CliFixture, UnreachableDaemonExitsWithAClearMessage) {
  const auto r = runCli({"--socket", (root / "/nowhere/sock").string(), "session", "--client-type", "7", "--session-id", "1",
                         "--step", "start"});
  EXPECT_EQ(r.status, cli::kExitUnreachable);
  EXPECT_EQ(r.err, "zerith: the daemon is unreachable: Cannot connect to " + (root / "/nowhere/sock").string() +
                       ": No such file or directory\n");
  EXPECT_EQ(r.out, "");
}

TEST_F(CliFixture, RefusedClientExitsWithTheRefusalStatus) {
  grantEntitlement(root, "<string>yes</string>");
  const auto r = runCli(session({"--step", "set-info", "--step", "start"}));
  EXPECT_EQ(r.status, cli::kExitRefused);
  EXPECT_EQ(r.out, "{\"step\":\"set-info\",\"failure\":\"The connection was invalidated\"}\n");
  EXPECT_EQ(r.err, "zerith: the daemon closed the session during set-info (is this user granted com.velmar.private.zerithd?)\n");
}

TEST_F(CliFixture, StatusNeedsADaemonThatAnswersIt) {
  const auto unreachable = runCli({"--socket", (root / "/nowhere/sock").string(), "status"});
  EXPECT_EQ(unreachable.status, cli::kExitUnreachable);
  EXPECT_EQ(unreachable.out, "");
  // This daemon knows only the session interface: the call is unknown there.
  const auto unknown = runCli({"--root", root.path().string(), "--timeout", "5000", "status", "--json"});
  EXPECT_EQ(unknown.status, cli::kExitStepFailed);
  EXPECT_EQ(unknown.err, "zerith: status: Unknown operation \"fetchDaemonStatusWithCompletionHandler:\"\n");
  EXPECT_EQ(unknown.out, "");
}

TEST(Cli, StatusTablesShowEachBackendsCountsAndWhyEventsWereDropped) {
  ipc::DaemonStatus status;
  status.sessions.push_back(ipc::SessionStatus{
      12, "s", 7,
      {ipc::BackendStatus{"httpsPost", 2,
                          {{"accepted", 1200}, {"sent", 1200}, {"inFlight", 6}, {"batched", 4}, {"droppedSampledOut", 0}, {"droppedFiltered", 3},
                           {"droppedBlacklisted", 1}, {"delivered", 1190}}},
       ipc::BackendStatus{"pellamlog", 3, {{"droppedUnsupported", 7}, {"droppedFutureReason", 2}}}}});
  status.sessions.push_back(ipc::SessionStatus{13, "t", 9, {}});
  status.ended.push_back(ipc::EndedTotals{7, "httpsPost", 2, {{"sent", 5}, {"retried", 2}}});
  EXPECT_EQ(cli::statusTable(status),
            "Live sessions: 2\n"
            "SESSION  CLIENT  BACKEND    STATE        ACCEPTED  SENT  BATCHED  SPOOLED  RETRIED  DELIVERED  INBATCH  INFLIGHT  INSPOOL  DROPPED  WHY\n"
            "12       7       httpsPost  enabled          1200  1200        4        0        0       1190        0         6        0        4  filtered 3, blacklisted 1\n"
            "12       7       pellamlog  sampled out         0     0        0        0        0          0        0         0        0        9  unsupported 7, futureReason 2\n"
            "13       9       -          no backends\n"
            "\n"
            "Ended sessions, totals by client type and backend:\n"
            "CLIENT  BACKEND    SESSIONS  ACCEPTED  SENT  BATCHED  SPOOLED  RETRIED  DELIVERED  INBATCH  INFLIGHT  INSPOOL  DROPPED  WHY\n"
            "7       httpsPost         2         0     5        0        0        2          0        0         0        0        0  -\n");
  EXPECT_EQ(cli::statusTable(ipc::DaemonStatus{}),
            "Live sessions: 0\n\nEnded sessions, totals by client type and backend:\n(none)\n");
}

TEST_F(CliFixture, AStepThatTimesOutStopsTheScript) {
  daemon->prepare = [](ipc::test::RecordingSession& s) { s.answer = false; };
  auto args = session({"--step", "set-info", "--step", "display-url", "--step", "finish"});
  args[3] = "50";  // --timeout
  const auto r = runCli(args);
  EXPECT_EQ(r.status, cli::kExitStepFailed);
  EXPECT_EQ(r.out, "{\"step\":\"set-info\"}\n{\"step\":\"display-url\",\"failure\":\"No answer to fetchDisplayURL: within 50 ms\"}\n");
  EXPECT_EQ(r.err, "zerith: display-url: No answer to fetchDisplayURL: within 50 ms\n");
}

TEST_F(CliFixture, BadCommandLinesAreRefusedBeforeConnecting) {
  EXPECT_EQ(runCli(session({"--step", "launch"})).err, "zerith: unknown step \"launch\" (see zerith session --help)\n");
  EXPECT_EQ(runCli(session({"--step", "send={oops"})).err, "zerith: send message is not valid JSON: {oops\n");
  EXPECT_EQ(runCli(session({"--step", "upload-log={}"})).status, cli::kExitUsage);
  EXPECT_EQ(runCli({"--help"}).status, 0);

  const std::string more = "\nRun with --help for more information.\n";
  EXPECT_EQ(runCli({"session", "--session-id", "1", "--step", "start"}).err, "zerith: session needs --client-type" + more);
  EXPECT_EQ(runCli({"session", "--client-type", "7", "--step", "start"}).err, "zerith: session needs --session-id" + more);
  EXPECT_EQ(runCli({"session", "--client-type", "7", "--session-id", "1"}).err, "zerith: session needs --step" + more);
  EXPECT_EQ(runCli({}).err, "zerith: a command is required: session, sessions, status, spool, entitlements, identifier or version" + more);

  // Misspelt words are named, with the nearest known one.
  EXPECT_EQ(runCli(session({"--stepp", "start"})).err,
            "zerith: unknown option --stepp for session (did you mean --step?)" + more);
  EXPECT_EQ(runCli({"sesion", "--client-type", "7", "--session-id", "1", "--step", "start"}).err,
            "zerith: unknown command \"sesion\" (did you mean session?)" + more);
  EXPECT_EQ(runCli({"--tmeout=5", "version"}).err, "zerith: unknown option --tmeout (did you mean --timeout?)" + more);
  EXPECT_EQ(runCli({"session", "--frobnicate", "--client-type", "7"}).err, "zerith: unknown option --frobnicate for session" + more);
  EXPECT_EQ(runCli({"version", "now"}).err, "zerith: unexpected argument \"now\"" + more);
  EXPECT_EQ(runCli({"--timeout", "0", "version"}).err, "zerith: --timeout must be at least 1 millisecond, not 0" + more);
  EXPECT_EQ(runCli({"--timeout", "-5", "version"}).status, cli::kExitUsage);

  // Client types without a storebag run as nothing on the daemon's side.
  for (const char* type : {"0", "4", "24", "99"}) {
    const auto r = runCli({"--root", root.path().string(), "session", "--client-type", type, "--session-id", "1", "--step", "start"});
    EXPECT_EQ(r.status, cli::kExitUsage) << type;
    EXPECT_EQ(r.err, std::string("zerith: client type ") + type + " has no storebag (client types 5 to 23 have one)\n");
  }
  EXPECT_EQ(runCli(session({"--session-info", R"({"clientType":"7"})", "--step", "start"})).err,
            "zerith: client type \"7\" has no storebag (client types 5 to 23 have one)\n");

  // Messages: category and type are 16-bit numbers, the payload a dictionary.
  EXPECT_EQ(runCli(session({"--step", R"(send={"category":"x","type":1})"})).err,
            "zerith: send message: \"category\" must be a number from 0 to 65535, not \"x\"\n");
  EXPECT_EQ(runCli(session({"--step", R"(send={"category":1})"})).err,
            "zerith: send message: \"type\" must be a number from 0 to 65535, not missing\n");
  EXPECT_EQ(runCli(session({"--step", R"(one-shot={"category":1.5,"type":1})"})).status, cli::kExitUsage);
  EXPECT_EQ(runCli(session({"--step", R"(send={"category":65536,"type":1})"})).status, cli::kExitUsage);
  EXPECT_EQ(runCli(session({"--step", R"(send={"category":1,"type":2,"payload":[1]})"})).err,
            "zerith: send message: \"payload\" must be a JSON dictionary\n");
  EXPECT_EQ(daemon->accepted.count(), 0);
}

TEST_F(CliFixture, TheDaemonsMessagesPrintAsEventLines) {
  std::thread sender([&] {
    auto client = daemon->waitForClient();
    ASSERT_TRUE(client.session->log.waitFor(1));
    client.toClient->sendMessageToClient(Value(), 2.5, 1, 2, Value(Dictionary{{"a", 1}}));
  });
  // finish is answered after the session recorded it; the message then
  // arrives while the script waits.
  const auto r = runCli(session({"--step", "finish", "--step", "wait=300"}));
  sender.join();
  EXPECT_EQ(r.status, 0);
  EXPECT_NE(r.out.find("{\"event\":\"message\",\"message\":null,\"timestamp\":2.5,\"category\":1,\"type\":2,\"payload\":{\"a\":1}}\n"),
            std::string::npos) << r.out;
}

TEST(Cli, IdentifierAndVersionUnderTheGivenRootOrTheDefaultOne) {
  TempRoot root;
  const auto id = runCli({"--root", root.path().string(), "identifier", "--dnu"});
  EXPECT_EQ(id.status, 0);
  EXPECT_EQ(id.out, "{\"identifier\":\"" + Zerith::getPersistentIdentifierForDNU(true) + "\",\"dnu\":true}\n");
  const std::string version =
      "{\"version\":\"8.0\",\"publicKey\":\"" + (root / "/usr/share/zerith/publicKey.der").string() + "\"}\n";
  EXPECT_EQ(runCli({"--root", root.path().string(), "version"}).out, version);
  // Without --root the daemon's default root is used.
  const ScopedEnv defaultRoot("ZERITHD_ROOT", root.path().c_str());
  EXPECT_EQ(runCli({"version"}).out, version);
}

// What the policy grants a user's processes, as the daemon decides it: this
// process's user before and after it is granted, another user, and a user
// the system does not have.
TEST(Cli, EntitlementsShowWhatThePolicyGrantsAUser) {
  TempRoot root;
  const auto entitlements = [&root](std::vector<std::string> more) {
    more.insert(more.begin(), {"--root", root.path().string(), "entitlements"});
    const CliResult r = runCli(more);
    EXPECT_EQ(r.status, 0) << r.err;
    std::string why;
    return json::parseValue(r.out, &why).value_or(Value());
  };
  const Value before = entitlements({});
  EXPECT_EQ(before["uid"].unsignedValue(), ::geteuid());
  EXPECT_EQ(before["admitted"], Value(false));
  EXPECT_EQ(before["entitlements"], Value(Dictionary{}));

  grantEntitlement(root);
  const Value after = entitlements({"--user", std::to_string(::geteuid())});
  EXPECT_EQ(after["admitted"], Value(true));
  EXPECT_EQ(after["entitlements"][ipc::kZerithdEntitlement], Value(true));
  if (::geteuid() != 65534) {
    EXPECT_EQ(entitlements({"--user", "65534"})["admitted"], Value(false));
    // Groups count as the daemon counts them: nobody's own (65534) admits
    // it, root's group (0) does not, as nobody is not in it.
    for (const auto& [gid, admitted] : {std::pair{0, false}, std::pair{65534, true}}) {
      root.write("/etc/zerithd/entitlements.d/group.plist",
                 "<plist version=\"1.0\"><dict><key>groups</key><array><integer>" + std::to_string(gid) +
                     "</integer></array><key>entitlements</key><dict><key>com.velmar.private.zerithd</key><true/>"
                     "</dict></dict></plist>\n");
      EXPECT_EQ(entitlements({"--user", "65534"})["admitted"], Value(admitted)) << "group " << gid;
    }
  }

  const CliResult unknown = runCli({"--root", root.path().string(), "entitlements", "--user", "no-such-zerith-user"});
  EXPECT_EQ(unknown.status, cli::kExitUsage);
  EXPECT_EQ(unknown.err, "zerith: no user no-such-zerith-user on this system\n");
}

}  // namespace
}  // namespace zerith::test
