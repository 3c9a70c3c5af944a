#include "backends/ZerithBackend.h"

#include <climits>
#include <cctype>
#include <cstdlib>

#include <fmt/format.h>

#include "config/ClientTypes.h"
#include "platform/Crypto.h"

namespace zerith {

namespace {

// Length of UTF-8 text in UTF-16 code units: one per code point, two for
// those beyond the basic plane (4-byte sequences). A byte that starts no
// valid sequence counts as one unit, as its replacement character would.
std::size_t utf16Length(std::string_view text) {
  std::size_t units = 0;
  std::size_t i = 0;
  while (i < text.size()) {
    const auto lead = static_cast<unsigned char>(text[i]);
    std::size_t length = 1;
    if (lead >= 0xF0 && lead <= 0xF4) {
      length = 4;
    } else if (lead >= 0xE0) {
      length = lead <= 0xEF ? 3 : 1;
    } else if (lead >= 0xC2) {
      length = 2;
    }
    bool valid = i + length <= text.size();
    for (std::size_t k = 1; valid && k < length; ++k) {
      valid = (static_cast<unsigned char>(text[i + k]) & 0xC0) == 0x80;
    }
    if (!valid) {
      length = 1;
    }
    units += length == 4 ? 2 : 1;
    i += length;
  }
  return units;
}

// The integer value of a version piece as a string's intValue reads it:
// leading blanks, an optional sign, digits; clamped to 32 bits; 0 for none.
std::int32_t intValueOf(std::string_view piece) {
  std::size_t i = 0;
  while (i < piece.size() && (piece[i] == ' ' || piece[i] == '\t' || piece[i] == '\n')) {
    ++i;
  }
  bool negative = false;
  if (i < piece.size() && (piece[i] == '+' || piece[i] == '-')) {
    negative = piece[i] == '-';
    ++i;
  }
  long long value = 0;
  for (; i < piece.size() && piece[i] >= '0' && piece[i] <= '9'; ++i) {
    value = value * 10 + (piece[i] - '0');
    if (value > static_cast<long long>(INT_MAX) + 1) {
      value = static_cast<long long>(INT_MAX) + 1;
    }
  }
  value = negative ? -value : value;
  if (value > INT_MAX) {
    value = INT_MAX;
  }
  return static_cast<std::int32_t>(value);
}

bool listHolds(const Value& list, std::uint16_t category) {
  if (const Array* elements = list.array()) {
    for (const Value& element : *elements) {
      if (element.intValue() == category) {
        return true;
      }
    }
  }
  return false;
}

}  // namespace

std::string_view backendCountName(BackendCount what) {
  switch (what) {
    case BackendCount::accepted: return "accepted";
    case BackendCount::sent: return "sent";
    case BackendCount::batched: return "batched";
    case BackendCount::spooled: return "spooled";
    case BackendCount::retried: return "retried";
    case BackendCount::delivered: return "delivered";
    case BackendCount::inBatch: return "inBatch";
    case BackendCount::inFlight: return "inFlight";
    case BackendCount::inSpool: return "inSpool";
    case BackendCount::droppedSampledOut: return "droppedSampledOut";
    case BackendCount::droppedFiltered: return "droppedFiltered";
    case BackendCount::droppedBlacklisted: return "droppedBlacklisted";
    case BackendCount::droppedDisabled: return "droppedDisabled";
    case BackendCount::droppedSpoolFull: return "droppedSpoolFull";
    case BackendCount::droppedTransportError: return "droppedTransportError";
    case BackendCount::droppedQueueFull: return "droppedQueueFull";
    case BackendCount::droppedUnsupported: return "droppedUnsupported";
    case BackendCount::droppedNoBodyFile: return "droppedNoBodyFile";
    case BackendCount::droppedBusy: return "droppedBusy";
    case BackendCount::droppedUnencodable: return "droppedUnencodable";
    case BackendCount::count_: break;
  }
  return "unknown";
}

std::string ZerithBackend::convertIntoSHA256(std::string_view text) {
  const std::size_t n = utf16Length(text);
  const auto digest = crypto::sha256(crypto::bytesOf(text.substr(0, n)));
  return crypto::hexLower(digest);
}

ZerithBackend::ZerithBackend(std::string name, Value profile, std::optional<std::string> productFamily)
    : name_(std::move(name)),
      profile_(std::move(profile)),
      productFamily_(productFamily ? Value(std::move(*productFamily)) : Value()),
      samplingFactor_(crypto::randomUniform(9999) / 10000.0),
      stateQueue_(kBackendStateQueueLabel) {}

// `udid` belongs to the session and `samplingThreshold` was never retained:
// neither is released here. The weak transport reference simply goes.
ZerithBackend::~ZerithBackend() = default;

void ZerithBackend::cleanup() {}

void ZerithBackend::setReportingSessionConnectivityDelegate(
    std::weak_ptr<ReportingSessionConnectivityInterface> delegate) {
  std::lock_guard lock(propertyMutex_);
  reportingSessionConnectivityDelegate_ = std::move(delegate);
}

std::shared_ptr<ReportingSessionConnectivityInterface> ZerithBackend::reportingSessionConnectivityDelegate() const {
  std::lock_guard lock(propertyMutex_);
  return reportingSessionConnectivityDelegate_.lock();
}

void ZerithBackend::setSelfVersion(std::string_view version) {
  std::vector<std::string_view> pieces;
  while (true) {
    const auto dot = version.find('.');
    pieces.push_back(version.substr(0, dot));
    if (dot == std::string_view::npos) {
      break;
    }
    version.remove_prefix(dot + 1);
  }
  selfVersionMajor_.store(static_cast<std::uint8_t>(intValueOf(pieces[0])));
  selfVersionMiddle_.store(pieces.size() >= 2 ? static_cast<std::uint8_t>(intValueOf(pieces[1])) : 0);
  selfVersionMinor_.store(pieces.size() >= 3 ? static_cast<std::uint8_t>(intValueOf(pieces[2])) : 0);
  const std::string minor = selfVersionMinor() != 0 ? fmt::format(".{}", selfVersionMinor()) : std::string();
  Value text(fmt::format("{}.{}{}", selfVersionMajor(), selfVersionMiddle(), minor));
  std::lock_guard lock(propertyMutex_);
  reportVersion_ = std::move(text);
}

ZerithBackend::RecordFacts ZerithBackend::recordFacts() const {
  std::lock_guard lock(propertyMutex_);
  return RecordFacts{combinedSessionIDString_, productFamily_, hardwareType_,
                     productVersion_,          buildVersion_,  reportVersion_};
}

std::int32_t ZerithBackend::state() const {
  return stateQueue_.sync([this] { return state_; });
}

void ZerithBackend::setState(std::int32_t state) {
  std::weak_ptr<ZerithBackend> weak = weak_from_this();
  if (weak.expired()) {
    // Not owned by a shared pointer (a backend on the stack): nothing can
    // keep it alive for a queued write, so write in turn right away.
    stateQueue_.sync([this, state] { state_ = state; });
    return;
  }
  // A write still queued when the backend goes is dropped with it.
  stateQueue_.async([weak = std::move(weak), state] {
    if (auto self = weak.lock()) {
      self->state_ = state;
    }
  });
}

std::int32_t ZerithBackend::stateOnQueue() const {
  stateQueue_.assertCurrent();
  return state_;
}

void ZerithBackend::setStateOnQueue(std::int32_t state) {
  stateQueue_.assertCurrent();
  state_ = state;
}

void ZerithBackend::updateState() { setState(kBackendStateEnabled); }

std::optional<std::string> ZerithBackend::sendMessage(const Value&, const timeval&, std::uint16_t, std::uint16_t,
                                                      std::uint16_t, std::int32_t) {
  // A kind that does not take events (upload, datagram, energy log) lets
  // them go here.
  counters_->add(BackendCount::droppedUnsupported);
  return std::nullopt;
}

std::optional<std::string> ZerithBackend::sendMessage(const Value& message, const timeval& timestamp,
                                                      std::uint16_t method, std::uint16_t respCode, std::int32_t flag) {
  const auto next = static_cast<std::uint16_t>(eventID_.fetch_add(1) + 1);
  return sendMessage(message, timestamp, method, respCode, next, flag);
}

void ZerithBackend::setStartTimestamp(const timeval& timestamp) {
  startTimeStamp_.store(static_cast<double>(timestamp.tv_sec) + static_cast<double>(timestamp.tv_usec) / 1000000.0);
}

std::optional<std::string> ZerithBackend::flushMessagesWithCompletion(FlushCompletion completion) {
  if (completion) {
    completion(Value(), std::nullopt);
  }
  return std::nullopt;
}

void ZerithBackend::uploadFileAtPath(const UploadRequest&, UploadCompletion completion) {
  if (completion) {
    completion(false, false);
  }
}

bool ZerithBackend::uploadLogData(const Value&) { return false; }

void ZerithBackend::setCorrelatedSessionID(std::optional<std::string> sessionID) {
  setCombinedSessionIDString(std::move(sessionID));
}

bool ZerithBackend::isWhitelistedEvent(std::uint16_t category) const {
  const Value whitelist = eventWhitelist();
  if (whitelist.isNil()) {
    return true;
  }
  return listHolds(whitelist, category);
}

bool ZerithBackend::isBlacklistedEvent(std::uint16_t category) const {
  const Value blacklist = eventBlacklist();
  if (blacklist.isNil() || blacklist.count() == 0) {
    return false;
  }
  return listHolds(blacklist, category);
}

std::uint32_t ZerithBackend::batchedEventsSize() { return 0; }

#define ZERITH_LOCKED_PROPERTY(Type, getter, setter, field) \
  Type ZerithBackend::getter() const {                      \
    std::lock_guard lock(propertyMutex_);                   \
    return field;                                           \
  }                                                         \
  void ZerithBackend::setter(Type v) {                      \
    std::lock_guard lock(propertyMutex_);                   \
    field = std::move(v);                                   \
  }

// A text kept as a value, nil when absent.
#define ZERITH_LOCKED_TEXT_PROPERTY(getter, setter, field)                                \
  std::optional<std::string> ZerithBackend::getter() const {                            \
    std::lock_guard lock(propertyMutex_);                                               \
    const std::string* text = field.string();                                           \
    return text ? std::optional<std::string>(*text) : std::nullopt;                     \
  }                                                                                     \
  void ZerithBackend::setter(std::optional<std::string> v) {                            \
    Value text = v ? Value(std::move(*v)) : Value();                                    \
    std::lock_guard lock(propertyMutex_);                                               \
    field = std::move(text);                                                            \
  }

ZERITH_LOCKED_TEXT_PROPERTY(combinedSessionIDString, setCombinedSessionIDString, combinedSessionIDString_)
ZERITH_LOCKED_PROPERTY(std::optional<std::string>, displayURL, setDisplayURL, displayURL_)
ZERITH_LOCKED_TEXT_PROPERTY(productVersion, setProductVersion, productVersion_)
ZERITH_LOCKED_TEXT_PROPERTY(buildVersion, setBuildVersion, buildVersion_)
ZERITH_LOCKED_TEXT_PROPERTY(hardwareType, setHardwareType, hardwareType_)
ZERITH_LOCKED_TEXT_PROPERTY(productFamily, setProductFamily, productFamily_)
ZERITH_LOCKED_PROPERTY(Value, userInfoDict, setUserInfoDict, userInfoDict_)
ZERITH_LOCKED_PROPERTY(Value, samplingThreshold, setSamplingThreshold, samplingThreshold_)
ZERITH_LOCKED_PROPERTY(Value, eventWhitelist, setEventWhitelist, eventWhitelist_)
ZERITH_LOCKED_PROPERTY(Value, eventBlacklist, setEventBlacklist, eventBlacklist_)
ZERITH_LOCKED_PROPERTY(std::optional<Data>, digestKey, setDigestKey, digestKey_)

#undef ZERITH_LOCKED_TEXT_PROPERTY
#undef ZERITH_LOCKED_PROPERTY

std::optional<std::string> postableURL(std::string url, std::string* why) {
  const auto lower = [](std::string_view text) {
    std::string out(text);
    for (char& c : out) {
      c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    }
    return out;
  };
  if (!isInternalBuild()) {
    const auto at = url.find("://");
    if (at != std::string::npos && lower(url.substr(0, at)) != "https") {
      // "https" + "://" + the second piece; a further "://" and what follows go.
      std::string rest = url.substr(at + 3);
      if (const auto again = rest.find("://"); again != std::string::npos) {
        rest.resize(again);
      }
      url = "https://" + rest;
    }
  }
  // Only HTTP(S) is ever posted to; anything else (no scheme, ftp on an
  // internal build) is refused instead of being handed to the transport.
  const auto schemeEnd = url.find("://");
  const std::string scheme = schemeEnd == std::string::npos ? std::string() : lower(url.substr(0, schemeEnd));
  if (scheme != "https" && scheme != "http") {
    if (why != nullptr) {
      *why = fmt::format("post URL '{}' is not an http(s) URL", url);
    }
    return std::nullopt;
  }
  return url;
}

}  // namespace zerith
