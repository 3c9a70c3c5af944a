#include "bench/pipeline/Collector.h"

#include <stdexcept>

#include "tests/support/HttpsTestServer.h"
#include "tools/zerith-collector/CollectorServer.h"

namespace zerith::bench {

Collector::Collector(Server server) {
  if (server == Server::ZerithCollector) {
    collector::CollectorOptions options;
    options.certificateFile = test::TestCA::shared().serverCertificateFile();
    options.keyFile = test::TestCA::shared().serverKeyFile();
    // zerithd posts each batch as soon as it is full, without a limit on
    // posts in flight: when the collector falls behind, connections pile up.
    // The collector's default limit of 64 would refuse them (and a refused
    // post loses its batch); the benchmark measures the pipelines, not that.
    options.maxConnections = 2048;
    collectorServer_ = std::make_unique<collector::CollectorServer>(
        options, [this](const std::string& line) { countLine(line); });
    std::string why;
    if (!collectorServer_->start(&why)) {
      throw std::runtime_error("zerith-collector did not start: " + why);
    }
    collectorThread_ = std::thread([this] { collectorServer_->run(); });
    return;
  }
  testServer_ = std::make_unique<test::HttpsTestServer>(test::TestCA::shared(),
                                                        test::HttpsTestServer::Options{.keepAlive = true,
                                                                                       .recordRequests = false});
  auto handler = [this](const test::RecordedRequest& request) {
    const auto encoding = request.header("Content-Encoding");
    count(request.body, encoding && *encoding == "gzip");
    return test::Reply{.status = 200};
  };
  testServer_->on("/zerithd", handler);
  testServer_->on("/peer", handler);
}

Collector::~Collector() {
  if (collectorServer_) {
    collectorServer_->stop();
    collectorThread_.join();
  } else {
    testServer_->stop();
  }
}

void Collector::setDown(bool down) {
  if (collectorServer_) {
    collector::Behaviour behaviour;
    behaviour.kind = down ? collector::Behaviour::Kind::close : collector::Behaviour::Kind::answer;
    collectorServer_->setBehaviour(behaviour);
  }
}

std::string Collector::url(std::string_view path) const {
  return collectorServer_ ? collectorServer_->baseURL() + std::string(path) : testServer_->url(path);
}

// One line of zerith-collector per record (or per refused request).
void Collector::countLine(const std::string& line) {
  {
    std::lock_guard lock(mutex_);
    ++counts_.posts;
    counts_.gzipPosts += line.find("\"gzip\":true") != std::string::npos ? 1 : 0;
    counts_.inflatedBytes += line.size();
    bool any = false;
    const bool readable = forEachEventId(line, [&](std::uint64_t id) {
      any = true;
      noteEventId(id);
    });
    // Lines without an identifier are the sessions' own records (start and
    // end messages) or envelopes without events; a refused request counts.
    counts_.malformed += (!readable || (!any && line.find("\"kind\":\"refused\"") != std::string::npos)) ? 1 : 0;
  }
  changed_.notify_all();
}

void Collector::noteEventId(std::uint64_t id) {
  if (id >= seen_.size()) {
    ++counts_.unexpected;
  } else if (seen_[id]) {
    ++counts_.duplicates;
  } else {
    seen_[id] = true;
    ++counts_.records;
  }
}

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
    ++counts_.posts;
    counts_.gzipPosts += gzip ? 1 : 0;
    counts_.inflatedBytes += body.size();
    const bool readable = forEachEventId(body, [&](std::uint64_t id) { noteEventId(id); });
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
