// Descriptors that travel with a call: the frame that claims them gets
// them, and whatever no frame claims, or is beyond its claim, is closed at
// once instead of piling up in the daemon.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "ipc/tests/IpcTestSupport.h"

namespace zerith::ipc::test {
namespace {

// A pipe whose write end is sent: once every copy of it is closed, its read
// end sees end of file.
struct Pipe {
  file::UniqueFd read, write;
  Pipe() {
    int p[2];
    EXPECT_EQ(::pipe2(p, O_CLOEXEC), 0);
    read.reset(p[0]);
    write.reset(p[1]);
  }
  bool closedEverywhere() const {
    pollfd p{read.get(), POLLIN, 0};
    char byte = 0;
    return ::poll(&p, 1, 5000) == 1 && ::read(read.get(), &byte, 1) == 0;
  }
};

struct Case {
  const char* name;
  std::uint32_t claimed;
  int sent;
  std::size_t received;  // descriptors the call gets
};

class DescriptorPassingTest : public ::testing::TestWithParam<Case> {};

TEST_P(DescriptorPassingTest, TheCallGetsWhatItClaimedAndTheRestIsClosed) {
  const Case& c = GetParam();
  RawPeer peer;
  std::vector<Pipe> pipes(static_cast<std::size_t>(c.sent));
  std::vector<int> fds;
  for (const auto& p : pipes) {
    fds.push_back(p.write.get());
  }
  ASSERT_TRUE(zerith::test::sendWithDescriptors(peer.raw.fd(), encodeCall("upload", 1, Dictionary(), c.claimed), fds));
  ASSERT_TRUE(peer.object->received.waitFor(1));
  const auto calls = peer.object->calls();
  ASSERT_EQ(calls[0].descriptors.size(), c.received);
  for (const auto& d : calls[0].descriptors) {
    struct stat s {};
    ASSERT_EQ(::fstat(d->get(), &s), 0);
    EXPECT_TRUE(S_ISFIFO(s.st_mode));
  }
  // Ours go; the ones beyond what the call holds must be gone already.
  for (auto& p : pipes) {
    p.write.reset();
  }
  for (std::size_t i = c.received; i < pipes.size(); ++i) {
    EXPECT_TRUE(pipes[i].closedEverywhere()) << i;
  }
  // A later call claims nothing that came before it.
  peer.write(encodeCall("next", 2, Dictionary(), 1));
  ASSERT_TRUE(peer.object->received.waitFor(2));
  EXPECT_TRUE(peer.object->calls()[1].descriptors.empty());
}

INSTANTIATE_TEST_SUITE_P(Claims, DescriptorPassingTest,
                         ::testing::Values(Case{"ClaimedAndSent", 1, 1, 1}, Case{"SentUnclaimed", 0, 1, 0},
                                           Case{"MoreSentThanClaimed", 1, 3, 1}, Case{"ClaimedNotSent", 2, 0, 0}),
                         [](const auto& info) { return std::string(info.param.name); });

// On an idle socket and behind frames that wait in the outbox (the peer
// reads only once all are written), the descriptors leave with their own
// call's frame and every frame keeps its place.
TEST(DescriptorPassing, ConnectionCallCarriesItsDescriptorsAlsoBehindWaitingFrames) {
  for (const std::size_t waiting : {0u, 64u}) {
    ConnectedPair pair;
    for (std::size_t n = 0; n < waiting; ++n) {
      pair.a->send("before", Dictionary{{"pad", Value(Data(16u << 10, 0x65))}});
    }
    EXPECT_EQ(pair.a->queuedBytes() > 0, waiting > 0);
    Pipe pipe;
    std::vector<file::UniqueFd> fds;
    fds.emplace_back(::dup(pipe.write.get()));
    pair.a->call("upload", Dictionary(), std::move(fds), [](std::optional<Dictionary>, std::optional<Error>) {});
    pair.a->send("after", Dictionary());
    pair.serve();
    ASSERT_TRUE(pair.object->received.waitFor(waiting + 2));
    const auto calls = pair.object->calls();
    ASSERT_EQ(calls.size(), waiting + 2);
    EXPECT_EQ(std::tie(calls[waiting].operation, calls.back().operation), std::make_tuple("upload", "after"));
    EXPECT_TRUE(calls.back().descriptors.empty());
    ASSERT_EQ(calls[waiting].descriptors.size(), 1u);
    EXPECT_EQ(::write(calls[waiting].descriptors[0]->get(), "x", 1), 1);
    char byte = 0;
    EXPECT_EQ(::read(pipe.read.get(), &byte, 1), 1);
  }
}

}  // namespace
}  // namespace zerith::ipc::test
