#pragma once

// An in-process HTTPS server on 127.0.0.1, port 0, with a certificate from a
// TestCA (the shared one unless told otherwise). Each path gets a fixed reply
// or a handler; every request is recorded with its method, target, headers
// and body before it is answered. Replies can be delayed, held until the test
// releases them, or sent chunked in pieces.
//
//   test::HttpsTestServer server;
//   server.on("/bag", {.status = 200, .headers = {{"Cache-Control", "max-age=600"}}, .body = "..."});
//   ... request server.url("/bag") ...
//   ASSERT_TRUE(server.waitForRequests(1));
//   EXPECT_EQ(server.requests()[0].header("If-Modified-Since"), "...");
//
// By default the server closes each connection after one answer, so that
// stopping it never waits for idle keep-alive connections. Paths without a handler answer
// 404 with an empty body. The server adds "Content-Length" (or chunked
// framing) itself: replies should not carry those headers.

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "tests/support/TestCA.h"

namespace zerith::test {

struct RecordedRequest {
  std::string method;
  std::string path;    // without the query
  std::string target;  // as on the request line, query included
  // Sorted by name, as the server library keeps them (the order on the wire
  // is not kept); duplicates stay.
  std::vector<std::pair<std::string, std::string>> headers;
  std::string body;
  int remotePort = 0;  // the client's port

  // First value of the header (case-insensitive name), nullopt when absent.
  std::optional<std::string> header(std::string_view name) const;
};

// Every member has a default, so designated initializers may name any subset
// ({.status = 204}, {.body = "x", .chunkSize = 100}).
struct Reply {
  int status = 200;
  std::vector<std::pair<std::string, std::string>> headers{};
  std::string body{};
  // Waits this long before answering.
  std::chrono::milliseconds delay{0};
  // > 0: the body goes out with chunked transfer encoding in pieces of this
  // size, `chunkPause` apart.
  std::size_t chunkSize = 0;
  std::chrono::milliseconds chunkPause{0};
};

using RequestHandler = std::function<Reply(const RecordedRequest&)>;

class HttpsTestServer {
 public:
  struct Options {
    // Keep connections open for further requests (benchmarks); stopping then
    // waits up to a second for idle connections.
    bool keepAlive = false;
    // Keep every request for requests(); benchmarks that count millions of
    // requests in their handlers turn this off (requestCount() still counts).
    bool recordRequests = true;
  };

  explicit HttpsTestServer(const TestCA& ca = TestCA::shared());
  HttpsTestServer(const TestCA& ca, Options options);
  ~HttpsTestServer();
  HttpsTestServer(const HttpsTestServer&) = delete;
  HttpsTestServer& operator=(const HttpsTestServer&) = delete;

  int port() const;
  // "https://127.0.0.1:<port><path>"
  std::string url(std::string_view path = "/") const;

  // Answers for a path (exact match, any method). Later calls replace.
  void on(const std::string& path, Reply reply);
  void on(const std::string& path, RequestHandler handler);

  // While held, every answer waits (after its request was recorded) until
  // releaseAnswers() or the server stops.
  void holdAnswers();
  void releaseAnswers();

  std::vector<RecordedRequest> requests() const;
  std::size_t requestCount() const;
  // Waits until at least `count` requests have arrived; false on time-out.
  bool waitForRequests(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  // Waits until a request for `path` has arrived; false on time-out.
  bool waitForRequestTo(const std::string& path, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  // Stops listening and ends held answers; also done by the destructor.
  void stop();

  struct Impl;

 private:
  std::unique_ptr<Impl> impl_;
};

// A loopback TCP port that refuses connections for as long as this object
// lives: the socket is bound (so nobody else gets the port) but never
// listens, so a connection attempt is answered with a reset.
class RefusingPort {
 public:
  RefusingPort();
  ~RefusingPort();
  RefusingPort(const RefusingPort&) = delete;
  RefusingPort& operator=(const RefusingPort&) = delete;

  int port() const { return port_; }
  // "https://127.0.0.1:<port><path>"
  std::string url(std::string_view path = "/") const;

 private:
  int fd_ = -1;
  int port_ = 0;
};

}  // namespace zerith::test
