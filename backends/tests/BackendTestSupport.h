#pragma once

// Scenario helpers of the backend tests: installing an adaptor plugin into
// the temporary root, writing files and reading line files, a backend's self
// version and what it counted.

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>
#include <vector>

#include "backends/BackendCounters.h"
#include "backends/ZerithBackend.h"
#include "platform/Paths.h"

namespace zerith::test {

inline void installAdaptorPlugin(const char* builtPlugin) {
  const auto target = paths::adaptorPluginPath();
  std::filesystem::create_directories(target.parent_path());
  std::filesystem::copy_file(builtPlugin, target, std::filesystem::copy_options::overwrite_existing);
}

inline void writeFile(const std::filesystem::path& path, std::string_view contents) {
  std::ofstream(path, std::ios::binary) << contents;
}

inline std::vector<std::string> readLines(const std::filesystem::path& path) {
  std::vector<std::string> lines;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    lines.push_back(line);
  }
  return lines;
}

// "major.middle.minor" of a backend's self version, as it keeps it for its
// subclasses.
inline std::string selfVersionOf(const ZerithBackend& b) {
  struct Peek : ZerithBackend {
    using ZerithBackend::selfVersionMajor;
    using ZerithBackend::selfVersionMiddle;
    using ZerithBackend::selfVersionMinor;
  };
  return std::to_string((b.*&Peek::selfVersionMajor)()) + "." + std::to_string((b.*&Peek::selfVersionMiddle)()) +
         "." + std::to_string((b.*&Peek::selfVersionMinor)());
}

// Every count but the ones named is 0.
inline void expectOnly(const BackendCounters& counters,
                       std::initializer_list<std::pair<BackendCount, std::uint64_t>> wanted) {
  for (std::size_t i = 0; i < kBackendCountKinds; ++i) {
    const auto kind = static_cast<BackendCount>(i);
    std::uint64_t expected = 0;
    for (const auto& [k, n] : wanted) {
      expected = k == kind ? n : expected;
    }
    EXPECT_EQ(counters.get(kind), expected) << backendCountName(kind);
  }
}

}  // namespace zerith::test
