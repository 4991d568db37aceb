#include "platform/objects/DictionaryIndex.h"

#include <chrono>
#include <exception>
#include <random>

#include "platform/base/Allocation.h"

namespace kyt::detail {
namespace {

struct HashKey {
  uint64_t first;
  uint64_t second;
};

HashKey drawHashKey() noexcept {
  try {
    std::random_device device;
    const auto draw = [&device] { return static_cast<uint64_t>(device()) << 32 | device(); };
    const uint64_t first = draw();
    return {first, draw()};
  } catch (const std::exception&) {  // no source of randomness: what an outsider knows least
    const auto ticks =
        static_cast<uint64_t>(std::chrono::high_resolution_clock::now().time_since_epoch().count());
    return {ticks * 0x9E3779B97F4A7C15U, reinterpret_cast<uint64_t>(&drawHashKey) ^ ticks};
  }
}

const HashKey& hashKey() noexcept {
  static const HashKey key = drawHashKey();
  return key;
}

// Drawn when the program starts, before confinement could refuse it.
[[maybe_unused]] const HashKey& drawnAtStart = hashKey();

struct SipState {
  uint64_t a, b, c, d;
  void round() noexcept {
    a += b, b = std::rotl(b, 13) ^ a, a = std::rotl(a, 32);
    c += d, d = std::rotl(d, 16) ^ c;
    a += d, d = std::rotl(d, 21) ^ a;
    c += b, b = std::rotl(b, 17) ^ c, c = std::rotl(c, 32);
  }
  void take(uint64_t word) noexcept {
    d ^= word;
    round();
    a ^= word;
  }
};

uint32_t hashOf(std::string_view text) noexcept {
  const HashKey& key = hashKey();
  SipState state{key.first ^ 0x736f6d6570736575U, key.second ^ 0x646f72616e646f6dU,
                 key.first ^ 0x6c7967656e657261U, key.second ^ 0x7465646279746573U};
  size_t i = 0;
  for (; i + 8 <= text.size(); i += 8) state.take(load64(text.data() + i));
  uint64_t last = static_cast<uint64_t>(text.size()) << 56;
  for (size_t shift = 0; i < text.size(); ++i, shift += 8)
    last |= static_cast<uint64_t>(static_cast<unsigned char>(text[i])) << shift;
  state.take(last);
  state.c ^= 0xFF;
  for (int i3 = 0; i3 < 3; ++i3) state.round();
  return static_cast<uint32_t>(state.a ^ state.b ^ state.c ^ state.d);
}

IndexBlock* newIndex(size_t capacity) {
  const size_t slots = std::bit_ceil(capacity + capacity / 2);
  void* memory = allocateZeros(sizeof(IndexBlock) + slots * sizeof(IndexSlot));
  return ::new (memory) IndexBlock{static_cast<uint32_t>(slots - 1), 0};
}

void enter(IndexBlock& index, IndexSlot slot) noexcept {
  uint32_t at = slot.hash & index.mask;
  while (index.slots()[at].place != 0) at = (at + 1) & index.mask;
  index.slots()[at] = slot;
}

void enterAll(DictionaryBlock& block, IndexBlock& index) noexcept {
  for (uint32_t i = 0; i < block.size; ++i) enter(index, {i + 1, hashOf(block.entries()[i].key.view())});
}

}  // namespace

uint32_t findInIndex(DictionaryBlock& block, std::string_view key) noexcept {
  const uint32_t hash = hashOf(key);
  IndexBlock& index = *block.index;
  for (uint32_t at = hash & index.mask; index.slots()[at].place != 0; at = (at + 1) & index.mask) {
    const IndexSlot slot = index.slots()[at];
    if (slot.hash == hash && block.entries()[slot.place - 1].key.view() == key) return slot.place - 1;
  }
  return kNotFound;
}

void addToIndex(DictionaryBlock& block, std::string_view key) {
  if (block.index == nullptr) {
    IndexBlock* made = newIndex(block.capacity);
    enterAll(block, *made);
    block.index = made;
  } else if (block.size >= (block.index->mask + size_t{1}) / 3 * 2) {
    IndexBlock* grown = newIndex(block.capacity);
    for (size_t i = 0; i <= block.index->mask; ++i)
      if (block.index->slots()[i].place != 0) enter(*grown, block.index->slots()[i]);
    std::free(block.index);
    block.index = grown;
  }
  enter(*block.index, {block.size + 1, hashOf(key)});
}

void removeFromIndex(DictionaryBlock& block, uint32_t position) noexcept {
  if (block.size - 1 <= kMaxScanned) {
    std::free(std::exchange(block.index, nullptr));
    return;
  }
  IndexBlock& index = *block.index;
  uint32_t hole = 0;
  for (uint32_t i = 0; i <= index.mask; ++i) {
    IndexSlot& slot = index.slots()[i];
    if (slot.place == position + 1) {
      hole = i;
    } else if (slot.place > position + 1) {
      --slot.place;
    }
  }
  // What follows the hole in its run moves up, unless it already stands where its search begins.
  index.slots()[hole] = {};
  for (uint32_t at = (hole + 1) & index.mask; index.slots()[at].place != 0; at = (at + 1) & index.mask) {
    const uint32_t home = index.slots()[at].hash & index.mask;
    if (((at - home) & index.mask) < ((at - hole) & index.mask)) continue;
    index.slots()[hole] = std::exchange(index.slots()[at], {});
    hole = at;
  }
}

void refillIndex(DictionaryBlock& block) noexcept {
  if (block.size <= kMaxScanned) {
    std::free(std::exchange(block.index, nullptr));
    return;
  }
  std::fill_n(block.index->slots(), block.index->mask + size_t{1}, IndexSlot{});
  enterAll(block, *block.index);
}

IndexBlock* copyOfIndex(IndexBlock& index) {
  const size_t size = sizeof(IndexBlock) + (index.mask + size_t{1}) * sizeof(IndexSlot);
  return static_cast<IndexBlock*>(std::memcpy(allocate(size), &index, size));
}

}  // namespace kyt::detail
