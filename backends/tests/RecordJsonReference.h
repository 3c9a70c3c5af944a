#pragma once

// The envelope as the HTTPS backend wrote it before it streamed batches: an
// nlohmann tree per record, dumped. What the writer in RecordJson.h is held
// to by the tests, the fuzz target and the benchmark.

#include <cmath>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "config/Conversions.h"
#include "platform/Value.h"

namespace zerith::test {

inline std::string treeEnvelopeJson(double postTime, const std::optional<std::string>& clientId,
                                    const std::vector<Dictionary>& records, const std::function<std::string()>& recordID,
                                    const std::function<void(const std::string&, const Value&)>& dropped) {
  using json = nlohmann::ordered_json;
  json list = json::array();
  for (const Dictionary& record : records) {
    json object = json::object();
    auto& entries = object.get_ref<json::object_t&>();
    for (const auto& [key, v] : record) {
      if (recordID && key == "_recordID") {
        continue;
      }
      switch (v.type()) {
        case Value::Type::Bool: entries.emplace_back(key, v.boolValue()); break;
        case Value::Type::Int: entries.emplace_back(key, v.intValue()); break;
        case Value::Type::UInt: entries.emplace_back(key, v.unsignedValue()); break;
        case Value::Type::Real:
          std::isfinite(v.doubleValue()) ? (void)entries.emplace_back(key, v.doubleValue()) : dropped(key, v);
          break;
        case Value::Type::String: entries.emplace_back(key, *v.string()); break;
        case Value::Type::Date: entries.emplace_back(key, sanitizeDouble(v.date()->secondsSince1970)); break;
        default: dropped(key, v);
      }
    }
    if (recordID) {
      entries.emplace_back("_recordID", recordID());
    }
    list.push_back(std::move(object));
  }
  json envelope = json::object();
  envelope["postTime"] = sanitizeDouble(postTime);
  if (clientId) {
    envelope["clientId"] = *clientId;
    envelope["events"] = std::move(list);
  }
  return envelope.dump(-1, ' ', false, json::error_handler_t::replace);
}

}  // namespace zerith::test
