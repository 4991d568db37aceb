// What waits for one watcher: a ring of shared values, of fixed length. Any thread puts, and never waits: no lock, and what
// finds the ring full is not taken. One thread at a time takes.
#pragma once

#include <atomic>
#include <bit>
#include <cassert>
#include <cstddef>
#include <memory>
#include <utility>
#include <vector>

namespace kyt {

template <typename T>
class WatchRing {
 public:
  // `size`: a power of two.
  explicit WatchRing(size_t size) : places_(size), mask_(size - 1) {
    assert(std::has_single_bit(size));
    for (size_t i = 0; i < size; ++i) places_[i].turn.store(i, std::memory_order_relaxed);
  }

  // False: it is full. A place's turn says whose it is: that of the put number N when it is N, of the take N when it is N+1.
  [[nodiscard]] bool put(std::shared_ptr<const T> value) {
    size_t number = puts_.load(std::memory_order_relaxed);
    for (;;) {
      Place& place = places_[number & mask_];
      const size_t turn = place.turn.load(std::memory_order_acquire);
      const auto ahead = static_cast<std::ptrdiff_t>(turn - number);
      if (ahead < 0) return false;
      if (ahead > 0) {
        number = puts_.load(std::memory_order_relaxed);
      } else if (puts_.compare_exchange_weak(number, number + 1, std::memory_order_relaxed)) {
        place.value = std::move(value);
        place.turn.store(number + 1, std::memory_order_release);
        return true;
      }
    }
  }

  // Whether a put now would be taken, if nobody else puts before.
  [[nodiscard]] bool hasRoom() const {
    const size_t number = puts_.load(std::memory_order_relaxed);
    const size_t turn = places_[number & mask_].turn.load(std::memory_order_acquire);
    return static_cast<std::ptrdiff_t>(turn - number) >= 0;
  }

  // Null: there is none, or it is being put at this moment.
  [[nodiscard]] std::shared_ptr<const T> take() {
    Place& place = places_[takes_ & mask_];
    if (place.turn.load(std::memory_order_acquire) != takes_ + 1) return nullptr;
    std::shared_ptr<const T> value = std::move(place.value);
    place.value = nullptr;
    place.turn.store(takes_ + mask_ + 1, std::memory_order_release);
    ++takes_;
    return value;
  }

 private:
  struct Place {
    std::atomic<size_t> turn{0};
    std::shared_ptr<const T> value;  // of whom the turn names
  };
  std::vector<Place> places_;
  const size_t mask_;
  std::atomic<size_t> puts_{0};
  size_t takes_ = 0;  // the taker's
};

}  // namespace kyt
