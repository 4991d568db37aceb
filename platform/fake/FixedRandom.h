// A random source whose draws a test sets, and whose UUIDs are numbered. Any thread.
#pragma once

#include <deque>
#include <initializer_list>
#include <vector>

#include "platform/RandomSource.h"
#include "platform/base/Mutex.h"

namespace kyt {

class FixedRandom : public RandomSource {
 public:
  // Every draw returns this (modulo its bound) unless draws are queued.
  explicit FixedRandom(uint32_t draw = 0) : draw_(draw) {}

  [[nodiscard]] uint32_t uniform(uint32_t bound) override;
  // The first is 00000000-0000-4000-8000-000000000001, the next ends in 2, and so on.
  [[nodiscard]] std::array<std::byte, 16> uuidBytes() override;

  void setDraw(uint32_t draw);
  void queueDraws(std::initializer_list<uint32_t> draws);  // answered first, in this order
  [[nodiscard]] std::vector<uint32_t> bounds() const;      // asked for so far
  // The UUID of that number, from 1.
  [[nodiscard]] static std::array<std::byte, 16> uuidNumber(uint64_t number);

 private:
  mutable Mutex mutex_;
  uint32_t draw_ GUARDED_BY(mutex_);
  std::deque<uint32_t> queued_ GUARDED_BY(mutex_);
  std::vector<uint32_t> bounds_ GUARDED_BY(mutex_);
  uint64_t uuids_ GUARDED_BY(mutex_) = 0;
};

}  // namespace kyt
