#include "platform/linux/data/LinuxRandom.h"

#include <sys/random.h>

#include <cassert>
#include <cerrno>
#include <cstdlib>

namespace kyt {
namespace {

// The kernel fills up to 256 bytes whole once it has entropy, which it has long before this program runs;
// only a signal before that may interrupt. A kernel without the call cannot run this program.
void fill(void* bytes, size_t size) {
  ssize_t filled = 0;
  do {
    filled = getrandom(bytes, size, 0);
  } while (filled < 0 && errno == EINTR);
  if (filled != static_cast<ssize_t>(size)) std::abort();
}

}  // namespace

uint32_t LinuxRandom::uniform(uint32_t bound) {
  assert(bound > 0);
  // Draws below 2^32 modulo the bound would favour the small results, and are drawn again.
  const uint32_t unfair = -bound % bound;
  uint32_t draw = 0;
  do {
    fill(&draw, sizeof draw);
  } while (draw < unfair);
  return draw % bound;
}

std::array<std::byte, 16> LinuxRandom::uuidBytes() {
  std::array<std::byte, 16> bytes{};
  fill(bytes.data(), bytes.size());
  bytes[6] = (bytes[6] & std::byte{0x0F}) | std::byte{0x40};
  bytes[8] = (bytes[8] & std::byte{0x3F}) | std::byte{0x80};
  return bytes;
}

}  // namespace kyt
