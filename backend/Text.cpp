#include "backend/Text.h"

#include "platform/Value.h"

namespace kyt {

namespace {

char foldASCII(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c + ('a' - 'A')) : c;
}

bool isASCII(char c) {
  return static_cast<unsigned char>(c) < 0x80;
}

// The lower-case letter of a character of two UTF-8 bytes (U+0080 to U+07FF). Only letters whose lower case
// takes two bytes too are folded, so that lengths stay.
unsigned foldTwoByteCharacter(unsigned c) {
  const bool even = (c & 1) == 0;
  if (c >= 0xC0 && c <= 0xDE && c != 0xD7) return c + 0x20;
  if ((c >= 0x100 && c <= 0x137 && c != 0x130) || (c >= 0x14A && c <= 0x177)) return even ? c + 1 : c;
  if ((c >= 0x139 && c <= 0x148) || (c >= 0x179 && c <= 0x17E)) return even ? c : c + 1;
  if (c == 0x178) return 0xFF;
  if (c >= 0x391 && c <= 0x3A9 && c != 0x3A2) return c + 0x20;
  if (c == 0x386) return 0x3AC;
  if (c >= 0x388 && c <= 0x38A) return c + 0x25;
  if (c == 0x38C) return 0x3CC;
  if (c == 0x38E || c == 0x38F) return c + 0x3F;
  if (c == 0x3C2) return 0x3C3;  // the final sigma is a sigma
  if (c >= 0x400 && c <= 0x40F) return c + 0x50;
  if (c >= 0x410 && c <= 0x42F) return c + 0x20;
  if ((c >= 0x460 && c <= 0x481) || (c >= 0x48A && c <= 0x4BF) || (c >= 0x4D0 && c <= 0x52F))
    return even ? c + 1 : c;
  return c;
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

std::string foldCase(std::string_view text) {
  std::string folded(text);
  for (size_t i = 0; i < folded.size(); ++i) {
    const auto lead = static_cast<unsigned char>(folded[i]);
    if (lead < 0x80) {
      folded[i] = foldASCII(folded[i]);
    } else if (lead >= 0xC2 && lead <= 0xDF && i + 1 < folded.size()) {
      const auto trail = static_cast<unsigned char>(folded[i + 1]);
      if ((trail & 0xC0) != 0x80) continue;
      const unsigned c = foldTwoByteCharacter((lead & 0x1Fu) << 6 | (trail & 0x3Fu));
      folded[i] = static_cast<char>(0xC0 | c >> 6);
      folded[++i] = static_cast<char>(0x80 | (c & 0x3F));
    }
  }
  return folded;
}

bool equalsFolded(std::string_view text, std::string_view folded) {
  if (text.size() != folded.size()) return false;
  for (size_t i = 0; i < text.size(); ++i) {
    if (!isASCII(text[i])) return foldCase(text) == folded;
    if (foldASCII(text[i]) != folded[i]) return false;
  }
  return true;
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && equalsFolded(a, foldCase(b));
}

std::array<uint8_t, 3> versionParts(std::string_view version) {
  std::array<uint8_t, 3> parts{};
  const std::vector<std::string_view> pieces = splitText(version, ".");
  for (size_t i = 0; i < parts.size() && i < pieces.size(); ++i)
    parts[i] = static_cast<uint8_t>(Value(pieces[i]).longLongValue());
  return parts;
}

void appendHex(std::span<const std::byte> bytes, std::string& out) {
  static constexpr char kDigits[] = "0123456789abcdef";
  for (const std::byte byte : bytes) {
    out += kDigits[std::to_integer<unsigned>(byte) >> 4];
    out += kDigits[std::to_integer<unsigned>(byte) & 0xF];
  }
}

}  // namespace kyt
