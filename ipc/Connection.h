#pragma once

// One end of a client connection over the local socket: length-prefixed
// binary property-list frames carrying messages, calls handled in order on
// the connection's serial queue, replies matched by call number.
//
// Wire message (a dictionary):
//   call:  {"op": <operation name>, "call": <n, only when a reply is wanted>,
//           "args": {<argument name>: <value>, ...}}    absent argument = nil
//   reply: {"reply": <n>, "args": {...}}  or  {"reply": <n>, "error": {domain, code, description}}
//
// End of file or a read error invalidates the connection: the invalidation
// handler runs once, on the connection's queue. A Unix socket has no
// interruption; the interruption handler exists and this transport never
// calls it.

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Error.h"
#include "platform/FileUtil.h"
#include "platform/SerialQueue.h"
#include "platform/Value.h"

namespace zerith::ipc {

// Frames larger than this close the connection.
inline constexpr std::uint32_t kMaxFrameBytes = 4u << 20;

struct PeerCredentials {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;  // supplementary groups (SO_PEERGROUPS)
};

struct Message {
  std::string operation;
  std::optional<std::uint64_t> call;  // set when the caller wants a reply
  Dictionary args;
  // Descriptors that came with the call (SCM_RIGHTS), in the order sent;
  // fewer than the frame claimed when some could not be received.
  std::vector<std::shared_ptr<const file::UniqueFd>> descriptors;
};

// Sends the reply to one call, at most once, from any thread. Dropping a
// Reply unanswered sends nothing.
class Reply {
 public:
  Reply() = default;
  virtual ~Reply() = default;
  virtual void send(Dictionary args) = 0;
  virtual void fail(const Error& error) = 0;
};

// What a connection exports: it receives every incoming call on the
// connection's queue.
class ExportedObject {
 public:
  virtual ~ExportedObject() = default;
  virtual void handleMessage(const Message& message, std::shared_ptr<Reply> reply) = 0;
  // True when handling `message` never waits for other work (a storebag
  // fetch, an upload, a network answer): such a call may be handled on the
  // thread that read it from the socket, which serves other connections too.
  // Every other call is handled by a thread of the queue's pool.
  virtual bool answersWithoutWaiting(const Message& message) const {
    (void)message;
    return false;
  }
};

class Connection : public std::enable_shared_from_this<Connection> {
 public:
  virtual ~Connection() = default;

  virtual void setExportedObject(std::shared_ptr<ExportedObject> object) = 0;
  virtual void setInterruptionHandler(std::function<void()> handler) = 0;
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;
  // Starts reading. Nothing is delivered before.
  virtual void resume() = 0;
  // Closes the socket; the invalidation handler runs (once).
  virtual void invalidate() = 0;

  // Calls on the peer, from any thread. `call` delivers the reply's
  // arguments, or an error when the peer failed the call or the connection
  // went away first, on the connection's queue.
  virtual void send(const std::string& operation, Dictionary args) = 0;
  using ReplyHandler = std::function<void(std::optional<Dictionary> args, std::optional<Error> error)>;
  virtual void call(const std::string& operation, Dictionary args, ReplyHandler handler) = 0;
  // A call that carries open descriptors (at most kMaxDescriptorsPerFrame)
  // to the peer process. A connection that cannot pass descriptors fails
  // the call.
  virtual void call(const std::string& operation, Dictionary args, std::vector<file::UniqueFd> descriptors,
                    ReplyHandler handler);

  virtual const PeerCredentials& peer() const = 0;
  // The peer's entitlement (nil when absent), looked up at connect time from
  // the entitlements policy; never from /proc data read later.
  virtual Value valueForEntitlement(const std::string& entitlement) const = 0;
  virtual const SerialQueue& queue() const = 0;
  // For logs: "<connection pid=123 uid=1000 fd=7>".
  virtual std::string description() const = 0;
};

}  // namespace zerith::ipc
