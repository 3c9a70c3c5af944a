// zerith-dashboard: watch dashboard datagrams arrive.
//
//   zerith-dashboard [--address 127.0.0.1] [--port 0] [--ack]
//                    [--drop-datagrams SHARE] [--drop-acks SHARE] [--seed N] [--count N]
//
// Prints "zerith-dashboard: listening on <address>:<port>" on standard error
// once the port is bound, then one JSON line per datagram on standard
// output. With --ack, datagrams of reliable backends are acknowledged.
// --drop-datagrams and --drop-acks lose that share (0 to 1) on purpose.
// --count ends the tool after that many datagrams (dropped ones included).

#include <cstdio>
#include <iostream>

#include <CLI/CLI.hpp>

#include "tools/zerith-dashboard/DashboardReceiver.h"

int main(int argc, char** argv) {
  CLI::App app("zerith-dashboard: prints dashboard datagrams as JSON lines");
  zerith::tools::ReceiverOptions options;
  std::uint64_t count = 0;
  app.add_option("--address", options.address, "IPv4 address to listen on")->capture_default_str();
  app.add_option("--port", options.port, "UDP port (0: any free port)")->capture_default_str();
  app.add_flag("--ack", options.acknowledge, "acknowledge datagrams of reliable backends");
  app.add_option("--drop-datagrams", options.dropDatagrams, "share of datagrams to lose")->check(CLI::Range(0.0, 1.0));
  app.add_option("--drop-acks", options.dropAcknowledgements, "share of acknowledgements to lose")
      ->check(CLI::Range(0.0, 1.0));
  app.add_option("--seed", options.seed, "seed of the losses")->capture_default_str();
  app.add_option("--count", count, "stop after this many datagrams");
  CLI11_PARSE(app, argc, argv);

  try {
    zerith::tools::DashboardReceiver receiver(options);
    std::cerr << "zerith-dashboard: listening on " << options.address << ":" << receiver.port() << std::endl;
    for (std::uint64_t seen = 0; count == 0 || seen < count; ++seen) {
      if (const auto line = receiver.receiveOne()) {
        std::cout << *line << std::endl;
      }
    }
  } catch (const std::exception& e) {
    std::cerr << "zerith-dashboard: " << e.what() << "\n";
    return 1;
  }
  return 0;
}
