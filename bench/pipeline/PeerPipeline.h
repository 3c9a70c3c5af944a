#pragma once

// The peer log pipeline of the benchmark: Debian's syslog-ng, started on a
// scratch configuration in a folder of its own (its socket, persist file,
// control socket and pid file all stay there; nothing system-wide is read
// or written):
//
//   unix-stream() source of JSON lines -> json-parser() -> http() destination
//   posting batches of 50 records as {"postTime":0,"events":[...]} (the
//   envelope's shape, its post time left constant) to the collector, one
//   worker, the path under flags(flow-control) so that a full queue stops
//   the reading instead of dropping events.
//
// It runs in the foreground without capabilities and talks to loopback only.

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <string>

namespace zerith::bench {

class PeerPipeline {
 public:
  struct Options {
    std::filesystem::path folder;   // scratch folder, created
    std::string postURL;            // the collector
    std::filesystem::path caFile;   // trusts the collector's certificate
    int batchLines = 50;
    std::chrono::milliseconds startTimeout{15000};
  };

  explicit PeerPipeline(Options options);
  ~PeerPipeline();
  PeerPipeline(const PeerPipeline&) = delete;
  PeerPipeline& operator=(const PeerPipeline&) = delete;

  // /usr/sbin/syslog-ng, or $ZERITH_PEER_BINARY.
  static std::filesystem::path binary();
  // The configuration text for these options.
  static std::string configuration(const Options& options, const std::filesystem::path& socketPath);

  // True once the source socket accepts connections.
  bool ready() const { return ready_; }
  pid_t pid() const { return pid_; }
  const std::filesystem::path& socketPath() const { return socketPath_; }
  // What the peer wrote to its standard error.
  std::string output() const;
  // SIGTERM and wait (also done by the destructor); the exit status.
  int stop();

 private:
  Options options_;
  std::filesystem::path socketPath_;
  std::filesystem::path outputPath_;
  pid_t pid_ = -1;
  bool ready_ = false;
};

}  // namespace zerith::bench
