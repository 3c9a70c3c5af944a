#pragma once

// A fresh root folder per test: every zerithd path is relocated under it for
// the test's lifetime and the folder is removed afterwards.

#include <filesystem>
#include <string>

namespace zerith::test {

class TempRoot {
 public:
  TempRoot();
  ~TempRoot();
  TempRoot(const TempRoot&) = delete;
  TempRoot& operator=(const TempRoot&) = delete;

  const std::filesystem::path& path() const { return path_; }
  // `absolute` moved under this root ("/etc/x" -> "<root>/etc/x").
  std::filesystem::path operator/(const std::string& absolute) const;
  // Writes a file (creating folders).
  void write(const std::string& absolute, const std::string& contents) const;

 private:
  std::filesystem::path path_;
  std::filesystem::path previous_;
};

// The build and source folders (set by CTest; fall back to the working dir).
std::filesystem::path buildDir();
std::filesystem::path sourceDir();

}  // namespace zerith::test
