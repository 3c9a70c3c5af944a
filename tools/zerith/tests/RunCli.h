// `zerith args...` run in this process, as the executable's main() runs it.
#pragma once

#include <sstream>
#include <string>
#include <vector>

#include "tools/zerith/ZerithCli.h"

namespace zerith::test {

struct CliResult {
  int status;
  std::string out;
  std::string err;
};

inline CliResult runCli(std::vector<std::string> args) {
  args.insert(args.begin(), "zerith");
  std::vector<const char*> argv;
  for (const auto& a : args) {
    argv.push_back(a.c_str());
  }
  std::ostringstream out, err;
  const int status = cli::run(static_cast<int>(argv.size()), argv.data(), out, err);
  return {status, out.str(), err.str()};
}

}  // namespace zerith::test
