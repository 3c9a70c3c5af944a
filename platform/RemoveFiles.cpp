#include "platform/RemoveFiles.h"

#include <string>
#include <system_error>
#include <vector>

namespace zerith {

namespace fs = std::filesystem;

void removeFilesMatchingRegex(const std::regex& regex, const fs::path& folder) {
  std::error_code ec;
  fs::recursive_directory_iterator it(folder, fs::directory_options::skip_permission_denied, ec);
  if (ec) {
    return;
  }
  // Matches are collected first: removing a folder while the walk is inside
  // it would break the iteration.
  std::vector<fs::path> matches;
  for (const fs::recursive_directory_iterator end; it != end; it.increment(ec)) {
    if (ec) {
      break;
    }
    const fs::path relative = it->path().lexically_relative(folder);
    if (std::regex_search(relative.generic_string(), regex)) {
      matches.push_back(it->path());
      if (it->is_directory(ec) && !it->is_symlink(ec)) {
        it.disable_recursion_pending();  // removed whole below
      }
    }
  }
  for (const auto& path : matches) {
    fs::remove_all(path, ec);
  }
}

}  // namespace zerith
