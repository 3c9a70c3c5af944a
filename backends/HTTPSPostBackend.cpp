#include "backends/HTTPSPostBackend.h"
#include "backends/BackendsLog.h"
#include "backends/Spool.h"
#include "backends/HTTPSPostBackendHelpers.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <deque>
#include <map>
#include <mutex>
#include <utility>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "config/ClientTypes.h"
#include "config/Compression.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "config/Identifiers.h"
#include "config/SenderCodes.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "platform/DefaultsKeys.h"
#include "platform/Log.h"
#include "zerith/Zerith.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

using https_post_detail::equalsIgnoringCase;
using https_post_detail::kRecordKeys;
using https_post_detail::kStopMessageKeys;
using https_post_detail::orNull;
using https_post_detail::recordInteger;
using https_post_detail::stringOf;

namespace {

// Posts that get no answer within this time fail instead of holding their
// connection for ever.
constexpr double kPostTimeoutSeconds = 60;

// An integer setting within its range in the defaults table; otherwise
// logged and `fallback`.
std::int32_t limitFromDefaults(const DefaultsSetting& setting, std::int32_t fallback) {
  std::string problem;
  if (const auto n = defaultsNumber(setting, Defaults(std::string(setting.domain)).objectForKey(setting.key), &problem)) {
    return static_cast<std::int32_t>(*n);
  }
  if (!problem.empty()) {
    backendsLogger().error("HTTPSPostBackend(initWithName): \"{}\" {}; using {}", setting.key, problem, fallback);
  }
  return fallback;
}

// A line at most every kLossLogInterval for one kind of loss, saying how
// many batches and records went since the last one.
class LossLog {
 public:
  explicit LossLog(const char* what) : what_(what) {}
  void lost(const std::string& backend, std::uint32_t records) {
    const auto now = std::chrono::steady_clock::now();
    std::uint64_t batches = 0;
    std::uint64_t total = 0;
    {
      std::lock_guard lock(mutex_);
      ++batches_;
      records_ += records;
      if (logged_ && now - *logged_ < kLossLogInterval) {
        return;
      }
      logged_ = now;
      batches = std::exchange(batches_, 0);
      total = std::exchange(records_, 0);
    }
    backendsLogger().error("HTTPSPostBackend(postJsonMessage): {}: {} lost {} batches ({} records) since the last line",
                           what_, backend, batches, total);
  }

 private:
  static constexpr std::chrono::seconds kLossLogInterval{10};
  const char* what_;
  std::mutex mutex_;
  std::optional<std::chrono::steady_clock::time_point> logged_;
  std::uint64_t batches_ = 0;
  std::uint64_t records_ = 0;
};

LossLog& noBodyFileLog() {
  static auto* log = new LossLog("a post's body file could not be written");
  return *log;
}
LossLog& busyLog() {
  static auto* log = new LossLog("posts in flight and waiting at their limits, no spool");
  return *log;
}

// One batch's post: what it needs from its backend, kept apart from it so
// that the answer is counted after the session has ended.
struct LivePost {
  std::shared_ptr<ReportingSessionConnectivityInterface> transport;
  URLRequest request;
  std::uint32_t records = 0;
  std::shared_ptr<BackendCounters> counters;
  std::weak_ptr<ZerithBackend> backend;
  std::string backendName;
  HTTPSPostBackend::PostCompletion completion;
  std::size_t limit = 0;         // posts in flight
  std::size_t waitLimit = 0;     // posts waiting for a slot
  std::shared_ptr<Spool> spool;           // on: failures are kept
  std::optional<std::string> spoolName;   // written ahead: the spool holds it already
};

// Posts in flight per backend name, over every session: a stalled collector
// holds at most the limit of sockets and body files per backend. A post
// past the limit waits its turn in memory (up to its wait limit; it holds no
// descriptor while it waits), unless the spool holds it already.
class PostSlots {
 public:
  enum class Take { go, waiting, full };
  Take take(const std::shared_ptr<LivePost>& post, bool mayWait) {
    std::lock_guard lock(mutex_);
    Backend& backend = backends_[post->backendName];
    if (backend.inFlight < post->limit) {
      ++backend.inFlight;
      return Take::go;
    }
    if (!mayWait || backend.waiting.size() >= post->waitLimit) {
      return Take::full;
    }
    backend.waiting.push_back(post);
    return Take::waiting;
  }
  // A post ended: the slot goes to the next waiting post (returned) or is
  // given back.
  std::shared_ptr<LivePost> give(const std::string& name) {
    std::lock_guard lock(mutex_);
    Backend& backend = backends_[name];
    if (!backend.waiting.empty()) {
      auto next = std::move(backend.waiting.front());
      backend.waiting.pop_front();
      return next;
    }
    if (backend.inFlight > 0) {
      --backend.inFlight;
    }
    return nullptr;
  }

 private:
  struct Backend {
    std::size_t inFlight = 0;
    std::deque<std::shared_ptr<LivePost>> waiting;
  };
  std::mutex mutex_;
  std::map<std::string, Backend> backends_;
};

PostSlots& postSlots() {
  static auto* slots = new PostSlots;
  return *slots;
}

// The batch was not posted: it stays in the spool that holds it, goes to the
// spool when it is on, or is dropped as `reason` with a line of `log`.
void notPosted(const std::shared_ptr<LivePost>& post, BackendCount reason, LossLog& log) {
  if (post->spoolName) {
    post->spool->liveAnswered(*post->spoolName, Spool::LiveAnswer::notPosted);
    return;
  }
  if (post->spool && reason == BackendCount::droppedBusy) {
    post->spool->keep(post->request, post->records, post->counters, nullptr, Spool::Kept::withoutAPost);
    return;
  }
  post->counters->add(reason, post->records);
  log.lost(post->backendName, post->records);
}

bool launchPost(const std::shared_ptr<LivePost>& post);

// A post's slot is free: the waiting posts go, in order, until one starts.
void freeSlot(const std::string& backendName) {
  for (std::size_t i = 0; i <= static_cast<std::size_t>(HTTPSPostBackend::kMaxPostsWaiting); ++i) {
    auto next = postSlots().give(backendName);
    if (!next || launchPost(next)) {
      return;
    }
  }
}

// Posts with a slot already held; false when the transport did not take it
// (no body file), which is counted and logged.
bool launchPost(const std::shared_ptr<LivePost>& post) {
  const bool taken = post->transport->postURLRequestWithCompletionHandler(
      post->request, [post](const Data&, const std::optional<HTTPURLResponse>& response, const std::optional<Error>& error) {
        freeSlot(post->backendName);
        if (error) {
          backendsLogger().error("HTTPSPostBackend(postJsonMessage): post error: {}", error->description);
        }
        const bool serverError = response && response->statusCode >= 500 && response->statusCode <= 599;
        const bool delivered = !error && response && response->statusCode >= 200 && response->statusCode <= 299;
        if (post->spoolName) {
          post->spool->liveAnswered(*post->spoolName, error || serverError ? Spool::LiveAnswer::failed
                                                      : delivered           ? Spool::LiveAnswer::delivered
                                                                            : Spool::LiveAnswer::refused);
        } else {
          post->counters->remove(BackendCount::inFlight, post->records);
          if ((error || serverError) && post->spool) {
            post->spool->keep(post->request, post->records, post->counters);
          } else if (delivered) {
            post->counters->add(BackendCount::delivered, post->records);
          } else {
            post->counters->add(BackendCount::droppedTransportError, post->records);
          }
        }
        if (delivered) {
          if (Spool* spool = Spool::current()) {
            spool->collectorAnswered();
          }
        }
        if (serverError) {
          const std::string text =
              fmt::format("backend {} disabled by server {} return code", post->backendName, response->statusCode);
          // The state is queued before the line is written, so whoever
          // reads the line reads the disabled state too.
          if (auto self = post->backend.lock()) {
            self->setState(kBackendStateDisabled);
          }
          backendsLogger().info("postJSONMessage: {}", text);
          if (post->completion) {
            post->completion(Value(), makeZerithError(text, response->statusCode));
          }
          return;
        }
        if (post->completion) {
          post->completion(Value(), error);
        }
      });
  if (!taken) {
    // As before, the caller hears nothing of it; the loss is counted and logged.
    if (!post->spoolName) {
      post->counters->remove(BackendCount::inFlight, post->records);
    }
    notPosted(post, BackendCount::droppedNoBodyFile, noBodyFileLog());
  }
  return taken;
}

void startLivePost(const std::shared_ptr<LivePost>& post) {
  // A batch the spool holds needs no room in memory: it waits there.
  const PostSlots::Take take = postSlots().take(post, !post->spoolName);
  if (take == PostSlots::Take::full) {
    notPosted(post, BackendCount::droppedBusy, busyLog());
    if (post->completion) {
      post->completion(Value(), makeZerithError("too many posts in flight", -1));
    }
    return;
  }
  if (!post->spoolName) {
    post->counters->add(BackendCount::inFlight, post->records);
  }
  if (take == PostSlots::Take::go && !launchPost(post)) {
    freeSlot(post->backendName);
  }
}

}  // namespace

std::shared_ptr<HTTPSPostBackend> HTTPSPostBackend::initWithName(std::string name, const Value& profile,
                                                                 const std::optional<std::string>& productFamily) {
  if (profile.isNil() || !productFamily) {
    return nullptr;
  }
  if (profile["clients"].isNil()) {
    backendsLogger().error("HTTPSPostBackend(initWithName): can't find the client list.");
    return nullptr;
  }
  return std::make_shared<HTTPSPostBackend>(Token{}, std::move(name), profile, productFamily);
}

HTTPSPostBackend::HTTPSPostBackend(Token, std::string name, Value profile, std::optional<std::string> productFamily)
    : ZerithBackend(std::move(name), std::move(profile), std::move(productFamily)) {
  Fields f;
  if (auto url = defaultsStringForKey(defaultsSetting("httpsPostURL").key)) {
    f.postURL = *url;
    backendsLogger().debug("HTTPSPostBackend(initWithName): Using user default '{}' for postURL", *url);
  }
  f.useDefaultPostURL = f.postURL.has_value();
  if (auto url = defaultsStringForKey(defaultsSetting("httpsRealtimePostURL").key)) {
    f.realtimePostURL = *url;
    backendsLogger().debug("HTTPSPostBackend(initWithName): Using user default '{}' for realtimePostURL", *url);
  }
  f.useDefaultRealtimePostURL = f.realtimePostURL.has_value();
  if (auto display = stringOf(this->profile()["display_url"])) {
    setDisplayURL(*display);
  }
  f.eventThreshold = kDefaultEventThreshold;
  f.dnuEnabled = diagnosticsSubmissionAllowed();
  f.uuidRespectDnu = Zerith::getPersistentIdentifierForDNU(true);
  f.uuidOverrideDnu = Zerith::getPersistentIdentifierForDNU(false);
  // A value of the wrong kind is logged once, when the daemon starts.
  constexpr const DefaultsSetting& force = defaultsSetting("forceEventLogging");
  std::string ignored;
  f.forceEventLogging =
      defaultsBoolean(force, Defaults(std::string(force.domain)).objectForKey(force.key), &ignored).value_or(false);
  f.spoolEnabled = spoolEnabledInDefaults();
  f.postsInFlight = limitFromDefaults(defaultsSetting("postsInFlightPerBackend"), kDefaultPostsInFlight);
  f.postsWaiting = limitFromDefaults(defaultsSetting("postsWaitingPerBackend"), kDefaultPostsWaiting);
  fields_ = std::move(f);
}

// A batch still held at the end never went: the backend was never allowed
// to post it (user info required and never given, or no flush came).
HTTPSPostBackend::~HTTPSPostBackend() {
  if (batch_.batchedEvents && !batch_.batchedEvents->empty()) {
    counters().add(BackendCount::droppedDisabled, batch_.batchedEvents->size());
    counters().remove(BackendCount::inBatch, batch_.batchedEvents->size());
  }
}

HTTPSPostBackend::Fields HTTPSPostBackend::fields() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_;
}

void HTTPSPostBackend::setImmutable() {
  std::lock_guard lock(fieldsMutex_);
  fields_.immutable = true;
}

// ---------------------------------------------------------------------------
// Sending, posting, flushing

std::optional<std::string> HTTPSPostBackend::sendMessage(const Value& message, const timeval& timestamp,
                                                         std::uint16_t method, std::uint16_t respCode,
                                                         std::uint16_t eventID, std::int32_t flag) {
  const std::int32_t currentState = state();
  if (currentState == kBackendStateDisabled) {
    counters().add(disabledBySampling() ? BackendCount::droppedSampledOut : BackendCount::droppedDisabled);
    return std::nullopt;
  }
  Value payload = message["ClientData"];
  if (payload.isNil()) {
    payload = message;
  }
  if (payload.isNil()) {
    backendsLogger().error("HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil");
    payload = Value(Dictionary());
  }
  // The record's final size is known here: the payload, the keys the
  // record adds, user info and the shared data. Room for all of them up
  // front spares the copy regrowing (and moving every entry) as keys come.
  const Value sharedData = message["SharedData"];
  const bool stopMessage = method == 0 && respCode == 1;
  const std::size_t capacity = payload.count() + kRecordKeys + (stopMessage ? kStopMessageKeys : 0) +
                               userInfoDict().count() + sharedData.count();
  Dictionary copy = payload.isDict() ? Dictionary(*payload.dict(), capacity) : Dictionary(Dictionary(), capacity);
  if (stopMessage) {
    backendsLogger().debug(
        "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP message dictionary");
    const Fields f = fields();
    copy.set("Opt", Value(f.dnuType));
    const Value threshold = samplingThreshold();
    copy.set("SamplingThreshold", threshold.isNil() ? Value(-1) : threshold);
    copy.set("OverrideSampling", f.overrideSampling.isNil() ? Value(-1) : f.overrideSampling);
    copy.set("Batch", Value(batchEvents() ? 1 : 0));
  }
  Dictionary event = completeRecord(std::move(copy), timestamp, method, respCode, eventID);
  prepareEventForMessage(event, sharedData);

  const bool realtime = (flag | 2) == 3;
  if ((flag | 1) == 3 && currentState == kBackendStateSampledOut) {
    setState(kBackendStateEnabled);
  }
  backendsLogger().debug("HTTPSPostBackend(sendMessage): realtime is {}", realtime ? 1 : 0);

  const bool haveUserInfo = userInfoDict().count() > 0;
  const bool batch = currentState == kBackendStateUndecided || currentState == kBackendStateSampledOut ||
                     (!realtime && batchEvents()) || (requireUserInfo() && !haveUserInfo);
  if (batch) {
    backendsLogger().debug("HTTPSPostBackend(sendMessage): Batching {}, {}, {}", currentState, batchEvents() ? 1 : 0,
                   requireUserInfo() ? 1 : 0);
    return batchEvent(std::move(event));
  }

  std::optional<std::string> flushed;
  bool flushPreceded = false;
  if (currentState == kBackendStateEnabled && realtime && batchedEventCount() > 0) {
    backendsLogger().debug(
        "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing Flush "
        "here to keep events in order.");
    flushed = flushMessagesWithCompletion(nullptr);
    flushPreceded = true;
  }
  backendsLogger().debug("HTTPSPostBackend(sendMessage): Sending {}, {}, {}", currentState, batchEvents() ? 1 : 0,
                 requireUserInfo() ? 1 : 0);
  std::optional<std::string> pretty;
  std::vector<Dictionary> one;
  one.push_back(std::move(event));
  std::uint32_t records = 0;
  const auto body = createMessageForPostAndLogging(std::move(one), &pretty, &records);
  if (!body) {
    counters().add(BackendCount::droppedUnencodable);
    return std::nullopt;
  }
  std::optional<std::string> text = pretty;
  if (flushPreceded) {
    text = fmt::format("Flushed events:\n{}\nStandalone event:\n{}", orNull(flushed), orNull(pretty));
  }
  countPosted(1, flag);
  postJSONMessage(*body, flag, method, respCode, nullptr, records);
  if (flushPreceded) {
    setImmutable();
  }
  return text;
}

std::string HTTPSPostBackend::digestDescription(const std::array<std::uint8_t, 20>& digest) {
  std::string out = "<";
  for (std::size_t i = 0; i < digest.size(); ++i) {
    if (i > 0 && i % 4 == 0) {
      out += ' ';
    }
    out += fmt::format("{:02x}", digest[i]);
  }
  out += '>';
  return out;
}

std::string HTTPSPostBackend::userAgent() const {
  const std::string minor = selfVersionMinor() != 0 ? fmt::format(".{}", selfVersionMinor()) : std::string();
  return fmt::format("Zerith/{}.{}{} ({}; {})", selfVersionMajor(), selfVersionMiddle(), minor, orNull(hardwareType()),
                     orNull(productVersion()));
}

void HTTPSPostBackend::postJSONMessage(const std::string& json, std::int32_t flag, std::optional<std::uint16_t> method,
                                       std::optional<std::uint16_t> responseCode, PostCompletion completion,
                                       std::optional<std::uint32_t> records) {
  const Fields f = fields();
  const bool realtime = (flag | 2) == 3;
  std::optional<std::string> url = realtime ? f.realtimePostURL : f.postURL;
  if (!url) {
    backendsLogger().error("HTTPSPostBackend(postJsonMessage): postURL is nil");
    if (completion) {
      completion(Value(), makeZerithError("postURL is nil", -1));
    }
    return;
  }

  const auto jsonBytes = crypto::bytesOf(json);
  Data body;
  bool compressed = false;
  if (auto gz = gzipDeflate(jsonBytes); gz && !gz->empty() && gz->size() < jsonBytes.size()) {
    body = std::move(*gz);
    compressed = true;
  } else {
    body.assign(jsonBytes.begin(), jsonBytes.end());
  }

  // The https rule, shared with uploads.
  std::string text;
  if (auto postable = postableURL(*url, &text)) {
    url = std::move(*postable);
  } else {
    backendsLogger().error("HTTPSPostBackend(postJsonMessage): post error: {}", text);
    if (completion) {
      completion(Value(), makeZerithError(text, -1));
    }
    return;
  }

  URLRequest request;
  request.httpMethod = "POST";
  request.url = *url;
  request.timeoutSeconds = kPostTimeoutSeconds;
  request.allowsCellularAccess = !shouldUseWiFiOnly();
  const Value userInfo = userInfoDict();
  const auto clientName = stringOf(userInfo[kZerithUserInfoClientName]);
  const auto serviceName = stringOf(userInfo[kZerithUserInfoServiceName]);
  // A missing name compares as equal: without user info there is no cellular.
  if ((!clientName || equalsIgnoringCase(*clientName, "com.velmar.lumira")) &&
      (!serviceName || equalsIgnoringCase(*serviceName, "haptics"))) {
    request.allowsCellularAccess = false;
  }

  HTTPHeaders& headers = request.headers;
  if (clientName) {
    headers.emplace_back("X-ZTH-Client-Name", *clientName);
  }
  if (serviceName) {
    headers.emplace_back("X-ZTH-Service-Name", *serviceName);
  }
  if (isInternal()) {
    headers.emplace_back("X-ZTH-Internal-Build", "1");
  }
  headers.emplace_back("User-Agent", userAgent());
  headers.emplace_back("X-ZTH-Client-Version", std::to_string(clientVersion()));
  headers.emplace_back("X-ZTH-Sender", std::string(senderCode(static_cast<std::uint32_t>(compType()))));
  if (method && responseCode) {
    headers.emplace_back("X-ZTH-Event-Map", fmt::format("{} {}", *method, *responseCode));
  }
  headers.emplace_back("Accept", "application/json");
  headers.emplace_back("Content-Type", "application/json");
  headers.emplace_back("Content-Length", std::to_string(body.size()));
  if (compressed) {
    headers.emplace_back("Content-Encoding", "gzip");
  }
  if (const auto key = digestKey(); key && digestAlgorithm() == 0) {
    headers.emplace_back("X-ZTH-DIGEST", digestDescription(crypto::hmacSha1(*key, jsonBytes)));
  }
  request.body = std::move(body);

  auto transport = reportingSessionConnectivityDelegate();
  if (!transport) {
    return;
  }
  auto post = std::make_shared<LivePost>();
  post->transport = std::move(transport);
  post->records = records ? *records : countEnvelopeRecords(json);
  post->counters = sharedCounters();
  post->backend = weak_from_this();
  post->backendName = name();
  post->completion = std::move(completion);
  post->limit = static_cast<std::size_t>(f.postsInFlight);
  post->waitLimit = static_cast<std::size_t>(f.postsWaiting);
  if (f.spoolEnabled) {
    post->spool = Spool::shared();
  }
  if (post->spool) {
    // Written ahead: on disk before the post starts, so a crash loses it not.
    URLRequest ahead = request;
    post->request = std::move(request);
    if (post->spool->writeAhead(std::move(ahead), post->records, post->counters,
                                [post](std::optional<std::string> name) {
                                  post->spoolName = std::move(name);
                                  startLivePost(post);
                                })) {
      return;
    }
  } else {
    post->request = std::move(request);
  }
  startLivePost(post);
}

namespace {

// Whether a post to `url` gets past the post's own URL checks.
bool isPostableURL(const std::string& url) { return postableURL(url).has_value(); }

}  // namespace

void HTTPSPostBackend::countPosted(std::size_t events, std::int32_t flag) {
  if (events == 0) {
    return;
  }
  bool postable = false;
  {
    std::lock_guard lock(fieldsMutex_);
    const std::optional<std::string>& url = (flag | 2) == 3 ? fields_.realtimePostURL : fields_.postURL;
    postable = url && isPostableURL(*url);
  }
  if (!postable) {
    counters().add(BackendCount::droppedDisabled, events);
  } else if (!reportingSessionConnectivityDelegate()) {
    counters().add(BackendCount::droppedTransportError, events);
  } else {
    counters().add(BackendCount::sent, events);
  }
}

std::optional<std::string> HTTPSPostBackend::flushMessagesWithCompletion(FlushCompletion completion) {
  // The batch is taken in one turn on the state queue; the post and every
  // completion run after it, so a completion may read the state.
  FlushOutcome outcome = stateQueue().sync([&] { return takeBatchOnStateQueue(); });
  if (outcome.error) {
    if (completion) {
      completion(Value(), makeZerithError(outcome.error, -1));
    }
    return std::nullopt;
  }
  countPosted(outcome.events, 0);
  postJSONMessage(*outcome.body, 0, std::nullopt, std::nullopt, std::move(completion), outcome.bodyRecords);
  if (outcome.pretty) {
    setImmutable();
  }
  return outcome.pretty;
}

HTTPSPostBackend::FlushOutcome HTTPSPostBackend::takeBatchOnStateQueue() {
  FlushOutcome outcome;
  if (!batch_.batchedEvents) {
    outcome.error = "Nothing to flush";
    return outcome;
  }
  const std::size_t taken = batch_.batchedEvents->size();
  if (const std::int32_t state = stateOnQueue(); state != kBackendStateEnabled) {
    // A batch that may not go is dropped: kept back by the sampling draw
    // (sampled out, or disabled by the override threshold) or not reporting.
    const bool sampled = state == kBackendStateSampledOut || (state == kBackendStateDisabled && disabledBySampling());
    counters().add(sampled ? BackendCount::droppedSampledOut : BackendCount::droppedDisabled, taken);
    counters().remove(BackendCount::inBatch, taken);
    batch_ = Batch{};
    outcome.error = "Nothing to flush";
    return outcome;
  }
  Dictionary userInfo = userInfoDict().isDict() ? userInfoDict().dictCopy() : Dictionary();
  if (requireUserInfo() && userInfo.empty()) {
    outcome.error = "Can not flush: userInfo is required";
    return outcome;
  }
  backendsLogger().debug("HTTPSPostBackend(flushMessagesWithCompletion): called");
  filterEvent(userInfo);
  std::vector<Dictionary> kept;
  kept.reserve(batch_.batchedEvents->size());
  for (Dictionary& event : *batch_.batchedEvents) {
    const auto category = static_cast<std::uint16_t>(recordInteger(event, "_method").value_or(0));
    if (!isWhitelistedEvent(category)) {
      backendsLogger().debug("flushMessagesWithCompletion: Dropping event with category {} as it is not whitelisted for backend {}",
                     category, name());
      counters().add(BackendCount::droppedFiltered);
      continue;
    }
    if (isBlacklistedEvent(category)) {
      backendsLogger().info("flushMessagesWithCompletion: Dropping event with category {} as it is blacklisted for backend {}",
                    category, name());
      counters().add(BackendCount::droppedBlacklisted);
      continue;
    }
    for (const auto& [key, value] : userInfo) {
      event.set(key, value);
    }
    kept.push_back(std::move(event));
  }
  batch_ = Batch{};
  counters().remove(BackendCount::inBatch, taken);
  outcome.events = kept.size();
  outcome.body =
      kept.empty() ? std::nullopt : createMessageForPostAndLogging(std::move(kept), &outcome.pretty, &outcome.bodyRecords);
  if (!outcome.body) {
    counters().add(BackendCount::droppedUnencodable, outcome.events);
    outcome.events = 0;
    outcome.error = "Nothing to flush: batched events were completely filtered out";
  }
  return outcome;
}

void HTTPSPostBackend::setCorrelatedSessionID(std::optional<std::string> sessionID) {
  ZerithBackend::setCorrelatedSessionID(sessionID);
  stateQueue().sync([&] {
    if (!batch_.batchedEvents) {
      return;
    }
    for (Dictionary& event : *batch_.batchedEvents) {
      if (sessionID) {
        event.set("_sessionID", Value(*sessionID));
      } else {
        event.erase("_sessionID");
      }
    }
  });
}

std::uint32_t HTTPSPostBackend::batchedEventsSize() {
  return stateQueue().sync([&]() -> std::uint32_t {
    if (!batch_.batchedEvents) {
      return 0;
    }
    Array records;
    records.reserve(batch_.batchedEvents->size());
    for (const Dictionary& event : *batch_.batchedEvents) {
      records.emplace_back(event);
    }
    return static_cast<std::uint32_t>(estimatedPlistMemorySize(Value(std::move(records))));
  });
}

std::size_t HTTPSPostBackend::batchedEventCount() const {
  return stateQueue().sync([&]() -> std::size_t { return batch_.batchedEvents ? batch_.batchedEvents->size() : 0; });
}

// ---------------------------------------------------------------------------
// Accessors

std::optional<std::string> HTTPSPostBackend::postURL() const { return fields().postURL; }
void HTTPSPostBackend::setPostURL(std::optional<std::string> url) {
  std::lock_guard lock(fieldsMutex_);
  fields_.postURL = std::move(url);
}
std::optional<std::string> HTTPSPostBackend::realtimePostURL() const { return fields().realtimePostURL; }
std::int32_t HTTPSPostBackend::eventThreshold() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.eventThreshold;
}
std::int32_t HTTPSPostBackend::dnuType() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.dnuType;
}
bool HTTPSPostBackend::isImmutable() const {
  std::lock_guard lock(fieldsMutex_);
  return fields_.immutable;
}
Value HTTPSPostBackend::overrideSampling() const { return fields().overrideSampling; }
std::vector<HTTPSPostBackend::Filter> HTTPSPostBackend::filters() const { return *fields().filters; }
std::int32_t HTTPSPostBackend::numberOfFilters() const { return fields().numberOfFilters; }
std::optional<std::string> HTTPSPostBackend::uuidCustom() const { return fields().uuidCustom; }

}  // namespace zerith
