// The event's road end to end, beside a peer log pipeline in the same run:
// N clients send the same events (ten keys, about 300 bytes of JSON) to
// zerithd through the client framework and to syslog-ng through its stream
// socket; both batch them by 50 and post them over HTTPS to one collector on
// loopback that counts every record by its identifier. Reported per
// pipeline: events per second accepted and delivered, CPU microseconds per
// event (user + system of the pipeline's process, from /proc) and beside it
// the clients' (this process) and the collector's (a process of its own),
// peak and private RSS, and whether every event arrived exactly once; with
// --idle-seconds, the CPU time and wake-ups of the idle process holding ten
// open sessions, per minute.
//
// With --spool-outage, a further zerithd run with the spool on: the
// collector is down (every connection closed at accept) while the load is
// sent, so every batch goes to the spool; reported: events spooled per
// second, the spool's disk bytes per event, the daemon's CPU per spooled
// event, and the time to drain the backlog once the collector is up again
// (first retry after at most the one-second back-off ceiling included),
// beside the normal run's delivered rate.
//
//   e2e_pipeline_bench --clients 8 --events 200000
//   e2e_pipeline_bench --clients 8 --events 30000 --rate 1000
//   e2e_pipeline_bench --clients 8 --events 200000 --replies none   (one-way events)
//   e2e_pipeline_bench --events 1000000 --memory-sample 10000
//   e2e_pipeline_bench --smoke --events 3000        (exit 1 unless lossless)
//   e2e_pipeline_bench --pipelines zerithd --events 1000000 --spool-outage --memory-sample 0
//
// Not a timed test: --smoke only checks the counts.

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <optional>
#include <sstream>
#include <thread>

#include "bench/pipeline/Collector.h"
#include "bench/pipeline/LoadGenerator.h"
#include "bench/pipeline/PeerPipeline.h"
#include "bench/pipeline/ProcStats.h"
#include "bench/pipeline/ZerithdPipeline.h"
#include "backends/Spool.h"
#include "tests/support/TestCA.h"

namespace zerith::bench {
namespace {

using Clock = std::chrono::steady_clock;

struct Settings {
  std::vector<std::string> pipelines{"peer", "zerithd"};
  LoadOptions load;
  std::uint64_t events = 10000;
  std::uint64_t memorySample = 10000;
  double idleSeconds = 0;
  int idleSessions = 10;
  std::chrono::milliseconds stall{30000};
  bool smoke = false;
  bool spoolOutage = false;
  double writeAhead = -1;  // >= 0: the zerithd run has the spool on, with this commit interval
  std::string collector = "zerith-collector";
};

struct Report {
  std::string pipeline{};
  std::string error{};
  LoadResult load{};
  double deliverSeconds = 0;
  Collector::Counts counts{};
  std::uint64_t expected = 0;
  std::optional<ProcSample> before{}, after{}, atSample{};
  std::optional<ProcSample> idleBefore{}, idleAfter{};
  double idleSeconds = 0;
  // The clients' process (this one, less the thread that counts the
  // collector's lines) and the collector's, over the same load.
  double clientCpuSeconds = 0;
  double collectorCpuSeconds = 0;

  bool lossless() const {
    return error.empty() && counts.records == expected && counts.duplicates == 0 && counts.unexpected == 0 &&
           counts.malformed == 0;
  }
  double cpuMicrosPerEvent() const {
    return before && after && counts.records ? (after->cpuSeconds - before->cpuSeconds) * 1e6 / counts.records : 0;
  }
  double clientMicrosPerEvent() const { return counts.records ? clientCpuSeconds * 1e6 / counts.records : 0; }
  double collectorMicrosPerEvent() const { return counts.records ? collectorCpuSeconds * 1e6 / counts.records : 0; }
  double deliveredPerSecond() const { return deliverSeconds > 0 ? counts.records / deliverSeconds : 0; }
  double acceptedPerSecond() const { return load.seconds > 0 ? load.accepted / load.seconds : 0; }
  // Voluntary context switches of the process per delivered event: each is
  // a thread that went to sleep and had to be woken. Summed over the threads
  // alive at each sample; a thread that ended in between takes its count
  // with it (then "-").
  std::string wakeupsPerEvent() const {
    if (!before || !after || !counts.records || after->voluntarySwitches < before->voluntarySwitches) {
      return "-";
    }
    char text[32];
    std::snprintf(text, sizeof(text), "%.2f",
                  static_cast<double>(after->voluntarySwitches - before->voluntarySwitches) /
                      static_cast<double>(counts.records));
    return text;
  }
};

// Measures one pipeline whose process is `pid`; `openIdle` opens the idle
// sessions and returns what keeps them open, `run` sends the load.
template <typename OpenIdle, typename Run>
void measure(Report& r, const Settings& s, Collector& collector, pid_t pid, OpenIdle&& openIdle, Run&& run) {
  if (s.idleSeconds > 0) {
    auto holder = openIdle();
    // Let the sessions' start-up work settle before the window opens.
    std::this_thread::sleep_for(std::chrono::seconds(2));
    r.idleBefore = sampleProcess(pid);
    const auto t0 = Clock::now();
    std::this_thread::sleep_for(std::chrono::duration<double>(s.idleSeconds));
    r.idleAfter = sampleProcess(pid);
    r.idleSeconds = std::chrono::duration<double>(Clock::now() - t0).count();
  }
  r.expected = s.events;
  collector.expect(s.events);
  r.before = sampleProcess(pid);
  const auto clientsBefore = sampleProcess(::getpid());
  const double readerBefore = collector.lineReaderCpuSeconds();
  const auto collectorBefore = collector.processId() ? sampleProcess(*collector.processId()) : std::nullopt;
  std::thread sampler;
  if (s.memorySample > 0 && s.memorySample < s.events) {
    sampler = std::thread([&] {
      if (collector.waitForRecords(s.memorySample, s.stall)) {
        r.atSample = sampleProcess(pid);
      }
    });
  }
  const auto t0 = Clock::now();
  r.load = run();
  if (!r.load.error.empty()) {
    r.error = r.load.error;
  }
  if (!collector.waitForRecords(s.events, s.stall) && r.error.empty()) {
    r.error = "delivery stalled";
  }
  r.deliverSeconds = std::chrono::duration<double>(Clock::now() - t0).count();
  r.after = sampleProcess(pid);
  const auto clientsAfter = sampleProcess(::getpid());
  const auto collectorAfter = collector.processId() ? sampleProcess(*collector.processId()) : std::nullopt;
  if (clientsBefore && clientsAfter) {
    r.clientCpuSeconds = clientsAfter->cpuSeconds - clientsBefore->cpuSeconds -
                         (collector.lineReaderCpuSeconds() - readerBefore);
  }
  if (collectorBefore && collectorAfter) {
    r.collectorCpuSeconds = collectorAfter->cpuSeconds - collectorBefore->cpuSeconds;
  }
  if (sampler.joinable()) {
    sampler.join();
  }
  r.counts = collector.counts();
}

Report runPeer(const Settings& s, Collector& collector, const std::filesystem::path& folder) {
  Report r{.pipeline = "peer", .expected = s.events};
  PeerPipeline peer({.folder = folder / "peer",
                     .postURL = collector.url("/peer"),
                     .caFile = test::TestCA::shared().caFile()});
  if (!peer.ready()) {
    r.error = "the peer did not start: " + peer.output();
    return r;
  }
  measure(
      r, s, collector, peer.pid(),
      [&] {
        struct Holder {
          std::vector<int> fds;
          ~Holder() {
            for (int fd : fds) {
              ::close(fd);
            }
          }
        };
        return std::make_unique<Holder>(Holder{openPeerConnections(peer.socketPath(), s.idleSessions)});
      },
      [&] { return runPeerLoad(s.load, peer.socketPath()); });
  if (!r.error.empty()) {
    r.error += "\n" + peer.output();
  }
  return r;
}

Report runZerithd(const Settings& s, Collector& collector) {
  Report r{.pipeline = "zerithd", .expected = s.events};
  Dictionary defaults;
  if (s.writeAhead >= 0) {
    // Every batch written ahead to the spool (and removed once taken).
    defaults = Dictionary{{"spoolEnabled", Value(true)},
                          {"spoolMaxBytes", Value(16ull << 30)},
                          {"spoolCommitIntervalSeconds", Value(s.writeAhead)}};
  }
  ZerithdPipeline daemon({.postURL = collector.url("/zerithd"), .defaults = std::move(defaults)});
  if (!daemon.ready()) {
    r.error = daemon.error();
    return r;
  }
  auto open = [&](int count, std::uint32_t firstID) {
    std::vector<std::unique_ptr<Zerith>> sessions;
    for (int i = 0; i < count; ++i) {
      std::string why;
      auto session = daemon.openSession(firstID + static_cast<std::uint32_t>(i), &why);
      if (!session) {
        r.error = why;
        break;
      }
      sessions.push_back(std::move(session));
    }
    return sessions;
  };
  std::vector<std::unique_ptr<Zerith>> sessions = open(s.load.clients, 1);
  if (!r.error.empty()) {
    return r;
  }
  measure(
      r, s, collector, daemon.pid(), [&] { return open(s.idleSessions, 1000); },
      [&] { return runZerithdLoad(s.load, sessions); });
  if (!r.lossless()) {
    // The daemon's errors say where events went (a failed post drops its batch).
    const std::string log = daemon.output();
    r.error += "\n" + log.substr(log.size() > 4000 ? log.size() - 4000 : 0);
  }
  return r;
}

// The zerithd run with the collector down and then up again.
struct OutageReport {
  std::string error{};
  std::uint64_t expected = 0;
  LoadResult load{};
  double spoolSeconds = 0;  // from the first event sent to the last record on disk
  std::uint64_t spooledRecords = 0;
  std::uint64_t spoolFiles = 0;
  std::uint64_t spoolBytes = 0;
  double drainSeconds = 0;  // from the collector's return to the last event delivered
  Collector::Counts counts{};
  std::optional<ProcSample> before{}, spooled{}, drained{};

  bool lossless() const {
    return error.empty() && counts.records == expected && counts.duplicates == 0 && counts.unexpected == 0;
  }
  double spooledPerSecond() const { return spoolSeconds > 0 ? expected / spoolSeconds : 0; }
  double drainedPerSecond() const { return drainSeconds > 0 ? counts.records / drainSeconds : 0; }
  double bytesPerEvent() const { return expected ? static_cast<double>(spoolBytes) / expected : 0; }
  double cpuMicrosPerSpooledEvent() const {
    return before && spooled && expected ? (spooled->cpuSeconds - before->cpuSeconds) * 1e6 / expected : 0;
  }
  double cpuMicrosPerDrainedEvent() const {
    return spooled && drained && counts.records ? (drained->cpuSeconds - spooled->cpuSeconds) * 1e6 / counts.records : 0;
  }
};

// The records, files and bytes in a spool folder, each file's header read
// once (the daemon never rewrites a file in place).
class SpoolScan {
 public:
  explicit SpoolScan(std::filesystem::path folder) : folder_(std::move(folder)) {}
  void update() {
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(folder_, ec)) {
      const std::string name = entry.path().filename().string();
      if (entry.path().extension() != ".zspool" || seen_.count(name)) {
        continue;
      }
      std::ifstream in(entry.path(), std::ios::binary);
      std::uint8_t head[kSpoolHeaderSize];
      if (!in.read(reinterpret_cast<char*>(head), sizeof head)) {
        continue;
      }
      if (const auto header = decodeSpoolHeader(std::span<const std::uint8_t>(head, sizeof head), nullptr)) {
        seen_[name] = header->recordCount;
        records_ += header->recordCount;
        bytes_ += kSpoolHeaderSize + header->bodyLength;
      }
    }
  }
  std::uint64_t records() const { return records_; }
  std::uint64_t bytes() const { return bytes_; }
  std::uint64_t files() const { return seen_.size(); }

 private:
  std::filesystem::path folder_;
  std::map<std::string, std::uint32_t> seen_;
  std::uint64_t records_ = 0;
  std::uint64_t bytes_ = 0;
};

OutageReport runZerithdOutage(const Settings& s, Collector& collector) {
  OutageReport r{.expected = s.events};
  // A spool large enough for the backlog; a back-off ceiling of one second
  // so that the drain starts soon after the collector's return.
  ZerithdPipeline daemon({.postURL = collector.url("/spool"),
                          .defaults = Dictionary{{"spoolEnabled", Value(true)},
                                                 {"spoolMaxBytes", Value(16ull << 30)},
                                                 {"spoolRetryInitialSeconds", Value(0.5)},
                                                 {"spoolRetryMaxSeconds", Value(1.0)}}});
  if (!daemon.ready()) {
    r.error = daemon.error();
    return r;
  }
  std::vector<std::unique_ptr<Zerith>> sessions;
  for (int i = 0; i < s.load.clients; ++i) {
    std::string why;
    auto session = daemon.openSession(static_cast<std::uint32_t>(i) + 1, &why);
    if (!session) {
      r.error = why;
      return r;
    }
    sessions.push_back(std::move(session));
  }
  collector.setDown(true);
  collector.expect(s.events);
  r.before = sampleProcess(daemon.pid());
  const auto t0 = Clock::now();
  r.load = runZerithdLoad(s.load, sessions);
  if (!r.load.error.empty()) {
    r.error = r.load.error;
    collector.setDown(false);
    return r;
  }
  // Every event on disk: the sessions' own start records come on top.
  SpoolScan scan(daemon.spoolFolder());
  auto lastChange = Clock::now();
  std::uint64_t lastRecords = 0;
  while (true) {
    scan.update();
    if (scan.records() >= s.events) {
      break;
    }
    if (scan.records() != lastRecords) {
      lastRecords = scan.records();
      lastChange = Clock::now();
    } else if (Clock::now() - lastChange > s.stall) {
      r.error = "spooling stalled at " + std::to_string(scan.records()) + " records";
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  r.spoolSeconds = std::chrono::duration<double>(Clock::now() - t0).count();
  r.spooled = sampleProcess(daemon.pid());
  r.spooledRecords = scan.records();
  r.spoolFiles = scan.files();
  r.spoolBytes = scan.bytes();

  const auto t1 = Clock::now();
  collector.setDown(false);
  if (!collector.waitForRecords(s.events, s.stall) && r.error.empty()) {
    r.error = "drain stalled";
  }
  r.drainSeconds = std::chrono::duration<double>(Clock::now() - t1).count();
  r.drained = sampleProcess(daemon.pid());
  r.counts = collector.counts();
  if (!r.lossless()) {
    const std::string log = daemon.output();
    r.error += "\n" + log.substr(log.size() > 4000 ? log.size() - 4000 : 0);
  }
  return r;
}

void printOutage(const OutageReport& o, const std::vector<Report>& reports) {
  std::printf(
      "\nspool outage run (collector down while sending, then up):\n"
      "| events | spooled/s | spool files | spool bytes/event | CPU µs/spooled event | drain s | drained/s | "
      "CPU µs/drained event | records | lost | dup |\n|---|---|---|---|---|---|---|---|---|---|---|\n");
  std::printf("| %llu | %.0f | %llu | %.1f | %.2f | %.2f | %.0f | %.2f | %llu | %lld | %llu |\n",
              static_cast<unsigned long long>(o.expected), o.spooledPerSecond(),
              static_cast<unsigned long long>(o.spoolFiles), o.bytesPerEvent(), o.cpuMicrosPerSpooledEvent(),
              o.drainSeconds, o.drainedPerSecond(), o.cpuMicrosPerDrainedEvent(),
              static_cast<unsigned long long>(o.counts.records),
              static_cast<long long>(o.expected) - static_cast<long long>(o.counts.records),
              static_cast<unsigned long long>(o.counts.duplicates));
  for (const auto& r : reports) {
    if (r.pipeline == "zerithd" && r.lossless() && r.deliveredPerSecond() > 0) {
      std::printf("ratio to the normal zerithd run: spooled/s %.2f, drained/s %.2f (normal delivered/s %.0f)\n",
                  o.spooledPerSecond() / r.deliveredPerSecond(), o.drainedPerSecond() / r.deliveredPerSecond(),
                  r.deliveredPerSecond());
    }
  }
  std::printf("zerithd-spool: %s", o.lossless() ? "lossless\n" : "NOT lossless");
  if (!o.lossless()) {
    std::printf(" (expected %llu, records %llu, duplicates %llu)%s%s\n", static_cast<unsigned long long>(o.expected),
                static_cast<unsigned long long>(o.counts.records), static_cast<unsigned long long>(o.counts.duplicates),
                o.error.empty() ? "" : ": ", o.error.c_str());
  }
  std::fflush(stdout);
}

std::string kib(const std::optional<ProcSample>& s, std::uint64_t ProcSample::*field) {
  return s ? std::to_string((*s).*field) : std::string("-");
}

void print(const Settings& s, const std::vector<Report>& reports) {
  std::printf("clients=%d events=%llu rate=%s window=%d replies=%s collector=%s\n", s.load.clients,
              static_cast<unsigned long long>(s.events),
              s.load.eventsPerSecond > 0 ? std::to_string(static_cast<long long>(s.load.eventsPerSecond)).c_str()
                                         : "max",
              s.load.window, s.load.replies ? "each" : "none", s.collector.c_str());
  std::printf(
      "| pipeline | accepted/s | delivered/s | CPU µs/event | client CPU µs/event | collector CPU µs/event | "
      "wake-ups/event | peak RSS KiB | private KiB @%llu | private KiB @end | posts | gzip | records | lost | dup "
      "|\n|---|---|---|---|---|---|---|---|---|---|---|---|---|---|---|\n",
      static_cast<unsigned long long>(s.memorySample));
  for (const auto& r : reports) {
    std::printf("| %s | %.0f | %.0f | %.2f | %.2f | %.2f | %s | %s | %s | %s | %llu | %llu | %llu | %lld | %llu |\n",
                r.pipeline.c_str(), r.acceptedPerSecond(), r.deliveredPerSecond(), r.cpuMicrosPerEvent(),
                r.clientMicrosPerEvent(), r.collectorMicrosPerEvent(),
                r.wakeupsPerEvent().c_str(), kib(r.after, &ProcSample::peakRssKiB).c_str(), kib(r.atSample, &ProcSample::privateRssKiB).c_str(),
                kib(r.after, &ProcSample::privateRssKiB).c_str(), static_cast<unsigned long long>(r.counts.posts),
                static_cast<unsigned long long>(r.counts.gzipPosts), static_cast<unsigned long long>(r.counts.records),
                static_cast<long long>(r.expected) - static_cast<long long>(r.counts.records),
                static_cast<unsigned long long>(r.counts.duplicates));
  }
  for (const auto& r : reports) {
    if (r.idleBefore && r.idleAfter && r.idleSeconds > 0) {
      const double perMinute = 60.0 / r.idleSeconds;
      // Switches are summed over the threads alive at each sample: a thread
      // that ended in between takes its count with it.
      const std::string wakeups =
          r.idleAfter->voluntarySwitches >= r.idleBefore->voluntarySwitches
              ? std::to_string(static_cast<long long>(
                    static_cast<double>(r.idleAfter->voluntarySwitches - r.idleBefore->voluntarySwitches) * perMinute))
              : std::string("unknown (threads ended)");
      std::printf("idle %s, %d sessions, %.0f s: CPU %.2f ms/min, wake-ups %s/min (voluntary switches), threads %llu\n",
                  r.pipeline.c_str(), s.idleSessions, r.idleSeconds,
                  (r.idleAfter->cpuSeconds - r.idleBefore->cpuSeconds) * 1e3 * perMinute, wakeups.c_str(),
                  static_cast<unsigned long long>(r.idleAfter->threads));
    }
  }
  const Report* z = nullptr;
  const Report* p = nullptr;
  for (const auto& r : reports) {
    (r.pipeline == "zerithd" ? z : p) = &r;
  }
  if (z && p && z->lossless() && p->lossless()) {
    std::printf("ratio zerithd/peer: delivered/s %.2f, CPU per event %.2f, client CPU per event %.2f, private RSS %.2f\n",
                p->deliveredPerSecond() > 0 ? z->deliveredPerSecond() / p->deliveredPerSecond() : 0,
                p->cpuMicrosPerEvent() > 0 ? z->cpuMicrosPerEvent() / p->cpuMicrosPerEvent() : 0,
                p->clientMicrosPerEvent() > 0 ? z->clientMicrosPerEvent() / p->clientMicrosPerEvent() : 0,
                p->after && z->after && p->after->privateRssKiB
                    ? static_cast<double>(z->after->privateRssKiB) / static_cast<double>(p->after->privateRssKiB)
                    : 0);
  }
  for (const auto& r : reports) {
    std::printf("%s: %s", r.pipeline.c_str(), r.lossless() ? "lossless\n" : "NOT lossless");
    if (!r.lossless()) {
      std::printf(" (expected %llu, records %llu, duplicates %llu, unexpected %llu, malformed %llu)%s%s\n",
                  static_cast<unsigned long long>(r.expected), static_cast<unsigned long long>(r.counts.records),
                  static_cast<unsigned long long>(r.counts.duplicates),
                  static_cast<unsigned long long>(r.counts.unexpected),
                  static_cast<unsigned long long>(r.counts.malformed), r.error.empty() ? "" : ": ", r.error.c_str());
    }
  }
  std::fflush(stdout);
}

}  // namespace
}  // namespace zerith::bench

int main(int argc, char** argv) {
  using namespace zerith::bench;
  Settings s;
  CLI::App app{"End-to-end pipeline benchmark: zerithd beside a peer log pipeline"};
  app.add_option("--pipelines", s.pipelines, "peer and/or zerithd")->check(CLI::IsMember({"peer", "zerithd"}));
  app.add_option("--clients", s.load.clients, "client connections")->check(CLI::Range(1, 64));
  app.add_option("--events", s.events, "events in all (split evenly over the clients)");
  app.add_option("--rate", s.load.eventsPerSecond, "paced total events per second (0: as fast as taken)");
  app.add_option("--window", s.load.window, "unanswered events per zerithd client")->check(CLI::Range(1, 100000));
  std::string replies = "each";
  app.add_option("--replies", replies,
                 "zerithd clients: each (every event asks for a reply) or none (one-way events, one flush at the end)")
      ->check(CLI::IsMember({"each", "none"}));
  app.add_option("--memory-sample", s.memorySample, "also sample memory after this many delivered events");
  app.add_option("--idle-seconds", s.idleSeconds, "measure the idle process with open sessions this long first");
  app.add_option("--idle-sessions", s.idleSessions, "sessions held open while idle");
  app.add_option("--collector", s.collector, "zerith-collector (one line per record) or test-server")
      ->check(CLI::IsMember({"zerith-collector", "test-server"}));
  app.add_flag("--spool-outage", s.spoolOutage,
               "also run zerithd with the spool on and the collector down while sending, then up");
  app.add_option("--write-ahead", s.writeAhead,
                 "the zerithd run with the spool on and this commit interval in seconds (every batch written ahead)")
      ->check(CLI::Range(0.0, 1.0));
  app.add_flag("--smoke", s.smoke, "exit 1 unless every pipeline delivered every event exactly once");
  CLI11_PARSE(app, argc, argv);
  s.load.replies = replies == "each";

  if (s.spoolOutage && s.collector != "zerith-collector") {
    std::fprintf(stderr, "--spool-outage needs --collector zerith-collector (the one that can go down)\n");
    return 2;
  }
  s.load.eventsPerClient = s.events / static_cast<std::uint64_t>(s.load.clients);
  s.events = s.load.eventsPerClient * static_cast<std::uint64_t>(s.load.clients);
  if (!std::getenv("ZERITHD_BINARY")) {
    ::setenv("ZERITHD_BINARY", ZERITHD_BUILT_BINARY, 1);
  }
  char folderTemplate[] = "/tmp/zerith-pipeline-XXXXXX";
  const char* folder = ::mkdtemp(folderTemplate);
  if (!folder) {
    std::perror("mkdtemp");
    return 2;
  }
  std::vector<Report> reports;
  std::optional<OutageReport> outage;
  {
    Collector collector(s.collector == "test-server" ? Collector::Server::TestServer
                                                     : Collector::Server::ZerithCollector);
    for (const auto& pipeline : s.pipelines) {
      reports.push_back(pipeline == "peer" ? runPeer(s, collector, folder) : runZerithd(s, collector));
    }
    if (s.spoolOutage) {
      outage = runZerithdOutage(s, collector);
    }
  }
  std::filesystem::remove_all(folder);
  print(s, reports);
  if (outage) {
    printOutage(*outage, reports);
  }
  if (s.smoke) {
    if (outage && !outage->lossless()) {
      return 1;
    }
    for (const auto& r : reports) {
      if (!r.lossless()) {
        return 1;
      }
    }
  }
  return 0;
}
