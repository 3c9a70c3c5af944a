#pragma once

// The Connection over a Unix-domain stream socket.
//
// Reading: one read is outstanding at a time; each chunk is decoded and its
// messages delivered in a turn of the connection's serial queue (on the
// thread that read it when the queue is free, so without a hand-off), and the
// next read starts only once that is done, so a peer that floods the socket waits for its earlier calls to be
// handled instead of filling memory.
//
// Writing: whole frames, from any thread, in the order the calls were made.
// A frame is written straight from the calling thread when the socket takes
// it; what the socket does not take waits in an outbox that drains as the
// peer reads. An outbox over kMaxOutboxBytes means the peer has stopped
// reading; the connection is then closed.

// A standard header first: asio decides between aligned_alloc and operator
// new by a libstdc++ macro, and every translation unit must decide alike.
#include <atomic>
#include <deque>
#include <filesystem>
#include <mutex>
#include <unordered_map>

#include <asio/local/stream_protocol.hpp>

#include "ipc/Connection.h"
#include "ipc/Frame.h"
#include "platform/FileUtil.h"
#include "platform/Log.h"

namespace zerith::ipc {

inline constexpr std::size_t kMaxOutboxBytes = 64u << 20;

// The peer of a connected Unix socket as the kernel recorded it when the
// connection was made (SO_PEERCRED, SO_PEERGROUPS). nullopt, with `why`, when
// the socket does not say.
std::optional<PeerCredentials> readPeerCredentials(int fd, std::string* why = nullptr);

class SocketConnection final : public Connection {
  struct Private {};

 public:
  // Takes over a connected socket. `entitlements` is what the policy granted
  // the peer.
  static std::shared_ptr<SocketConnection> adopt(file::UniqueFd fd, PeerCredentials peer, Dictionary entitlements);
  // The client end: connects to the listener at `path`. nullptr (with
  // `error`) when nothing listens there.
  static std::shared_ptr<SocketConnection> connect(const std::filesystem::path& path, Error* error = nullptr);

  SocketConnection(Private, file::UniqueFd fd, PeerCredentials peer, Dictionary entitlements);
  ~SocketConnection() override;
  SocketConnection(const SocketConnection&) = delete;
  SocketConnection& operator=(const SocketConnection&) = delete;

  void setExportedObject(std::shared_ptr<ExportedObject> object) override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  void resume() override;
  void invalidate() override;

  void send(const std::string& operation, Dictionary args) override;
  void call(const std::string& operation, Dictionary args, ReplyHandler handler) override;

  const PeerCredentials& peer() const override { return peer_; }
  Value valueForEntitlement(const std::string& entitlement) const override;
  const SerialQueue& queue() const override { return queue_; }
  std::string description() const override;

  bool isInvalidated() const { return invalidated_.load(); }
  // Queues one encoded frame (reply paths use it). False when the connection
  // no longer writes.
  bool writeFrame(Data frame);

 private:
  void startRead();
  void onRead(const std::error_code& ec, std::size_t size);
  void processInput(std::size_t size);
  void deliver(IncomingMessage message);
  void readFailed(const std::error_code& ec);
  void protocolError(const std::string& why);

  // Sends what the socket takes now; 0 or an errno.
  int sendSome(const std::uint8_t* bytes, std::size_t size, std::size_t& sent);
  void armWritable();
  void onWritable(const std::error_code& ec);
  void writeFailed(int err);

  void beginInvalidation();
  void finishInvalidation();
  static Error goneError();

  log::Logger log_{"ipc"};
  SerialQueue queue_;
  const int fd_;
  const PeerCredentials peer_;
  const Dictionary entitlements_;
  asio::local::stream_protocol::socket socket_;
  bool socketOpen_ = false;  // set once by the constructor

  std::mutex stateMutex_;
  std::shared_ptr<ExportedObject> exported_;
  std::function<void()> invalidationHandler_;
  std::function<void()> interruptionHandler_;
  std::atomic<bool> resumed_{false};
  std::atomic<bool> invalidated_{false};

  // Used only on the queue (or by the one outstanding read).
  std::vector<std::uint8_t> readBuffer_;
  FrameDecoder decoder_;

  std::mutex writeMutex_;
  std::deque<Data> outbox_;
  std::size_t outboxOffset_ = 0;  // of the front frame
  std::size_t outboxBytes_ = 0;
  bool writeArmed_ = false;
  bool writeClosed_ = false;

  std::mutex callsMutex_;
  std::uint64_t nextCall_ = 1;
  bool callsClosed_ = false;
  std::unordered_map<std::uint64_t, ReplyHandler> pending_;
};

}  // namespace zerith::ipc
