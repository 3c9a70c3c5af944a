#pragma once

// The load of the pipeline benchmark: N clients, each on its own thread and
// its own connection, send their share of the events as fast as they are
// taken or paced to a total rate. Event identifiers are dense: client c
// sends c * perClient .. (c + 1) * perClient - 1.
//
// - zerithd: each client is a session of the client framework. With replies
//   (the default) an event is accepted when the daemon's reply to
//   sendMessageWithDictionary:reply: arrives (at most `window` unanswered per
//   client); the client flushes its session at the end, as a client that
//   ends its work does. Without replies each event is sent one-way (no reply
//   block, like the peer's lines) and accepted once the send returned (the
//   framework's backpressure holds a sender back while the daemon does not
//   keep up); the client then flushes with flushMessagesWithCompletion: and
//   waits for its completion.
// - the peer: each client writes one JSON line per event to the peer's
//   stream socket; an event is accepted once the socket took it (the peer's
//   flow control holds writes back when its queue is full).

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "zerith/Zerith.h"

namespace zerith::bench {

struct LoadOptions {
  int clients = 1;
  std::uint64_t eventsPerClient = 1000;
  double eventsPerSecond = 0;  // all clients together; 0: as fast as taken
  int window = 256;            // unanswered events per zerithd client
  bool replies = true;         // zerithd: each event asks for a reply; false: one-way sends
};

struct LoadResult {
  std::uint64_t accepted = 0;
  std::uint64_t refused = 0;   // nil replies or failed writes
  double seconds = 0;          // from the first send until the last acceptance
  std::string error{};
};

LoadResult runZerithdLoad(const LoadOptions& options, std::vector<std::unique_ptr<Zerith>>& sessions);
LoadResult runPeerLoad(const LoadOptions& options, const std::filesystem::path& socketPath);

// Open stream connections to the peer's socket (for the idle measurement).
std::vector<int> openPeerConnections(const std::filesystem::path& socketPath, int count);

}  // namespace zerith::bench
