// Compression of a request body: compressDataWithZlibOrGzip on a 20 KB JSON
// envelope of event records, beside the plain zlib loop that minigzip runs
// (deflateInit2, deflate through a fixed 16 KB buffer, deflateEnd) on the
// same bytes in the same run.

#include <benchmark/benchmark.h>
#include <zlib.h>

#include <string>

#include "config/Compression.h"
#include "platform/Json.h"
#include "platform/Value.h"

namespace {

using namespace zerith;

// An envelope as the HTTPS backend posts it, grown to about 20 KB.
const Data& envelope() {
  static const Data bytes = [] {
    Array events;
    std::string json;
    for (int i = 0; json.size() < 20 * 1024; ++i) {
      events.push_back(Value(Dictionary{{"_startTS", Value(1700000000 - 40)},
                                        {"_sender", "YJ"},
                                        {"_clientVersion", Value(412)},
                                        {"_sessionID", "q2nS4o7hTjKb3v1u0Vd9Fw==.Xk3pQ9c2Rz6aL1mN8bT0Yg=="},
                                        {"_eventNumber", Value(i)},
                                        {"_method", Value(12 + i % 5)},
                                        {"_status", Value(i % 3)},
                                        {"_clientTS", Value(1699999960.25 + i)},
                                        {"eventTime", Value(1699999960.25 + i)},
                                        {"_productFamily", "kitchen"},
                                        {"_productModel", "Velmar7,1"},
                                        {"_osVersion", "17.2"},
                                        {"_build", "21C52"},
                                        {"_internal", Value(2)},
                                        {"_reportVers", "8.1"},
                                        {"_timezoneOffset", Value(3600)},
                                        {"rssi", Value(-40 - i % 30)},
                                        {"channel", Value(36 + i % 12)}}));
      json = json::serialize(Value(Dictionary{{"postTime", Value(1700000000.5)},
                                              {"clientId", "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"},
                                              {"events", Value(events)}}));
    }
    return Data(json.begin(), json.end());
  }();
  return bytes;
}

void BM_CompressDataWithZlibOrGzip(benchmark::State& state) {
  const bool gzip = state.range(0) != 0;
  const Data& input = envelope();
  std::size_t out = 0;
  for (auto _ : state) {
    auto compressed = compressDataWithZlibOrGzip(gzip, input);
    out = compressed->size();
    benchmark::DoNotOptimize(compressed);
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * input.size()));
  state.counters["in_bytes"] = static_cast<double>(input.size());
  state.counters["out_bytes"] = static_cast<double>(out);
}
BENCHMARK(BM_CompressDataWithZlibOrGzip)->ArgName("gzip")->Arg(1)->Arg(0);

// minigzip's gz_compress loop without the file: one stream, a fixed output
// buffer drained after every deflate call.
void BM_ZlibMinigzipLoop(benchmark::State& state) {
  const int windowBits = state.range(0) != 0 ? 31 : 15;
  const Data& input = envelope();
  std::uint8_t buffer[16384];
  std::size_t out = 0;
  for (auto _ : state) {
    z_stream s{};
    deflateInit2(&s, Z_DEFAULT_COMPRESSION, Z_DEFLATED, windowBits, 8, Z_DEFAULT_STRATEGY);
    s.next_in = const_cast<Bytef*>(input.data());
    s.avail_in = static_cast<uInt>(input.size());
    int rc = Z_OK;
    out = 0;
    while (rc != Z_STREAM_END) {
      s.next_out = buffer;
      s.avail_out = sizeof(buffer);
      rc = deflate(&s, Z_FINISH);
      out += sizeof(buffer) - s.avail_out;
      benchmark::DoNotOptimize(buffer);
    }
    deflateEnd(&s);
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * input.size()));
  state.counters["out_bytes"] = static_cast<double>(out);
}
BENCHMARK(BM_ZlibMinigzipLoop)->ArgName("gzip")->Arg(1)->Arg(0);

}  // namespace
