// A session's start against a real storebag server on loopback: a signed
// storebag over HTTPS starts the session only when the daemon trusts the
// server through its --ca-file; SIGHUP drops what the daemon cached. What it
// trusts: no bag issued before the newest it accepted (across a restart too,
// until the operator forgets that time), both signatures once the Ed25519 key
// is installed, and no signed bag that it cannot use.

#include <signal.h>

#include <filesystem>

#include "config/StorebagIssueTimes.h"
#include "config/StorebagSigner.h"
#include "tests/e2e/E2eFixture.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;

constexpr double kOlder = 1'700'000'000;  // 2023-11-14 22:13:20
constexpr double kNewer = 1'800'000'000;  // 2027-01-15 08:00:00

class StorebagStartTest : public E2eTest {
 protected:
  void SetUp() override {
    serveSignedStorebag(server, Value(Dictionary{{"version", Value("5.2.0")},
                                                 {"seed", Dictionary{{"kovu", Dictionary{{"active", Value(true)}}}}}}));
  }

  HttpsTestServer server;
};

TEST_F(StorebagStartTest, StorebagServerOutsideTheTrustedAuthoritiesLeavesTheSessionUnstarted) {
  startDaemon();  // no --ca-file: the test CA is not trusted
  EXPECT_TRUE(startedBackends(31).isNil());
  // The error line carries the TLS cause, not only the info line before it.
  const std::string url = server.url("/zerith/dravon?version=8.0");
  const std::string cause = "SSL certificate problem: unable to get local issuer certificate";
  EXPECT_TRUE(daemon->waitForExact(Level::Default, "fetchNetworkStorebag: Error resolving with lookup server " + url +
                                                       ", sendSynchronousRequest error " + cause))
      << daemon->output();
  EXPECT_TRUE(daemon->waitForExact(
      Level::Error, "fetchAndCacheStorebag: Unable to fetch storebag for client type 7: " + cause + " from " + url +
                        "; the built-in fallback storebag was loaded; the storebag's "
                        "signature is missing"))
      << daemon->output();
}

class StorebagTrustTest : public E2eTest {
 protected:
  void SetUp() override {
    grant(Value(true), /*status=*/true);  // the status tells the refusal counts
    rsa = *generateStorebagKeyPair(2048);
    installPublicKey(rsa.publicKeyDER);
    Defaults("com.velmar.zerith").setObject("zerith_storebag_url", Value(server.url("/zerith")));
  }

  // A bag whose one backend tells which bag a session got.
  static Data bag(const char* backend, std::optional<double> issued) {
    const Value section(Dictionary{{backend, Value(Dictionary{})}});
    const Data plain =
        plist::encodeBinary(Value(Dictionary{{"version", backend}, {"seed", section}, {"release", section}}));
    return issued ? *stampStorebagIssueTime(plain, Date{*issued}) : plain;
  }
  Data sign(const Data& bagBytes, const std::optional<std::string>& ed25519PEM = std::nullopt) const {
    return *signStorebagContainer(rsa.privateKeyPEM, bagBytes, nullptr, ed25519PEM);
  }
  // Every fetch asks again (max age 0), so a refusal shows at the next session.
  void serve(const Data& container) {
    server.on("/zerith/dravon", {.status = 200,
                                 .headers = {{"Cache-Control", "max-age=0"}},
                                 .body = std::string(container.begin(), container.end())});
  }

  void start() { startDaemon(trusting(TestCA::shared().caFile(), nullptr)); }
  Value backends() { return startedBackends(5); }

  // A fresh first fetch: no in-memory entry, no disk copy.
  void forgetStorebags(std::size_t hangups) {
    daemon->signal(SIGHUP);
    ASSERT_TRUE(daemon->waitFor("main: Received SIGHUP, dropped ", hangups)) << daemon->output();
    fs::remove(paths::storebagCacheDir() / "dravon");
  }

  std::uint64_t refusedCount(const char* name) {
    auto parsed = statusJson();
    const auto count = parsed.is_object() ? parsed["storebags"]["counts"][name] : nlohmann::ordered_json();
    EXPECT_TRUE(count.is_number_unsigned()) << parsed;
    return count.is_number_unsigned() ? count.get<std::uint64_t>() : 0;
  }

  static Value only(const char* backend) { return Value(Array{Value(backend)}); }

  StorebagKeyPair rsa;
  HttpsTestServer server;
};

TEST_F(StorebagTrustTest, AnOlderBagIsRefusedAcrossARestartUntilTheOperatorForgetsTheNewerTime) {
  serve(sign(bag("kovu", kNewer)));
  start();
  ASSERT_EQ(backends(), only("kovu")) << daemon->output();

  serve(sign(bag("pellamlog", kOlder)));
  EXPECT_EQ(backends(), only("kovu"));
  const std::string rollback = "fetchStorebagWithName: storebag 'dravon' from " +
                               server.url("/zerith/dravon?version=8.0") +
                               " was issued at 2023-11-14 22:13:20 +0000, before 2027-01-15 08:00:00 +0000, the "
                               "newest issue time accepted for it: refused as a rollback";
  ASSERT_TRUE(daemon->waitForExact(Level::Error, rollback)) << daemon->output();
  EXPECT_EQ(backends(), only("kovu"));
  EXPECT_GE(refusedCount("rollbacksRefused"), 1u);

  // The remembered time outlives the daemon: the older bag stays out.
  ASSERT_EQ(daemon->stop(), 0);
  start();
  EXPECT_EQ(backends(), only("kovu"));
  ASSERT_TRUE(daemon->waitForExact(Level::Error, rollback)) << daemon->output();
  EXPECT_EQ(backends(), only("kovu"));

  // The operator's way back: the next refresh takes the older bag.
  std::optional<Date> forgotten;
  std::string error;
  ASSERT_TRUE(forgetStorebagIssueTime("dravon", forgotten, &error)) << error;
  EXPECT_EQ(forgotten, Date{kNewer});
  // This session's fetch is the refresh or comes before it: it may see either
  // bag. What counts is that the older one is saved and served from now on.
  backends();
  ASSERT_TRUE(daemon->waitFor("fetchStorebagWithName: storebag 'dravon' has been saved to disk cache"))
      << daemon->output();
  EXPECT_EQ(backends(), only("pellamlog")) << daemon->output();
}

TEST_F(StorebagTrustTest, AnInstalledEd25519KeyRequiresBothSignatures) {
  const StorebagKeyPair strong = *generateStorebagEd25519KeyPair();
  const StorebagKeyPair otherStrong = *generateStorebagEd25519KeyPair();
  const Data good = bag("kovu", kNewer);
  const auto strongOver = [&](const Data& signedBytes, const StorebagKeyPair& keys) {
    const Data rsaSignature = *signStorebagBytes(rsa.privateKeyPEM, good);
    return plist::encodeBinary(makeStorebagContainer(rsaSignature, good,
                                                     *signStorebagBytes(keys.privateKeyPEM, signedBytes, nullptr,
                                                                        /*ed25519=*/true)));
  };
  // Without the key, either container verifies as it always has.
  serve(sign(good));
  start();
  EXPECT_EQ(backends(), only("kovu")) << daemon->output();
  forgetStorebags(1);
  serve(strongOver(bag("other", kNewer), strong));
  EXPECT_EQ(backends(), only("kovu")) << daemon->output();

  root.write("/usr/share/zerith/publicKeyEd25519.der",
             std::string(strong.publicKeyDER.begin(), strong.publicKeyDER.end()));
  const struct {
    Data container;
    const char* cause;
  } refused[] = {
      {sign(good), "the container has no \"signature_ed25519\" string"},
      {strongOver(bag("other", kNewer), strong), "the Ed25519 signature does not match the bag under this public key"},
      {strongOver(good, otherStrong), "the Ed25519 signature does not match the bag under this public key"},
  };
  std::size_t hangups = 1;
  for (const auto& r : refused) {
    SCOPED_TRACE(r.cause);
    forgetStorebags(++hangups);
    serve(r.container);
    EXPECT_TRUE(backends().isNil());
    EXPECT_TRUE(
        daemon->waitFor(std::string("fetchAndCacheStorebag: Unable to fetch storebag for client type 7: ") + r.cause))
        << daemon->output();
    EXPECT_FALSE(fs::exists(paths::storebagCacheDir() / "dravon"));
  }
  forgetStorebags(++hangups);
  serve(sign(good, strong.privateKeyPEM));
  EXPECT_EQ(backends(), only("kovu")) << daemon->output();
}

TEST_F(StorebagTrustTest, ASignedButUnusableBagIsLoggedWithItsCauseAndNotCached) {
  Value deep(Dictionary{});
  for (int i = 0; i < 40; ++i) {
    deep = Value(Dictionary{{"k", deep}});
  }
  const struct {
    Data bagBytes;
    const char* cause;
  } unusable[] = {
      {plist::encodeBinary(Value(Array{Value("seed")})), "the bag is an array, not a dictionary"},
      {Data{'n', 'o', 't', ' ', 'a', ' ', 'l', 'i', 's', 't'}, "the bag is not a property list ("},
      {plist::encodeBinary(deep), "the bag is not a property list (nesting deeper than 32)"},
      {plist::encodeBinary(Value(Dictionary{{"issue_time", "yesterday"}})), "its \"issue_time\" is "},
  };
  start();
  std::size_t hangups = 0;
  for (const auto& u : unusable) {
    SCOPED_TRACE(u.cause);
    serve(sign(u.bagBytes));
    EXPECT_TRUE(backends().isNil());
    EXPECT_TRUE(daemon->waitFor("fetchStorebagWithName: storebag 'dravon' from " +
                                server.url("/zerith/dravon?version=8.0") + " is signed but unusable: " + u.cause))
        << daemon->output();
    EXPECT_FALSE(fs::exists(paths::storebagCacheDir() / "dravon"));
    forgetStorebags(++hangups);
  }
  EXPECT_GE(refusedCount("unusableRefused"), 4u);
}

}  // namespace
}  // namespace zerith::test
