// zerith-defaults: reads and writes zerithd's defaults domains.

#include <CLI/CLI.hpp>

#include <iostream>

#include "platform/Paths.h"
#include "tools/zerith-defaults/DefaultsTool.h"

int main(int argc, char** argv) {
  CLI::App app("Reads and writes the defaults domains of zerithd (com.velmar.zerith, ...).");
  std::string root = zerith::paths::defaultRoot().string();
  app.add_option("--root", root, "Root folder of every zerithd path (environment ZERITHD_ROOT)");
  // Everything after the first word is the command, typed flags included
  // ("write com.velmar.zerith environmentType -int 4").
  app.prefix_command();
  app.footer("\n" + zerith::tool::usage());
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return app.exit(e);
  }
  zerith::paths::setRoot(root);
  return zerith::tool::runDefaultsCommand(app.remaining(), std::cout, std::cerr);
}
