// The shared HTTPS test server and CA, driven by a bare libcurl client: the
// other transport tests (and other subsystems' tests) rely on it recording
// and answering exactly.

#include <curl/curl.h>
#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <thread>

#include "tests/support/HttpsTestServer.h"
#include "tests/support/TestCA.h"

namespace zerith::test {
namespace {

struct Fetched {
  CURLcode code = CURLE_OK;
  long status = 0;
  std::string body;
  std::string headers;
};

Fetched fetch(const std::string& url, const std::string& caFile, const std::string& postBody = {},
              const std::string& header = {}) {
  struct CurlFree {
    void operator()(CURL* c) const { curl_easy_cleanup(c); }
  };
  struct SlistFree {
    void operator()(curl_slist* l) const { curl_slist_free_all(l); }
  };
  std::unique_ptr<CURL, CurlFree> curl(curl_easy_init());
  std::unique_ptr<curl_slist, SlistFree> list;
  Fetched out;
  const auto append = +[](char* p, size_t s, size_t n, void* ud) -> size_t {
    static_cast<std::string*>(ud)->append(p, s * n);
    return s * n;
  };
  curl_easy_setopt(curl.get(), CURLOPT_URL, url.c_str());
  curl_easy_setopt(curl.get(), CURLOPT_CAINFO, caFile.c_str());
  curl_easy_setopt(curl.get(), CURLOPT_TIMEOUT_MS, 10000L);
  curl_easy_setopt(curl.get(), CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(curl.get(), CURLOPT_WRITEFUNCTION, append);
  curl_easy_setopt(curl.get(), CURLOPT_WRITEDATA, &out.body);
  curl_easy_setopt(curl.get(), CURLOPT_HEADERFUNCTION, append);
  curl_easy_setopt(curl.get(), CURLOPT_HEADERDATA, &out.headers);
  if (!postBody.empty()) {
    curl_easy_setopt(curl.get(), CURLOPT_POSTFIELDSIZE, static_cast<long>(postBody.size()));
    curl_easy_setopt(curl.get(), CURLOPT_POSTFIELDS, postBody.data());
  }
  if (!header.empty()) {
    list.reset(curl_slist_append(nullptr, header.c_str()));
    curl_easy_setopt(curl.get(), CURLOPT_HTTPHEADER, list.get());
  }
  out.code = curl_easy_perform(curl.get());
  curl_easy_getinfo(curl.get(), CURLINFO_RESPONSE_CODE, &out.status);
  return out;
}

TEST(HttpsTestServer, AnswersExactlyAndRecordsTheRequestTrustedOnlyThroughItsCA) {
  HttpsTestServer server;
  server.on("/bag", Reply{201, {{"Cache-Control", "max-age=600"}, {"X-Twice", "a"}, {"X-Twice", "b"}}, "payload"});

  const auto ok = fetch(server.url("/bag?version=8.1"), TestCA::shared().caFile().string(), std::string("\0body\x01", 6),
                        "If-Modified-Since: yesterday");
  ASSERT_EQ(ok.code, CURLE_OK);
  EXPECT_EQ(ok.status, 201);
  EXPECT_EQ(ok.body, "payload");
  EXPECT_NE(ok.headers.find("Cache-Control: max-age=600\r\n"), std::string::npos);
  EXPECT_NE(ok.headers.find("X-Twice: a\r\n"), std::string::npos);
  EXPECT_NE(ok.headers.find("X-Twice: b\r\n"), std::string::npos);

  ASSERT_EQ(server.requestCount(), 1u);
  const auto r = server.requests()[0];
  EXPECT_EQ(r.method, "POST");
  EXPECT_EQ(r.path, "/bag");
  EXPECT_EQ(r.target, "/bag?version=8.1");
  EXPECT_EQ(r.body, std::string("\0body\x01", 6));
  EXPECT_EQ(r.header("if-modified-since"), "yesterday");
  EXPECT_EQ(r.headerCount("REMOTE_ADDR"), 0u);
  EXPECT_GT(r.remotePort, 0);

  // A server whose certificate comes from another CA is not trusted.
  TestCA stranger("stranger CA");
  HttpsTestServer untrusted(stranger);
  EXPECT_EQ(fetch(untrusted.url("/"), TestCA::shared().caFile().string()).code, CURLE_PEER_FAILED_VERIFICATION);
  EXPECT_EQ(untrusted.requestCount(), 0u);
}

TEST(HttpsTestServer, UnknownPathsAnswer404AndEmptyRepliesCarryNoBody) {
  HttpsTestServer server;
  server.on("/empty", Reply{});
  const auto missing = fetch(server.url("/nothing"), TestCA::shared().caFile().string());
  EXPECT_EQ(missing.status, 404);
  EXPECT_EQ(missing.body, "");
  const auto empty = fetch(server.url("/empty"), TestCA::shared().caFile().string());
  EXPECT_EQ(empty.status, 200);
  EXPECT_EQ(empty.body, "");
  EXPECT_NE(empty.headers.find("Content-Length: 0\r\n"), std::string::npos);
}

TEST(HttpsTestServer, ChunkedRepliesArriveWholeAndHeldAnswersWaitForRelease) {
  HttpsTestServer server;
  std::string big(300000, '\0');
  for (std::size_t i = 0; i < big.size(); ++i) {
    big[i] = static_cast<char>(i * 7 + i / 251);
  }
  server.on("/big", Reply{.status = 200, .headers = {{"Content-Type", "application/octet-stream"}}, .body = big, .chunkSize = 4096});
  const auto whole = fetch(server.url("/big"), TestCA::shared().caFile().string());
  EXPECT_EQ(whole.body, big);
  EXPECT_NE(whole.headers.find("Transfer-Encoding: chunked\r\n"), std::string::npos);
  EXPECT_NE(whole.headers.find("Content-Type: application/octet-stream\r\n"), std::string::npos);

  server.holdAnswers();
  Fetched held;
  std::thread client([&] { held = fetch(server.url("/big"), TestCA::shared().caFile().string()); });
  ASSERT_TRUE(server.waitForRequests(2));
  EXPECT_EQ(held.status, 0);  // still waiting: the answer is held
  server.releaseAnswers();
  client.join();
  EXPECT_EQ(held.body, big);
}

TEST(HttpsTestServer, RefusingPortRefusesAndStopEndsHeldAnswers) {
  RefusingPort refusing;
  EXPECT_EQ(fetch(refusing.url("/"), TestCA::shared().caFile().string()).code, CURLE_COULDNT_CONNECT);
  EXPECT_GT(unusedLoopbackPort(), 0);

  auto server = std::make_unique<HttpsTestServer>();
  server->holdAnswers();
  Fetched held;
  std::thread client([&] { held = fetch(server->url("/"), TestCA::shared().caFile().string()); });
  ASSERT_TRUE(server->waitForRequests(1));
  server->stop();  // must not wait for the held answer
  client.join();
  server.reset();
}

}  // namespace
}  // namespace zerith::test
