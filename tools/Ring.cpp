#include "tools/Ring.h"

#include <span>

#include "platform/Cryptography.h"

namespace kyt::tools {

uint32_t ringOf(std::string_view identifier, Cryptography& cryptography) {
  const std::string text = "kytreporting-ring:" + std::string(identifier);
  const auto digest = cryptography.sha256(std::as_bytes(std::span(text)));
  uint64_t number = 0;
  for (size_t i = 0; i < 8; ++i) number = number << 8U | std::to_integer<uint64_t>(digest[i]);
  return static_cast<uint32_t>(number % kRings);
}

std::string ringText(uint32_t ring) {
  return std::string(1, static_cast<char>('0' + ring / 10)) + static_cast<char>('0' + ring % 10);
}

std::optional<std::string> addressOfRing(std::string_view address, uint32_t ring) {
  constexpr std::string_view kPlace = "{ring}";
  std::string out(address);
  size_t at = out.find(kPlace);
  if (at == std::string::npos) return std::nullopt;
  for (; at != std::string::npos; at = out.find(kPlace, at)) out.replace(at, kPlace.size(), ringText(ring));
  return out;
}

}  // namespace kyt::tools
