#pragma once

// The base of every backend: the identity a session copies into it, the
// reporting state behind the backend's own serial queue, the sampling draw,
// the event-category lists, and harmless defaults for every operation a
// concrete backend may override (send and flush give nil, uploads answer no),
// so that a session can call every operation on every backend.

#include <sys/time.h>

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "backends/BackendCounters.h"
#include "platform/Error.h"
#include "platform/SerialQueue.h"
#include "platform/Value.h"
#include "transport/ReportingSessionConnectivityInterface.h"

namespace zerith {

namespace sandbox {
class GrantedFile;
}

// A file a client asked to upload: read through the descriptor the client
// passed, named by the last component of the path it gave.
struct UploadRequest {
  std::shared_ptr<sandbox::GrantedFile> file;
  std::string name;  // as the client gave it; escape before logging
  uid_t client = 0;  // the connection's user, for the per-client limit
  std::chrono::steady_clock::time_point deadline;  // the request's answer is due
};
using UploadCompletion = std::function<void(bool taken, bool serverSucceeded)>;

// The URL a post goes to, after the https rule: a scheme other than https
// becomes https on a device that is not an internal build (a further "://"
// and what follows go), and only http(s) is posted to. nullopt, with the
// reason, when the URL cannot be posted to.
std::optional<std::string> postableURL(std::string url, std::string* why = nullptr);

// Reporting states of a backend.
inline constexpr std::int32_t kBackendStateUndecided = 0;
inline constexpr std::int32_t kBackendStateDisabled = 1;
inline constexpr std::int32_t kBackendStateEnabled = 2;
inline constexpr std::int32_t kBackendStateSampledOut = 3;  // kept by an override threshold

inline constexpr char kBackendStateQueueLabel[] = "com.velmar.ZerithBackendStateQueue";

class ZerithBackend;

// A session's backends by name, in the storebag section's order.
using BackendDictionary = std::vector<std::pair<std::string, std::shared_ptr<ZerithBackend>>>;

class ZerithBackend : public std::enable_shared_from_this<ZerithBackend> {
 public:
  // Completion of a flush: a result object (nil when none) and an error.
  using FlushCompletion = std::function<void(const Value& result, const std::optional<Error>& error)>;

  // The factory: the backend kind named by `name` (one of the kZerithBackend
  // names), or nullptr after logging the name when there is none (an
  // unknown name, or the adaptor backend on a "Tarvix" device). A kind's own
  // initialiser may refuse too; that nullptr is passed on.
  static std::shared_ptr<ZerithBackend> newBackendWithName(std::string_view name, const Value& profile,
                                                           const std::optional<std::string>& productFamily,
                                                           std::int32_t clientType);

  // An extra kind for the factory, consulted before the built-in table, so
  // that it may stand in for any name; registering a name again replaces the
  // earlier maker. The daemon registers none: this is for backends that live
  // outside this library, such as the recording backend of the tests.
  using Maker = std::function<std::shared_ptr<ZerithBackend>(std::string_view name, const Value& profile,
                                                             const std::optional<std::string>& productFamily,
                                                             std::int32_t clientType)>;
  static void registerBackendKind(std::string name, Maker make);

  // Lower-case hex SHA-256 of the first N UTF-8 bytes of `text`, N being its
  // length in UTF-16 code units: the server hashes the same way, so text
  // beyond ASCII is deliberately hashed short.
  static std::string convertIntoSHA256(std::string_view text);

  // Copies the arguments, draws the sampling factor and creates the state
  // queue; state 0, every flag 0, every other field empty.
  ZerithBackend(std::string name, Value profile, std::optional<std::string> productFamily);
  virtual ~ZerithBackend();
  ZerithBackend(const ZerithBackend&) = delete;
  ZerithBackend& operator=(const ZerithBackend&) = delete;

  virtual void cleanup();

  void setReportingSessionConnectivityDelegate(std::weak_ptr<ReportingSessionConnectivityInterface> delegate);
  // nullptr once the session's transport has gone.
  std::shared_ptr<ReportingSessionConnectivityInterface> reportingSessionConnectivityDelegate() const;

  // "major.middle.minor" (more pieces ignored, missing ones 0), each piece's
  // integer value truncated to 8 bits: "300.1" gives 44.1.0.
  void setSelfVersion(std::string_view version);

  // The reporting state: read with a synchronous hop to the state queue,
  // written with an asynchronous one. Never call state() from a block that
  // runs on this backend's state queue.
  std::int32_t state() const;
  void setState(std::int32_t state);
  // Decides the state; the base enables the backend.
  virtual void updateState();

  // Sends one event; the text returned goes to the message log (nil: none).
  virtual std::optional<std::string> sendMessage(const Value& message, const timeval& timestamp, std::uint16_t method,
                                                 std::uint16_t respCode, std::uint16_t eventID, std::int32_t flag);
  // Numbers the event (the running number wraps at 16 bits; the first event
  // is 1) and dispatches to the six-argument send.
  std::optional<std::string> sendMessage(const Value& message, const timeval& timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::int32_t flag);

  // seconds + microseconds / 1000000.0
  void setStartTimestamp(const timeval& timestamp);

  // Calls `completion` (when given) with nil and no error; returns nil.
  virtual std::optional<std::string> flushMessagesWithCompletion(FlushCompletion completion);
  // Offers a file upload. `completion` runs exactly once, from any thread:
  // `taken` when this backend posted the file, `serverSucceeded` when the
  // server's answer said "success" (the client framework then deletes the
  // file). This base class takes nothing.
  virtual void uploadFileAtPath(const UploadRequest& request, UploadCompletion completion);
  // `logData` is the client's array of property-list values.
  virtual bool uploadLogData(const Value& logData);
  virtual void setCorrelatedSessionID(std::optional<std::string> sessionID);

  // No whitelist: every category passes. An empty whitelist admits nothing,
  // while an empty blacklist refuses nothing; the asymmetry is intended.
  bool isWhitelistedEvent(std::uint16_t category) const;
  bool isBlacklistedEvent(std::uint16_t category) const;

  virtual std::uint32_t batchedEventsSize();

  // What became of this backend's events so far (see BackendCounters.h).
  BackendCounters& counters() { return *counters_; }
  const BackendCounters& counters() const { return *counters_; }
  // The same counters, for whoever reads them after the backend has gone
  // (the agent's totals of ended sessions: completions count on after the
  // session's end).
  std::shared_ptr<const BackendCounters> sharedCounters() const { return counters_; }
  // The same block for what counts on after the backend has gone (a post's
  // answer, a spooled batch's delivery).
  std::shared_ptr<BackendCounters> sharedCounters() { return counters_; }

  // Properties; every accessor is atomic.
  const std::string& name() const { return name_; }
  std::uint32_t sessionID() const { return sessionID_.load(); }
  void setSessionID(std::uint32_t v) { sessionID_.store(v); }
  std::optional<std::string> combinedSessionIDString() const;
  void setCombinedSessionIDString(std::optional<std::string> v);
  std::int32_t compType() const { return compType_.load(); }
  void setCompType(std::int32_t v) { compType_.store(v); }
  std::uint16_t clientVersion() const { return clientVersion_.load(); }
  void setClientVersion(std::uint16_t v) { clientVersion_.store(v); }
  // Not owned: the session's buffer, which outlives its backends.
  const char* udid() const { return udid_.load(); }
  void setUdid(const char* v) { udid_.store(v); }
  std::optional<std::string> displayURL() const;
  void setDisplayURL(std::optional<std::string> v);
  std::optional<std::string> productVersion() const;
  void setProductVersion(std::optional<std::string> v);
  std::optional<std::string> buildVersion() const;
  void setBuildVersion(std::optional<std::string> v);
  std::optional<std::string> hardwareType() const;
  void setHardwareType(std::optional<std::string> v);
  std::optional<std::string> productFamily() const;
  void setProductFamily(std::optional<std::string> v);
  Value userInfoDict() const;
  void setUserInfoDict(Value v);
  bool isInternal() const { return isInternal_.load(); }
  void setIsInternal(bool v) { isInternal_.store(v); }
  bool requireUserInfo() const { return requireUserInfo_.load(); }
  void setRequireUserInfo(bool v) { requireUserInfo_.store(v); }
  bool batchEvents() const { return batchEvents_.load(); }
  void setBatchEvents(bool v) { batchEvents_.store(v); }
  double samplingFactor() const { return samplingFactor_.load(); }
  void setSamplingFactor(double v) { samplingFactor_.store(v); }
  // A number, or nil.
  Value samplingThreshold() const;
  void setSamplingThreshold(Value v);
  std::optional<Data> digestKey() const;
  void setDigestKey(std::optional<Data> v);
  std::int32_t digestAlgorithm() const { return digestAlgorithm_.load(); }
  void setDigestAlgorithm(std::int32_t v) { digestAlgorithm_.store(v); }

 protected:
  // Fields without a public accessor, for the concrete backends.
  const Value& profile() const { return profile_; }  // immutable after creation
  double startTimeStamp() const { return startTimeStamp_.load(); }
  std::uint16_t eventID() const { return eventID_.load(); }
  std::uint8_t selfVersionMajor() const { return selfVersionMajor_.load(); }
  std::uint8_t selfVersionMiddle() const { return selfVersionMiddle_.load(); }
  std::uint8_t selfVersionMinor() const { return selfVersionMinor_.load(); }
  // What every record of this backend carries from the backend's own
  // properties, read under one lock; absent texts are nil. The values are
  // shared with the backend (no copy per record). `reportVersion` is the
  // framework version as records carry it ("8.1", "1.2.3"), made once when
  // the version is set.
  struct RecordFacts {
    Value combinedSessionID;
    Value productFamily;
    Value hardwareType;
    Value productVersion;
    Value buildVersion;
    Value reportVersion;
  };
  RecordFacts recordFacts() const;
  bool shouldUseWiFiOnly() const { return shouldUseWiFiOnly_.load(); }
  void setShouldUseWiFiOnly(bool v) { shouldUseWiFiOnly_.store(v); }
  // Arrays of numbers, or nil when absent.
  Value eventWhitelist() const;
  void setEventWhitelist(Value v);
  Value eventBlacklist() const;
  void setEventBlacklist(Value v);

  const SerialQueue& stateQueue() const { return stateQueue_; }
  // The state itself, for blocks that already run on the state queue.
  std::int32_t stateOnQueue() const;
  void setStateOnQueue(std::int32_t state);

 private:
  const std::string name_;
  const Value profile_;
  std::int32_t state_ = kBackendStateUndecided;  // only on stateQueue_

  mutable std::mutex propertyMutex_;  // the string, dictionary and list fields below
  // The texts records carry are kept as values (nil when absent), which
  // records share.
  Value productVersion_;
  Value buildVersion_;
  Value hardwareType_;
  Value productFamily_;
  Value combinedSessionIDString_;
  std::optional<std::string> displayURL_;
  Value userInfoDict_;
  Value samplingThreshold_;
  Value eventWhitelist_;
  Value eventBlacklist_;
  Value reportVersion_{std::string("0.0")};
  std::optional<Data> digestKey_;
  std::weak_ptr<ReportingSessionConnectivityInterface> reportingSessionConnectivityDelegate_;

  const std::shared_ptr<BackendCounters> counters_ = std::make_shared<BackendCounters>();
  std::atomic<double> startTimeStamp_{0};
  std::atomic<std::uint32_t> sessionID_{0};
  std::atomic<std::int32_t> compType_{0};
  std::atomic<std::uint16_t> clientVersion_{0};
  std::atomic<std::uint16_t> eventID_{0};
  std::atomic<std::uint8_t> selfVersionMajor_{0};
  std::atomic<std::uint8_t> selfVersionMiddle_{0};
  std::atomic<std::uint8_t> selfVersionMinor_{0};
  std::atomic<bool> isInternal_{false};
  std::atomic<bool> requireUserInfo_{false};
  std::atomic<bool> shouldUseWiFiOnly_{false};
  std::atomic<bool> batchEvents_{false};
  std::atomic<const char*> udid_{nullptr};
  std::atomic<double> samplingFactor_{0};
  std::atomic<std::int32_t> digestAlgorithm_{0};

  SerialQueue stateQueue_;
};

}  // namespace zerith
