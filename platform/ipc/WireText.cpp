#include "platform/ipc/WireText.h"

#include <array>
#include <cstdint>
#include <cstring>

#include "platform/ipc/Wire.h"

namespace kyt::wire {
namespace {

constexpr uint8_t kLetter = 1, kDigit = 2, kHyphen = 4;  // a letter or an underscore

constexpr std::array<uint8_t, 256> makeClasses() {
  std::array<uint8_t, 256> classes{};
  for (int c = 'A'; c <= 'Z'; ++c) classes[static_cast<size_t>(c)] = kLetter;
  for (int c = 'a'; c <= 'z'; ++c) classes[static_cast<size_t>(c)] = kLetter;
  for (int c = '0'; c <= '9'; ++c) classes[static_cast<size_t>(c)] = kDigit;
  classes['_'] = kLetter;
  classes['-'] = kHyphen;
  return classes;
}
constexpr std::array<uint8_t, 256> kClasses = makeClasses();

bool is(char c, unsigned classes) {
  return (kClasses[static_cast<uint8_t>(c)] & classes) != 0;
}

uint64_t load(const char* at) {
  uint64_t word;
  std::memcpy(&word, at, sizeof word);
  return word;
}

// The length of the well-formed sequence that begins with a byte that is no ASCII, or 0.
size_t sequenceLength(const unsigned char* at, size_t left) {
  const auto continues = [&](size_t i) { return (at[i] & 0xC0) == 0x80; };
  const unsigned char lead = at[0];
  if (lead < 0xC2) return 0;
  if (lead < 0xE0) return left >= 2 && continues(1) ? 2 : 0;
  if (lead < 0xF0) {
    if (left < 3 || !continues(1) || !continues(2)) return 0;
    if (lead == 0xE0 && at[1] < 0xA0) return 0;  // overlong
    if (lead == 0xED && at[1] > 0x9F) return 0;  // surrogates
    return 3;
  }
  if (lead > 0xF4 || left < 4 || !continues(1) || !continues(2) || !continues(3)) return 0;
  if (lead == 0xF0 && at[1] < 0x90) return 0;  // overlong
  if (lead == 0xF4 && at[1] > 0x8F) return 0;  // above U+10FFFF
  return 4;
}

// Elements of letters, digits and underscores (and hyphens where admitted) between dots, at least two of
// them.
bool isDottedName(std::string_view name, bool hyphens, bool digitsMayLead) noexcept {
  if (name.size() > kMaxNameBytes) return false;
  const unsigned leading =
      kLetter | (hyphens ? unsigned{kHyphen} : 0u) | (digitsMayLead ? unsigned{kDigit} : 0u);
  const unsigned following = leading | kDigit;
  bool dotted = false, atStart = true;
  for (char c : name) {
    if (c == '.') {
      if (atStart) return false;
      dotted = atStart = true;
    } else {
      if (!is(c, atStart ? leading : following)) return false;
      atStart = false;
    }
  }
  return dotted && !atStart;
}

constexpr std::string_view kBasicTypes = "ybnqiuxtdsogh";
bool isBasic(char type) {
  return kBasicTypes.find(type) != std::string_view::npos;
}

constexpr int kMaxSignatureArrays = 32;
constexpr int kMaxSignatureStructs = 32;

// The length of the complete type at the beginning of `s`, or 0 when there is none.
size_t completeType(std::string_view s, int arrays, int structs) noexcept {
  if (s.empty()) return 0;
  if (isBasic(s[0]) || s[0] == 'v') return 1;
  if (s[0] == '(') {
    if (structs == kMaxSignatureStructs) return 0;
    size_t at = 1;
    while (at < s.size() && s[at] != ')') {
      const size_t length = completeType(s.substr(at), arrays, structs + 1);
      if (length == 0) return 0;
      at += length;
    }
    return at < s.size() && at > 1 ? at + 1 : 0;
  }
  if (s[0] != 'a' || arrays == kMaxSignatureArrays || s.size() < 2) return 0;
  if (s[1] != '{') {
    const size_t element = completeType(s.substr(1), arrays + 1, structs);
    return element == 0 ? 0 : element + 1;
  }
  if (structs == kMaxSignatureStructs || s.size() < 5 || !isBasic(s[2])) return 0;
  const size_t value = completeType(s.substr(3), arrays + 1, structs + 1);
  const size_t closing = 3 + value;
  return value != 0 && closing < s.size() && s[closing] == '}' ? closing + 1 : 0;
}

}  // namespace

bool isValidUnicode(std::string_view text) noexcept {
  const auto* at = reinterpret_cast<const unsigned char*>(text.data());
  const unsigned char* const end = at + text.size();
  while (at != end) {
    if (end - at >= 8 && notPlain(load(reinterpret_cast<const char*>(at))) == 0) {
      at += 8;
    } else if (*at < 0x80) {
      if (*at == 0) return false;
      ++at;
    } else {
      const size_t length = sequenceLength(at, static_cast<size_t>(end - at));
      if (length == 0) return false;
      at += length;
    }
  }
  return true;
}

void appendValidText(std::string_view text, std::string& out) {
  if (isValidText(text)) {
    out.append(text);
    return;
  }
  const auto* at = reinterpret_cast<const unsigned char*>(text.data());
  const unsigned char* const end = at + text.size();
  while (at != end) {
    const bool plain = *at < 0x80 && *at != 0;
    const size_t length = plain ? 1 : *at == 0 ? 0 : sequenceLength(at, static_cast<size_t>(end - at));
    if (length == 0) {
      out.append("\xEF\xBF\xBD");
      ++at;
    } else {
      out.append(reinterpret_cast<const char*>(at), length);
      at += length;
    }
  }
}

bool isValidObjectPath(std::string_view path) noexcept {
  if (path.empty() || path[0] != '/') return false;
  if (path.size() == 1) return true;
  bool atStart = true;
  for (char c : path.substr(1)) {
    if (c == '/') {
      if (atStart) return false;
      atStart = true;
    } else {
      if (!is(c, kLetter | kDigit)) return false;
      atStart = false;
    }
  }
  return !atStart;
}

bool isValidInterfaceName(std::string_view name) noexcept {
  return isDottedName(name, false, false);
}

bool isValidMemberName(std::string_view name) noexcept {
  if (name.empty() || name.size() > kMaxNameBytes || is(name[0], kDigit)) return false;
  for (char c : name) {
    if (!is(c, kLetter | kDigit)) return false;
  }
  return true;
}

bool isValidBusName(std::string_view name) noexcept {
  if (!name.empty() && name[0] == ':') return isDottedName(name.substr(1), true, true);
  return isDottedName(name, true, false);
}

bool isValidSignature(std::string_view signature) noexcept {
  if (signature.size() > kMaxSignatureBytes) return false;
  while (!signature.empty()) {
    const size_t length = completeType(signature, 0, 0);
    if (length == 0) return false;
    signature.remove_prefix(length);
  }
  return true;
}

bool isValidSingleSignature(std::string_view signature) noexcept {
  return !signature.empty() && signature.size() <= kMaxSignatureBytes &&
         completeType(signature, 0, 0) == signature.size();
}

size_t firstTypeLength(std::string_view signature) noexcept {
  return completeType(signature, 0, 0);
}

size_t alignmentOf(char type) noexcept {
  switch (type) {
    case 'n':
    case 'q':
      return 2;
    case 'b':
    case 'i':
    case 'u':
    case 's':
    case 'o':
    case 'a':
    case 'h':
      return 4;
    case 'x':
    case 't':
    case 'd':
    case '(':
    case '{':
      return 8;
    default:
      return 1;
  }
}

}  // namespace kyt::wire
