#pragma once

// The collector of the tests whose collector fails and recovers while they
// run: it serves the storebag from <root>/collector/www, reads its behaviour
// from `behaviourFile` before every request (written "answer" first) and
// drops records it took before.

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <span>
#include <string>
#include <thread>

#include "platform/FileUtil.h"
#include "tests/e2e/E2eFixture.h"
#include "tests/support/CollectorProcess.h"

namespace zerith::test {

// Writes the collector's behaviour ("answer", "stall 300", "status 503", ...).
inline bool writeBehaviour(const std::filesystem::path& behaviourFile, const std::string& text) {
  return file::writeAtomically(
      behaviourFile, std::span<const std::uint8_t>(reinterpret_cast<const std::uint8_t*>(text.data()), text.size()));
}

inline std::unique_ptr<CollectorProcess> startBehavingCollector(const std::filesystem::path& root,
                                                                const std::filesystem::path& behaviourFile) {
  std::filesystem::create_directories(behaviourFile.parent_path());
  writeBehaviour(behaviourFile, "answer");
  return std::make_unique<CollectorProcess>(
      ZERITH_COLLECTOR_TOOL, std::vector<std::string>{"--generate-cert", (root / "collector/certs").string(), "--serve",
                                                      (root / "collector/www").string(), "--behaviour-file",
                                                      behaviourFile.string(), "--drop-duplicates"});
}

// The collector's lines, read on a thread of their own so that its output
// pipe never fills while a test floods: the records taken, and the record
// IDs of the numbered events (method 3, payload "n") by number.
class CollectorReader {
 public:
  explicit CollectorReader(CollectorProcess& collector)
      : thread_([this, &collector] {
          while (!stop_) {
            if (auto line = collector.nextLine({}, std::chrono::milliseconds(200))) {
              absorb(*line);
            }
          }
        }) {}
  ~CollectorReader() {
    stop_ = true;
    thread_.join();
  }
  std::size_t recordsTaken() const {
    std::lock_guard lock(mutex_);
    return records_;
  }
  std::map<int, std::set<std::string>> idsByNumber() const {
    std::lock_guard lock(mutex_);
    return ids_;
  }
  // Waits (bounded) until `records` records were taken.
  bool waitForRecords(std::size_t records, std::chrono::seconds timeout) const {
    return waitUntil(timeout, [&] { return records_ >= records; });
  }
  // Waits (bounded) until every number in `wanted` was taken.
  bool waitFor(const std::set<int>& wanted, std::chrono::seconds timeout) const {
    return waitUntil(
        timeout, [&] { return std::all_of(wanted.begin(), wanted.end(), [&](int n) { return ids_.count(n) != 0; }); });
  }

 private:
  template <typename Done>
  bool waitUntil(std::chrono::seconds timeout, Done done) const {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
      {
        std::lock_guard lock(mutex_);
        if (done()) {
          return true;
        }
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    return false;
  }
  void absorb(const nlohmann::ordered_json& line) {
    if (line.value("kind", "") != "record" || line.value("status", 0) != 200) {
      return;
    }
    std::lock_guard lock(mutex_);
    ++records_;
    const auto& record = line["record"];
    if (record.value("_method", 0) == 3) {
      ids_[record.value("n", -1)].insert(record.value("_recordID", std::string("none")));
    }
  }

  mutable std::mutex mutex_;
  std::size_t records_ = 0;
  std::map<int, std::set<std::string>> ids_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

// The behaving collector serving the signed collector storebag (posting to
// its "/post", `clientEntry` added to the demo client's entry), its reader,
// and the daemon trusting it; `keys` go into the daemon's defaults first.
class BehavingCollectorTest : public E2eTest {
 protected:
  void startAll(const Dictionary& keys, const Dictionary& clientEntry, bool status = false) {
    grant(Value(true), status);
    for (const auto& [key, value] : keys) {
      Defaults("com.velmar.zerith").setObject(key, value);
    }
    behaviourFile = root.path() / "collector/behaviour";
    collector = startBehavingCollector(root.path(), behaviourFile);
    ASSERT_GT(collector->port(), 0) << collector->said();
    publishSignedStorebag(collectorStorebag(collector->url("/post"), clientEntry), root.path() / "collector/www",
                          collector->url("/zerith"));
    reader = std::make_unique<CollectorReader>(*collector);
    startDaemon(daemonOptions());
  }

  DaemonProcess::Options daemonOptions() const { return collectorDaemonOptions(root.path() / "collector/certs"); }

  void behave(const std::string& text) { ASSERT_TRUE(writeBehaviour(behaviourFile, text)); }

  // The spool on, retried after 0.2 s and then at most every second.
  static Dictionary spoolOn() {
    return Dictionary{{"spoolEnabled", true}, {"spoolRetryInitialSeconds", 0.2}, {"spoolRetryMaxSeconds", 1.0}};
  }

  // Event number `n` (category 3, type 4) padded with `pad` bytes.
  static Value numbered(int n, std::size_t pad) {
    return event(3, 4, Value(Dictionary{{"n", n}, {"pad", std::string(pad, 'p')}}));
  }

  std::unique_ptr<CollectorProcess> collector;
  std::unique_ptr<CollectorReader> reader;
  std::filesystem::path behaviourFile;
};

}  // namespace zerith::test
