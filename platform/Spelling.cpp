#include "platform/Spelling.h"

#include <algorithm>
#include <vector>

namespace zerith {

std::size_t editDistance(std::string_view a, std::string_view b) {
  std::vector<std::size_t> row(b.size() + 1);
  for (std::size_t j = 0; j <= b.size(); ++j) {
    row[j] = j;
  }
  for (std::size_t i = 1; i <= a.size(); ++i) {
    std::size_t diagonal = row[0];
    row[0] = i;
    for (std::size_t j = 1; j <= b.size(); ++j) {
      const std::size_t above = row[j];
      row[j] = std::min({row[j] + 1, row[j - 1] + 1, diagonal + (a[i - 1] == b[j - 1] ? 0 : 1)});
      diagonal = above;
    }
  }
  return row[b.size()];
}

std::optional<std::string> nearestSpelling(std::string_view word, std::span<const std::string_view> known,
                                           std::size_t maxEdits) {
  std::optional<std::string> best;
  std::size_t bestDistance = maxEdits + 1;
  for (const std::string_view candidate : known) {
    if (const std::size_t d = editDistance(word, candidate); d < bestDistance) {
      best = std::string(candidate);
      bestDistance = d;
    }
  }
  return best;
}

}  // namespace zerith
