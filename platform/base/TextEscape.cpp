#include "platform/base/TextEscape.h"

#include <algorithm>
#include <cstdint>

#include "platform/base/Hex.h"

namespace kyt {
namespace {

uint8_t byteAt(std::string_view text, size_t index) {
  return static_cast<uint8_t>(text[index]);
}

bool isContinuation(std::string_view text, size_t index) {
  return index < text.size() && (byteAt(text, index) & 0xC0) == 0x80;
}

bool isPlainASCII(char c) {
  return c >= 0x20 && c < 0x7F;
}

// Of a valid sequence of that length.
bool mayBeShown(std::string_view sequence) {
  if (sequence.size() == 1) return isPlainASCII(sequence[0]);
  if (sequence.size() == 2) return !(byteAt(sequence, 0) == 0xC2 && byteAt(sequence, 1) < 0xA0);
  if (sequence.size() == 3 && byteAt(sequence, 0) == 0xE2) {
    const uint8_t last = byteAt(sequence, 2);
    if (byteAt(sequence, 1) == 0x80) return last < 0xA8 || last > 0xAE;
    if (byteAt(sequence, 1) == 0x81) return last < 0xA6 || last > 0xA9;
  }
  return true;
}

// Of a valid sequence of three bytes at most.
uint16_t codeUnit(std::string_view sequence) {
  const auto bits = [&](size_t index) { return byteAt(sequence, index) & 0x3FU; };
  if (sequence.size() == 1) return byteAt(sequence, 0);
  if (sequence.size() == 2) return static_cast<uint16_t>((byteAt(sequence, 0) & 0x1FU) << 6 | bits(1));
  return static_cast<uint16_t>((byteAt(sequence, 0) & 0x0FU) << 12 | bits(1) << 6 | bits(2));
}

void appendEscapedByte(std::string& out, uint8_t byte) {
  switch (byte) {
    case '\t':
      out += "\\t";
      return;
    case '\n':
      out += "\\n";
      return;
    case '\r':
      out += "\\r";
      return;
    default:
      break;
  }
  out += "\\x";
  appendHexByte(byte, out);
}

}  // namespace

size_t utf8SequenceLength(std::string_view text) {
  if (text.empty()) return 0;
  const uint8_t first = byteAt(text, 0);
  if (first < 0x80) return 1;
  if (first < 0xC2 || first > 0xF4) return 0;
  if (!isContinuation(text, 1)) return 0;
  if (first < 0xE0) return 2;
  const uint8_t second = byteAt(text, 1);
  if (first == 0xE0 && second < 0xA0) return 0;  // overlong
  if (first == 0xED && second > 0x9F) return 0;  // a surrogate
  if (!isContinuation(text, 2)) return 0;
  if (first < 0xF0) return 3;
  if (first == 0xF0 && second < 0x90) return 0;  // overlong
  if (first == 0xF4 && second > 0x8F) return 0;  // past U+10FFFF
  return isContinuation(text, 3) ? 4 : 0;
}

bool isValidUTF8(std::string_view text) {
  while (!text.empty()) {
    const size_t length = utf8SequenceLength(text);
    if (length == 0) return false;
    text.remove_prefix(length);
  }
  return true;
}

void appendEscaped(std::string& out, std::string_view text) {
  while (!text.empty()) {
    const auto plain =
        static_cast<size_t>(std::find_if_not(text.begin(), text.end(), isPlainASCII) - text.begin());
    out.append(text.substr(0, plain));
    text.remove_prefix(plain);
    if (text.empty()) return;
    const size_t length = std::max<size_t>(utf8SequenceLength(text), 1);
    const std::string_view sequence = text.substr(0, length);
    if (utf8SequenceLength(text) != 0 && mayBeShown(sequence)) {
      out.append(sequence);
    } else {
      for (char c : sequence) appendEscapedByte(out, static_cast<uint8_t>(c));
    }
    text.remove_prefix(length);
  }
}

std::string escapedText(std::string_view text) {
  std::string out;
  out.reserve(text.size() + 16);
  appendEscaped(out, text);
  return out;
}

std::string escapedJSON(std::string_view json) {
  std::string out;
  out.reserve(json.size() + 16);
  while (!json.empty()) {
    const size_t length = utf8SequenceLength(json);
    const std::string_view sequence = json.substr(0, std::max<size_t>(length, 1));
    if (length != 0 && mayBeShown(sequence)) {
      out.append(sequence);
    } else {
      const uint16_t unit = length != 0 ? codeUnit(sequence) : 0xFFFD;
      out += "\\u";
      appendHexByte(static_cast<uint8_t>(unit >> 8), out);
      appendHexByte(static_cast<uint8_t>(unit & 0xFF), out);
    }
    json.remove_prefix(sequence.size());
  }
  return out;
}

std::string escapedName(std::string_view name) {
  std::string out;
  for (size_t next = 0; (next = name.find('\\')) != name.npos; name.remove_prefix(next + 1)) {
    appendEscaped(out, name.substr(0, next));
    out += "\\x5c";
  }
  appendEscaped(out, name);
  return out;
}

void appendEscapedLines(std::string& out, std::string_view text) {
  for (;;) {
    const size_t end = text.find('\n');
    appendEscaped(out, text.substr(0, end));
    if (end == text.npos) return;
    out += '\n';
    text.remove_prefix(end + 1);
  }
}

bool isPlainLines(std::string_view text) {
  constexpr size_t kPiece =
      64;  // compilers make a few instructions of a loop of constant length without branches
  const auto isOdd = [](char c) { return static_cast<unsigned>(!isPlainASCII(c)) & (c != '\n'); };
  for (; text.size() >= kPiece; text.remove_prefix(kPiece)) {
    unsigned odd = 0;
    for (size_t i = 0; i < kPiece; ++i) odd |= isOdd(text[i]);
    if (odd != 0) return false;
  }
  return std::none_of(text.begin(), text.end(), isOdd);
}

size_t lengthThatFits(std::string_view text, size_t escapedBytes) {
  size_t end = 0;
  for (size_t used = 0; end < text.size();) {
    const std::string_view rest = text.substr(end);
    const size_t length = std::max<size_t>(utf8SequenceLength(rest), 1);
    if (isPlainASCII(rest.front())) {
      ++used;
    } else {
      std::string shown;
      appendEscaped(shown, rest.substr(0, length));
      used += shown.size();
    }
    if (used > escapedBytes) break;
    end += length;
  }
  return end;
}

bool isPlainText(std::string_view text) {
  if (std::all_of(text.begin(), text.end(), isPlainASCII)) return true;
  return escapedText(text).size() == text.size();
}

std::string beginningOf(std::string_view text) {
  constexpr size_t kShort = 12, kShown = 8;
  if (text.size() <= kShort) return std::string(text);
  size_t end = kShown;
  while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) --end;  // not within a character
  return std::string(text.substr(0, end)) + "...";
}

}  // namespace kyt
