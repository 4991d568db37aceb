// Small operations on text that back ends share: splitting, comparing without case, versions, hexadecimal
// digits. Pure functions; any thread.
//
// Case: ASCII, Latin-1, Latin Extended-A, Greek and Cyrillic letters have two cases here; every other
// character equals itself alone. Folding never changes the number of bytes.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace kyt {

// The pieces between separators, empty ones included; one piece when there is no separator.
[[nodiscard]] std::vector<std::string_view> splitText(std::string_view text, std::string_view separator);

[[nodiscard]] std::string foldCase(std::string_view text);
// Whether foldCase(text) == folded, without allocating when `text` is ASCII.
[[nodiscard]] bool equalsFolded(std::string_view text, std::string_view folded);
[[nodiscard]] bool equalsIgnoringCase(std::string_view a, std::string_view b);

// "major.middle.minor": the integer values of the first three pieces, each cut to its low eight bits; a
// missing piece and one that is no number are 0.
[[nodiscard]] std::array<uint8_t, 3> versionParts(std::string_view version);

// Two lower-case digits for each byte.
void appendHex(std::span<const std::byte> bytes, std::string& out);

}  // namespace kyt
