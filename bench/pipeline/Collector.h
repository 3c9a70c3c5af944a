#pragma once

// The collector of the pipeline benchmark: an HTTPS server on loopback
// (tests/support/HttpsTestServer, kept-alive connections, no request kept)
// that counts the records of every posted JSON envelope by their event
// identifier, so that an event lost or delivered twice shows in the counts.
// Bodies sent with "Content-Encoding: gzip" arrive inflated (the server
// library inflates them); they are counted as compressed requests.

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace zerith::test {
class HttpsTestServer;
}

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
  struct Counts {
    std::uint64_t records = 0;      // distinct expected identifiers seen
    std::uint64_t duplicates = 0;   // identifiers seen again
    std::uint64_t unexpected = 0;   // identifiers outside the expected range
    std::uint64_t requests = 0;
    std::uint64_t gzipRequests = 0;
    std::uint64_t malformed = 0;    // bodies with an unreadable identifier
    std::uint64_t inflatedBytes = 0;
  };

  Collector();
  ~Collector();
  Collector(const Collector&) = delete;
  Collector& operator=(const Collector&) = delete;

  // "https://127.0.0.1:<port><path>"; every path counts.
  std::string url(std::string_view path) const;

  // Starts a new count: identifiers 0 .. ids-1 are expected, once each.
  void expect(std::uint64_t ids);
  Counts counts() const;

  // Waits until `records` distinct identifiers have arrived; false when no
  // new one arrived for `idle`.
  bool waitForRecords(std::uint64_t records, std::chrono::milliseconds idle) const;

 private:
  void count(std::string_view body, bool gzip);

  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<bool> seen_;
  Counts counts_;
  std::unique_ptr<test::HttpsTestServer> server_;
};

}  // namespace zerith::bench
