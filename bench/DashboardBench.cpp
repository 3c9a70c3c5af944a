// Dashboard and upload backends beside what their libraries do alone:
// - BM_DashboardDatagrams: events through one dashboard backend (datagram
//   built on the caller's thread, handed to the network queue, sent there)
//   to a UDP server on loopback; the run ends when the queue has sent all.
// - BM_ReferenceBareSend: the same datagram bytes with send() in a loop on a
//   connected UDP socket to the same server.
// - BM_UploadFile10MB: a 10 MB log file through UploadBackend (opened with
//   the upload checks, read, gzip'd, posted through a POST-mode connectivity
//   helper) to the in-process HTTPS server, which answers "ok" so the file
//   stays for the next round.
// - BM_ReferenceGzipCurlPost10MB: the same file read, gzip'd by zlib's own
//   deflate loop (same level and window) and posted by libcurl's easy
//   interface to the same server with the same headers.

#include <fcntl.h>

#include <future>
#include <arpa/inet.h>
#include <benchmark/benchmark.h>
#include <curl/curl.h>
#include <sys/socket.h>
#include <unistd.h>
#include <zlib.h>

#include <fstream>
#include <random>

#include "backends/DashboardBackend.h"
#include "backends/DashboardDatagram.h"
#include "backends/UploadBackend.h"
#include "platform/SandboxExtension.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/TempRoot.h"
#include "tests/support/TestCA.h"
#include "tests/support/UdpTestServer.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/URLSession.h"

namespace {

using namespace zerith;

constexpr char kUdid[] = "0123456789abcdef0123456789abcdef01234567";

// A typical event: a handful of short fields.
Value event() {
  return Value(Dictionary{{"callID", Value("4F2A9C11")},
                          {"duration", Value(1234)},
                          {"codec", Value("opus")},
                          {"packetLoss", Value(0.25)},
                          {"network", Value("wifi")}});
}

// The share of datagrams the server received (loopback drops what its
// receive buffer cannot hold), after the last one had time to arrive.
void recordDelivery(benchmark::State& state, const test::UdpTestServer& server) {
  const auto sent = static_cast<std::size_t>(state.iterations());
  server.waitForArrivals(sent, std::chrono::seconds(2));
  state.counters["delivered"] = static_cast<double>(server.arrivals().size()) / static_cast<double>(sent);
}

void BM_DashboardDatagrams(benchmark::State& state) {
  test::UdpTestServer server;
  auto backend = DashboardBackend::initWithName(
      "dashboard", Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(server.port())}}), std::nullopt);
  backend->setUdid(kUdid);
  const Value e = event();
  const timeval now{1700000000, 123456};
  std::uint16_t number = 0;
  for (auto _ : state) {
    backend->sendMessage(e, now, std::uint16_t{1}, std::uint16_t{2}, ++number);
  }
  backend->messageQueueSnapshot();  // waits until the queue has sent every datagram
  state.SetItemsProcessed(state.iterations());
  recordDelivery(state, server);
  backend->cleanup();
}

void BM_ReferenceBareSend(benchmark::State& state) {
  test::UdpTestServer server;
  dashboard::Header h;
  h.udid = kUdid;
  const auto bytes = dashboard::encode(
      h, dashboard::buildText({{"network", "wifi"}, {"codec", "opus"}, {"packetLoss", "0.25"}, {"duration", "1234"},
                               {"callID", "4F2A9C11"}}));
  const int fd = ::socket(AF_INET, SOCK_DGRAM, 0);
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  to.sin_port = htons(server.port());
  ::connect(fd, reinterpret_cast<sockaddr*>(&to), sizeof to);
  bool failed = false;
  for (auto _ : state) {
    failed = failed || ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(bytes.size());
  }
  ::close(fd);
  if (failed) {
    state.SkipWithError("a send failed");
  }
  state.SetItemsProcessed(state.iterations());
  recordDelivery(state, server);
}

// 10 MB of log-like text: compresses about as real logs do.
std::string logText() {
  std::mt19937 random(7);
  std::string text;
  text.reserve(10 << 20);
  const char* words[] = {"connection", "established", "packet", "lost", "retry", "codec", "opus", "frame", "late"};
  while (text.size() < (10u << 20)) {
    text += "2026-11-23T09:00:" + std::to_string(random() % 60) + " [" + std::to_string(random() % 1000) + "] ";
    for (int i = 0; i < 8; ++i) {
      text += words[random() % 9];
      text += ' ';
    }
    text += std::to_string(random()) + "\n";
  }
  text.resize(10u << 20);
  return text;
}

struct UploadSetup {
  UploadSetup() : server(test::TestCA::shared(), test::HttpsTestServer::Options{true}) {
    URLSession::setExtraCAFile(test::TestCA::shared().caFile().string());
    server.on("/upload", test::Reply{.body = "ok"});
    file = root.path() / "upload.log";
    std::ofstream(file, std::ios::binary) << logText();
  }
  test::TempRoot root;
  test::HttpsTestServer server;
  std::filesystem::path file;
};

void BM_UploadFile10MB(benchmark::State& state) {
  UploadSetup setup;
  auto transport =
      ReportingSessionConnectivityHelper::initWithDelegate({}, ReportingSessionConnectivityHelper::POSTRequestMode());
  auto backend = UploadBackend::initWithName("uploadServer", Value(Dictionary{{"post_url", Value(setup.server.url("/upload"))}}),
                                             std::nullopt);
  backend->setUdid(kUdid);
  backend->setReportingSessionConnectivityDelegate(transport);
  bool failed = false;
  for (auto _ : state) {
    // Read through a descriptor, as the daemon reads a client's file.
    UploadRequest request;
    request.name = setup.file.filename().string();
    request.deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    request.file = sandbox::GrantedFile::adopt(
        std::make_shared<const file::UniqueFd>(::open(setup.file.c_str(), O_RDONLY | O_CLOEXEC)), request.name);
    std::promise<bool> taken;
    backend->uploadFileAtPath(request, [&](bool t, bool) { taken.set_value(t); });
    failed = failed || !taken.get_future().get();
  }
  if (failed || setup.server.requestCount() != static_cast<std::size_t>(state.iterations())) {
    state.SkipWithError("an upload failed");
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * (10 << 20));
}

std::string gzipByZlib(const std::string& input) {
  z_stream s{};
  deflateInit2(&s, Z_DEFAULT_COMPRESSION, Z_DEFLATED, 31, 8, Z_DEFAULT_STRATEGY);
  s.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(input.data()));
  s.avail_in = static_cast<uInt>(input.size());
  std::string out;
  char chunk[1 << 16];
  int rc = Z_OK;
  while (rc == Z_OK) {
    s.next_out = reinterpret_cast<Bytef*>(chunk);
    s.avail_out = sizeof chunk;
    rc = deflate(&s, Z_FINISH);
    out.append(chunk, sizeof chunk - s.avail_out);
  }
  deflateEnd(&s);
  return out;
}

void BM_ReferenceGzipCurlPost10MB(benchmark::State& state) {
  UploadSetup setup;
  const std::string url = setup.server.url("/upload") + "?uuid=" + kUdid +
                          "&sequence=0&description=Vidra%20AFRC%20log%20(Uploaded%20by%20QPX)"
                          "&filename=upload.log.gz&raw=true";
  const std::string caFile = test::TestCA::shared().caFile().string();
  std::unique_ptr<CURL, decltype(&curl_easy_cleanup)> easy(curl_easy_init(), &curl_easy_cleanup);
  curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/octet-stream");
  headers = curl_slist_append(headers, "Content-Encoding: gzip");
  curl_easy_setopt(easy.get(), CURLOPT_URL, url.c_str());
  curl_easy_setopt(easy.get(), CURLOPT_CAINFO, caFile.c_str());
  curl_easy_setopt(easy.get(), CURLOPT_HTTPHEADER, headers);
  curl_easy_setopt(easy.get(), CURLOPT_WRITEFUNCTION, +[](char*, size_t size, size_t n, void*) { return size * n; });
  bool failed = false;
  for (auto _ : state) {
    std::ifstream in(setup.file, std::ios::binary);
    const std::string contents((std::istreambuf_iterator<char>(in)), {});
    const std::string body = gzipByZlib(contents);
    curl_easy_setopt(easy.get(), CURLOPT_POSTFIELDS, body.data());
    curl_easy_setopt(easy.get(), CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
    failed = failed || curl_easy_perform(easy.get()) != CURLE_OK;
  }
  curl_slist_free_all(headers);
  if (failed) {
    state.SkipWithError("a request failed");
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * (10 << 20));
}

BENCHMARK(BM_DashboardDatagrams)->Iterations(200000)->Repetitions(3)->UseRealTime();
BENCHMARK(BM_ReferenceBareSend)->Iterations(200000)->Repetitions(3)->UseRealTime();
BENCHMARK(BM_UploadFile10MB)->Iterations(3)->Repetitions(3)->UseRealTime()->Unit(benchmark::kMillisecond);
BENCHMARK(BM_ReferenceGzipCurlPost10MB)->Iterations(3)->Repetitions(3)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
