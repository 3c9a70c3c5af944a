#pragma once

// "Did you mean" hints for misspelt names: the command line's options and
// commands, the keys of a storebag.

#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace zerith {

// The edit distance (insertions, deletions, substitutions) between two words.
std::size_t editDistance(std::string_view a, std::string_view b);

// The known word nearest to `word`, when it is at most `maxEdits` edits away
// (the first of equally near ones).
std::optional<std::string> nearestSpelling(std::string_view word, std::span<const std::string_view> known,
                                           std::size_t maxEdits = 2);

}  // namespace zerith
