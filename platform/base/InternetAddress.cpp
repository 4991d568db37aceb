#include "platform/base/InternetAddress.h"

#include <optional>

#include "platform/base/Hex.h"

namespace kyt {

namespace {

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}
bool isBlank(char c) {
  return c == ' ' || (c >= '\t' && c <= '\r');
}

unsigned digitValue(char c) {
  return static_cast<unsigned>(hexDigit(c));  // far above every base where it is none
}

// One number from the front of the text, in the base that its beginning says.
std::optional<uint32_t> takeNumber(std::string_view& text) {
  if (text.empty() || !isDigit(text[0])) return std::nullopt;
  unsigned base = 10;
  if (text.starts_with("0x") || text.starts_with("0X")) {
    base = 16;
    text.remove_prefix(2);
    if (text.empty() || digitValue(text[0]) >= 16) return std::nullopt;
  } else if (text[0] == '0') {
    base = 8;
  }
  uint64_t number = 0;
  while (!text.empty() && digitValue(text[0]) < base) {
    number = number * base + digitValue(text[0]);
    if (number > UINT32_MAX) return std::nullopt;
    text.remove_prefix(1);
  }
  return static_cast<uint32_t>(number);
}

}  // namespace

uint32_t ipv4Address(std::string_view text) {
  text = text.substr(0, text.find('\0'));
  uint32_t address = 0;
  for (unsigned bitsLeft = 32;;) {
    const std::optional<uint32_t> number = takeNumber(text);
    if (!number) return kNoIPv4Address;
    if (!text.empty() && text[0] == '.') {
      bitsLeft -= 8;
      if (bitsLeft == 0 || *number > 0xFF) return kNoIPv4Address;
      address |= *number << bitsLeft;
      text.remove_prefix(1);
      continue;
    }
    if (!text.empty() && !isBlank(text[0])) return kNoIPv4Address;
    if (bitsLeft < 32 && *number >> bitsLeft != 0) return kNoIPv4Address;
    return address | *number;
  }
}

}  // namespace kyt
