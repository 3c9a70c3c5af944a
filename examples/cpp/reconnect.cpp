// A reporter that outlives restarts of the daemon, from C++.
//
// The daemon may restart under a running client (an upgrade, `systemctl
// restart zerithd`): the connection ends, the invalidation handler runs and
// every call still waiting fails with "The connection was invalidated". The
// session does not come back by itself. This reporter connects again with a
// growing pause, describes and starts its session again, and sends what it
// could not send meanwhile. What waits is bounded: past kMaxWaiting events
// the oldest are dropped and counted, never held without limit.
//
// An event whose answer the restart cut off is sent again: an event may
// arrive twice, none is lost while it waits here.
#include <zerith/Zerith.h>

#include <algorithm>
#include <chrono>
#include <deque>
#include <iostream>
#include <memory>
#include <thread>

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;
using zerith::Dictionary;
using zerith::Value;
using zerith::Zerith;

namespace {

constexpr int kEvents = 30;
constexpr auto kInterval = 100ms;
constexpr std::size_t kMaxWaiting = 1000;

class Reporter {
 public:
  explicit Reporter(Value sessionInfo) : sessionInfo_(std::move(sessionInfo)) {}

  // Queues the event and sends what waits, if the daemon can be reached now.
  void report(Value event) {
    if (waiting_.size() == kMaxWaiting) {
      waiting_.pop_front();
      ++dropped_;
    }
    waiting_.push_back(std::move(event));
    sendWaiting(Clock::now());
  }

  // Sends what waits, trying to reach the daemon until `deadline`; true when
  // nothing waits any more.
  bool sendWaiting(Clock::time_point deadline) {
    for (int failures = 0; !waiting_.empty();) {
      if (!connected() && !reconnect(deadline)) {
        return false;
      }
      const zerith::ZerithReply reply = session_->sendMessage(waiting_.front(), 2s);
      if (reply) {
        waiting_.pop_front();
        ++sent_;
        failures = 0;
      } else if (!connected()) {
        continue;  // the connection ended meanwhile: connect again
      } else if (++failures == 3) {
        // Refused or unanswered on a live connection, three times: this
        // event will not go (the reason is on standard error).
        std::cerr << "reconnect: event dropped: " << reply.error->description << '\n';
        waiting_.pop_front();
        ++dropped_;
        failures = 0;
      }
    }
    return true;
  }

  bool finish() { return connected() && static_cast<bool>(session_->finishSession(2s)); }

  void printTotals() const {
    std::cout << "reconnect: " << sent_ << " events sent, " << dropped_ << " dropped, " << waiting_.size()
              << " not sent, " << reconnections_ << " reconnections\n";
  }

 private:
  bool connected() const { return session_ && session_->isValid(); }

  // Connects, describes and starts the session; pauses from 50 ms up to 1 s
  // between tries until `deadline` (one try when it has passed).
  bool reconnect(Clock::time_point deadline) {
    session_.reset();
    for (auto pause = 50ms;; pause = std::min<std::chrono::milliseconds>(pause * 2, 1s)) {
      zerith::Error error;
      if (auto session = Zerith::connect({}, &error)) {
        if (session->setSessionInfo(sessionInfo_, {}, {}, false, 2s) && session->startConfig(5s)) {
          session_ = std::move(session);
          if (everConnected_) {
            ++reconnections_;
            std::cout << "reconnect: connected again\n";
          }
          everConnected_ = true;
          return true;
        }
      }
      if (Clock::now() + pause > deadline) {
        return false;
      }
      std::this_thread::sleep_for(pause);
    }
  }

  Value sessionInfo_;
  std::unique_ptr<Zerith> session_;
  std::deque<Value> waiting_;
  bool everConnected_ = false;
  int sent_ = 0;
  int dropped_ = 0;
  int reconnections_ = 0;
};

}  // namespace

int main() {
  Reporter reporter(Dictionary{{kZerithSessionInfoClientType, 7}, {kZerithSessionInfoSessionID, 200}});
  for (int i = 0; i < kEvents; ++i) {
    reporter.report(Dictionary{{kZerithMessageParametersCategory, 30},
                               {kZerithMessageParametersType, 1},
                               {kZerithMessageParametersPayload, Dictionary{{"n", i}}}});
    std::this_thread::sleep_for(kInterval);
  }
  // At the end, what still waits gets ten seconds to find the daemon.
  const bool all = reporter.sendWaiting(Clock::now() + 10s) && reporter.finish();
  reporter.printTotals();
  return all ? 0 : 1;
}
