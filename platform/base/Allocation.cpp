#include "platform/base/Allocation.h"

#include <atomic>
#include <cstdlib>
#include <new>

namespace kyt {
namespace {

template <typename Try>
void* insist(Try tryOnce) {
  for (;;) {
    if (void* const memory = tryOnce()) return memory;
    const std::new_handler handler = std::get_new_handler();
    if (handler == nullptr) throw std::bad_alloc();
    handler();
  }
}

std::atomic<bool> wasRefused{false};

}  // namespace

void* allocate(size_t bytes) {
  return insist([bytes] { return std::malloc(bytes); });
}

void* allocateZeros(size_t bytes) {
  return insist([bytes] { return std::calloc(1, bytes); });
}

bool memoryWasRefused() {
  return wasRefused.load(std::memory_order_relaxed);
}

void setMemoryWasRefused(bool was) {
  wasRefused.store(was, std::memory_order_relaxed);
}

}  // namespace kyt
