// A hostile local client against the real daemon: it sends `fetchDisplayURL:`
// calls as fast as it can and reads no reply. The daemon holds it back
// instead of queueing replies for it, serves another client meanwhile, and
// answers every call that it took once the flooder reads.

#include <fcntl.h>
#include <poll.h>

#include "tests/e2e/E2eFixture.h"

namespace zerith::test {
namespace {

constexpr const char* kDisplayURL = "fetchDisplayURL:";

TEST_F(E2eTest, AClientThatFloodsCallsWithoutReadingIsHeldBackAndAnsweredInFullLater) {
  grant(Value(true));
  startDaemon();
  file::UniqueFd flooder = connectToDaemonSocket();
  ASSERT_TRUE(flooder);
  ::fcntl(flooder.get(), F_SETFL, ::fcntl(flooder.get(), F_GETFL) | O_NONBLOCK);

  // Far more calls than a held-back connection takes in (their replies would
  // be about 30 MB).
  constexpr std::uint64_t kMax = 300000;
  std::uint64_t written = 0;
  Data pending;
  std::size_t offset = 0;
  const auto floodUntil = std::chrono::steady_clock::now() + 60s;
  while (written < kMax && std::chrono::steady_clock::now() < floodUntil) {
    if (offset == pending.size()) {
      pending = ipc::encodeCall(kDisplayURL, written + 1, {});
      offset = 0;
    }
    const ssize_t n = ::send(flooder.get(), pending.data() + offset, pending.size() - offset, MSG_NOSIGNAL);
    if (n > 0) {
      offset += static_cast<std::size_t>(n);
      written += offset == pending.size() ? 1 : 0;
      continue;
    }
    ASSERT_TRUE(errno == EAGAIN || errno == EWOULDBLOCK) << "the daemon closed the flooder: " << daemon->output();
    pollfd p{flooder.get(), POLLOUT, 0};
    if (::poll(&p, 1, 500) == 0 && daemon->count("peer does not read its replies (") > 0) {
      break;  // held back (a slow machine alone may leave the socket full for a while)
    }
  }
  ASSERT_LT(written, kMax) << "the daemon never stopped taking calls";

  // Another client is served while the flooder sits there.
  auto other = RawFrameSocket::connect();
  ASSERT_TRUE(other.has_value());
  ASSERT_TRUE(other->call(kDisplayURL, 1));
  const auto reply = other->replyTo(1);
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ((*reply)["args"]["url"], Value("URL not available"));

  // Reading lets the daemon read on: every call written is answered, in order.
  ::fcntl(flooder.get(), F_SETFL, ::fcntl(flooder.get(), F_GETFL) & ~O_NONBLOCK);
  RawFrameSocket reader(std::move(flooder));
  std::uint64_t answered = 0;
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  while (answered < written && std::chrono::steady_clock::now() < deadline) {
    const auto message = reader.read();
    ASSERT_TRUE(message.has_value()) << "replies stopped after " << answered << " of " << written
                                     << (reader.closed() ? " (closed)" : "");
    ASSERT_EQ((*message)["reply"], Value(static_cast<long long>(++answered)));
  }
  EXPECT_EQ(answered, written);
  EXPECT_EQ(daemon->count("closing connection: peer does not read"), 0u);
  EXPECT_EQ(daemon->count("reads slowest"), 0u);
}

}  // namespace
}  // namespace zerith::test
