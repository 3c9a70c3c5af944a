#include "tests/support/Command.h"

#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>

namespace zerith::test {

CommandResult runCommand(const std::string& command, int timeoutSeconds) {
  CommandResult r;
  FILE* pipe = ::popen(("timeout " + std::to_string(timeoutSeconds) + " sh -c " + shellQuote(command)).c_str(), "r");
  if (pipe == nullptr) {
    return r;
  }
  char buffer[4096];
  for (std::size_t n; (n = std::fread(buffer, 1, sizeof(buffer), pipe)) > 0;) {
    r.output.append(buffer, n);
  }
  const int status = ::pclose(pipe);
  r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return r;
}

std::string shellQuote(const std::string& s) {
  std::string out = "'";
  for (const char c : s) {
    out += c == '\'' ? std::string("'\\''") : std::string(1, c);
  }
  return out + "'";
}

bool onPath(const std::string& tool) {
  const char* path = std::getenv("PATH");
  std::istringstream dirs(path ? path : "/usr/bin:/bin");
  std::string dir;
  while (std::getline(dirs, dir, ':')) {
    if (!dir.empty() && ::access((std::filesystem::path(dir) / tool).c_str(), X_OK) == 0) {
      return true;
    }
  }
  return false;
}

std::string readText(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

}  // namespace zerith::test
