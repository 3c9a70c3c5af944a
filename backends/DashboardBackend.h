#pragma once

// The dashboard backend: events as single UDP datagrams to a dashboard
// server (wire format in DashboardDatagram.h), one readable local log line
// per datagram, and an optional reliable mode in which the server
// acknowledges each datagram by its event number and the backend sends
// unacknowledged ones again after 2, 5, 10 and 19 timer ticks, dropping them
// at the 20th. At most 50 datagrams are kept; the 51st pushes out the
// oldest. It also posts arrays of log data to the profile's "post_url".
//
// Profile keys: "ip", "port" (both required), "reliable" (present: reliable
// mode, its integer value the tick period in milliseconds), "display_url",
// "post_url". A backend made from an address instead of a profile is always
// reliable with the 500 ms period.
//
// The socket, the retransmission queue, the timer, the read source and the
// clean-up state live on the serial queue "com.velmar.Zerith.networkProc".
// The timer keeps the backend alive: after cleanup() (the session dropping
// it) it goes on retransmitting until its queue drains, or for 9.5 seconds
// at most, and then lets go.
//
// Like the energy-log backend, its send is the five-argument one with an
// event number and does not override the six-argument send the base class
// dispatches to; a session's numbered events therefore reach the base's
// send, which sends nothing. Callers that hold a DashboardBackend as such
// reach the datagram path.

#include <netinet/in.h>

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/UDPPacketToSend.h"
#include "backends/ZerithBackend.h"

namespace zerith {

inline constexpr char kNetworkProcQueueLabel[] = "com.velmar.Zerith.networkProc";

class DashboardBackend : public ZerithBackend {
 public:
  static constexpr std::size_t kMaxQueuedPackets = 50;
  static constexpr std::chrono::milliseconds kDefaultPeriod{500};
  static constexpr std::chrono::milliseconds kLastResortCleanup{9500};
  // Ticks before the next retransmission, by retransmissions done so far.
  static constexpr std::array<int, 4> kRetransmitThresholds{2, 3, 5, 9};

  // Clean-up states.
  static constexpr int kRunning = 0;
  static constexpr int kCleanupRequested = 1;
  static constexpr int kLastResortScheduled = 2;

  // From a storebag profile ("ip", "port").
  static std::shared_ptr<DashboardBackend> initWithName(std::string name, Value profile,
                                                        std::optional<std::string> productFamily);
  // From an address; nullptr when `serverIP` is nil.
  static std::shared_ptr<DashboardBackend> initWithName(std::string name, std::optional<std::string> serverIP,
                                                        std::uint16_t serverPort,
                                                        std::optional<std::string> productFamily);
  // The full initialiser: the profile's address when it has one, else the
  // arguments.
  static std::shared_ptr<DashboardBackend> initWithName(std::string name, Value profile,
                                                        std::optional<std::string> serverIP, std::uint16_t serverPort,
                                                        std::optional<std::string> productFamily);

  ~DashboardBackend() override;

  using ZerithBackend::sendMessage;
  // Builds one datagram, hands it to the network queue and returns its local
  // log line; nil when no buffer can be had. Pass the event number as a
  // 16-bit value: with an int the base class's numbering send (whose last
  // argument is the flag) is the better match.
  std::optional<std::string> sendMessage(const Value& message, const timeval& timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID);

  // The local log line of a datagram of at least 64 bytes.
  static std::string writeLocalLog(std::span<const std::uint8_t> datagram);
  // A string or a number as its text; anything else "null".
  static std::string descriptionForObject(const Value& object);
  static std::string sanitize(std::string_view text);

  void cleanup() override;
  bool uploadLogData(const Value& logData) override;

  // Inspection, for tests and diagnostics: each hops onto the network
  // queue (never call them from it).
  struct QueuedPacket {
    std::uint16_t eventNumber;
    int state;
    int numberOfChecks;
    int numberOfRetransmits;
  };
  std::vector<QueuedPacket> messageQueueSnapshot() const;
  int socketDescriptor() const;
  int cleanupState() const;
  bool hasReadSource() const;
  bool hasTimer() const;
  // The local port the socket is bound to; 0 when it never was bound.
  std::uint16_t boundPort() const;

  bool reliableUDP() const { return reliableUDP_.load(); }
  bool usingProfile() const { return usingProfile_.load(); }
  std::chrono::milliseconds period() const { return period_; }
  const std::optional<std::string>& postURL() const { return postURL_; }
  const SerialQueue& networkProcQueue() const { return networkProcQueue_; }

  // Called on the network queue after every change of the retransmission
  // queue and after the sources were cancelled, with the queue's size.
  using QueueObserver = std::function<void(std::size_t count, bool sourcesCancelled)>;
  void setQueueObserver(QueueObserver observer);

  struct Token {
   private:
    Token() = default;
    friend class DashboardBackend;
  };
  DashboardBackend(Token, std::string name, Value profile, std::optional<std::string> productFamily, int socket);

 private:
  void useReliableUDP();
  void armReadSource();
  void processSocketRead();
  void tryToSendMsg(std::span<const std::uint8_t> bytes, std::uint16_t eventNumber);
  void myPeriodicTask();
  void scheduleTick();
  void cleanupSources();
  void closeSocket();
  void notifyObserver();
  bool sendWhole(std::span<const std::uint8_t> bytes);

  std::shared_ptr<DashboardBackend> self();

  // Network queue only, after initialisation.
  int socketDescriptor_ = -1;
  std::deque<UDPPacketToSend> messageQueue_;
  struct ReadSource;
  std::unique_ptr<ReadSource> readSource_;
  std::optional<SerialQueue::Timer> timer_;
  std::chrono::steady_clock::time_point nextTick_;
  int cleanupState_ = kRunning;
  bool sourcesCancelled_ = false;
  QueueObserver observer_;

  // Set during initialisation, read anywhere.
  std::atomic<bool> reliableUDP_{false};
  std::atomic<bool> usingProfile_{false};
  std::chrono::milliseconds period_ = kDefaultPeriod;
  std::optional<std::string> postURL_;
  sockaddr_in serverAddress_{};
  std::uint16_t boundPort_ = 0;

  SerialQueue networkProcQueue_;
};

}  // namespace zerith
