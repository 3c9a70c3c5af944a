#pragma once

// The backend that carries almost every event a device reports: each event
// becomes a JSON record, records wait in a batch (or go at once when
// realtime) and are posted as one JSON envelope over HTTPS with
// identification headers and an optional HMAC-SHA-1 digest.
//
// The storebag's client entry ("clients" of the profile) decides the
// reporting state (consent, locale, device lists, sampling), the post URLs,
// the batch threshold, the event lists and the filters that remove keys or
// replace their values by a SHA-256.
//
// Threads: the batch and the per-method counts live on the backend's state
// queue; the storebag-driven fields sit behind a mutex of their own and are
// read as snapshots. The transport's completion only touches the state
// through setState.

#include <array>
#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "backends/ZerithBackend.h"
#include "platform/DefaultsKeys.h"

namespace zerith {

class HTTPSPostBackend : public ZerithBackend {
 public:
  // One element of a client entry's "filters": which records it applies to
  // (-1: any method or status), what it does to the entry named `key`.
  struct Filter {
    std::int32_t method = -1;
    std::int32_t status = -1;
    std::int32_t action = 0;  // 0 keep, 1 remove, 2 SHA-256
    std::string key;
  };
  static constexpr std::int32_t kFilterKeep = 0;
  static constexpr std::int32_t kFilterRemove = 1;
  static constexpr std::int32_t kFilterSHA256 = 2;

  static constexpr std::int32_t kDefaultEventThreshold = 49;
  // Posts under way at once per backend name, over every session (the
  // defaults key "postsInFlightPerBackend"). A batch past it waits in the
  // spool when on, otherwise in memory, up to "postsWaitingPerBackend"
  // batches; past that it is dropped (droppedBusy).
  static constexpr std::int32_t kDefaultPostsInFlight = 16;
  static constexpr std::int32_t kDefaultPostsWaiting = 1024;
  static constexpr auto kMaxPostsWaiting = static_cast<std::int32_t>(defaultsSetting("postsWaitingPerBackend").high);

  // Completion of a post: a result object (always nil) and an error.
  using PostCompletion = FlushCompletion;

  struct Token {
   private:
    Token() = default;
    friend class HTTPSPostBackend;
  };

  // nullptr when the profile or product family is absent, or the profile has
  // no "clients" entry (logged).
  static std::shared_ptr<HTTPSPostBackend> initWithName(std::string name, const Value& profile,
                                                        const std::optional<std::string>& productFamily);
  HTTPSPostBackend(Token, std::string name, Value profile, std::optional<std::string> productFamily);
  ~HTTPSPostBackend() override;

  // The state decided from the storebag's client entry.
  void updateState() override;
  std::int32_t updateBackendState();

  std::optional<std::string> sendMessage(const Value& message, const timeval& timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID, std::int32_t flag) override;
  using ZerithBackend::sendMessage;
  std::optional<std::string> flushMessagesWithCompletion(FlushCompletion completion) override;
  void setCorrelatedSessionID(std::optional<std::string> sessionID) override;
  std::uint32_t batchedEventsSize() override;

  // Records, batch and envelope.
  Dictionary newEventDictfromPayload(const Value& payload, const timeval& timestamp, std::uint16_t method,
                                     std::uint16_t respCode, std::uint16_t eventID) const;
  // The same on a copy of the payload that the caller has already made.
  Dictionary completeRecord(Dictionary event, const timeval& timestamp, std::uint16_t method, std::uint16_t respCode,
                            std::uint16_t eventID) const;
  void prepareEventForMessage(Dictionary& event, const Value& frameworkData) const;
  std::optional<std::string> batchEvent(Dictionary event);
  // The compact envelope (entries JSON cannot carry left out and logged).
  // When `prettyJsonString` is given and printing is allowed, it receives
  // the pretty-printed copy; `recordCount`, when given, the number of
  // records the envelope holds.
  std::optional<std::string> createMessageForPostAndLogging(std::vector<Dictionary> events,
                                                            std::optional<std::string>* prettyJsonString,
                                                            std::uint32_t* recordCount = nullptr) const;
  // `records`: how many records `json` holds, when the caller knows it (an
  // envelope it made); otherwise they are counted in the text.
  void postJSONMessage(const std::string& json, std::int32_t flag, std::optional<std::uint16_t> method,
                       std::optional<std::uint16_t> responseCode, PostCompletion completion,
                       std::optional<std::uint32_t> records = std::nullopt);

  // Storebag-driven pieces.
  bool matchClientNameAndServiceID(const Value& client, const std::optional<std::string>& clientName,
                                   const std::optional<std::string>& serviceID) const;
  bool isFrameworkEnabledForClient(const Value& client) const;
  bool updatePostLink(const Value& client);
  void resetBackendStateWithClient(const Value& client);
  void createFiltersFromArray(const Value& array);
  void filterEvent(Dictionary& event) const;
  // Empty or absent list: `whitelist`; absent string: !`whitelist`;
  // otherwise whether an element equals (exact) or is contained in (substring)
  // the string, ignoring case.
  static bool matchExactStringWithList(const Value& list, const std::optional<std::string>& wholeString,
                                       bool whitelist);
  static bool matchStringWithList(const Value& list, const std::optional<std::string>& wholeString, bool whitelist);

  // The header value of a digest: "<" hex in groups of four bytes ">".
  static std::string digestDescription(const std::array<std::uint8_t, 20>& digest);
  // "Zerith/<major>.<middle>[.<minor>] (<hardware>; <os version>)"
  std::string userAgent() const;

  // Accessors for the session and tests.
  std::optional<std::string> postURL() const;
  void setPostURL(std::optional<std::string> url);
  std::optional<std::string> realtimePostURL() const;
  std::int32_t eventThreshold() const;
  std::int32_t dnuType() const;
  bool isImmutable() const;
  Value overrideSampling() const;
  std::vector<Filter> filters() const;
  std::int32_t numberOfFilters() const;
  std::optional<std::string> uuidCustom() const;
  // Records waiting in the batch (a synchronous read on the state queue).
  std::size_t batchedEventCount() const;
  // The last state decision disabled the backend by the sampling draw (its
  // factor at or above the override threshold), not by a rule.
  bool disabledBySampling() const { return disabledBySampling_.load(); }

 private:
  // Every storebag- and defaults-driven field, behind one mutex.
  struct Fields {
    std::optional<std::string> postURL;
    bool useDefaultPostURL = false;
    std::optional<std::string> realtimePostURL;
    bool useDefaultRealtimePostURL = false;
    std::shared_ptr<const std::vector<Filter>> filters = std::make_shared<const std::vector<Filter>>();
    std::int32_t numberOfFilters = 0;
    bool dnuEnabled = false;
    std::int32_t dnuType = 0;
    std::int32_t eventThreshold = kDefaultEventThreshold;
    std::int32_t extrasOnInternal = 0;
    Value overrideSampling;
    std::optional<std::string> uuidRespectDnu;
    std::optional<std::string> uuidOverrideDnu;
    std::optional<std::string> uuidCustom;
    bool forceEventLogging = false;
    bool immutable = false;
    bool spoolEnabled = false;  // "spoolEnabled": records carry "_recordID", batches are written ahead to the spool
    std::int32_t postsInFlight = kDefaultPostsInFlight;
    std::int32_t postsWaiting = kDefaultPostsWaiting;
  };
  Fields fields() const;
  void setImmutable();

  // The batch: only on the state queue.
  struct Batch {
    std::optional<std::vector<Dictionary>> batchedEvents;
    std::vector<std::pair<std::uint16_t, std::int64_t>> eventMethodCounts;
  };
  // What a flush took from the batch: the envelope and its printable copy,
  // or why there is nothing to post.
  struct FlushOutcome {
    const char* error = nullptr;
    std::size_t events = 0;  // records taken from the batch
    std::uint32_t bodyRecords = 0;  // records in the body
    std::optional<std::string> body;
    std::optional<std::string> pretty;
  };
  FlushOutcome takeBatchOnStateQueue();
  // Counts `events` records handed to a post with `flag`: sent, or dropped
  // when the post has no usable URL or no transport.
  void countPosted(std::size_t events, std::int32_t flag);

  mutable std::mutex fieldsMutex_;
  Fields fields_;
  Batch batch_;  // state queue only
  std::atomic<bool> disabledBySampling_{false};
};

}  // namespace zerith
