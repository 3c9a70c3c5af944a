#include "bench/pipeline/Collector.h"

#include "tests/support/HttpsTestServer.h"

namespace zerith::bench {

Collector::Collector() {
  server_ = std::make_unique<test::HttpsTestServer>(test::TestCA::shared(),
                                                    test::HttpsTestServer::Options{.keepAlive = true,
                                                                                   .recordRequests = false});
  auto handler = [this](const test::RecordedRequest& request) {
    const auto encoding = request.header("Content-Encoding");
    count(request.body, encoding && *encoding == "gzip");
    return test::Reply{.status = 200};
  };
  server_->on("/zerithd", handler);
  server_->on("/peer", handler);
}

Collector::~Collector() { server_->stop(); }

std::string Collector::url(std::string_view path) const { return server_->url(path); }

void Collector::expect(std::uint64_t ids) {
  std::lock_guard lock(mutex_);
  seen_.assign(ids, false);
  counts_ = {};
}

Collector::Counts Collector::counts() const {
  std::lock_guard lock(mutex_);
  return counts_;
}

void Collector::count(std::string_view body, bool gzip) {
  {
    std::lock_guard lock(mutex_);
    ++counts_.requests;
    counts_.gzipRequests += gzip ? 1 : 0;
    counts_.inflatedBytes += body.size();
    const bool readable = forEachEventId(body, [&](std::uint64_t id) {
      if (id >= seen_.size()) {
        ++counts_.unexpected;
      } else if (seen_[id]) {
        ++counts_.duplicates;
      } else {
        seen_[id] = true;
        ++counts_.records;
      }
    });
    counts_.malformed += readable ? 0 : 1;
  }
  changed_.notify_all();
}

bool Collector::waitForRecords(std::uint64_t records, std::chrono::milliseconds idle) const {
  std::unique_lock lock(mutex_);
  for (;;) {
    const std::uint64_t before = counts_.records;
    if (before >= records) {
      return true;
    }
    if (!changed_.wait_for(lock, idle, [&] { return counts_.records != before || counts_.records >= records; })) {
      return false;
    }
  }
}

}  // namespace zerith::bench
