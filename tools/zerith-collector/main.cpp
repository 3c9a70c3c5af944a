// zerith-collector: a collector for what devices post, on loopback by
// default, writing every request it receives as JSON lines.
//
//   zerith-collector --generate-cert DIR [options]   makes DIR/ca.pem, cert.pem, key.pem (kept
//                                                    when present) and serves with them
//   zerith-collector --cert cert.pem --key key.pem [options]
//   zerith-collector --plain [options]               plain HTTP (for tests of refusal only)
//
// Options: --listen ADDR (127.0.0.1), --port N (0: any), --port-file FILE,
// --out FILE (stdout), --status N (200), --digest-key KEY, --store DIR,
// --answer TEXT ("success"), --log-data-path PATH ("/logdata"),
// --serve DIR (GET of static files, e.g. a storebag), --max-body BYTES,
// --max-inflated BYTES, --max-connections N (64), --behaviour-file FILE (answer | status N | stall MS |
// close, read before every connection and request), --drop-duplicates
// (records by "_recordID"). Stops on SIGINT/SIGTERM, or when the process named
// by --parent-pid has gone.

#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <iostream>
#include <mutex>
#include <thread>

#include <CLI/CLI.hpp>

#include "tools/zerith-collector/CollectorServer.h"

#if defined(ZERITH_COVERAGE)
// _Exit skips the exit handler that writes the coverage counters.
extern "C" void __gcov_dump(void);
#endif

namespace {

zerith::collector::CollectorServer* running = nullptr;

}  // namespace

int main(int argc, char** argv) {
  using namespace zerith::collector;
  CLI::App app{"zerith-collector: receives what devices post and writes it as JSON lines"};
  CollectorOptions options;
  std::string generateFolder, portFile, outFile, digestKey;
  long long maxBody = static_cast<long long>(options.limits.maxBodyBytes);
  long long maxInflated = static_cast<long long>(options.limits.maxInflatedBytes);
  int parentPid = 0;
  long long maxConnections = static_cast<long long>(options.maxConnections);
  app.add_option("--listen", options.listenAddress, "address to listen on")->capture_default_str();
  app.add_option("--port", options.port, "port (0: any free port)")->check(CLI::Range(0, 65535));
  app.add_option("--port-file", portFile, "write the port chosen into this file once listening");
  app.add_flag("--plain", options.plain, "plain HTTP instead of HTTPS");
  app.add_option("--cert", options.certificateFile, "server certificate (PEM, chain may follow)");
  app.add_option("--key", options.keyFile, "server private key (PEM)");
  app.add_option("--generate-cert", generateFolder,
                 "make ca.pem, cert.pem and key.pem in this folder (kept when present) and serve with them");
  app.add_option("--out", outFile, "append JSON lines to this file instead of standard output");
  app.add_option("--status", options.status, "status to answer every POST with")->check(CLI::Range(100, 599));
  app.add_option("--digest-key", digestKey, "check X-ZTH-DIGEST against HMAC-SHA-1 with this key");
  app.add_option("--store", options.storeFolder, "store the bodies of uploads in this folder");
  app.add_option("--answer", options.answerText, "body of the answer to uploads")->capture_default_str();
  app.add_option("--log-data-path", options.logDataPath, "path whose POSTs are answered with the stored file's path")
      ->capture_default_str();
  app.add_option("--serve", options.serveFolder, "answer GETs with the files of this folder");
  app.add_option("--max-body", maxBody, "largest body taken, in bytes")->check(CLI::PositiveNumber);
  app.add_option("--max-inflated", maxInflated, "largest body after gzip is undone, in bytes")->check(CLI::PositiveNumber);
  app.add_option("--max-connections", maxConnections,
                 "connections served at once; more are closed as they come (a load test may need more)")
      ->check(CLI::Range(1, 65536))
      ->capture_default_str();
  app.add_option("--parent-pid", parentPid, "stop once this process has gone");
  app.add_option("--behaviour-file", options.behaviourFile,
                 "read how to behave from this file before every connection and request: "
                 "answer, status N, stall MS or close");
  app.add_flag("--drop-duplicates", options.dropDuplicates,
               "write records whose _recordID was taken before as \"duplicate\" lines");
  CLI11_PARSE(app, argc, argv);

  options.limits.maxBodyBytes = static_cast<std::size_t>(maxBody);
  options.limits.maxInflatedBytes = static_cast<std::size_t>(maxInflated);
  options.maxConnections = static_cast<std::size_t>(maxConnections);
  if (!digestKey.empty()) {
    options.digestKey = digestKey;
  }
  std::string error;
  if (!generateFolder.empty()) {
    if (!generateCertificates(generateFolder, &error)) {
      std::cerr << "zerith-collector: " << error << "\n";
      return 1;
    }
    options.certificateFile = std::filesystem::path(generateFolder) / "cert.pem";
    options.keyFile = std::filesystem::path(generateFolder) / "key.pem";
  }
  if (!options.plain && (options.certificateFile.empty() || options.keyFile.empty())) {
    std::cerr << "zerith-collector: HTTPS needs --cert and --key, or --generate-cert DIR (or --plain)\n";
    return 2;
  }

  std::ofstream file;
  if (!outFile.empty()) {
    file.open(outFile, std::ios::app);
    if (!file) {
      std::cerr << "zerith-collector: cannot open " << outFile << "\n";
      return 1;
    }
  }
  std::ostream& out = outFile.empty() ? std::cout : file;
  std::mutex outMutex;
  CollectorServer server(options, [&](const std::string& lines) {
    std::lock_guard lock(outMutex);
    out << lines << '\n';
    out.flush();
  });
  if (!server.start(&error)) {
    std::cerr << "zerith-collector: " << error << "\n";
    return 1;
  }
  if (!portFile.empty()) {
    const std::string temporary = portFile + ".new";
    std::ofstream(temporary) << server.port() << "\n";
    std::rename(temporary.c_str(), portFile.c_str());
  }
  std::cerr << "zerith-collector: listening on " << server.baseURL() << "\n";

  // Signals end the accept loop from a thread of our own.
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
  signal(SIGPIPE, SIG_IGN);
  running = &server;
  std::thread([set] {
    int signal = 0;
    sigwait(&set, &signal);
    running->stop();
  }).detach();
  if (parentPid > 0) {
    std::thread([parentPid] {
      while (::kill(parentPid, 0) == 0 || errno == EPERM) {
        std::this_thread::sleep_for(std::chrono::milliseconds(500));
      }
      running->stop();
    }).detach();
  }
  server.run();
  server.stop();
  std::cerr << "zerith-collector: stopped\n";
#if defined(ZERITH_COVERAGE)
  __gcov_dump();
#endif
  std::_Exit(0);
}
