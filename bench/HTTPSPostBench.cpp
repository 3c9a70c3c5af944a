// HTTPS post backend benchmarks:
// - one event record built (newEventDictfromPayload, prepareEventForMessage)
//   and serialised as a one-record envelope, beside nlohmann-json building
//   the same ordered object with the same keys and values and dumping it;
// - a batch of 50 records flushed: gzip, digest, headers and the POST
//   through a connectivity helper to zerith-collector (a child process) on
//   loopback, waiting for its answer; beside libcurl's easy interface
//   posting the same gzip'd body with the same headers to the same collector
//   on a kept-alive connection. Process CPU time per event is this
//   process's only: the collector runs in its own.

#include <benchmark/benchmark.h>
#include <curl/curl.h>
#include <zlib.h>
#include <sys/time.h>

#include <semaphore>
#include <string>

#include <nlohmann/json.hpp>

#include "backends/HTTPSPostBackend.h"
#include "bench/BenchBackend.h"
#include "config/Compression.h"
#include "config/DeviceInfo.h"
#include "platform/Crypto.h"
#include "platform/Defaults.h"
#include "tests/support/CollectorProcess.h"
#include "tests/support/TempRoot.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/URLSession.h"

namespace {

using namespace zerith;

// An event as clients send them: a dozen keys of numbers and short strings.
Value payload(int n) {
  return Value(Dictionary{{"ClientData", Dictionary{{"bytesSent", 120000 + n},
                                                    {"bytesReceived", 98000 + n},
                                                    {"durationMs", 4150.5},
                                                    {"codec", "opus"},
                                                    {"network", "wifi"},
                                                    {"rttMs", 23},
                                                    {"jitterMs", 1.25},
                                                    {"lossPercent", 0.4},
                                                    {"result", "ok"},
                                                    {"attempt", 1},
                                                    {"region", "eu-west"},
                                                    {"udid", "device-identifier-0001"}}}});
}

std::shared_ptr<HTTPSPostBackend> makeBackend(const std::string& postURL,
                                              std::shared_ptr<ReportingSessionConnectivityInterface> transport) {
  const Value udidFilters(Array{Value(Dictionary{{"key", "udid"}, {"action", "sha256"}})});
  auto b = bench::makeBenchBackend(
      Value(Dictionary{{"post_url", postURL}, {"event_threshold", 1000}, {"filters", udidFilters}}));
  b->setDigestKey(Data{'k', 'e', 'y'});
  b->setReportingSessionConnectivityDelegate(std::move(transport));
  b->updateState();
  // The filter list is read on the checked path only; set it directly.
  b->createFiltersFromArray(udidFilters);
  return b;
}

void BM_RecordBuildAndSerialise(benchmark::State& state) {
  test::TempRoot root;
  auto b = makeBackend("https://127.0.0.1:1/", nullptr);
  const Value message = payload(1);
  timeval now{};
  gettimeofday(&now, nullptr);
  std::size_t bytes = 0;
  for (auto _ : state) {
    Dictionary record = b->newEventDictfromPayload(message["ClientData"], now, 3, 4, 1);
    b->prepareEventForMessage(record, Value());
    std::vector<Dictionary> one;
    one.push_back(std::move(record));
    const auto body = b->createMessageForPostAndLogging(std::move(one), nullptr);
    bytes += body->size();
    benchmark::DoNotOptimize(body);
  }
  state.SetItemsProcessed(state.iterations());
  state.counters["bytes/record"] = static_cast<double>(bytes) / static_cast<double>(state.iterations());
}

// The same ordered object (payload keys, then the backend's 17, user info)
// built with nlohmann-json directly and dumped: JSON building alone, no
// value tree, no filters, no sanitising.
void BM_ReferenceNlohmannRecord(benchmark::State& state) {
  const std::string udidHash = ZerithBackend::convertIntoSHA256("device-identifier-0001");
  timeval now{};
  gettimeofday(&now, nullptr);
  std::size_t bytes = 0;
  for (auto _ : state) {
    nlohmann::ordered_json r;
    r["bytesSent"] = 120001;
    r["bytesReceived"] = 98001;
    r["durationMs"] = 4150.5;
    r["codec"] = "opus";
    r["network"] = "wifi";
    r["rttMs"] = 23;
    r["jitterMs"] = 1.25;
    r["lossPercent"] = 0.4;
    r["result"] = "ok";
    r["attempt"] = 1;
    r["region"] = "eu-west";
    r["udid"] = udidHash;
    r["_startTS"] = 960;
    r["_sender"] = "YJ";
    r["_clientVersion"] = 3;
    r["_sessionID"] = 1234;
    r["_eventNumber"] = 0;
    r["_method"] = 3;
    r["_status"] = 4;
    r["_clientTS"] = 969.75;
    r["eventTime"] = 969.75;
    r["_productFamily"] = "Bench";
    r["_productModel"] = "Board9,1";
    r["_osVersion"] = "12.4";
    r["_build"] = "Z1234";
    r["_internal"] = 2;
    r["_reportVers"] = "8.1";
    r["_timezoneOffset"] = timeZoneOffsetSeconds();
    r["clientName"] = "demo";
    r["serviceName"] = "cli";
    nlohmann::ordered_json envelope;
    envelope["postTime"] = 1.0 * static_cast<double>(now.tv_sec);
    envelope["clientId"] = "E621E1F8-C36C-495A-93FC-0C247A3E6E5F";
    envelope["events"] = nlohmann::ordered_json::array({std::move(r)});
    const std::string body = envelope.dump();
    bytes += body.size();
    benchmark::DoNotOptimize(body);
  }
  state.SetItemsProcessed(state.iterations());
  state.counters["bytes/record"] = static_cast<double>(bytes) / static_cast<double>(state.iterations());
}

struct CollectorSetup {
  CollectorSetup()
      : collector(ZERITH_COLLECTOR_TOOL, {"--generate-cert", (root.path() / "certs").string(), "--out", "/dev/null",
                                          "--digest-key", "key"}) {
    URLSession::setExtraCAFile((root.path() / "certs/ca.pem").string());
  }
  test::TempRoot root;
  test::CollectorProcess collector;
};

constexpr int kBatch = 50;

void BM_BatchOf50PostedToCollector(benchmark::State& state) {
  CollectorSetup setup;
  auto transport = ReportingSessionConnectivityHelper::initWithDelegate({}, 4);
  auto b = makeBackend(setup.collector.url("/post"), transport);
  std::binary_semaphore done(0);
  bool failed = false;
  for (auto _ : state) {
    timeval now{};
    gettimeofday(&now, nullptr);
    for (int i = 0; i < kBatch; ++i) {
      b->sendMessage(payload(i), now, 3, 4, 0);
    }
    b->flushMessagesWithCompletion([&](const Value&, const std::optional<Error>& error) {
      failed = failed || error.has_value();
      done.release();
    });
    done.acquire();
  }
  if (failed) {
    state.SkipWithError("a post failed");
  }
  state.SetItemsProcessed(state.iterations() * kBatch);
  state.counters["batches/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}

// The JSON body of a batch of 50 as the backend writes it before gzip.
std::string fiftyRecordJson(const std::string& postURL) {
  auto b = makeBackend(postURL, nullptr);
  timeval now{};
  gettimeofday(&now, nullptr);
  std::vector<Dictionary> records;
  for (int i = 0; i < kBatch; ++i) {
    Dictionary r = b->newEventDictfromPayload(payload(i)["ClientData"], now, 3, 4, 1);
    b->prepareEventForMessage(r, Value());
    records.push_back(std::move(r));
  }
  return *b->createMessageForPostAndLogging(std::move(records), nullptr);
}

// zlib alone, per event: the body of a batch of 50 gzip'd by zlib's own
// deflate loop at its default level (the level the body format names), the
// share of the compression no backend can do without.
void BM_ReferenceZlibGzipOfTheBody(benchmark::State& state) {
  test::TempRoot root;
  const std::string json = fiftyRecordJson("https://127.0.0.1:1/");
  std::vector<unsigned char> out(compressBound(static_cast<uLong>(json.size())) + 64);
  std::size_t compressed = 0;
  for (auto _ : state) {
    z_stream z{};
    deflateInit2(&z, Z_DEFAULT_COMPRESSION, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY);
    z.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(json.data()));
    z.avail_in = static_cast<uInt>(json.size());
    z.next_out = out.data();
    z.avail_out = static_cast<uInt>(out.size());
    if (deflate(&z, Z_FINISH) != Z_STREAM_END) {
      state.SkipWithError("deflate did not finish");
    }
    compressed = z.total_out;
    deflateEnd(&z);
    benchmark::DoNotOptimize(out.data());
  }
  state.SetItemsProcessed(state.iterations() * kBatch);
  state.counters["json bytes"] = static_cast<double>(json.size());
  state.counters["gzip bytes"] = static_cast<double>(compressed);
}

// libcurl alone: the same gzip'd 50-record body with the same headers to the
// same collector, one easy handle reused (kept-alive TLS), on this thread.
void BM_ReferenceCurlPostOfTheSameBody(benchmark::State& state) {
  CollectorSetup setup;
  const std::string json = fiftyRecordJson(setup.collector.url("/post"));
  const auto gz = gzipDeflate(crypto::bytesOf(json));
  const std::string body(gz->begin(), gz->end());
  const std::string url = setup.collector.url("/post");
  const std::string caFile = (setup.root.path() / "certs/ca.pem").string();
  std::unique_ptr<CURL, decltype(&curl_easy_cleanup)> easy(curl_easy_init(), &curl_easy_cleanup);
  curl_slist* headers = nullptr;
  for (const char* h : {"X-ZTH-Client-Name: demo", "X-ZTH-Service-Name: cli", "User-Agent: Zerith/8.1 (Board9,1; 12.4)",
                        "X-ZTH-Client-Version: 3", "X-ZTH-Sender: YJ", "Accept: application/json",
                        "Content-Type: application/json", "Content-Encoding: gzip", "Expect:"}) {
    headers = curl_slist_append(headers, h);
  }
  const std::string digest = "X-ZTH-DIGEST: <00000000 00000000 00000000 00000000 00000000>";
  headers = curl_slist_append(headers, digest.c_str());
  curl_easy_setopt(easy.get(), CURLOPT_URL, url.c_str());
  curl_easy_setopt(easy.get(), CURLOPT_CAINFO, caFile.c_str());
  curl_easy_setopt(easy.get(), CURLOPT_HTTPHEADER, headers);
  curl_easy_setopt(easy.get(), CURLOPT_POSTFIELDS, body.data());
  curl_easy_setopt(easy.get(), CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
  curl_easy_setopt(easy.get(), CURLOPT_WRITEFUNCTION, +[](char*, size_t size, size_t n, void*) { return size * n; });
  bool failed = false;
  for (auto _ : state) {
    failed = failed || curl_easy_perform(easy.get()) != CURLE_OK;
  }
  curl_slist_free_all(headers);
  if (failed) {
    state.SkipWithError("a post failed");
  }
  state.SetItemsProcessed(state.iterations() * kBatch);
  state.counters["batches/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
  state.counters["gzip bytes"] = static_cast<double>(body.size());
  state.counters["json bytes"] = static_cast<double>(json.size());
}

BENCHMARK(BM_RecordBuildAndSerialise);
BENCHMARK(BM_ReferenceNlohmannRecord);
BENCHMARK(BM_ReferenceZlibGzipOfTheBody);
BENCHMARK(BM_BatchOf50PostedToCollector)->MeasureProcessCPUTime()->UseRealTime();
BENCHMARK(BM_ReferenceCurlPostOfTheSameBody)->MeasureProcessCPUTime()->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
