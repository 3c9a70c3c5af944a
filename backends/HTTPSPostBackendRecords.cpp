// The HTTPS backend's records: a record made from a payload, the batch it
// waits in, and the JSON envelope a batch is posted in.

#include "backends/HTTPSPostBackend.h"
#include "backends/BackendsLog.h"
#include "backends/HTTPSPostBackendHelpers.h"
#include "backends/RecordJson.h"
#include "backends/Spool.h"

#include <algorithm>
#include <cmath>
#include <functional>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "config/Identifiers.h"
#include "config/SenderCodes.h"
#include "zerith/Zerith.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

using https_post_detail::kRecordKeys;
using https_post_detail::recordInteger;

// ---------------------------------------------------------------------------
// Records, batch and envelope

Dictionary HTTPSPostBackend::newEventDictfromPayload(const Value& payload, const timeval& timestamp,
                                                     std::uint16_t method, std::uint16_t respCode,
                                                     std::uint16_t eventID) const {
  const std::size_t capacity = payload.count() + kRecordKeys + userInfoDict().count();
  Dictionary event = payload.isDict() ? Dictionary(*payload.dict(), capacity) : Dictionary(Dictionary(), capacity);
  return completeRecord(std::move(event), timestamp, method, respCode, eventID);
}

Dictionary HTTPSPostBackend::completeRecord(Dictionary event, const timeval& timestamp, std::uint16_t method,
                                            std::uint16_t respCode, std::uint16_t) const {
  const double start = startTimeStamp();
  const std::int64_t startTS = roundDownToMinute(static_cast<std::int64_t>(start));
  event.set("_startTS", Value(static_cast<long long>(startTS)));
  event.set("_sender", Value(senderCode(static_cast<std::uint32_t>(compType()))));
  event.set("_clientVersion", Value(static_cast<unsigned>(clientVersion())));
  RecordFacts facts = recordFacts();
  if (!facts.combinedSessionID.isNil()) {
    event.set("_sessionID", std::move(facts.combinedSessionID));
  }
  const std::int32_t type = compType();
  if (type == 7 || (isInternal() && (type == 11 || type == 13))) {
    event.set("_sessionID", Value(static_cast<unsigned>(sessionID())));
  }
  event.set("_eventNumber", Value(static_cast<unsigned>(eventID())));
  event.set("_method", Value(static_cast<unsigned>(method)));
  event.set("_status", Value(static_cast<unsigned>(respCode)));
  const double clientTS = sanitizeDouble(static_cast<double>(startTS) + (timevalToSeconds(timestamp) - start));
  event.set("_clientTS", Value(clientTS));
  event.set("eventTime", Value(clientTS));
  // Absent product facts leave no entry rather than a null on the wire (an
  // entry of the payload by that name goes too).
  if (!facts.productFamily.isNil()) {
    event.set("_productFamily", std::move(facts.productFamily));
  } else {
    event.erase("_productFamily");
  }
  if (!facts.hardwareType.isNil()) {
    event.set("_productModel", std::move(facts.hardwareType));
  } else {
    event.erase("_productModel");
  }
  if (!facts.productVersion.isNil()) {
    event.set("_osVersion", std::move(facts.productVersion));
  }
  if (!facts.buildVersion.isNil()) {
    event.set("_build", std::move(facts.buildVersion));
  }
  event.set("_internal", Value(isInternalBuild() ? 3u : 2u));
  event.set("_reportVers", std::move(facts.reportVersion));
  event.set("_timezoneOffset", Value(static_cast<long long>(timeZoneOffsetSeconds())));
  return event;
}

void HTTPSPostBackend::prepareEventForMessage(Dictionary& event, const Value& frameworkData) const {
  const Value userInfo = userInfoDict();
  if (const Dictionary* entries = userInfo.dict()) {
    for (const auto& [key, value] : *entries) {
      event.set(key, value);
    }
  }
  if (const Dictionary* data = frameworkData.dict()) {
    for (const auto& [key, value] : *data) {
      event.set(key, value);
    }
  }
  filterEvent(event);
}

std::optional<std::string> HTTPSPostBackend::batchEvent(Dictionary event) {
  const auto method = static_cast<std::uint16_t>(recordInteger(event, "_method").value_or(0));
  const std::int32_t threshold = eventThreshold();
  // Creates the batch when there is none, with room for a method's full
  // batch; on the state queue.
  const auto createBatch = [&] {
    if (!batch_.batchedEvents) {
      batch_.batchedEvents.emplace();
      batch_.batchedEvents->reserve(static_cast<std::size_t>(std::clamp<std::int32_t>(threshold, 0, 255)) + 1);
    }
  };
  // Appends the record and stores the method's new count; on the state queue.
  const auto append = [&](std::int64_t count) {
    Batch& batch = batch_;
    createBatch();
    batch.batchedEvents->push_back(std::move(event));
    counters().add(BackendCount::batched);
    counters().add(BackendCount::inBatch);
    for (auto& [m, n] : batch.eventMethodCounts) {
      if (m == method) {
        n = count + 1;
        return;
      }
    }
    batch.eventMethodCounts.emplace_back(method, count + 1);
  };
  // One turn on the state queue reads the method's count and, when it does
  // not force a flush, appends the record at once. The append may join the
  // read because all that the batch's users rely on is that a later turn on
  // the queue (a flush, a size or count read) sees every record whose
  // batchEvent has returned; one turn gives that as well as two. The turn
  // runs on this thread, so no pool thread is woken per record.
  std::int64_t count = 0;
  const bool appended = stateQueue().sync([&] {
    createBatch();
    for (const auto& [m, n] : batch_.eventMethodCounts) {
      if (m == method) {
        count = n;
        break;
      }
    }
    if (count > threshold) {
      return false;
    }
    append(count);
    return true;
  });
  if (appended) {
    return std::nullopt;
  }
  backendsLogger().debug("HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method {}",
                 method);
  std::optional<std::string> result = flushMessagesWithCompletion(nullptr);
  // The record that forced the flush is appended in a turn of its own after
  // it, so it is never part of what it flushed; it starts the method's new
  // count.
  stateQueue().sync([&] { append(0); });
  return result;
}

std::optional<std::string> HTTPSPostBackend::createMessageForPostAndLogging(
    std::vector<Dictionary> events, std::optional<std::string>* prettyJsonString, std::uint32_t* recordCount) const {
  timeval now{};
  gettimeofday(&now, nullptr);
  const Fields f = fields();

  std::optional<std::string> clientId = f.uuidCustom ? f.uuidCustom : (f.dnuType != 0 ? f.uuidOverrideDnu : f.uuidRespectDnu);
  if (f.extrasOnInternal != 0 && isInternal()) {
    const char* device = udid();
    clientId = device ? std::optional<std::string>(device) : std::nullopt;
  }

  // The three keys go in as one list that ends at the first absent value.
  // Set once, here: a spooled batch is posted again byte for byte, so the
  // collector sees the same ID on every copy of a record.
  const std::function<std::string()> recordID = f.spoolEnabled ? std::function<std::string()>(newRecordID) : nullptr;
  std::string compact = envelopeJson(timevalToSeconds(now), clientId, events, recordID, [](const std::string& key, const Value& v) {
    backendsLogger().error(
        "HTTPSPostBackend(createMessageForPostAndLogging): QFJSONSerialization unable to handle key: {}, value: {}", key,
        v.description());
  });

  if (recordCount) {
    // The envelope carries every record when it has a client identifier,
    // none without.
    *recordCount = clientId ? static_cast<std::uint32_t>(events.size()) : 0;
  }
  if (prettyJsonString) {
    const ZerithEnvironmentType environment =
        lastResolvedEnvironmentType() != kEnvironmentNone ? lastResolvedEnvironmentType() : userDefaultsEnvironment();
    const bool forced = (environment == kEnvironmentDevelopment || environment == kEnvironmentInternal) && f.forceEventLogging;
    const bool consented = f.dnuType == 0 && f.dnuEnabled;
    if (forced || consented) {
      // Read back from the text just written (valid JSON, UTF-8 already).
      *prettyJsonString = nlohmann::ordered_json::parse(compact).dump(4);
    }
  }
  return compact;
}

}  // namespace zerith
