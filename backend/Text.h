// Small operations on text that back ends share: splitting, comparing without case, versions. Pure functions; any
// thread.
//
// Case: Unicode's simple case folding, of each character by itself, in no language's own way (a dotless i is no i). What
// is no UTF-8 equals itself alone. A character and what it folds to may take different numbers of bytes: the Kelvin sign
// is a k.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace kyt {

// The pieces between separators, empty ones included; one piece when there is no separator.
[[nodiscard]] std::vector<std::string_view> splitText(std::string_view text, std::string_view separator);

[[nodiscard]] uint32_t foldCharacter(uint32_t character);
[[nodiscard]] std::string foldCase(std::string_view text);
// Whether foldCase(text) == folded, without allocating.
[[nodiscard]] bool equalsFolded(std::string_view text, std::string_view folded);
[[nodiscard]] bool equalsIgnoringCase(std::string_view a, std::string_view b);

// What is known of all texts that fold to one: how many bytes they have, and whether their first and last bytes are
// ASCII. Slow; for tables that are made once.
struct UnfoldedSizes {
  size_t least = 0, most = 0;
  bool endsMayBeASCII = true;      // both
  bool endsMayBeNonASCII = false;  // one of them or both
};
[[nodiscard]] UnfoldedSizes unfoldedSizes(std::string_view folded);

// "major.middle.minor": the integer values of the first three pieces, each cut to its low eight bits; a
// missing piece and one that is no number are 0.
[[nodiscard]] std::array<uint8_t, 3> versionParts(std::string_view version);

}  // namespace kyt
