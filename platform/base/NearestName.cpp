#include "platform/base/NearestName.h"

#include <algorithm>
#include <numeric>
#include <vector>

namespace kyt {

namespace {

constexpr size_t kLongest = 256;  // of what is compared: the work is the product of two lengths

char lower(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

size_t distance(std::string_view a, std::string_view b) {
  std::vector<size_t> row(b.size() + 1);
  std::iota(row.begin(), row.end(), size_t{0});
  for (size_t i = 0; i < a.size(); ++i) {
    size_t diagonal = row[0];
    row[0] = i + 1;
    for (size_t j = 0; j < b.size(); ++j) {
      const size_t replaced = diagonal + (lower(a[i]) == lower(b[j]) ? 0 : 1);
      diagonal = row[j + 1];
      row[j + 1] = std::min({replaced, row[j] + 1, diagonal + 1});
    }
  }
  return row.back();
}

}  // namespace

std::optional<std::string> nearestName(std::string_view name, std::span<const std::string> known) {
  if (name.size() > kLongest) return std::nullopt;
  const std::string* nearest = nullptr;
  size_t least = std::max<size_t>(2, name.size() / 3) + 1;
  for (const std::string& candidate : known) {
    const size_t letters = distance(name, candidate);
    if (letters >= least) continue;
    least = letters;
    nearest = &candidate;
  }
  return nearest != nullptr ? std::optional(*nearest) : std::nullopt;
}

}  // namespace kyt
