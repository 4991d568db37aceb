// The bounded queue between the threads that report and the library's thread: many producers, one consumer,
// no locks (a ring of cells, each with a sequence number that says whose turn it is). push() fails at once
// when there is no room.
#pragma once

#include <atomic>
#include <bit>
#include <cstddef>
#include <memory>
#include <utility>

namespace kyt::client {

template <typename Item>
class MessageRing {
 public:
  // Room for `capacity` items, rounded up to a power of two.
  explicit MessageRing(size_t capacity) : mask_(std::bit_ceil(capacity) - 1), cells_(new Cell[mask_ + 1]) {
    for (size_t i = 0; i <= mask_; ++i) cells_[i].sequence.store(i, std::memory_order_relaxed);
  }

  // Any thread. False, and `item` untouched, when the ring is full.
  bool push(Item&& item) {
    size_t position = tail_.load(std::memory_order_relaxed);
    for (;;) {
      Cell& cell = cells_[position & mask_];
      const size_t sequence = cell.sequence.load(std::memory_order_acquire);
      const auto difference = static_cast<ptrdiff_t>(sequence - position);
      if (difference < 0) return false;
      if (difference > 0) {
        position = tail_.load(std::memory_order_relaxed);
      } else if (tail_.compare_exchange_weak(position, position + 1, std::memory_order_relaxed)) {
        cell.item = std::move(item);
        cell.sequence.store(position + 1, std::memory_order_release);
        return true;
      }
    }
  }

  // The consumer's thread only.
  bool pop(Item& item) {
    const size_t position = head_.load(std::memory_order_relaxed);
    Cell& cell = cells_[position & mask_];
    if (cell.sequence.load(std::memory_order_acquire) != position + 1) return false;
    item = std::move(cell.item);
    cell.item = Item();
    cell.sequence.store(position + mask_ + 1, std::memory_order_release);
    head_.store(position + 1, std::memory_order_relaxed);
    return true;
  }

  // The consumer's thread only: visits what could be popped now, in its place.
  template <typename Visitor>
  void forEach(Visitor&& visit) {
    for (size_t position = head_.load(std::memory_order_relaxed);; ++position) {
      Cell& cell = cells_[position & mask_];
      if (cell.sequence.load(std::memory_order_acquire) != position + 1) return;
      visit(cell.item);
    }
  }

  // A snapshot, possibly stale. Any thread.
  [[nodiscard]] size_t size() const {
    const size_t head = head_.load(std::memory_order_relaxed);
    const size_t tail = tail_.load(std::memory_order_relaxed);
    return tail > head ? tail - head : 0;
  }
  // Consumer's thread: whether something can be popped, or is about to be.
  [[nodiscard]] bool empty() const {
    return tail_.load(std::memory_order_relaxed) == head_.load(std::memory_order_relaxed);
  }

 private:
  struct Cell {
    std::atomic<size_t> sequence{0};
    Item item;
  };
  const size_t mask_;
  std::unique_ptr<Cell[]> cells_;
  alignas(64) std::atomic<size_t> tail_{0};
  alignas(64) std::atomic<size_t> head_{0};
};

}  // namespace kyt::client
