// The daemon's own work per event, in one process, with the allocations it
// makes (every malloc, calloc and realloc of the process, libplist's and
// libstdc++'s included, counted by a pass-through to glibc's allocator):
// - a client's event frame decoded (structural check, libplist, value
//   tree, the message's checks), beside nlohmann-json parsing the same event
//   as one JSON line, what a log pipeline does per event;
// - the daemon's answer to an event (a reply frame with empty arguments);
// - 50 events made records by the HTTPS backend (payload copy, its keys,
//   user info, filters) and written as one envelope, beside nlohmann-json
//   dumping an envelope of the same 50 records already built as its objects;
// - the envelope of those 50 records alone, written by the backend's
//   streaming writer, beside the nlohmann tree per record and its dump that
//   the backend used before (the same records, IDs and drops).
// The event is the end-to-end pipeline benchmark's (bench/pipeline).

#include <benchmark/benchmark.h>
#include <sys/time.h>

#include <atomic>
#include <cstdlib>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "backends/HTTPSPostBackend.h"
#include "backends/RecordJson.h"
#include "backends/Spool.h"
#include "backends/tests/RecordJsonReference.h"
#include "bench/BenchBackend.h"
#include "bench/pipeline/BenchEvent.h"
#include "config/DeviceInfo.h"
#include "zerith/ZerithConstants.h"
#include "ipc/ClientSessionWire.h"
#include "ipc/Frame.h"
#include "platform/Defaults.h"
#include "platform/Json.h"
#include "tests/support/TempRoot.h"

// ---- allocation count ----------------------------------------------------------

namespace {
std::atomic<std::uint64_t> allocations{0};
std::atomic<std::uint64_t> allocatedBytes{0};
}  // namespace

extern "C" {
void* __libc_malloc(std::size_t size);
void* __libc_calloc(std::size_t n, std::size_t size);
void* __libc_realloc(void* p, std::size_t size);
void __libc_free(void* p);

void* malloc(std::size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  allocatedBytes.fetch_add(size, std::memory_order_relaxed);
  return __libc_malloc(size);
}
void* calloc(std::size_t n, std::size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  allocatedBytes.fetch_add(n * size, std::memory_order_relaxed);
  return __libc_calloc(n, size);
}
void* realloc(void* p, std::size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  allocatedBytes.fetch_add(size, std::memory_order_relaxed);
  return __libc_realloc(p, size);
}
void free(void* p) { __libc_free(p); }
}

namespace {

using namespace zerith;

constexpr int kEvents = 64;
constexpr int kBatch = 50;

Value message(std::uint64_t id) {
  return Value(Dictionary{{kZerithMessageParametersCategory, Value(unsigned{bench::kEventCategory})},
                          {kZerithMessageParametersType, Value(unsigned{bench::kEventType})},
                          {kZerithMessageParametersPayload, bench::eventPayload(id)}});
}

struct AllocationCount {
  std::uint64_t calls = allocations.load();
  std::uint64_t bytes = allocatedBytes.load();
};

void countAllocations(benchmark::State& state, const AllocationCount& before, std::uint64_t events) {
  state.counters["allocs/event"] = static_cast<double>(allocations.load() - before.calls) / static_cast<double>(events);
  state.counters["alloc bytes/event"] =
      static_cast<double>(allocatedBytes.load() - before.bytes) / static_cast<double>(events);
}

void BM_EventFrameDecode(benchmark::State& state) {
  std::vector<Data> frames;
  for (int i = 0; i < kEvents; ++i) {
    frames.push_back(ipc::encodeCall(ipc::wire::kSendMessage, static_cast<std::uint64_t>(i + 1),
                                     ipc::wire::sendMessageArgs(message(static_cast<std::uint64_t>(i)))));
  }
  std::size_t i = 0;
  const AllocationCount before;
  for (auto _ : state) {
    const Data& frame = frames[i++ % frames.size()];
    auto decoded = ipc::decodeMessage(plist::Bytes(frame.data() + ipc::kFrameHeaderBytes,
                                                   frame.size() - ipc::kFrameHeaderBytes));
    if (!decoded) {
      state.SkipWithError("an event frame did not decode");
      break;
    }
    benchmark::DoNotOptimize(decoded);
  }
  countAllocations(state, before, state.iterations());
  state.SetItemsProcessed(state.iterations());
}

// The answer to an event whose backends batched it: no result, no error.
void BM_EventReplyEncode(benchmark::State& state) {
  const Dictionary args{{"result", Value()}, {"error", Value()}};
  std::uint64_t call = 1;
  std::size_t bytes = 0;
  const AllocationCount before;
  for (auto _ : state) {
    const Data frame = ipc::encodeReply(call++, args);
    bytes += frame.size();
    benchmark::DoNotOptimize(frame);
  }
  countAllocations(state, before, state.iterations());
  state.SetItemsProcessed(state.iterations());
  state.counters["frame bytes"] = static_cast<double>(bytes) / static_cast<double>(state.iterations());
}

void BM_ReferenceJsonLineParse(benchmark::State& state) {
  std::vector<std::string> lines;
  for (int i = 0; i < kEvents; ++i) {
    lines.push_back(bench::eventJsonLine(static_cast<std::uint64_t>(i)));
  }
  std::size_t i = 0;
  const AllocationCount before;
  for (auto _ : state) {
    auto parsed = nlohmann::json::parse(lines[i++ % lines.size()]);
    benchmark::DoNotOptimize(parsed);
  }
  countAllocations(state, before, state.iterations());
  state.SetItemsProcessed(state.iterations());
}

// The backend as the pipeline benchmark's storebag makes it: batching, a
// user info dictionary, no filters that match the event.
std::shared_ptr<HTTPSPostBackend> makeBackend() {
  auto b = bench::makeBenchBackend(Value(Dictionary{{"post_url", "https://127.0.0.1:1/"}, {"event_threshold", 49}}));
  b->updateState();
  return b;
}

void BM_RecordsAndEnvelopeOf50(benchmark::State& state) {
  test::TempRoot root;
  auto b = makeBackend();
  std::vector<Value> messages;
  for (int i = 0; i < kBatch; ++i) {
    messages.push_back(message(static_cast<std::uint64_t>(i)));
  }
  timeval now{};
  gettimeofday(&now, nullptr);
  std::size_t bytes = 0;
  const AllocationCount before;
  for (auto _ : state) {
    std::vector<Dictionary> records;
    records.reserve(kBatch);
    for (const Value& m : messages) {
      Dictionary record = b->newEventDictfromPayload(m[kZerithMessageParametersPayload], now, 42, 7, 1);
      b->prepareEventForMessage(record, Value());
      records.push_back(std::move(record));
    }
    const auto body = b->createMessageForPostAndLogging(std::move(records), nullptr);
    bytes += body->size();
    benchmark::DoNotOptimize(body);
  }
  countAllocations(state, before, state.iterations() * kBatch);
  state.SetItemsProcessed(state.iterations() * kBatch);
  state.counters["envelope bytes"] = static_cast<double>(bytes) / static_cast<double>(state.iterations());
}

// The 50 records as the backend batches them.
std::vector<Dictionary> batchOf50(HTTPSPostBackend& b) {
  timeval now{};
  gettimeofday(&now, nullptr);
  std::vector<Dictionary> records;
  for (int i = 0; i < kBatch; ++i) {
    Dictionary record = b.newEventDictfromPayload(message(static_cast<std::uint64_t>(i))[kZerithMessageParametersPayload],
                                                  now, 42, 7, 1);
    b.prepareEventForMessage(record, Value());
    records.push_back(std::move(record));
  }
  return records;
}

// The floor of the envelope: the same 50 records, already nlohmann objects
// with the same keys and values, dumped.
void BM_ReferenceEnvelopeDump(benchmark::State& state) {
  test::TempRoot root;
  auto b = makeBackend();
  std::vector<Dictionary> records = batchOf50(*b);
  const auto envelope = nlohmann::ordered_json::parse(*b->createMessageForPostAndLogging(std::move(records), nullptr));
  const AllocationCount before;
  for (auto _ : state) {
    const std::string body = envelope.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    benchmark::DoNotOptimize(body);
  }
  countAllocations(state, before, state.iterations() * kBatch);
  state.SetItemsProcessed(state.iterations() * kBatch);
}

// The 50 records as the backend batches them, then their envelope alone,
// written by `write` (the backend's writer or the tree it replaced).
template <typename Write>
void envelopeOf50(benchmark::State& state, Write write) {
  test::TempRoot root;
  auto b = makeBackend();
  std::vector<Dictionary> records = batchOf50(*b);
  const std::optional<std::string> clientId("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
  const auto none = [](const std::string&, const Value&) {};
  std::size_t bytes = 0;
  const AllocationCount before;
  for (auto _ : state) {
    const std::string body = write(1.7e9, clientId, records, newRecordID, none);
    bytes += body.size();
    benchmark::DoNotOptimize(body);
  }
  countAllocations(state, before, state.iterations() * kBatch);
  state.SetItemsProcessed(state.iterations() * kBatch);
  state.counters["envelope bytes"] = static_cast<double>(bytes) / static_cast<double>(state.iterations());
}

void BM_EnvelopeWriteOf50(benchmark::State& state) { envelopeOf50(state, envelopeJson); }
void BM_ReferenceTreeEnvelopeOf50(benchmark::State& state) { envelopeOf50(state, test::treeEnvelopeJson); }

}  // namespace

BENCHMARK(BM_EventFrameDecode);
BENCHMARK(BM_EventReplyEncode);
BENCHMARK(BM_ReferenceJsonLineParse);
BENCHMARK(BM_RecordsAndEnvelopeOf50);
BENCHMARK(BM_ReferenceEnvelopeDump);
BENCHMARK(BM_EnvelopeWriteOf50);
BENCHMARK(BM_ReferenceTreeEnvelopeOf50);

BENCHMARK_MAIN();
