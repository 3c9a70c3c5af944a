#include "tests/support/TempRoot.h"

#include <cstdlib>
#include <fstream>
#include <stdexcept>

#include "platform/Paths.h"

namespace zerith::test {

TempRoot::TempRoot() {
  std::string tmpl = (std::filesystem::temp_directory_path() / "zerith-test-XXXXXX").string();
  if (!::mkdtemp(tmpl.data())) {
    throw std::runtime_error("mkdtemp failed");
  }
  path_ = tmpl;
  previous_ = paths::root();
  paths::setRoot(path_);
}

TempRoot::~TempRoot() {
  paths::setRoot(previous_);
  std::error_code ec;
  std::filesystem::remove_all(path_, ec);
}

std::filesystem::path TempRoot::operator/(const std::string& absolute) const {
  std::string rel = absolute;
  while (!rel.empty() && rel.front() == '/') rel.erase(rel.begin());
  return path_ / rel;
}

void TempRoot::write(const std::string& absolute, const std::string& contents) const {
  const auto p = *this / absolute;
  std::filesystem::create_directories(p.parent_path());
  std::ofstream(p, std::ios::binary) << contents;
}

std::filesystem::path buildDir() {
  const char* env = std::getenv("ZERITH_BUILD_DIR");
  return env ? env : std::filesystem::current_path();
}

std::filesystem::path sourceDir() {
  const char* env = std::getenv("ZERITH_SOURCE_DIR");
  return env ? env : std::filesystem::current_path();
}

}  // namespace zerith::test
