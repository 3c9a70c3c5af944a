// A call and its media streams as one session hierarchy, from C++.
//
// The call is the root of the hierarchy (level 0) and asks for aggregation:
// a copy of every event of the call and of the sessions below it comes back
// over the call's own connection, to its message handler. Each stream is a
// session of its own one level below, under the call's hierarchy token. The
// call's shared data ("room") goes with every event of the hierarchy to the
// backends. The streams send without waiting for an answer, as a media
// thread would, and flush before they finish.
//
// Without a storebag the daemon has no backends for the client type and
// drops events before they are aggregated: the example then says so and
// still runs every step.
#include <zerith/Zerith.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <iostream>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

using namespace std::chrono_literals;
using zerith::Dictionary;
using zerith::Value;
using zerith::Zerith;
using zerith::ZerithReply;

namespace {

constexpr int kStreams = 2;
constexpr int kEventsPerStream = 3;
constexpr int kStreamCategory = 20;

// What the call's message handler received, for main to wait on. The
// handler runs on the call session's queue, not on main's thread.
struct Aggregated {
  std::mutex mutex;
  std::condition_variable changed;
  int events = 0;  // of the streams
};

Value sessionInfo(unsigned sessionID, const std::string& token, int level) {
  return Dictionary{{kZerithSessionInfoClientType, 7},
                    {kZerithSessionInfoSessionID, sessionID},
                    {kZerithSessionInfoHierarchyToken,
                     Dictionary{{kZerithHierarchyTokenTokenID, token}, {kZerithHierarchyTokenLevel, level}}}};
}

// False, with the reason on standard error, when `reply` carries an error.
bool ok(const char* step, const ZerithReply& reply) {
  if (!reply) {
    std::cerr << "call: " << step << ": " << reply.error->description << '\n';
  }
  return static_cast<bool>(reply);
}

}  // namespace

int main() {
  zerith::Error error;
  // Declared before the sessions, so that it outlives the call's handler.
  Aggregated aggregated;
  const auto call = Zerith::connect({}, &error);
  if (!call) {
    std::cerr << "call: " << error.description << '\n';
    return 1;
  }
  // Set before the session info: the first aggregated event may follow at once.
  call->setMessageHandler([&aggregated](const Value& info, double, std::uint16_t category, std::uint16_t type,
                                        const Value& payload) {
    std::lock_guard lock(aggregated.mutex);
    if (info.isNil() && payload.isNil()) {
      // A session below an ancestor that aggregates gets this empty message
      // instead of copies; the call, the root, never does.
      std::cout << "call: aggregation ended\n";
    } else {
      // The daemon's own events of each session (category 0: its start and
      // its end with health figures) come too.
      aggregated.events += category == kStreamCategory ? 1 : 0;
      std::cout << "call: event " << category << '/' << type << " of session "
                << info[kZerithSessionInfoSessionID].unsignedValue() << ": " << payload.description() << '\n';
    }
    aggregated.changed.notify_all();
  });

  // The hierarchy token names this call; any text unique on the device will do.
  const std::string token = "call-" + std::to_string(std::chrono::system_clock::now().time_since_epoch().count());
  if (!ok("call info", call->setSessionInfo(sessionInfo(100, token, 0), {}, {}, /*hasAggregationBlock=*/true, 5s))) {
    return 1;
  }
  const ZerithReply started = call->startConfig(5s);
  if (!ok("call start", started)) {
    return 1;
  }
  const bool backends = !started["backends"].isNil();
  std::cout << "call: backends " << started["backends"].description() << '\n';
  // Every session with this token now sends "room" with its events.
  if (!ok("shared data", call->updateSharedData(Dictionary{{"room", "blue"}}, 5s))) {
    return 1;
  }

  std::vector<std::unique_ptr<Zerith>> streams;
  for (unsigned s = 1; s <= kStreams; ++s) {
    auto stream = Zerith::connect({}, &error);
    if (!stream) {
      std::cerr << "call: stream " << s << ": " << error.description << '\n';
      return 1;
    }
    if (!ok("stream info", stream->setSessionInfo(sessionInfo(100 + s, token, 1), {}, {}, false, 5s)) ||
        !ok("stream start", stream->startConfig(5s))) {
      return 1;
    }
    streams.push_back(std::move(stream));
  }
  for (int i = 0; i < kEventsPerStream; ++i) {
    for (unsigned s = 0; s < streams.size(); ++s) {
      // No reply asked for: the call returns once the event is queued.
      streams[s]->sendMessageWithDictionary(
          Dictionary{{kZerithMessageParametersCategory, kStreamCategory},
                     {kZerithMessageParametersType, 3},
                     {kZerithMessageParametersPayload, Dictionary{{"stream", s + 1}, {"packetsLost", i}}}},
          nullptr);
    }
  }
  // A flush answers once the daemon has taken every event sent before it.
  for (const auto& stream : streams) {
    const ZerithReply flushed = stream->flushMessages(5s);
    if (!flushed) {
      std::cerr << "call: flush: " << flushed.error->description << '\n';
      return 1;
    }
  }

  bool complete = true;
  if (backends) {
    std::unique_lock lock(aggregated.mutex);
    complete = aggregated.changed.wait_for(
        lock, 5s, [&aggregated] { return aggregated.events == kStreams * kEventsPerStream; });
    std::cout << "call: " << aggregated.events << " of " << kStreams * kEventsPerStream
              << " stream events aggregated\n";
  } else {
    std::cout << "call: no backends for this client type, so nothing is aggregated\n";
  }

  // The streams end first, then the call.
  for (const auto& stream : streams) {
    if (!ok("stream finish", stream->finishSession(5s))) {
      return 1;
    }
  }
  streams.clear();
  return ok("call finish", call->finishSession(5s)) && complete ? 0 : 1;
}
