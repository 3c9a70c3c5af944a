#include "tests/support/HttpsTestServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <condition_variable>
#include <map>
#include <mutex>
#include <stdexcept>
#include <thread>

#include <httplib.h>

namespace zerith::test {

namespace {

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && ::strncasecmp(a.data(), b.data(), a.size()) == 0;
}

}  // namespace

std::optional<std::string> RecordedRequest::header(std::string_view name) const {
  for (const auto& [k, v] : headers) {
    if (equalsIgnoringCase(k, name)) {
      return v;
    }
  }
  return std::nullopt;
}

struct HttpsTestServer::Impl {
  std::unique_ptr<httplib::SSLServer> server;
  std::thread thread;
  int port = 0;

  mutable std::mutex mutex;
  mutable std::condition_variable changed;
  std::map<std::string, RequestHandler> handlers;
  std::vector<RecordedRequest> recorded;
  std::size_t received = 0;
  bool recordRequests = true;
  bool held = false;
  bool stopping = false;

  void handle(const httplib::Request& req, httplib::Response& res) {
    RecordedRequest r;
    r.method = req.method;
    r.path = req.path;
    r.target = req.target.empty() ? req.path : req.target;
    for (const auto& [k, v] : req.headers) {
      // cpp-httplib adds these itself; they were not on the wire.
      if (k == "REMOTE_ADDR" || k == "REMOTE_PORT" || k == "LOCAL_ADDR" || k == "LOCAL_PORT") {
        continue;
      }
      r.headers.emplace_back(k, v);
    }
    r.body = req.body;
    r.remotePort = req.remote_port;

    RequestHandler handler;
    {
      std::lock_guard lock(mutex);
      ++received;
      if (recordRequests) {
        recorded.push_back(r);
      }
      if (auto it = handlers.find(r.path); it != handlers.end()) {
        handler = it->second;
      }
    }
    changed.notify_all();

    Reply reply = handler ? handler(r) : Reply{404, {}, {}};
    {
      std::unique_lock lock(mutex);
      changed.wait(lock, [&] { return !held || stopping; });
      if (reply.delay.count() > 0) {
        changed.wait_for(lock, reply.delay, [&] { return stopping; });
      }
    }

    res.status = reply.status;
    std::string contentType;
    for (const auto& [k, v] : reply.headers) {
      if (equalsIgnoringCase(k, "Content-Type")) {
        contentType = v;
      }
      res.set_header(k, v);
    }
    if (reply.chunkSize == 0) {
      res.body = std::move(reply.body);
      return;
    }
    res.headers.erase("Content-Type");
    auto body = std::make_shared<std::string>(std::move(reply.body));
    const std::size_t chunk = reply.chunkSize;
    const auto pause = reply.chunkPause;
    res.set_chunked_content_provider(contentType, [body, chunk, pause, this](std::size_t offset, httplib::DataSink& sink) {
      if (offset >= body->size()) {
        sink.done();
        return true;
      }
      if (offset > 0 && pause.count() > 0) {
        std::unique_lock lock(mutex);
        if (changed.wait_for(lock, pause, [&] { return stopping; })) {
          return false;
        }
      }
      const std::size_t n = std::min(chunk, body->size() - offset);
      return sink.write(body->data() + offset, n);
    });
    if (contentType.empty()) {
      res.headers.erase("Content-Type");
    }
  }
};

HttpsTestServer::HttpsTestServer(const TestCA& ca) : HttpsTestServer(ca, Options{}) {}

HttpsTestServer::HttpsTestServer(const TestCA& ca, Options options) : impl_(std::make_unique<Impl>()) {
  impl_->server = std::make_unique<httplib::SSLServer>(ca.serverCertificateFile().c_str(), ca.serverKeyFile().c_str());
  if (!impl_->server->is_valid()) {
    throw std::runtime_error("HttpsTestServer: TLS context could not be set up");
  }
  impl_->recordRequests = options.recordRequests;
  auto& server = *impl_->server;
  // A kept-alive connection holds a server thread while it stays open.
  const std::size_t threads = options.keepAlive ? 128 : 16;
  server.new_task_queue = [threads] { return new httplib::ThreadPool(threads); };
  // Headers and body leave in separate writes; without this a kept-alive
  // connection waits for the client's delayed acknowledgement each time.
  server.set_tcp_nodelay(true);
  if (options.keepAlive) {
    server.set_keep_alive_max_count(1000);
    server.set_keep_alive_timeout(1);
  } else {
    server.set_keep_alive_max_count(1);
  }
  Impl* impl = impl_.get();
  const auto handler = [impl](const httplib::Request& req, httplib::Response& res) { impl->handle(req, res); };
  server.Get(".*", handler).Post(".*", handler).Put(".*", handler).Patch(".*", handler).Delete(".*", handler);
  server.Options(".*", handler);
  int listening = -1;
  server.set_socket_options([&listening](int fd) {
    httplib::default_socket_options(fd);
    listening = fd;
  });
  impl_->port = server.bind_to_any_port("127.0.0.1");
  if (impl_->port <= 0) {
    throw std::runtime_error("HttpsTestServer: cannot bind a loopback port");
  }
  // cpp-httplib listens with a backlog of 5: many clients connecting at once
  // would wait a second for a SYN retransmission. Listening again widens it.
  if (listening >= 0) {
    ::listen(listening, 1024);
  }
  // The socket already listens: connections made before the thread runs wait
  // in the backlog.
  impl_->thread = std::thread([impl] { impl->server->listen_after_bind(); });
  // stop() only ends a server that already runs its accept loop.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (!server.is_running()) {
    if (std::chrono::steady_clock::now() > deadline) {
      throw std::runtime_error("HttpsTestServer: the server did not start");
    }
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
}

HttpsTestServer::~HttpsTestServer() { stop(); }

int HttpsTestServer::port() const { return impl_->port; }

std::string HttpsTestServer::url(std::string_view path) const {
  return "https://127.0.0.1:" + std::to_string(impl_->port) + std::string(path);
}

void HttpsTestServer::on(const std::string& path, Reply reply) {
  on(path, [reply = std::move(reply)](const RecordedRequest&) { return reply; });
}

void HttpsTestServer::on(const std::string& path, RequestHandler handler) {
  std::lock_guard lock(impl_->mutex);
  impl_->handlers[path] = std::move(handler);
}

void HttpsTestServer::holdAnswers() {
  std::lock_guard lock(impl_->mutex);
  impl_->held = true;
}

void HttpsTestServer::releaseAnswers() {
  {
    std::lock_guard lock(impl_->mutex);
    impl_->held = false;
  }
  impl_->changed.notify_all();
}

std::vector<RecordedRequest> HttpsTestServer::requests() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->recorded;
}

std::size_t HttpsTestServer::requestCount() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->received;
}

bool HttpsTestServer::waitForRequests(std::size_t count, std::chrono::milliseconds timeout) const {
  std::unique_lock lock(impl_->mutex);
  return impl_->changed.wait_for(lock, timeout, [&] { return impl_->received >= count; });
}

bool HttpsTestServer::waitForRequestTo(const std::string& path, std::chrono::milliseconds timeout) const {
  std::unique_lock lock(impl_->mutex);
  return impl_->changed.wait_for(lock, timeout, [&] {
    return std::any_of(impl_->recorded.begin(), impl_->recorded.end(), [&](const RecordedRequest& r) { return r.path == path; });
  });
}

void HttpsTestServer::stop() {
  {
    std::lock_guard lock(impl_->mutex);
    impl_->stopping = true;
  }
  impl_->changed.notify_all();
  impl_->server->stop();
  if (impl_->thread.joinable()) {
    impl_->thread.join();
  }
}

RefusingPort::RefusingPort() : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(addr);
  if (fd_ < 0 || ::bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 ||
      ::getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    throw std::runtime_error("RefusingPort: cannot bind a loopback port");
  }
  port_ = ntohs(addr.sin_port);
}

RefusingPort::~RefusingPort() { ::close(fd_); }

std::string RefusingPort::url(std::string_view path) const {
  return "https://127.0.0.1:" + std::to_string(port_) + std::string(path);
}

}  // namespace zerith::test
