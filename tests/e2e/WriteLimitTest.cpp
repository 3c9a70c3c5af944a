// A file size limit (RLIMIT_FSIZE) under the daemon: a write past it fails
// with EFBIG, which the daemon handles as any other failed write (the signal
// it would otherwise die of is ignored); it goes on serving clients.

#include <sys/resource.h>

#include <cerrno>
#include <cstring>
#include <ostream>
#include <random>
#include <string>

#include "tests/e2e/E2eFixture.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

struct WriteLimitCase {
  const char* name;
  std::uint64_t limit;    // bytes
  std::size_t eventSize;  // 0: no event is sent
  const char* failedWrite;
  friend void PrintTo(const WriteLimitCase& c, std::ostream* os) { *os << c.name; }
};

class WriteLimitTest : public E2eTest, public ::testing::WithParamInterface<WriteLimitCase> {
 protected:
  static std::string randomHex(std::size_t size) {
    std::mt19937_64 random(7);
    std::string text(size, '0');
    for (char& c : text) {
      c = "0123456789abcdef"[random() % 16];
    }
    return text;
  }
};

TEST_P(WriteLimitTest, AWriteBeyondTheLimitFailsAndTheDaemonServesOn) {
  const WriteLimitCase& c = GetParam();
  grant(Value(true));
  HttpsTestServer server;
  server.on("/post", {.status = 200});
  serveSignedStorebag(server, collectorStorebag(server.url("/post")));
  startDaemon(testCAOptions());
  // The limit holds before the first HTTPS request (which makes the CA
  // bundle) and before any post.
  const rlimit limit{c.limit, c.limit};
  ASSERT_EQ(::prlimit(daemon->pid(), RLIMIT_FSIZE, &limit, nullptr), 0) << std::strerror(errno);

  auto client = startDemoSession(1);
  ASSERT_TRUE(client);
  if (c.eventSize != 0) {
    ASSERT_TRUE(client->sendMessage(event(3, 4, Value(Dictionary{{"blob", randomHex(c.eventSize)}})), 10s));
  }
  ASSERT_TRUE(daemon->waitFor(c.failedWrite)) << daemon->output();
  EXPECT_NE(daemon->output().find("File too large"), std::string::npos) << daemon->output();

  // Still alive and answering: another client's session is set up.
  auto other = connect();
  ASSERT_TRUE(other);
  EXPECT_TRUE(other->setSessionInfo(sessionInfo(2), Value(), Value(), false, 10s));
  EXPECT_TRUE(daemon->running());
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
