#pragma once

// The collector of the tests whose collector fails and recovers while they
// run: it serves the storebag from <root>/collector/www, reads its behaviour
// from `behaviourFile` before every request (written "answer" first) and
// drops records it took before.

#include <filesystem>
#include <memory>
#include <span>
#include <string>

#include "platform/FileUtil.h"
#include "tests/support/CollectorProcess.h"

namespace zerith::test {

// Writes the collector's behaviour ("answer", "stall 300", "status 503", ...).
inline bool writeBehaviour(const std::filesystem::path& behaviourFile, const std::string& text) {
  return file::writeAtomically(
      behaviourFile, std::span<const std::uint8_t>(reinterpret_cast<const std::uint8_t*>(text.data()), text.size()));
}

inline std::unique_ptr<CollectorProcess> startBehavingCollector(const std::filesystem::path& root,
                                                                const std::filesystem::path& behaviourFile) {
  std::filesystem::create_directories(behaviourFile.parent_path());
  writeBehaviour(behaviourFile, "answer");
  return std::make_unique<CollectorProcess>(
      ZERITH_COLLECTOR_TOOL,
      std::vector<std::string>{"--generate-cert", (root / "collector/certs").string(), "--serve",
                               (root / "collector/www").string(), "--behaviour-file", behaviourFile.string(),
                               "--drop-duplicates"});
}

}  // namespace zerith::test
