// A session's start against a real storebag server: a signed storebag over
// HTTPS, trusted through the daemon's --ca-file, starts the session and
// sends its start message to the client's aggregator.

#include <signal.h>

#include <future>

#include "config/StorebagSigner.h"
#include "tests/e2e/E2eFixture.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

using log::Level;

class StorebagStartTest : public E2eTest {
 protected:
  void SetUp() override {
    grant(Value(true));
    const Value bag(Dictionary{{"version", Value("5.2.0")},
                               {"seed", Value(Dictionary{{"kovu", Value(Dictionary{{"active", Value(true)}})}})}});
    serveSignedStorebag(server, bag);
  }

  DaemonProcess& start(bool trustTestCA) {
    DaemonProcess::Options options = testCAOptions("fr_FR.UTF-8");
    if (!trustTestCA) {
      options.arguments.resize(2);  // no --ca-file
    }
    return startDaemon(options);
  }

  Value startSession() { return startedBackends(31); }
  static Value info() { return sessionInfo(31); }

  HttpsTestServer server;
};

TEST_F(StorebagStartTest, SignedStorebagStartsTheSessionAndItsStartMessageReachesTheAggregator) {
  start(/*trustTestCA=*/true);
  // What the message handler touches outlives the client.
  std::promise<Dictionary> startMessage;
  std::atomic<int> messages{0};
  auto client = connect();
  ASSERT_TRUE(client);
  client->setMessageHandler(
      [&](const Value& message, double, std::uint16_t category, std::uint16_t type, const Value& payload) {
        if (messages++ == 0) {
          startMessage.set_value(Dictionary{{"message", message},
                                            {"category", Value(unsigned{category})},
                                            {"type", Value(unsigned{type})},
                                            {"payload", payload}});
        }
      });
  ASSERT_TRUE(client->setSessionInfo(info(), Value(), Value(),
                                     /*hasAggregationBlock=*/true, 10s));
  const auto started = client->startConfig(20s);
  ASSERT_TRUE(started) << started.error->description;
  // The seed section's adaptor backend is made (client type 7 may have one)
  // and enabled; without its plugin it reports every event as not forwarded.
  EXPECT_EQ(started["backends"], Value(Array{Value("kovu")})) << daemon->output();

  ASSERT_TRUE(server.waitForRequests(1));
  EXPECT_EQ(server.requests()[0].path, "/zerith/dravon");
  auto future = startMessage.get_future();
  ASSERT_EQ(future.wait_for(10s), std::future_status::ready);
  EXPECT_EQ(future.get(),
            (Dictionary{{"message", info()},
                        {"category", Value(0u)},
                        {"type", Value(0u)},
                        {"payload", Value(Dictionary{{"AutomaticTimeSet", Value(true)}, {"Locale", Value("FR")}})}}));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "createBackendsWithStorebag: Creating backends for session 31"));

  // A second start is answered from the agent's cache.
  ASSERT_TRUE(client->startConfig(20s));
  EXPECT_TRUE(daemon->waitForExact(Level::Debug, "storebagForSession: Cached storebag found for client type 7"));
  EXPECT_EQ(server.requestCount(), 1u);
}

TEST_F(StorebagStartTest, StorebagServerOutsideTheTrustedAuthoritiesLeavesTheSessionUnstarted) {
  start(/*trustTestCA=*/false);
  EXPECT_TRUE(startSession().isNil());
  // The error line carries the TLS cause, not only the info line before it.
  const std::string cause = "SSL certificate problem: unable to get local issuer certificate from " +
                            server.url("/zerith/dravon?version=8.0");
  EXPECT_TRUE(
      daemon->waitForExact(Level::Default, "fetchNetworkStorebag: Error resolving with lookup server " +
                                               server.url("/zerith/dravon?version=8.0") +
                                               ", sendSynchronousRequest error SSL certificate problem: unable to "
                                               "get local issuer certificate"))
      << daemon->output();
  EXPECT_TRUE(
      daemon->waitForExact(Level::Error, "fetchAndCacheStorebag: Unable to fetch storebag for client type 7: " + cause +
                                             "; the built-in fallback storebag was loaded; the storebag's "
                                             "signature is missing"))
      << daemon->output();
}

// The operator's way out of the in-memory cache: SIGHUP drops the cached
// storebags and the 900-second wait after a failure, so that a new server
// URL or a replaced public key takes effect without a restart.
TEST_F(StorebagStartTest, SighupDropsTheCachedStorebagsAndTheWaitAfterAFailure) {
  RefusingPort refusing;
  Defaults("com.velmar.zerith").setObject("zerith_storebag_url", Value(refusing.url("/zerith")));
  start(/*trustTestCA=*/true);
  EXPECT_TRUE(startSession().isNil());
  ASSERT_TRUE(daemon->waitFor("fetchAndCacheStorebag: Unable to fetch storebag for client type 7: "));

  // A corrected URL alone waits out the 900 seconds.
  Defaults("com.velmar.zerith").setObject("zerith_storebag_url", Value(server.url("/zerith")));
  EXPECT_TRUE(startSession().isNil());
  EXPECT_TRUE(daemon->waitForExact(Level::Default,
                                   "storebagForSession: Not fetching storebag for client "
                                   "type 7 - must wait 900 seconds between attempts"));
  EXPECT_EQ(server.requestCount(), 0u);

  daemon->signal(SIGHUP);
  ASSERT_TRUE(daemon->waitForExact(Level::Default,
                                   "main: Received SIGHUP, dropped 1 cached storebag(s) and "
                                   "their waits; the next session fetches again"));
  EXPECT_EQ(startSession(), Value(Array{Value("kovu")})) << daemon->output();
  EXPECT_EQ(server.requestCount(), 1u);

  // A replaced public key: the fresh in-memory copy still serves, until the
  // operator drops it; then the copy on disk is checked with the new key.
  const auto other = generateStorebagKeyPair(2048);
  ASSERT_TRUE(other.has_value());
  installPublicKey(other->publicKeyDER);
  EXPECT_EQ(startSession(), Value(Array{Value("kovu")}));
  daemon->signal(SIGHUP);
  ASSERT_TRUE(daemon->waitFor("main: Received SIGHUP, dropped 1 cached storebag(s)", 2));
  EXPECT_TRUE(startSession().isNil());
  EXPECT_TRUE(daemon->waitFor("fetchStorebagWithName: Signature can not be verified, "));
  EXPECT_TRUE(daemon->running());
}

}  // namespace
}  // namespace zerith::test
