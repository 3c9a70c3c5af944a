#pragma once

// Removes stale files below a folder by a pattern over their relative paths.

#include <filesystem>

// GCC 12 reports false "may be used uninitialized" warnings inside <regex>
// when optimising with the sanitizers on.
#if defined(__GNUC__) && !defined(__clang__)
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wmaybe-uninitialized"
#include <regex>
#pragma GCC diagnostic pop
#else
#include <regex>
#endif

namespace zerith {

// Walks every entry under `folder` recursively and deletes folder/<relative
// path> (a folder with everything in it) when `regex` matches anywhere in the
// relative path ("sub/a.zthdiag"). Symbolic links are removed, never
// followed. Errors while walking or deleting are ignored: what cannot be
// removed stays.
void removeFilesMatchingRegex(const std::regex& regex, const std::filesystem::path& folder);

}  // namespace zerith
