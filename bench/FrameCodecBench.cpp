// The frame codec beside libplist on the same bytes, in one run:
// - a client's one-way event frame written (what the client framework does
//   per event before the socket write), by the codec and by the libplist
//   path frames took before (a libplist tree, then its writer);
// - that frame's body read to a message (the daemon's decode), beside
//   libplist's own parse of the same bytes (plist_from_bin and plist_free:
//   no bounds, no Value) and the libplist path frames took before (the
//   structural check, libplist, then the walk into a Value);
// - libplist's own writer on a tree it already holds.
// The ratios to record are codec ÷ libplist's own parse and write.

#include <benchmark/benchmark.h>
#include <plist/plist.h>

#include <cstring>
#include <memory>
#include <vector>

#include "bench/pipeline/BenchEvent.h"
#include "ipc/ClientSessionWire.h"
#include "ipc/Frame.h"
#include "platform/BinaryPlist.h"
#include "platform/PropertyList.h"

namespace {

using namespace zerith;

constexpr int kEvents = 64;

struct PlistFree {
  void operator()(plist_t p) const { plist_free(p); }
};

Value message(std::uint64_t id) {
  // The keys the client framework gives an event's message.
  return Value(Dictionary{{"category", Value(unsigned{bench::kEventCategory})},
                          {"type", Value(unsigned{bench::kEventType})},
                          {"payload", bench::eventPayload(id)}});
}

std::vector<Data> eventBodies() {
  std::vector<Data> bodies;
  for (int i = 0; i < kEvents; ++i) {
    const Data frame = ipc::encodeCall(ipc::wire::kSendMessage, std::nullopt,
                                       ipc::wire::sendMessageArgs(message(static_cast<std::uint64_t>(i))));
    bodies.emplace_back(frame.begin() + ipc::kFrameHeaderBytes, frame.end());
  }
  return bodies;
}

void BM_EventEncodeCodec(benchmark::State& state) {
  std::uint64_t i = 0;
  for (auto _ : state) {
    const Value m = message(i++ % kEvents);
    Data frame = ipc::encodeCall(ipc::wire::kSendMessage, std::nullopt, ipc::wire::sendMessageArgs(m));
    benchmark::DoNotOptimize(frame);
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_EventEncodeLibplistPath(benchmark::State& state) {
  std::uint64_t i = 0;
  for (auto _ : state) {
    const Value m = message(i++ % kEvents);
    const Data body = plist::encodeBinary(
        Value(Dictionary{{"op", ipc::wire::kSendMessage}, {"args", ipc::wire::sendMessageArgs(m)}}));
    Data frame(ipc::kFrameHeaderBytes + body.size());
    std::memcpy(frame.data() + ipc::kFrameHeaderBytes, body.data(), body.size());
    benchmark::DoNotOptimize(frame);
  }
  state.SetItemsProcessed(state.iterations());
}

// The event's Value alone, which both encode benchmarks build first.
void BM_EventMessageBuild(benchmark::State& state) {
  std::uint64_t i = 0;
  for (auto _ : state) {
    Value m = message(i++ % kEvents);
    benchmark::DoNotOptimize(m);
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_LibplistOwnWrite(benchmark::State& state) {
  std::vector<std::unique_ptr<void, PlistFree>> trees;
  for (const Data& body : eventBodies()) {
    plist_t root = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(body.data()), static_cast<std::uint32_t>(body.size()), &root);
    trees.emplace_back(root);
  }
  std::size_t i = 0;
  for (auto _ : state) {
    char* out = nullptr;
    std::uint32_t length = 0;
    plist_to_bin(trees[i++ % trees.size()].get(), &out, &length);
    benchmark::DoNotOptimize(out);
    plist_to_bin_free(out);
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_EventDecodeCodec(benchmark::State& state) {
  const auto bodies = eventBodies();
  std::size_t i = 0;
  for (auto _ : state) {
    auto decoded = ipc::decodeMessage(plist::bytesOf(bodies[i++ % bodies.size()]));
    if (!decoded) {
      state.SkipWithError("an event frame did not decode");
      break;
    }
    benchmark::DoNotOptimize(decoded);
  }
  state.SetItemsProcessed(state.iterations());
  state.counters["body bytes"] = static_cast<double>(bodies.front().size());
}

void BM_EventDecodeLibplistPath(benchmark::State& state) {
  const auto bodies = eventBodies();
  const plist::Limits limits = ipc::frameLimits();
  std::size_t i = 0;
  for (auto _ : state) {
    auto decoded = plist::decodeBinary(plist::bytesOf(bodies[i++ % bodies.size()]), limits);
    benchmark::DoNotOptimize(decoded);
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_LibplistOwnParse(benchmark::State& state) {
  const auto bodies = eventBodies();
  std::size_t i = 0;
  for (auto _ : state) {
    const Data& body = bodies[i++ % bodies.size()];
    plist_t root = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(body.data()), static_cast<std::uint32_t>(body.size()), &root);
    benchmark::DoNotOptimize(root);
    plist_free(root);
  }
  state.SetItemsProcessed(state.iterations());
}

}  // namespace

BENCHMARK(BM_EventMessageBuild);
BENCHMARK(BM_EventEncodeCodec);
BENCHMARK(BM_EventEncodeLibplistPath);
BENCHMARK(BM_LibplistOwnWrite);
BENCHMARK(BM_EventDecodeCodec);
BENCHMARK(BM_EventDecodeLibplistPath);
BENCHMARK(BM_LibplistOwnParse);
BENCHMARK_MAIN();
