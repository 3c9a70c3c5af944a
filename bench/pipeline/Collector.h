#pragma once

// The collector of the pipeline benchmark: an HTTPS server on loopback that
// counts the records of every posted JSON envelope by their event
// identifier, so that an event lost or delivered twice shows in the counts.
// Two servers can do the receiving:
// - zerith-collector (tools/zerith-collector), a process of its own: it
//   inflates gzip bodies, parses each envelope and writes one JSON line per
//   record to a pipe; the lines are counted here, on a thread whose CPU
//   time is kept apart, so that this process's CPU is the clients';
// - the test support's HTTPS server (kept-alive connections, no request
//   kept), whose library inflates gzip bodies; the body is scanned here.

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/FileUtil.h"

namespace zerith::test {
class ChildProcess;
class HttpsTestServer;
}  // namespace zerith::test

namespace zerith::bench {

// The key that carries each benchmark event's identifier.
inline constexpr std::string_view kEventIdKey = "zid";

// Calls `onId` for every "zid" value in an envelope ("zid":123 or
// "zid":"123", as the peer's JSON formatter writes every value as a string).
// Returns false when an identifier is not a number.
template <typename OnId>
bool forEachEventId(std::string_view body, OnId&& onId) {
  static constexpr std::string_view needle = "\"zid\":";
  for (std::size_t at = body.find(needle); at != std::string_view::npos; at = body.find(needle, at)) {
    at += needle.size();
    if (at < body.size() && body[at] == '"') {
      ++at;
    }
    std::uint64_t id = 0;
    const std::size_t start = at;
    while (at < body.size() && body[at] >= '0' && body[at] <= '9') {
      id = id * 10 + static_cast<std::uint64_t>(body[at] - '0');
      ++at;
    }
    if (at == start) {
      return false;
    }
    onId(id);
  }
  return true;
}

class Collector {
 public:
  enum class Server { ZerithCollector, TestServer };

  struct Counts {
    std::uint64_t records = 0;      // distinct expected identifiers seen
    std::uint64_t duplicates = 0;   // identifiers seen again
    std::uint64_t unexpected = 0;   // identifiers outside the expected range
    std::uint64_t posts = 0;        // requests (test server) or record lines (zerith-collector)
    std::uint64_t gzipPosts = 0;    // of those, sent gzip-compressed
    std::uint64_t malformed = 0;    // unreadable identifiers, refused requests
    std::uint64_t inflatedBytes = 0;
  };

  explicit Collector(Server server = Server::ZerithCollector);
  ~Collector();
  Collector(const Collector&) = delete;
  Collector& operator=(const Collector&) = delete;

  // "https://127.0.0.1:<port><path>"; every path counts.
  std::string url(std::string_view path) const;

  // Down: every connection is closed as soon as it is accepted (the
  // zerith-collector server only); up again: answered as before.
  void setDown(bool down);

  // Starts a new count: identifiers 0 .. ids-1 are expected, once each.
  void expect(std::uint64_t ids);
  Counts counts() const;

  // Waits until `records` distinct identifiers have arrived; false when no
  // new one arrived for `idle`.
  bool waitForRecords(std::uint64_t records, std::chrono::milliseconds idle) const;

  // zerith-collector's process (nullopt for the test server, which runs in
  // this process), and the CPU time this process spent reading its lines.
  std::optional<pid_t> processId() const;
  double lineReaderCpuSeconds() const;

 private:
  void count(std::string_view body, bool gzip);
  // Marks one event identifier as seen; under mutex_.
  void noteEventId(std::uint64_t id);
  void countLine(std::string_view line);
  void startCollectorProcess();
  void readCollectorLines();

  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<bool> seen_;
  Counts counts_;
  std::unique_ptr<test::HttpsTestServer> testServer_;
  std::unique_ptr<test::ChildProcess> collectorProcess_;
  file::UniqueFd collectorOutput_;
  std::string collectorURL_;
  std::string behaviourFile_;
  std::thread collectorThread_;
  std::atomic<std::uint64_t> readerCpuNanos_{0};
};

}  // namespace zerith::bench
