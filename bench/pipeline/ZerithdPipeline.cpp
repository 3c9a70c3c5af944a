#include "bench/pipeline/ZerithdPipeline.h"

#include <unistd.h>

#include <chrono>
#include <cstdlib>

#include "config/StorebagSigner.h"
#include "platform/Defaults.h"
#include "platform/PropertyList.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/TempRoot.h"
#include "tests/support/TestCA.h"

namespace zerith::bench {

std::string ZerithdPipeline::spoolFolder() const { return (root_->path() / "var/lib/zerithd/spool").string(); }

namespace {

using namespace std::chrono_literals;

// Client type 7 fetches the storebag named "dravon".
constexpr std::uint32_t kClientType = 7;
constexpr const char* kStorebagPath = "/zerith/dravon";
constexpr const char* kClientName = "com.velmar.bench";

}  // namespace

Value ZerithdPipeline::storebag(const Options& options) {
  const Value client(Dictionary{{"client", Value(kClientName)},
                                {"service", Value("playback")},
                                {"post_url", Value(options.postURL)},
                                {"event_threshold", Value(options.eventThreshold)},
                                {"expedite", Value(0)},
                                {"override_dnu", Value(1)},
                                {"sampling_threshold", Value(1.0)},
                                {"locale_whitelist", Value(Array{Value("US")})},
                                {"filters", Value(Array{})}});
  const Value section(Dictionary{{kZerithBackendHTTPPost, Value(Dictionary{{"clients", Value(Array{client})}})}});
  // Every environment gets the same section, whichever the daemon runs in.
  return Value(Dictionary{{"version", Value("5.2.0")},
                          {"development", section},
                          {"internal", section},
                          {"seed", section},
                          {"release", section}});
}

ZerithdPipeline::ZerithdPipeline(Options options) {
  root_ = std::make_unique<test::TempRoot>();
  const Value policy(Dictionary{{"users", Value(Array{Value(static_cast<unsigned long long>(::getuid()))})},
                                {"entitlements", Value(Dictionary{{"com.velmar.private.zerithd", Value(true)}})}});
  root_->write("/etc/zerithd/entitlements.d/bench.plist", plist::encodeXml(policy));

  std::string why;
  const auto keys = generateStorebagKeyPair(2048, &why);
  if (!keys) {
    error_ = "storebag key generation failed: " + why;
    return;
  }
  root_->write("/usr/share/zerith/publicKey.der", std::string(keys->publicKeyDER.begin(), keys->publicKeyDER.end()));
  const auto container = signStorebagContainer(keys->privateKeyPEM, plist::encodeBinary(storebag(options)), &why);
  if (!container) {
    error_ = "storebag signing failed: " + why;
    return;
  }
  storebagServer_ = std::make_unique<test::HttpsTestServer>();
  storebagServer_->on(kStorebagPath, {.status = 200,
                                      .headers = {{"Cache-Control", "max-age=3600"}},
                                      .body = std::string(container->begin(), container->end())});
  Defaults("com.velmar.zerith").setObject("zerith_storebag_url", Value(storebagServer_->url("/zerith")));
  for (const auto& [key, value] : options.defaults) {
    Defaults("com.velmar.zerith").setObject(key, value);
  }

  test::DaemonProcess::Options daemonOptions;
  daemonOptions.debug = options.debugLog;
  daemonOptions.arguments = {"--stop-timeout", "5", "--ca-file", test::TestCA::shared().caFile().string()};
  daemonOptions.environment = {{"LC_ALL", "en_US.UTF-8"}};
  daemon_ = std::make_unique<test::DaemonProcess>(*root_, daemonOptions);
  if (!daemon_->ready()) {
    error_ = "zerithd did not start:\n" + daemon_->output();
  }
}

ZerithdPipeline::~ZerithdPipeline() {
  if (daemon_ && daemon_->running()) {
    daemon_->stop();
  }
}

bool ZerithdPipeline::ready() const { return daemon_ && daemon_->ready() && error_.empty(); }
pid_t ZerithdPipeline::pid() const { return daemon_ ? daemon_->pid() : -1; }
std::string ZerithdPipeline::output() const { return daemon_ ? daemon_->output() : std::string(); }

std::unique_ptr<Zerith> ZerithdPipeline::openSession(std::uint32_t sessionID, std::string* why) const {
  Error error;
  auto session = Zerith::connect({}, &error);
  if (!session) {
    *why = "connect: " + error.description;
    return nullptr;
  }
  const Value info(Dictionary{{kZerithSessionInfoSessionID, Value(static_cast<unsigned long long>(sessionID))},
                              {kZerithSessionInfoClientType, Value(static_cast<unsigned long long>(kClientType))},
                              {kZerithSessionInfoBatchEvent, Value(true)}});
  // No user info: the session does not require it, and the storebag's
  // client entry then applies without the consent and locale checks.
  if (auto r = session->setSessionInfo(info, Value(), Value(), false, 10s); !r) {
    *why = "setSessionInfo: " + r.error->description;
    return nullptr;
  }
  const auto started = session->startConfig(30s);
  if (!started) {
    *why = "startConfig: " + started.error->description;
    return nullptr;
  }
  const Value backends = started["backends"];
  bool hasPost = false;
  if (const Array* list = backends.array()) {
    for (const Value& name : *list) {
      hasPost = hasPost || (name.string() && *name.string() == kZerithBackendHTTPPost);
    }
  }
  if (!hasPost) {
    *why = "the session started without an httpsPost backend (backends: " +
           (backends.isNil() ? std::string("none") : std::to_string(backends.array() ? backends.array()->size() : 0)) +
           ")";
    return nullptr;
  }
  return session;
}

}  // namespace zerith::bench
