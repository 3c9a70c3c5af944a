// libFuzzer target: the HTTPS backend's batch writer held to the nlohmann
// tree it replaced. The bytes are a binary property list read as a batch (a
// dictionary is a record; in an array, each dictionary is one) with any text,
// UTF-8 or not, any reals and dates: both writers' texts read back to the same
// JSON, keys in the same order, and drop the same entries.
// (The backends tests replay the corpus through recordJsonFuzzOneInput.)

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "backends/RecordJson.h"
#include "backends/tests/RecordJsonReference.h"
#include "platform/BinaryPlist.h"

#ifndef ZERITH_FUZZ_ENTRY_NAME
#define ZERITH_FUZZ_ENTRY_NAME LLVMFuzzerTestOneInput
#endif

extern "C" int ZERITH_FUZZ_ENTRY_NAME(const std::uint8_t* data, std::size_t size) {
  using namespace zerith;
  const auto value = bplist::decode(plist::Bytes(data, size));
  if (!value) {
    return 0;
  }
  std::vector<Dictionary> records;
  double postTime = 0;
  if (const Dictionary* record = value->dict()) {
    records.push_back(*record);
  } else if (const Array* list = value->array()) {
    for (const Value& v : *list) {
      if (v.dict()) {
        records.push_back(*v.dict());
      } else if (v.type() == Value::Type::Real) {
        postTime = v.doubleValue();
      }
    }
  }
  const auto written = [&](auto writer) {
    int n = 0;
    std::vector<std::string> dropped;
    const std::string text = writer(postTime, "client", records, [&n] { return std::to_string(n++); },
                                    [&](const std::string& key, const Value&) { dropped.push_back(key); });
    auto json = nlohmann::ordered_json::parse(text, nullptr, false);
    if (json.is_discarded()) {
      std::abort();
    }
    return std::pair(std::move(json), dropped);
  };
  if (written(envelopeJson) != written(test::treeEnvelopeJson)) {
    std::abort();
  }
  return 0;
}
