#pragma once

// Scenario helpers of the backend tests: installing an adaptor plugin into
// the temporary root and reading line files.

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "platform/Paths.h"

namespace zerith::test {

inline void installAdaptorPlugin(const char* builtPlugin) {
  const auto target = paths::adaptorPluginPath();
  std::filesystem::create_directories(target.parent_path());
  std::filesystem::copy_file(builtPlugin, target, std::filesystem::copy_options::overwrite_existing);
}

inline std::vector<std::string> readLines(const std::filesystem::path& path) {
  std::vector<std::string> lines;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    lines.push_back(line);
  }
  return lines;
}

}  // namespace zerith::test
