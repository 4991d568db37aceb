#include "platform/fake/FixedRandom.h"

#include <cassert>

namespace kyt {

uint32_t FixedRandom::uniform(uint32_t bound) {
  assert(bound > 0);
  MutexLock lock(mutex_);
  bounds_.push_back(bound);
  if (queued_.empty()) return draw_ % bound;
  const uint32_t draw = queued_.front();
  queued_.pop_front();
  return draw % bound;
}

std::array<std::byte, 16> FixedRandom::uuidBytes() {
  MutexLock lock(mutex_);
  return uuidNumber(++uuids_);
}

std::array<std::byte, 16> FixedRandom::uuidNumber(uint64_t number) {
  std::array<std::byte, 16> bytes{};
  bytes[6] = std::byte{0x40};
  bytes[8] = std::byte{0x80};
  for (size_t i = 15; i > 8; --i, number >>= 8) bytes[i] = static_cast<std::byte>(number & 0xFF);
  return bytes;
}

void FixedRandom::setDraw(uint32_t draw) {
  MutexLock lock(mutex_);
  draw_ = draw;
}

void FixedRandom::queueDraws(std::initializer_list<uint32_t> draws) {
  MutexLock lock(mutex_);
  queued_.insert(queued_.end(), draws);
}

std::vector<uint32_t> FixedRandom::bounds() const {
  MutexLock lock(mutex_);
  return bounds_;
}

}  // namespace kyt
