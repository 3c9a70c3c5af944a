// Bytes from a client -> a real connection with the daemon's exporter in
// front of a session that records calls.
//
// The input goes through a socket pair in small writes (the first byte sets
// their size, 1 to 16 bytes), then the client end closes. Whatever the bytes,
// the connection must deliver what it can, end exactly once, and not hang:
// a connection still open 10 seconds after its peer left is a failure.

#include <sys/socket.h>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <mutex>

#include "ipc/ClientSessionExporter.h"
#include "ipc/SocketConnection.h"
#include "ipc/tests/RecordingSession.h"

using namespace zerith;
using namespace zerith::ipc;

namespace {

struct Ended {
  std::mutex mutex;
  std::condition_variable cv;
  int count = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) {
    return 0;
  }
  const std::size_t chunk = static_cast<std::size_t>(data[0] % 16) + 1;
  ++data;
  --size;

  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
    std::abort();
  }
  file::UniqueFd client(fds[1]);
  auto peer = readPeerCredentials(fds[0]);
  if (!peer) {
    std::abort();
  }
  auto connection = SocketConnection::adopt(file::UniqueFd(fds[0]), *peer, Dictionary());
  auto session = std::make_shared<test::RecordingSession>();
  auto ended = std::make_shared<Ended>();
  connection->setExportedObject(std::make_shared<ClientSessionExporter>(session, connection->description()));
  connection->setInvalidationHandler([ended] {
    {
      std::lock_guard lock(ended->mutex);
      ++ended->count;
    }
    ended->cv.notify_all();
  });
  connection->resume();

  for (std::size_t offset = 0; offset < size;) {
    const std::size_t n = std::min(chunk, size - offset);
    const ssize_t w = ::send(client.get(), data + offset, n, MSG_NOSIGNAL);
    if (w <= 0) {
      break;  // the connection closed on a bad frame
    }
    offset += static_cast<std::size_t>(w);
  }
  ::shutdown(client.get(), SHUT_WR);

  std::unique_lock lock(ended->mutex);
  if (!ended->cv.wait_for(lock, std::chrono::seconds(10), [&] { return ended->count > 0; })) {
    std::abort();  // the connection never noticed its peer left
  }
  lock.unlock();
  connection->queue().sync([] {});
  lock.lock();
  if (ended->count != 1) {
    std::abort();
  }
  return 0;
}
