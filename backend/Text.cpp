#include "backend/Text.h"

#include <algorithm>
#include <iterator>

#include "backend/CaseFoldingTable.h"
#include "platform/objects/Value.h"

namespace kyt {

namespace {

char foldASCII(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c + ('a' - 'A')) : c;
}

bool isASCII(char c) {
  return static_cast<unsigned char>(c) < 0x80;
}

struct Character {
  uint32_t code = 0;
  size_t bytes = 1;
  bool isWhole = false;  // otherwise one byte that is no UTF-8
};

// The character at the beginning of a text that is not empty.
Character firstCharacter(std::string_view text) {
  const auto byte = [text](size_t i) { return static_cast<unsigned char>(text[i]); };
  const unsigned lead = byte(0);
  if (lead < 0x80) return {lead, 1, true};
  const size_t bytes = lead >= 0xF0 ? 4 : lead >= 0xE0 ? 3 : 2;
  if (lead < 0xC2 || lead > 0xF4 || text.size() < bytes) return {lead};
  uint32_t code = lead & (0x7Fu >> bytes);
  for (size_t i = 1; i < bytes; ++i) {
    if ((byte(i) & 0xC0u) != 0x80) return {lead};
    code = code << 6 | (byte(i) & 0x3Fu);
  }
  constexpr uint32_t kLeast[] = {0, 0, 0x80, 0x800, 0x10000};
  if (code < kLeast[bytes] || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF)) return {lead};
  return {code, bytes, true};
}

size_t bytesOf(uint32_t code) {
  return code < 0x80 ? 1 : code < 0x800 ? 2 : code < 0x10000 ? 3 : 4;
}

// Writes the character's UTF-8; how many bytes it took.
size_t encode(uint32_t code, char* out) {
  const size_t bytes = bytesOf(code);
  if (bytes == 1) {
    out[0] = static_cast<char>(code);
    return 1;
  }
  for (size_t i = bytes - 1; i > 0; --i, code >>= 6) out[i] = static_cast<char>(0x80 | (code & 0x3F));
  out[0] = static_cast<char>((0xF00u >> bytes & 0xFFu) | code);
  return bytes;
}

// What the text begins with, folded, in UTF-8; what is no UTF-8 is itself.
struct Folded {
  char text[4];
  size_t bytes, consumed;
};
Folded foldFirst(std::string_view text) {
  const Character character = firstCharacter(text);
  Folded folded{{text[0]}, 1, character.bytes};
  if (character.isWhole) folded.bytes = encode(foldCharacter(character.code), folded.text);
  return folded;
}

}  // namespace

std::vector<std::string_view> splitText(std::string_view text, std::string_view separator) {
  std::vector<std::string_view> pieces;
  size_t start = 0;
  for (size_t found; (found = text.find(separator, start)) != std::string_view::npos;
       start = found + separator.size())
    pieces.push_back(text.substr(start, found - start));
  pieces.push_back(text.substr(start));
  return pieces;
}

uint32_t foldCharacter(uint32_t character) {
  const auto* range = std::upper_bound(std::begin(kCaseFolding), std::end(kCaseFolding), character,
                                       [](uint32_t c, const CaseFoldingRange& r) { return c < r.first; });
  if (range == std::begin(kCaseFolding)) return character;
  --range;
  if (character > range->last || (character - range->first) % range->step != 0) return character;
  return character + static_cast<uint32_t>(range->distance);
}

std::string foldCase(std::string_view text) {
  std::string folded;
  folded.reserve(text.size());
  while (!text.empty()) {
    if (isASCII(text.front())) {
      folded += foldASCII(text.front());
      text.remove_prefix(1);
      continue;
    }
    const Folded first = foldFirst(text);
    folded.append(first.text, first.bytes);
    text.remove_prefix(first.consumed);
  }
  return folded;
}

bool equalsFolded(std::string_view text, std::string_view folded) {
  while (!text.empty()) {
    if (folded.empty()) return false;
    if (isASCII(text.front())) {
      if (foldASCII(text.front()) != folded.front()) return false;
      text.remove_prefix(1);
      folded.remove_prefix(1);
      continue;
    }
    const Folded first = foldFirst(text);
    if (folded.substr(0, first.bytes) != std::string_view(first.text, first.bytes)) return false;
    text.remove_prefix(first.consumed);
    folded.remove_prefix(first.bytes);
  }
  return folded.empty();
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return equalsFolded(a, foldCase(b));
}

UnfoldedSizes unfoldedSizes(std::string_view folded) {
  UnfoldedSizes sizes;
  for (bool first = true; !folded.empty(); first = false) {
    const Character character = firstCharacter(folded);
    size_t least = character.bytes, most = character.bytes;
    for (const CaseFoldingRange& range : kCaseFolding) {
      const auto from = static_cast<uint32_t>(static_cast<int64_t>(character.code) - range.distance);
      if (!character.isWhole || from < range.first || from > range.last ||
          (from - range.first) % range.step != 0)
        continue;
      least = std::min(least, bytesOf(from));
      most = std::max(most, bytesOf(from));
    }
    sizes.least += least;
    sizes.most += most;
    folded.remove_prefix(character.bytes);
    const bool isEnd = first || folded.empty();
    if (isEnd && most > 1) sizes.endsMayBeNonASCII = true;
    if (isEnd && (!character.isWhole || character.code >= 0x80))
      sizes.endsMayBeASCII = false, sizes.endsMayBeNonASCII = true;
  }
  return sizes;
}

std::array<uint8_t, 3> versionParts(std::string_view version) {
  std::array<uint8_t, 3> parts{};
  const std::vector<std::string_view> pieces = splitText(version, ".");
  for (size_t i = 0; i < parts.size() && i < pieces.size(); ++i)
    parts[i] = static_cast<uint8_t>(Value(pieces[i]).longLongValue());
  return parts;
}

}  // namespace kyt
