#pragma once

// The collector's HTTP(S) server: HTTP/1.1 with keep-alive over TLS
// (OpenSSL) or plain TCP, one thread per connection up to a limit. Every
// request becomes one or more JSON lines handed to the line writer:
//
//   POST of a JSON envelope   one "record" line per event record, with the
//                             record's "_sender" and "_sessionID" beside it
//                             (an envelope without events: one "envelope"
//                             line)
//   any other POST            one "upload" (or "logdata") line with the
//                             path, query, sizes and SHA-256; the body, gzip
//                             undone, is stored in the store folder
//   GET                       one "get" line; files of the serve folder are
//                             answered (with Last-Modified/304)
//   refused request           one "refused" line with the reason
//   a record seen before      with duplicate dropping on: one "duplicate"
//                             line with its "_recordID" instead of "record"
//
// The behaviour can change while it runs (tests of a collector that fails
// and recovers): setBehaviour(), or a behaviour file read before every
// connection and request. Its text is one of
//
//   answer          answer as the options say (also: no file, empty file)
//   status N        answer every POST with status N (records are not taken)
//   stall MS        take the request, hold it MS milliseconds, then close the
//                   connection without an answer ("stalled" line)
//   close           close every connection as soon as it is accepted
//
// Every line carries the method, path, query, the headers in wire order,
// the status answered and, when a digest key is set, whether
// "X-ZTH-DIGEST" matched the HMAC-SHA-1 of the body ("valid", "invalid",
// "missing").
//
// Untrusted input is bounded before it is parsed: the header block (64 KiB,
// 100 lines), the body (Content-Length only, up to the body limit), the
// inflated size and the JSON nesting depth (CollectorBody.h), idle time.

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "tools/zerith-collector/CollectorBody.h"

namespace zerith::collector {

struct CollectorOptions {
  std::string listenAddress = "127.0.0.1";
  int port = 0;  // 0: any free port
  bool plain = false;  // plain HTTP instead of TLS
  std::filesystem::path certificateFile;  // PEM, leaf first (chain may follow)
  std::filesystem::path keyFile;          // PEM
  int status = 200;                       // the status every POST is answered with
  std::optional<std::string> digestKey;
  std::filesystem::path storeFolder;      // empty: uploads are not stored
  std::string answerText = "success";     // body of the answer to uploads
  std::string logDataPath = "/logdata";   // POSTs here are answered with the stored file's path
  std::filesystem::path serveFolder;      // empty: GET answers 404
  BodyLimits limits;
  std::size_t maxConnections = 64;
  int idleTimeoutSeconds = 10;
  std::filesystem::path behaviourFile;    // empty: setBehaviour() only
  // Records whose "_recordID" was taken before (2xx) are not taken again:
  // they are written as "duplicate" lines and counted.
  bool dropDuplicates = false;
};

struct Behaviour {
  enum class Kind { answer, status, stall, close };
  Kind kind = Kind::answer;
  int value = 0;  // the status, or the stall in ms
  // nullopt for text that is none of the behaviours.
  static std::optional<Behaviour> parse(std::string_view text);
};

class CollectorServer {
 public:
  // Writes one line, or the lines of one envelope joined by newlines, at
  // once (without a newline at the end).
  using LineWriter = std::function<void(const std::string& lines)>;

  CollectorServer(CollectorOptions options, LineWriter writer);
  ~CollectorServer();
  CollectorServer(const CollectorServer&) = delete;
  CollectorServer& operator=(const CollectorServer&) = delete;

  // Loads the certificate, binds and listens. False with the reason.
  bool start(std::string* error);
  int port() const { return port_; }
  // "https://127.0.0.1:<port>"
  std::string baseURL() const;

  // Accepts connections until stop().
  void run();
  // Ends run(), closes every connection and waits for their threads.
  void stop();

  // Takes effect from the next connection or request (a behaviour file,
  // when set, wins).
  void setBehaviour(Behaviour behaviour);
  // Records dropped as duplicates, and records taken (distinct IDs).
  std::uint64_t duplicates() const { return duplicates_; }
  std::uint64_t distinctRecords() const;

  struct Connection;

 private:
  void serveConnection(int fd);
  void handle(Connection& connection);

  CollectorOptions options_;
  LineWriter writer_;
  void* sslContext_ = nullptr;  // SSL_CTX*
  int listenFd_ = -1;
  int wakeFds_[2] = {-1, -1};
  int port_ = 0;
  std::atomic<bool> stopping_{false};
  std::atomic<std::uint64_t> stored_{0};
  std::atomic<std::uint64_t> duplicates_{0};

  Behaviour behaviour();
  mutable std::mutex behaviourMutex_;
  Behaviour behaviour_;
  std::set<std::string> seenRecordIDs_;  // behaviourMutex_

  std::mutex mutex_;
  std::condition_variable idle_;
  std::set<int> connections_;
  std::size_t threads_ = 0;
};

// A CA and a server certificate for localhost, 127.0.0.1 and ::1 issued by
// it, written as ca.pem, cert.pem and key.pem into `folder` (kept when they
// already exist). False with the reason.
bool generateCertificates(const std::filesystem::path& folder, std::string* error);

}  // namespace zerith::collector
