// The frame codec's encoder beside libplist's own writer on the same
// messages, in the same run: the fetchDisplayURL: reply (the smallest frame
// on the round trip) and a sendMessageWithDictionary: call carrying a
// ten-key event. The reference builds the same tree with libplist's C API
// and serialises it with plist_to_bin, as the codec did before it wrote the
// binary format itself; the decode of each frame is measured too, for the
// share of the codec in one round trip.

#include <benchmark/benchmark.h>

#include <plist/plist.h>

#include <cstdlib>

#include "ipc/Frame.h"
#include "platform/PropertyList.h"

namespace {

using namespace zerith;

Value replyMessage() {
  return Value(Dictionary{{"reply", Value(1ll)}, {"args", Value(Dictionary{{"url", Value("URL not available")}})}});
}

Value eventCall() {
  const Value payload(Dictionary{{"zid", Value(123456u)},
                                 {"app", Value("com.velmar.bench.mediaplayer")},
                                 {"codec", Value("hevc-main10-5.1")},
                                 {"durationMs", Value(184467u)},
                                 {"bitrateKbps", Value(4500u)},
                                 {"stalls", Value(3u)},
                                 {"network", Value("wifi-5ghz")},
                                 {"region", Value("eu-central-2")},
                                 {"errorDomain", Value("com.velmar.media.playback")},
                                 {"detail", Value("segment fetch retried after a stalled read; buffer refilled from "
                                                  "the secondary edge cache")}});
  const Value message(Dictionary{{"category", Value(42u)}, {"type", Value(7u)}, {"payload", payload}});
  return Value(Dictionary{{"op", Value("sendMessageWithDictionary:reply:")},
                          {"call", Value(7ll)},
                          {"args", Value(Dictionary{{"message", message}})}});
}

// The same tree through libplist's API (integers as uint nodes, as the codec
// built them).
plist_t toLibplist(const Value& v) {
  switch (v.type()) {
    case Value::Type::Int:
    case Value::Type::UInt: return plist_new_uint(v.unsignedValue());
    case Value::Type::String: return plist_new_string(v.string()->c_str());
    case Value::Type::Dict: {
      plist_t d = plist_new_dict();
      for (const auto& [k, e] : *v.dict()) {
        plist_dict_set_item(d, k.c_str(), toLibplist(e));
      }
      return d;
    }
    default: return plist_new_bool(0);
  }
}

void encodeWithLibplist(benchmark::State& state, const Value& message) {
  for (auto _ : state) {
    plist_t root = toLibplist(message);
    char* out = nullptr;
    std::uint32_t len = 0;
    plist_to_bin(root, &out, &len);
    benchmark::DoNotOptimize(out);
    plist_to_bin_free(out);
    plist_free(root);
  }
}

void encodeWithCodec(benchmark::State& state, const Value& message) {
  for (auto _ : state) {
    Data frame = ipc::encodeFrame(message);
    benchmark::DoNotOptimize(frame.data());
  }
  state.counters["frame_bytes"] = static_cast<double>(ipc::encodeFrame(message).size());
}

void decodeWithCodec(benchmark::State& state, const Value& message) {
  const Data frame = ipc::encodeFrame(message);
  const plist::Bytes body(frame.data() + ipc::kFrameHeaderBytes, frame.size() - ipc::kFrameHeaderBytes);
  for (auto _ : state) {
    auto decoded = ipc::decodeMessage(body);
    benchmark::DoNotOptimize(decoded);
  }
}

void BM_EncodeReply_Libplist(benchmark::State& s) { encodeWithLibplist(s, replyMessage()); }
void BM_EncodeReply_Codec(benchmark::State& s) { encodeWithCodec(s, replyMessage()); }
void BM_DecodeReply_Codec(benchmark::State& s) { decodeWithCodec(s, replyMessage()); }
void BM_EncodeEvent_Libplist(benchmark::State& s) { encodeWithLibplist(s, eventCall()); }
void BM_EncodeEvent_Codec(benchmark::State& s) { encodeWithCodec(s, eventCall()); }
void BM_DecodeEvent_Codec(benchmark::State& s) { decodeWithCodec(s, eventCall()); }
BENCHMARK(BM_EncodeReply_Libplist);
BENCHMARK(BM_EncodeReply_Codec);
BENCHMARK(BM_DecodeReply_Codec);
BENCHMARK(BM_EncodeEvent_Libplist);
BENCHMARK(BM_EncodeEvent_Codec);
BENCHMARK(BM_DecodeEvent_Codec);

}  // namespace

BENCHMARK_MAIN();
