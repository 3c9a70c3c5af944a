#include "bench/pipeline/BenchEvent.h"

#include <array>

namespace zerith::bench {

namespace {

// The values vary with the identifier so that neither pipeline compresses
// or caches one repeated record.
constexpr std::array<const char*, 4> kCodecs = {"h264-high-4.1", "hevc-main10-5.1", "av1-main-4.0", "vp9-profile2"};
constexpr std::array<const char*, 3> kNetworks = {"wifi-5ghz", "cellular-5g-sa", "ethernet-1g"};

struct Fields {
  std::uint64_t id;
  const char* codec;
  std::uint64_t durationMs;
  std::uint64_t bitrateKbps;
  std::uint64_t stalls;
  const char* network;
};

Fields fieldsOf(std::uint64_t id) {
  return {id, kCodecs[id % kCodecs.size()], 60000 + (id * 7919) % 3600000, 800 + (id * 104729) % 24000, id % 5,
          kNetworks[id % kNetworks.size()]};
}

constexpr const char* kApp = "com.velmar.bench.mediaplayer";
constexpr const char* kRegion = "eu-central-2";
constexpr const char* kErrorDomain = "com.velmar.media.playback";
constexpr const char* kDetail =
    "segment fetch retried after a stalled read; buffer refilled from the secondary edge cache";

}  // namespace

Value eventPayload(std::uint64_t id) {
  const Fields f = fieldsOf(id);
  return Value(Dictionary{{"zid", Value(static_cast<unsigned long long>(f.id))},
                          {"app", Value(kApp)},
                          {"codec", Value(f.codec)},
                          {"durationMs", Value(static_cast<unsigned long long>(f.durationMs))},
                          {"bitrateKbps", Value(static_cast<unsigned long long>(f.bitrateKbps))},
                          {"stalls", Value(static_cast<unsigned long long>(f.stalls))},
                          {"network", Value(f.network)},
                          {"region", Value(kRegion)},
                          {"errorDomain", Value(kErrorDomain)},
                          {"detail", Value(kDetail)}});
}

std::string eventJsonLine(std::uint64_t id) {
  const Fields f = fieldsOf(id);
  std::string line;
  line.reserve(320);
  line += "{\"zid\":" + std::to_string(f.id);
  line += ",\"app\":\"";
  line += kApp;
  line += "\",\"codec\":\"";
  line += f.codec;
  line += "\",\"durationMs\":" + std::to_string(f.durationMs);
  line += ",\"bitrateKbps\":" + std::to_string(f.bitrateKbps);
  line += ",\"stalls\":" + std::to_string(f.stalls);
  line += ",\"network\":\"";
  line += f.network;
  line += "\",\"region\":\"";
  line += kRegion;
  line += "\",\"errorDomain\":\"";
  line += kErrorDomain;
  line += "\",\"detail\":\"";
  line += kDetail;
  line += "\"}\n";
  return line;
}

}  // namespace zerith::bench
