// The hash index of a dictionary of more than kMaxScanned entries: open addressing, at most two thirds full,
// from the hash of a key to the position of its entry. Used by Value.cpp alone.
//
// Keys come from clients, tens of thousands in one message, so the hash is SipHash-1-3 under a key drawn once
// for the process: nobody outside can choose keys that collide. Each slot keeps its hash, so growing and
// removing hash nothing.
#pragma once

#include <cstdint>
#include <string_view>

#include "platform/objects/Value.h"

namespace kyt::detail {

struct IndexSlot {
  uint32_t place = 0;  // the entry's position plus 1; 0: free
  uint32_t hash = 0;
};

struct IndexBlock {
  uint32_t mask;  // number of slots, a power of two, minus 1
  uint32_t unused;
  [[nodiscard]] IndexSlot* slots() noexcept { return reinterpret_cast<IndexSlot*>(this + 1); }
};

inline constexpr uint32_t kNotFound = UINT32_MAX;

// Position or kNotFound.
[[nodiscard]] uint32_t findInIndex(DictionaryBlock& block, std::string_view key) noexcept;
// Before the entry at position block.size is made: enters it, making or growing the index when needed.
void addToIndex(DictionaryBlock& block, std::string_view key);
// Before the entry at that position is removed: the later ones move down by one. Frees the index when few are
// left.
void removeFromIndex(DictionaryBlock& block, uint32_t position) noexcept;
// After entries changed places or went: enters all again, or frees the index when few are left.
void refillIndex(DictionaryBlock& block) noexcept;
[[nodiscard]] IndexBlock* copyOfIndex(IndexBlock& index);

}  // namespace kyt::detail
