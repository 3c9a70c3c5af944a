#include "bench/pipeline/Collector.h"

#include <fcntl.h>
#include <poll.h>
#include <time.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <stdexcept>

#include "tests/support/Command.h"
#include "tests/support/HttpsTestServer.h"

namespace zerith::bench {

Collector::Collector(Server server) {
  if (server == Server::ZerithCollector) {
    startCollectorProcess();
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

// zerith-collector as a process of its own, so that the CPU of this process
// is the clients' alone; its lines come through a pipe and are counted on a
// thread whose own CPU time is kept apart.
void Collector::startCollectorProcess() {
  char behaviourTemplate[] = "/tmp/zerith-pipeline-behaviour-XXXXXX";
  const int behaviourFd = ::mkstemp(behaviourTemplate);
  if (behaviourFd < 0) {
    throw std::runtime_error("no behaviour file for zerith-collector");
  }
  ::close(behaviourFd);
  behaviourFile_ = behaviourTemplate;
  int out[2];
  int err[2];
  if (::pipe2(out, O_CLOEXEC) != 0 || ::pipe2(err, O_CLOEXEC) != 0) {
    throw std::runtime_error("no pipes for zerith-collector");
  }
  collectorOutput_.reset(out[0]);
  const file::UniqueFd errRead(err[0]);
  {
    const file::UniqueFd outWrite(out[1]);
    const file::UniqueFd errWrite(err[1]);
    // zerithd posts each batch as soon as it is full, without a limit on
    // posts in flight: when the collector falls behind, connections pile
    // up. The collector's default limit of 64 would refuse them (and a
    // refused post loses its batch); the benchmark measures the pipelines,
    // not that.
    collectorProcess_ = std::make_unique<test::ChildProcess>(
        std::vector<std::string>{ZERITH_COLLECTOR_TOOL, "--cert", test::TestCA::shared().serverCertificateFile().string(),
                                 "--key", test::TestCA::shared().serverKeyFile().string(), "--max-connections",
                                 "2048", "--behaviour-file", behaviourFile_, "--parent-pid",
                                 std::to_string(::getpid())},
        std::vector<std::pair<int, int>>{{out[1], 1}, {err[1], 2}});
  }
  // Ready once it says where it listens: "... listening on https://127.0.0.1:<port>".
  std::string said;
  while (said.find("listening on ") == std::string::npos || said.back() != '\n') {
    pollfd p{errRead.get(), POLLIN, 0};
    char buffer[4096];
    const ssize_t n = ::poll(&p, 1, 10000) == 1 ? ::read(errRead.get(), buffer, sizeof(buffer)) : 0;
    if (n <= 0) {
      throw std::runtime_error("zerith-collector did not start: " + said);
    }
    said.append(buffer, static_cast<std::size_t>(n));
  }
  const auto at = said.find("listening on ");
  collectorURL_ = said.substr(at + 13, said.find('\n', at) - at - 13);
  collectorThread_ = std::thread([this] { readCollectorLines(); });
}

void Collector::readCollectorLines() {
  std::string pending;
  char buffer[65536];
  for (;;) {
    const ssize_t n = ::read(collectorOutput_.get(), buffer, sizeof(buffer));
    if (n <= 0) {
      break;
    }
    pending.append(buffer, static_cast<std::size_t>(n));
    std::size_t start = 0;
    for (std::size_t end = pending.find('\n'); end != std::string::npos; end = pending.find('\n', start)) {
      countLine(std::string_view(pending).substr(start, end - start));
      start = end + 1;
    }
    pending.erase(0, start);
    timespec now{};
    ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
    readerCpuNanos_.store(static_cast<std::uint64_t>(now.tv_sec) * 1'000'000'000u + static_cast<std::uint64_t>(now.tv_nsec));
  }
}

double Collector::lineReaderCpuSeconds() const { return static_cast<double>(readerCpuNanos_.load()) / 1e9; }

std::optional<pid_t> Collector::processId() const {
  return collectorProcess_ ? std::optional<pid_t>(collectorProcess_->pid()) : std::nullopt;
}

Collector::~Collector() {
  if (collectorProcess_) {
    collectorProcess_->stop(std::chrono::seconds(5));
    collectorThread_.join();  // its output ends with it
    std::filesystem::remove(behaviourFile_);
  } else {
    testServer_->stop();
  }
}

void Collector::setDown(bool down) {
  if (collectorProcess_) {
    // Read before every connection and request.
    const std::string temporary = behaviourFile_ + ".new";
    std::ofstream(temporary) << (down ? "close\n" : "answer\n");
    std::filesystem::rename(temporary, behaviourFile_);
  }
}

std::string Collector::url(std::string_view path) const {
  return collectorProcess_ ? collectorURL_ + std::string(path) : testServer_->url(path);
}

// One line of zerith-collector per record (or per refused request).
void Collector::countLine(std::string_view line) {
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
