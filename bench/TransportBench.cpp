// Transport benchmarks, each through a ReportingSessionConnectivityHelper and
// the one transport thread, against the in-process HTTPS server:
// - a 1 KB POST round trip in mode 4, on a fresh TLS connection each time
//   and on a kept-alive one;
// - the same in mode 1 (body written to a file, unlinked, uploaded from the
//   descriptor);
// - 64 POSTs in flight at once (requests/s);
// - one 16 MB GET answer (bytes/s).

#include <benchmark/benchmark.h>
#include <curl/curl.h>

#include <atomic>
#include <cstdio>
#include <latch>
#include <memory>
#include <semaphore>
#include <string>

#include "tests/support/HttpsTestServer.h"
#include "tests/support/TempRoot.h"
#include "tests/support/TestCA.h"
#include "transport/ReportingSessionConnectivityHelper.h"

namespace {

using namespace zerith;

struct Setup {
  explicit Setup(bool keepAlive) : server(test::TestCA::shared(), test::HttpsTestServer::Options{keepAlive}) {
    URLSession::setExtraCAFile(test::TestCA::shared().caFile().string());
    server.on("/post", test::Reply{.body = "ok"});
    server.on("/large", test::Reply{.body = std::string(16 << 20, 'x')});
  }
  test::TempRoot root;
  test::HttpsTestServer server;
};

URLRequest postRequest(const std::string& url, std::size_t bodySize) {
  URLRequest r;
  r.httpMethod = "POST";
  r.url = url;
  r.body.assign(bodySize, 'b');
  r.setValue("application/json", "Content-Type");
  return r;
}

void roundTrips(benchmark::State& state, std::uint32_t mode) {
  Setup setup(state.range(0) != 0);
  auto helper = ReportingSessionConnectivityHelper::initWithDelegate({}, mode);
  const URLRequest request = postRequest(setup.server.url("/post"), 1024);
  std::binary_semaphore done(0);
  bool failed = false;
  for (auto _ : state) {
    helper->postURLRequestWithCompletionHandler(request, [&](const Data&, const auto&, const std::optional<Error>& error) {
      failed = failed || error.has_value();
      done.release();
    });
    done.acquire();
  }
  if (failed) {
    state.SkipWithError("a request failed");
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_DataPostRoundTrip(benchmark::State& state) { roundTrips(state, 4); }
void BM_UploadPostRoundTrip(benchmark::State& state) { roundTrips(state, ReportingSessionConnectivityHelper::POSTRequestMode()); }

// The reference in the same run: libcurl's easy interface on the calling
// thread, the same 1 KB POST to the same server, one handle reused (so the
// connection is kept alive when the server keeps it) — no transport thread,
// no queues, no task records. BM_DataPostRoundTrip divided by this is what
// the helper's hand-offs and bookkeeping cost.
void BM_ReferenceCurlEasyPost(benchmark::State& state) {
  Setup setup(state.range(0) != 0);
  const std::string url = setup.server.url("/post");
  const std::string body(1024, 'b');
  const std::string caFile = test::TestCA::shared().caFile().string();
  std::unique_ptr<CURL, decltype(&curl_easy_cleanup)> easy(curl_easy_init(), &curl_easy_cleanup);
  curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
  curl_easy_setopt(easy.get(), CURLOPT_URL, url.c_str());
  curl_easy_setopt(easy.get(), CURLOPT_CAINFO, caFile.c_str());
  curl_easy_setopt(easy.get(), CURLOPT_HTTPHEADER, headers);
  curl_easy_setopt(easy.get(), CURLOPT_POSTFIELDS, body.data());
  curl_easy_setopt(easy.get(), CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
  curl_easy_setopt(easy.get(), CURLOPT_WRITEFUNCTION, +[](char*, size_t size, size_t n, void*) { return size * n; });
  if (state.range(0) == 0) {
    curl_easy_setopt(easy.get(), CURLOPT_FORBID_REUSE, 1L);
  }
  bool failed = false;
  for (auto _ : state) {
    failed = failed || curl_easy_perform(easy.get()) != CURLE_OK;
  }
  curl_slist_free_all(headers);
  if (failed) {
    state.SkipWithError("a request failed");
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_PostsInFlight(benchmark::State& state) {
  Setup setup(true);
  auto helper = ReportingSessionConnectivityHelper::initWithDelegate({}, 4);
  const URLRequest request = postRequest(setup.server.url("/post"), 1024);
  const auto inFlight = static_cast<std::ptrdiff_t>(state.range(0));
  std::atomic<bool> failed = false;
  for (auto _ : state) {
    std::latch done(inFlight);
    for (std::ptrdiff_t i = 0; i < inFlight; ++i) {
      helper->postURLRequestWithCompletionHandler(request, [&](const Data&, const auto&, const std::optional<Error>& error) {
        if (error) {
          failed = true;
          std::fprintf(stderr, "%s\n", error->description.c_str());
        }
        done.count_down();
      });
    }
    done.wait();
  }
  if (failed) {
    state.SkipWithError("a request failed");
  }
  state.SetItemsProcessed(state.iterations() * inFlight);
}

void BM_LargeGet(benchmark::State& state) {
  Setup setup(true);
  auto helper = ReportingSessionConnectivityHelper::initWithDelegate({}, 8);
  URLRequest request;
  request.url = setup.server.url("/large");
  std::binary_semaphore done(0);
  std::size_t received = 0;
  for (auto _ : state) {
    helper->getURLRequestWithCompletionHandler(request, [&](const Data& data, const auto&, const auto&) {
      received = data.size();
      done.release();
    });
    done.acquire();
  }
  if (received != (16u << 20)) {
    state.SkipWithError("short answer");
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * (16 << 20));
}

BENCHMARK(BM_DataPostRoundTrip)->ArgName("keepAlive")->Arg(0)->Arg(1)->UseRealTime();
BENCHMARK(BM_ReferenceCurlEasyPost)->ArgName("keepAlive")->Arg(0)->Arg(1)->UseRealTime();
BENCHMARK(BM_UploadPostRoundTrip)->ArgName("keepAlive")->Arg(0)->Arg(1)->UseRealTime();
BENCHMARK(BM_PostsInFlight)->Arg(64)->UseRealTime();
BENCHMARK(BM_LargeGet)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
