#pragma once

// A real nginx serving a folder over HTTPS on 127.0.0.1, for tests that need
// a real static file server's "Last-Modified", "If-Modified-Since" and 304
// handling.
//
// The listening socket is opened here on port 0 and handed to nginx as an
// inherited socket, so there is no race for a free port and no wait for
// readiness: connections queue in the socket's backlog until nginx accepts
// them. nginx runs in the foreground (`-g 'daemon off;'`, one worker) with
// its prefix, configuration, pid file, temporary folders and logs in a
// folder of the test; its certificate comes from a TestCA.
//
//   test::NginxServer nginx({.workDir = root / "/nginx", .documentRoot = root / "/www"});
//   if (!NginxServer::available()) GTEST_SKIP();
//   ASSERT_TRUE(nginx.started()) << nginx.error();
//   ... fetch nginx.url("/bags/dravon") ...

#include <chrono>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>

#include "tests/support/Command.h"
#include "tests/support/TestCA.h"

namespace zerith::test {

class NginxServer {
 public:
  struct Options {
    std::filesystem::path workDir;       // prefix, config, pid, temp and logs (created)
    std::filesystem::path documentRoot;  // served at "/" (created)
    // Extra directives inside the server block, e.g.
    // "add_header Cache-Control \"max-age=600\";".
    std::string serverDirectives;
  };

  // nginx is installed (/usr/sbin/nginx).
  static bool available();

  explicit NginxServer(Options options, const TestCA& ca = TestCA::shared());
  ~NginxServer();
  NginxServer(const NginxServer&) = delete;
  NginxServer& operator=(const NginxServer&) = delete;

  bool started() const { return nginx_ != nullptr; }
  // Why it did not start (with nginx's own messages).
  const std::string& error() const { return error_; }

  int port() const { return port_; }
  // "https://127.0.0.1:<port><path>"
  std::string url(std::string_view path = "/") const;

  // The access log so far, one line per answered request:
  //   GET /bags/dravon?version=8.0 304 ims="Tue, 14 Nov 2023 22:13:20 GMT"
  std::string accessLog() const;
  // Waits until the access log holds `needle` (nginx writes the line after
  // the answer, so a client may see the answer first); false on time-out.
  bool waitForAccessLog(std::string_view needle,
                        std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  // Stops nginx (SIGTERM, then SIGKILL after five seconds) and reaps it.
  void stop();

 private:
  void start(const TestCA& ca);

  Options options_;
  int port_ = 0;
  std::unique_ptr<ChildProcess> nginx_;
  std::string error_;
};

}  // namespace zerith::test
