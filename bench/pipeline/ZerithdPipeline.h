#pragma once

// zerithd as the benchmark runs it: the real daemon binary in a temporary
// root (debug log off, the running user entitled), a signed storebag served
// over HTTPS from loopback and trusted through --ca-file, whose sections
// enable the httpsPost backend posting to the collector in batches of 50.

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Value.h"
#include "zerith/Zerith.h"

namespace zerith::test {
class DaemonProcess;
class HttpsTestServer;
class TempRoot;
}  // namespace zerith::test

namespace zerith::bench {

class ZerithdPipeline {
 public:
  struct Options {
    std::string postURL;       // the collector
    int eventThreshold = 49;   // a batch is posted when its 51st record arrives: 50 per post
    bool debugLog = false;
    // Defaults keys of com.velmar.zerith set before the daemon starts (the
    // spool's, for the outage run).
    Dictionary defaults{};
  };

  explicit ZerithdPipeline(Options options);
  ~ZerithdPipeline();
  ZerithdPipeline(const ZerithdPipeline&) = delete;
  ZerithdPipeline& operator=(const ZerithdPipeline&) = delete;

  bool ready() const;
  pid_t pid() const;
  std::string output() const;
  // The daemon's spool folder.
  std::string spoolFolder() const;
  // Why the pipeline is not ready (empty when it is).
  const std::string& error() const { return error_; }

  // A client session of the benchmark's client type, configured and
  // started; nullptr (with `why`) when the daemon refused, or when the
  // session did not get its httpsPost backend.
  std::unique_ptr<Zerith> openSession(std::uint32_t sessionID, std::string* why) const;

  // The storebag of these options (the bag before signing).
  static Value storebag(const Options& options);

 private:
  std::unique_ptr<test::TempRoot> root_;
  std::unique_ptr<test::HttpsTestServer> storebagServer_;
  std::unique_ptr<test::DaemonProcess> daemon_;
  std::string error_;
};

}  // namespace zerith::bench
