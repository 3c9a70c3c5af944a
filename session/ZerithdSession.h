#pragma once

// One reporting session per client connection. It carries out
// ClientSessionInterface for the client, holds the client's session info and
// user info, owns the session's backends and its connectivity helper, and
// reaches the agent through ZerithdSessionDelegate (held weakly: the agent
// owns its sessions, never the other way round).
//
// Client calls arrive on the connection's queue, one at a time. The agent
// reads the hierarchy fields of every session (level, token, aggregator flag,
// identifiers) from other sessions' threads while it holds its own lock; those
// fields live behind a small leaf mutex of the session, which is never held
// while calling out.

#include <array>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "backends/ZerithBackend.h"
#include "ipc/ClientSessionInterface.h"
#include "platform/Value.h"
#include "session/ZerithdSessionDelegate.h"

namespace zerith {

// The prefix of the final report's per-backend counts.
inline constexpr char kBackendCountsKey[] = "BackendCounts";

namespace ipc {
class Connection;
}
class ReportingSessionConnectivityHelper;

class ZerithdSession final : public ClientSessionInterface, public std::enable_shared_from_this<ZerithdSession> {
 public:
  // nullptr when the session's transport cannot be set up.
  static std::shared_ptr<ZerithdSession> initWithSessionDelegate(std::weak_ptr<ZerithdSessionDelegate> delegate,
                                                                 std::shared_ptr<ipc::Connection> connection);
  ~ZerithdSession() override;

  ZerithdSession(const ZerithdSession&) = delete;
  ZerithdSession& operator=(const ZerithdSession&) = delete;

  // Properties.
  std::uint32_t sessionID() const;
  void setSessionID(std::uint32_t sessionID);
  const std::string& sessionIDString() const { return sessionIDString_; }
  Value storebagVersion() const;
  void setStorebagVersion(const Value& version);
  Value userInfo() const;
  Value sessionInfo() const;
  bool hasAggregator() const;
  void setHasAggregator(bool hasAggregator);
  bool hasFinishedGracefully() const;
  // The kZerithHierarchyTokenLevel entry of the hierarchy dictionary, 0 when
  // absent.
  std::uint32_t hierarchyLevel() const;
  // The kZerithHierarchyTokenTokenID entry of the hierarchy dictionary.
  Value hierarchyToken() const;
  // Integer value of the session info's kZerithSessionInfoClientType.
  std::int64_t clientType() const;
  // The device identifier, 40 characters (empty when unavailable).
  std::string deviceID() const;
  Value digestKey() const;
  std::string description() const;

  // ClientSessionInterface.
  void setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworksToCheck,
                      bool hasAggregationBlock) override;
  void startConfigWithCompletionHandler(ValueCompletion completion) override;
  void fetchStatesWithUserInfo(const Value& userInfo, ValueCompletion completionHandler) override;
  void fetchDisplayURL(ValueCompletion completion) override;
  void sendMessageWithDictionary(const Value& message, ValueCompletion reply) override;
  void flushMessagesWithCompletion(ValueErrorCompletion completion) override;
  void finishSessionGracefully() override;
  void uploadFileAtPath(const Value& fileURL, const Value& extensionToken, BoolCompletion completionHandler) override;
  void uploadFileWithDescriptor(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                                UploadCompletion completion) override;
  void uploadLogData(const Value& logData, BoolErrorCompletion completionHandler) override;
  void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                  std::uint16_t type, const Value& payload, ValueCompletion reply) override;
  void updateSharedDataWithDictionary(const Value& dictionary) override;
  void updateSharedDataForKey(const Value& key, const Value& value) override;
  void setDigestKey(const Value& digestKey, std::int32_t algorithm) override;

  // Lifecycle.
  void receivedUserInfo(const Value& userInfo);
  void updateSessionWithDefaultSessionInfo();
  void sendStartMessage();

  // Backend set and reporting states.
  void createBackendsWithStorebag(const Value& storebag);
  void updateUserInfoForBackends();
  void updateReportingStates();
  void syncReportingStates();
  // Names of the reporting backends; nil when the session has no backend set.
  Value fetchReportingStates() const;
  void updateCombinedSessionID();
  // What the backends hold, for health reports.
  std::uint32_t batchedEventsSize() const;
  // What became of each backend's events so far, as "BackendCounts_<backend>_<count>"
  // entries of the final report (counts of 0 are left out).
  void addBackendCounts(Dictionary& payload) const;

  // Dispatch.
  Value sendMessageWithDictionary(const Value& message);
  void internalSendMessage(const Value& payload, double timestamp, std::uint16_t method, std::uint16_t respCode);
  void internalFlushMessagesWithCompletion(ValueErrorCompletion completion);

  // Aggregation.
  void aggregateMessage(const Value& sessionInfo, double timestamp, std::uint16_t category, std::uint16_t type,
                        const Value& payload);
  void sendToAggregator(const Value& sessionInfo, double timestamp, std::uint16_t category, std::uint16_t type,
                        const Value& payload);
  void shutdownSessionAggregation();
  // The one-shot sender: a throw-away backend set built from the storebag.
  static void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& storebag,
                                         std::uint16_t category, std::uint16_t type, const Value& payload);

  // Uploads.
  // Offers the file to every backend and answers once all have answered,
  // without holding the calling thread meanwhile.
  void uploadFileWithURL(const Value& fileURL, std::shared_ptr<const file::UniqueFd> descriptor,
                         UploadCompletion completion);

  // The session's transport (for its backends).
  std::shared_ptr<ReportingSessionConnectivityHelper> connectivityHelper() const { return connectivityHelper_; }

  // The backend set, nullptr until a storebag built it. The set itself never
  // changes once made: a new storebag replaces it whole, so a dispatch that
  // took it goes on with the set it took.
  std::shared_ptr<const BackendDictionary> backends() const;
  // The backend of that name in the set, nullptr when there is none.
  std::shared_ptr<ZerithBackend> backendNamed(std::string_view name) const;

  // The one-shot sender's daemon-wide transport, made on first use under the
  // class-wide lock; nullptr before the first one-shot message.
  static std::shared_ptr<ReportingSessionConnectivityHelper> oneShotConnectivityHelper();

 private:
  ZerithdSession(std::weak_ptr<ZerithdSessionDelegate> delegate, std::shared_ptr<ipc::Connection> connection);

  std::shared_ptr<ZerithdSessionDelegate> delegate() const { return sessionDelegate_.lock(); }
  bool hasBackendSet() const;

  // The class-wide lock: flush joins of every session and the one-shot
  // transport. A leaf: nothing else is taken while it is held.
  static RankedMutex<std::mutex>& classLock();
  static std::shared_ptr<ReportingSessionConnectivityHelper>& oneShotHelperLocked();

  // Fields other threads read while the agent lock is held.
  struct Fields {
    std::uint32_t sessionID = 0;
    Value sessionInfo;
    Value userInfo;
    Value frameworks;
    Value hierarchyDictionary;
    Value storebagVersion;
    bool hasAggregator = false;
    bool hasFinishedGracefully = false;
    Data digestKey;
    std::int32_t digestAlgorithm = 0;
    // nullptr until a storebag built the set.
    std::shared_ptr<const BackendDictionary> backends;
  };

  mutable std::mutex fieldsMutex_;
  Fields fields_;

  const std::weak_ptr<ZerithdSessionDelegate> sessionDelegate_;
  const std::weak_ptr<ipc::Connection> connection_;
  std::string sessionIDString_;
  std::array<char, 41> deviceid_{};
  Dictionary periodicServices_;  // never filled
  std::shared_ptr<ReportingSessionConnectivityHelper> connectivityHelper_;
  bool initialised_ = true;
};

}  // namespace zerith
