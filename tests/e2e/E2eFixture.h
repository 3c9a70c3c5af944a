#pragma once

// Scenario helpers of the end-to-end tests: a temporary root with an
// entitlements policy for the test's own user, the real zerithd started in
// it, storebags signed and served, collectors as processes of their own;
// raw socket clients are tests/support/RawFrameSocket.h.

#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

#include "config/StorebagSigner.h"
#include "ipc/DaemonStatus.h"
#include "platform/Defaults.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tests/support/CollectorProcess.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/RawFrameSocket.h"
#include "tests/support/TempRoot.h"
#include "tests/support/TestCA.h"
#include "tools/zerith/ZerithCli.h"
#include "tools/zerith/tests/RunCli.h"
#include "zerith/Zerith.h"

namespace zerith::test {

using namespace std::chrono_literals;

// Entries of /proc/<pid>/<folder> ("fd": descriptors, "task": threads).
inline std::size_t procEntries(pid_t pid, const char* folder) {
  std::error_code ec;
  std::size_t n = 0;
  for (auto it = std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/" + folder, ec);
       !ec && it != std::filesystem::directory_iterator(); it.increment(ec)) {
    ++n;
  }
  return n;
}

// A field of /proc/<pid>/status in KiB ("VmRSS", "VmHWM").
inline std::uint64_t procStatusKiB(pid_t pid, const std::string& field) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(in, line);) {
    if (line.rfind(field + ":", 0) == 0) {
      return std::stoull(line.substr(field.size() + 1));
    }
  }
  return 0;
}

// What a client's message handler (its aggregation block) received. Declare
// it before the client: the daemon may still send while the client ends.
class Received {
 public:
  struct Message {
    Value sessionInfo;
    unsigned category;
    unsigned type;
    Value payload;
  };
  void attach(Zerith& client) {
    client.setMessageHandler(
        [this](const Value& info, double, std::uint16_t category, std::uint16_t type, const Value& payload) {
          std::lock_guard lock(mutex_);
          messages_.push_back({info, category, type, payload});
          changed_.notify_all();
        });
  }
  // The first message that `match` takes; nullopt on time-out.
  template <typename Match>
  std::optional<Message> waitFor(Match match, std::chrono::milliseconds timeout = 10s) {
    std::unique_lock lock(mutex_);
    std::optional<Message> found;
    changed_.wait_for(lock, timeout, [&] {
      for (const auto& m : messages_) {
        if (match(m)) {
          found = m;
          return true;
        }
      }
      return false;
    });
    return found;
  }
  std::vector<Message> all() {
    std::lock_guard lock(mutex_);
    return messages_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Message> messages_;
};

class E2eTest : public ::testing::Test {
 protected:
  // The test's own user may report (grant() changes that), and no storebag
  // server answers: a refused port fails every fetch at once.
  E2eTest() {
    grant(Value(true));
    Defaults("com.velmar.zerith").setObject("zerith_storebag_url", Value("https://127.0.0.1:1/zerith"));
  }

  // The `users` (by default the test's own) may (or may not) report, and
  // read the daemon's status when `status` is set.
  void grant(const Value& entitlement, bool status = false,
             Array users = {Value(static_cast<unsigned long long>(::getuid()))}) {
    Dictionary entitlements;
    if (!entitlement.isNil()) {
      entitlements.set("com.velmar.private.zerithd", entitlement);
    }
    if (status) {
      entitlements.set(ipc::kDaemonStatusEntitlement, true);
    }
    const Value policy(
        Dictionary{{"users", Value(std::move(users))}, {"entitlements", Value(std::move(entitlements))}});
    root.write("/etc/zerithd/entitlements.d/test.plist", plist::encodeXml(policy));
  }

  // The storebag signing key the daemon verifies with.
  void installPublicKey(const Data& der) {
    root.write("/usr/share/zerith/publicKey.der", std::string(der.begin(), der.end()));
  }

  // `bag` in a signed container; the key pair is made once per test process
  // and its public half installed where this root's daemon reads it.
  Data signedStorebag(const Value& bag) {
    static const std::optional<StorebagKeyPair> keys = generateStorebagKeyPair(2048);
    EXPECT_TRUE(keys.has_value());
    if (!keys) {
      return {};
    }
    installPublicKey(keys->publicKeyDER);
    const auto container = signStorebagContainer(keys->privateKeyPEM, plist::encodeBinary(bag));
    EXPECT_TRUE(container.has_value());
    return container.value_or(Data());
  }

  // Signs `bag` (signedStorebag), writes it where a collector serving `www`
  // hands out the storebag "dravon", and points the daemon's storebag URL at
  // `storebagURL`.
  void publishSignedStorebag(const Value& bag, const std::filesystem::path& www, const std::string& storebagURL) {
    std::filesystem::create_directories(www / "zerith");
    ASSERT_TRUE(file::writeAtomically(www / "zerith/dravon", signedStorebag(bag), std::filesystem::perms(0644)));
    Defaults("com.velmar.zerith").setObject("zerith_storebag_url", Value(storebagURL));
  }

  // The same for a test server: it answers "/zerith/dravon" with the signed
  // `bag` (cacheable for ten minutes), and the daemon asks it for storebags.
  void serveSignedStorebag(HttpsTestServer& server, const Value& bag) {
    const Data container = signedStorebag(bag);
    server.on("/zerith/dravon", {.status = 200,
                                 .headers = {{"Cache-Control", "max-age=600"}},
                                 .body = std::string(container.begin(), container.end())});
    Defaults("com.velmar.zerith").setObject("zerith_storebag_url", Value(server.url("/zerith")));
  }

  // A storebag whose seed and release sections are both `section`.
  static Value storebag(const Value& section) {
    return Value(Dictionary{{"version", "8.1.0"}, {"seed", section}, {"release", section}});
  }

  // The collector tests' storebag: one HTTPS backend for the demo client,
  // posting to `postURL`, admitted for the GB locale, every event sampled in
  // and the device identifier hashed; `extra` adds or replaces entries.
  static Value collectorStorebag(const std::string& postURL, const Dictionary& extra = {}) {
    Dictionary client{{"client", "demo"},
                      {"service", "cli"},
                      {"override_dnu", 1},
                      {"locale_whitelist", Array{Value("GB")}},
                      {"filters", Array{Value(Dictionary{{"key", "udid"}, {"action", "sha256"}})}},
                      {"sampling_threshold", 1.0},
                      {"post_url", postURL}};
    for (const auto& [key, value] : extra) {
      client.set(key, value);
    }
    return storebag(Value(Dictionary{{"httpsPost", Dictionary{{"clients", Array{Value(std::move(client))}}}}}));
  }

  // zerith-collector with a certificate made in <root>/collector/certs and
  // `args`; the daemon trusts it with trusting(collectorCA()).
  std::unique_ptr<CollectorProcess> startCollector(const std::vector<std::string>& args) const {
    std::vector<std::string> all = {"--generate-cert", (root.path() / "collector/certs").string()};
    all.insert(all.end(), args.begin(), args.end());
    auto collector = std::make_unique<CollectorProcess>(ZERITH_COLLECTOR_TOOL, all);
    EXPECT_GT(collector->port(), 0) << collector->said();
    return collector;
  }
  std::filesystem::path collectorCA() const { return root.path() / "collector/certs/ca.pem"; }

  // A daemon that trusts the CA in `caFile` (by default the test CA that
  // HttpsTestServer serves with) and reads its locale from `locale` when
  // given (the collector tests' storebags admit only GB).
  static DaemonProcess::Options trusting(const std::filesystem::path& caFile = TestCA::shared().caFile(),
                                         const char* locale = "en_GB.UTF-8") {
    DaemonProcess::Options options{.arguments = {"--stop-timeout", "5", "--ca-file", caFile.string()}};
    if (locale) {
      options.environment = {{"LC_ALL", locale}};
    }
    return options;
  }

  static std::unique_ptr<Zerith> connect() {
    Error error;
    auto client = Zerith::connect({}, &error);
    EXPECT_NE(client, nullptr) << error.description;
    return client;
  }

  // A session of client type 7 that requires user info and gives the one
  // the collector tests' storebags admit ("demo", "cli"), so that the whole
  // storebag check runs (consent, locale, filters, sampling); `started`
  // (when given) receives the start's answer.
  std::unique_ptr<Zerith> startDemoSession(std::uint32_t sessionID, ZerithReply* started = nullptr) {
    auto client = connect();
    if (!client) {
      return nullptr;
    }
    Dictionary info = sessionInfo(sessionID).dictCopy();
    info.set(kZerithSessionInfoRequireUserInfo, Value(true));
    const Value user(Dictionary{{kZerithUserInfoClientName, "demo"}, {kZerithUserInfoServiceName, "cli"}});
    EXPECT_TRUE(client->setSessionInfo(Value(std::move(info)), user, Value(), false, 10s));
    ZerithReply answer = client->startConfig(20s);
    EXPECT_TRUE(answer);
    if (started) {
      *started = std::move(answer);
    }
    return client;
  }

  static Value sessionInfo(std::uint32_t sessionID, long long clientType = 7) {
    return Value(
        Dictionary{{kZerithSessionInfoSessionID, Value(sessionID)}, {kZerithSessionInfoClientType, Value(clientType)}});
  }
  // The session info of a member of the hierarchy `token` at `level`.
  static Value hierarchy(std::uint32_t sessionID, const std::string& token, long long level) {
    Dictionary d = sessionInfo(sessionID).dictCopy();
    d.set(kZerithSessionInfoHierarchyToken,
          Value(Dictionary{{kZerithHierarchyTokenTokenID, Value(token)}, {kZerithHierarchyTokenLevel, Value(level)}}));
    return Value(std::move(d));
  }
  // An event's message parameters; no payload when `payload` is nil.
  static Value event(long long category, long long type, const Value& payload = Value()) {
    Dictionary d{{kZerithMessageParametersCategory, Value(category)}, {kZerithMessageParametersType, Value(type)}};
    if (!payload.isNil()) {
      d.set(kZerithMessageParametersPayload, payload);
    }
    return Value(std::move(d));
  }

  // The backends a new session `sessionID` of client type 7 starts with;
  // nil when the daemon has no storebag for it.
  Value startedBackends(std::uint32_t sessionID) {
    auto client = connect();
    if (!client) {
      return Value();
    }
    EXPECT_TRUE(client->setSessionInfo(sessionInfo(sessionID), Value(), Value(), false, 10s));
    const auto started = client->startConfig(20s);
    EXPECT_TRUE(started);
    return started["backends"];
  }

  // `zerith --root <root> args...`, run in this process.
  CliResult zerith(std::vector<std::string> args) const {
    args.insert(args.begin(), {"--root", root.path().string()});
    return runCli(std::move(args));
  }
  // `zerith status --json`, parsed (discarded when it fails).
  nlohmann::ordered_json statusJson() const {
    const CliResult run = zerith({"status", "--json"});
    EXPECT_EQ(run.status, 0) << run.err;
    return nlohmann::ordered_json::parse(run.out, nullptr, /*allow_exceptions=*/false);
  }

  DaemonProcess& startDaemon(DaemonProcess::Options options = {}) {
    if (options.arguments.empty()) {
      options.arguments = {"--stop-timeout", "5"};
    }
    daemon = std::make_unique<DaemonProcess>(root, std::move(options));
    EXPECT_TRUE(daemon->ready()) << daemon->output();
    return *daemon;
  }

  void TearDown() override {
    if (daemon) {
      // A daemon that ended on its own during the test (a crash, outside the
      // sanitizer build too) fails it as one that stops badly does; tests
      // that kill it on purpose let it go first.
      const auto status = daemon->running() ? daemon->stop() : daemon->waitForExit(std::chrono::milliseconds(0));
      EXPECT_EQ(status, 0) << (status ? std::to_string(*status) : std::string("still running")) << "\n"
                           << daemon->output();
      EXPECT_EQ(daemon->output().find("Sanitizer"), std::string::npos) << daemon->output();
    }
  }

  static constexpr const char* kTransactionEnded = "releaseVeskTransaction: Vesk transaction ended";

  TempRoot root;
  std::unique_ptr<DaemonProcess> daemon;
};

}  // namespace zerith::test
