#pragma once

// A TLS server on 127.0.0.1, port 0, that keeps the exact bytes of each
// request as they came off the wire (header lines in their order, the body
// as sent), which the recording HTTPS test server cannot: its library sorts
// the headers. It answers every request with 200 and closes the
// connection. It also counts the connections it served, with a request or
// without (a failed handshake, or a client that closed after it), so a test
// can wait for a refused connection and then see that it sent no request.
//
// Any certificate and key can be given, so tests can present a certificate
// for the wrong host name.

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "tests/support/TestCA.h"

namespace zerith::test {

class WireCaptureServer {
 public:
  struct Request {
    std::vector<std::pair<std::string, std::string>> headers;  // in wire order
    std::string requestLine;
    std::string body;
  };

  explicit WireCaptureServer(const IssuedCertificate& certificate = TestCA::shared().serverCertificate()) {
    ctx_ = SSL_CTX_new(TLS_server_method());
    BIO* certBio = BIO_new_mem_buf(certificate.certificatePem.data(), static_cast<int>(certificate.certificatePem.size()));
    X509* cert = PEM_read_bio_X509(certBio, nullptr, nullptr, nullptr);
    BIO_free(certBio);
    BIO* keyBio = BIO_new_mem_buf(certificate.privateKeyPem.data(), static_cast<int>(certificate.privateKeyPem.size()));
    EVP_PKEY* key = PEM_read_bio_PrivateKey(keyBio, nullptr, nullptr, nullptr);
    BIO_free(keyBio);
    if (!cert || !key || SSL_CTX_use_certificate(ctx_, cert) != 1 || SSL_CTX_use_PrivateKey(ctx_, key) != 1) {
      throw std::runtime_error("WireCaptureServer: bad certificate or key");
    }
    X509_free(cert);
    EVP_PKEY_free(key);

    fd_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    if (::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0 || ::listen(fd_, 64) != 0 ||
        ::getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &length) != 0) {
      throw std::runtime_error("WireCaptureServer: cannot listen");
    }
    port_ = ntohs(address.sin_port);
    thread_ = std::thread([this] { run(); });
  }

  ~WireCaptureServer() {
    stop_ = true;
    thread_.join();
    ::close(fd_);
    SSL_CTX_free(ctx_);
  }
  WireCaptureServer(const WireCaptureServer&) = delete;
  WireCaptureServer& operator=(const WireCaptureServer&) = delete;

  std::string url(const std::string& path = "/") const { return "https://127.0.0.1:" + std::to_string(port_) + path; }

  std::vector<Request> requests() const {
    std::lock_guard lock(mutex_);
    return requests_;
  }
  // Waits until `count` connections have been served.
  bool waitForConnections(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return connections_ >= count; });
  }

 private:
  void run() {
    while (!stop_) {
      pollfd p{fd_, POLLIN, 0};
      if (::poll(&p, 1, 50) <= 0) {
        continue;
      }
      const int client = ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
      if (client >= 0) {
        serve(client);
        ::close(client);
      }
    }
  }

  void serve(int client) {
    timeval tv{5, 0};
    ::setsockopt(client, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
    SSL* ssl = SSL_new(ctx_);
    SSL_set_fd(ssl, client);
    if (SSL_accept(ssl) != 1) {
      // The client may refuse the certificate only once it has it; it may
      // also have sent application bytes, which a failed handshake never
      // decrypts: count them as none.
      {
        std::lock_guard lock(mutex_);
        ++connections_;
      }
      changed_.notify_all();
      SSL_free(ssl);
      ERR_clear_error();
      return;
    }
    std::string raw;
    char buffer[16384];
    std::size_t headerEnd = std::string::npos;
    std::size_t contentLength = 0;
    while (true) {
      const int n = SSL_read(ssl, buffer, sizeof(buffer));
      if (n <= 0) {
        break;
      }
      raw.append(buffer, static_cast<std::size_t>(n));
      if (headerEnd == std::string::npos) {
        headerEnd = raw.find("\r\n\r\n");
        if (headerEnd != std::string::npos) {
          const std::string head = raw.substr(0, headerEnd);
          if (const char* at = ::strcasestr(head.c_str(), "\r\ncontent-length:")) {
            contentLength = std::stoul(std::string(at + 17));
          }
        }
      }
      if (headerEnd != std::string::npos && raw.size() >= headerEnd + 4 + contentLength) {
        break;
      }
    }
    Request request;
    if (headerEnd != std::string::npos) {
      std::istringstream head(raw.substr(0, headerEnd + 2));
      std::getline(head, request.requestLine);
      request.requestLine.pop_back();  // the '\r'
      for (std::string line; std::getline(head, line);) {
        const auto colon = line.find(':');
        if (colon != std::string::npos) {
          const auto value = std::min(line.find_first_not_of(' ', colon + 1), line.size() - 1);
          request.headers.emplace_back(line.substr(0, colon), line.substr(value, line.size() - 1 - value));
        }
      }
      request.body = raw.substr(headerEnd + 4);
    }
    const std::string answer = "HTTP/1.1 200 OK\r\nContent-Length: 0\r\nConnection: close\r\n\r\n";
    SSL_write(ssl, answer.data(), static_cast<int>(answer.size()));
    SSL_shutdown(ssl);
    SSL_free(ssl);
    {
      std::lock_guard lock(mutex_);
      ++connections_;
      if (!raw.empty()) {
        requests_.push_back(std::move(request));
      }
    }
    changed_.notify_all();
  }

  SSL_CTX* ctx_ = nullptr;
  int fd_ = -1;
  int port_ = 0;
  std::atomic<bool> stop_{false};
  std::thread thread_;
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<Request> requests_;
  std::size_t connections_ = 0;
};

}  // namespace zerith::test
