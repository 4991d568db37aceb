// The blocks of strings, data, arrays and dictionaries, and everything about them that need not be inlined;
// the hash index of large dictionaries is in platform/objects/DictionaryIndex.cpp.
//
// Entries are moved with memcpy: a Value or String is 16 bytes that refer to nothing by their own address.
#include "platform/objects/Value.h"

#include <algorithm>
#include <memory>

#include "platform/base/Allocation.h"
#include "platform/objects/DictionaryIndex.h"

namespace kyt {
namespace detail {
namespace {

// Lengths are 32 bits wide; nothing that comes from outside may be nearly as long.
constexpr size_t kMaxBlockSize = UINT32_MAX - 4096;

Block* newBytesBlock(size_t size, size_t extra) {
  if (size > kMaxBlockSize) throw std::bad_alloc();
  return ::new (allocate(sizeof(Block) + size + extra)) Block{{1}, static_cast<uint32_t>(size)};
}

ArrayBlock* newArrayBlock(size_t capacity) {
  if (capacity > kMaxBlockSize / sizeof(Value)) throw std::bad_alloc();
  return ::new (allocate(sizeof(ArrayBlock) + capacity * sizeof(Value)))
      ArrayBlock{{{1}, 0}, static_cast<uint32_t>(capacity), 0};
}

DictionaryBlock* newDictionaryBlock(size_t capacity) {
  if (capacity > kMaxBlockSize / sizeof(DictionaryEntry)) throw std::bad_alloc();
  return ::new (allocate(sizeof(DictionaryBlock) + capacity * sizeof(DictionaryEntry)))
      DictionaryBlock{{{1}, 0}, static_cast<uint32_t>(capacity), 0, nullptr};
}

template <typename Entry>
void copyBytes(Entry* to, const Entry* from, size_t count) noexcept {
  if (count != 0) std::memcpy(static_cast<void*>(to), static_cast<const void*>(from), count * sizeof(Entry));
}
template <typename Entry>
void moveBytes(Entry* to, const Entry* from, size_t count) noexcept {
  std::memmove(static_cast<void*>(to), static_cast<const void*>(from), count * sizeof(Entry));
}

void destroyEntries(DictionaryEntry* entries, size_t count) noexcept {
  std::destroy_n(entries, count);
}

// A block with room for `capacity` entries that holds the given array's: they are moved out of a block
// without other owners, which is freed, and copied from a shared one, which loses a reference.
ArrayBlock* rebuilt(ArrayBlock* old, size_t capacity) {
  ArrayBlock* block = newArrayBlock(capacity);
  if (old == nullptr) return block;
  if (isUnique(old)) {
    copyBytes(block->entries(), old->entries(), old->size);
    block->size = old->size;
    std::free(old);
    return block;
  }
  std::uninitialized_copy_n(old->entries(), old->size, block->entries());
  block->size = old->size;
  if (dropReference(old)) destroyBlock(old, kTagArray);
  return block;
}

DictionaryBlock* rebuilt(DictionaryBlock* old, size_t capacity) {
  DictionaryBlock* block = newDictionaryBlock(capacity);
  if (old == nullptr) return block;
  if (isUnique(old)) {
    copyBytes(block->entries(), old->entries(), old->size);
    block->size = old->size;
    block->index = std::exchange(old->index, nullptr);
    std::free(old);
    return block;
  }
  if (old->index != nullptr) {
    try {
      block->index = copyOfIndex(*old->index);
    } catch (...) {
      std::free(block);
      throw;
    }
  }
  std::uninitialized_copy_n(old->entries(), old->size, block->entries());
  block->size = old->size;
  if (dropReference(old)) destroyBlock(old, kTagDictionary);
  return block;
}

size_t grownCapacity(size_t size) {
  return std::max<size_t>(size + size / 2, size + 4);
}

}  // namespace

void makeHeapText(Cell& cell, std::string_view text) {
  Block* block = newBytesBlock(text.size(), 1);
  std::memcpy(block->text(), text.data(), text.size());
  block->text()[text.size()] = '\0';
  std::memset(&cell, 0, sizeof cell);
  cell.block = block;
  cell.tag = kTagHeapString;
}

void destroyBlock(Block* block, uint8_t tag) noexcept {
  if (tag == kTagArray) {
    std::destroy_n(static_cast<ArrayBlock*>(block)->entries(), block->size);
  } else if (tag == kTagDictionary) {
    auto* dictionary = static_cast<DictionaryBlock*>(block);
    destroyEntries(dictionary->entries(), dictionary->size);
    std::free(dictionary->index);
  }
  std::free(block);
}

}  // namespace detail

using detail::ArrayBlock;
using detail::DictionaryBlock;

String String::permanent(std::string_view text) {
  String string(text);
  if (detail::ownsBlock(string.cell_))
    string.cell_.block->references.store(detail::kPermanent, std::memory_order_relaxed);
  return string;
}

size_t String::utf16Length() const noexcept {
  const std::string_view text = view();
  size_t units = 0;
  for (size_t i = 0; i < text.size(); ++units) {
    const auto byte = static_cast<unsigned char>(text[i]);
    size_t length = byte >= 0xF0 && byte < 0xF5   ? 4
                    : byte >= 0xE0 && byte < 0xF0 ? 3
                    : byte >= 0xC2 && byte < 0xE0 ? 2
                                                  : 1;
    bool whole = i + length <= text.size();
    for (size_t k = 1; whole && k < length; ++k)
      whole = (static_cast<unsigned char>(text[i + k]) & 0xC0) == 0x80;
    if (!whole) length = 1;
    if (length == 4) ++units;  // a surrogate pair
    i += length;
  }
  return units;
}

Data::Data(std::span<const std::byte> bytes) {
  if (bytes.empty()) return;
  block_ = detail::newBytesBlock(bytes.size(), 0);
  std::memcpy(block_->text(), bytes.data(), bytes.size());
}

Data Data::uninitialized(size_t size, std::byte*& bytes) {
  Data data;
  bytes = nullptr;
  if (size == 0) return data;
  data.block_ = detail::newBytesBlock(size, 0);
  bytes = reinterpret_cast<std::byte*>(data.block_->text());
  return data;
}

void Data::truncate(size_t newSize) noexcept {
  assert(newSize <= size());
  if (block_ == nullptr) return;
  assert(detail::isUnique(block_));
  if (newSize == 0) {
    *this = Data();
  } else {
    block_->size = static_cast<uint32_t>(newSize);
  }
}

Array::Array(std::initializer_list<Value> values) {
  if (values.size() != 0) reserve(values.size());
  for (const Value& value : values) append(value);
}

void Array::reserve(size_t capacity) {
  auto* block = static_cast<ArrayBlock*>(block_);
  if (block != nullptr && capacity <= block->capacity && detail::isUnique(block)) return;
  if (block == nullptr && capacity == 0) return;
  block_ = detail::rebuilt(block, std::max(capacity, size()));
}

void Array::removeAt(size_t index) {
  assert(index < size());
  Value* entries = mutableBegin();
  std::destroy_at(entries + index);
  detail::moveBytes(entries + index, entries + index + 1, size() - index - 1);
  --block_->size;
}

Value* Array::mutableBegin() {
  if (block_ == nullptr) return nullptr;
  if (!detail::isUnique(block_)) reserve(size());
  return static_cast<ArrayBlock*>(block_)->entries();
}

bool operator==(const Array& a, const Array& b) noexcept {
  return a.block_ == b.block_ || std::equal(a.begin(), a.end(), b.begin(), b.end());
}

Dictionary::Dictionary(std::initializer_list<std::pair<String, Value>> entries) {
  if (entries.size() != 0) reserve(entries.size());
  for (const auto& [key, value] : entries) set(key, value);
}

void Dictionary::reserve(size_t capacity) {
  auto* block = static_cast<DictionaryBlock*>(block_);
  if (block != nullptr && capacity <= block->capacity && detail::isUnique(block)) return;
  if (block == nullptr && capacity == 0) return;
  block_ = detail::rebuilt(block, std::max(capacity, size()));
}

const Value* Dictionary::findSlowly(std::string_view key) const noexcept {
  auto* block = static_cast<DictionaryBlock*>(block_);
  if (block->index != nullptr) {
    const uint32_t position = detail::findInIndex(*block, key);
    return position == detail::kNotFound ? nullptr : &block->entries()[position].value;
  }
  for (const DictionaryEntry& entry : *this)
    if (entry.key.view() == key) return &entry.value;
  return nullptr;
}

void Dictionary::appendSlowly(String key, Value value) {
  const size_t count = size();
  auto* block = static_cast<DictionaryBlock*>(block_);
  if (block == nullptr || count == block->capacity) {
    reserve(detail::grownCapacity(count));
  } else {
    reserve(block->capacity);
  }
  block = static_cast<DictionaryBlock*>(block_);
  if (count >= detail::kMaxScanned) detail::addToIndex(*block, key.view());
  ::new (static_cast<void*>(block->entries() + count)) DictionaryEntry{std::move(key), std::move(value)};
  ++block->size;
}

Dictionary Dictionary::takingOver(DictionaryEntry* entries, size_t count) {
  assert(count <= detail::kMaxScanned);
  Dictionary taken;
  if (count == 0) return taken;
  DictionaryBlock* block = detail::newDictionaryBlock(count);
  detail::moveBytes(block->entries(), entries, count);
  block->size = static_cast<uint32_t>(count);
  taken.block_ = block;
  return taken;
}

Value Dictionary::take(std::string_view key) noexcept {
  const Value* found = find(key);
  if (found == nullptr) return {};
  if (!detail::isUnique(block_)) return *found;
  return std::move(*const_cast<Value*>(found));
}

bool Dictionary::remove(std::string_view key) {
  const Value* found = find(key);
  if (found == nullptr) return false;
  const auto position = static_cast<size_t>(detail::entryOf(found) - begin());
  DictionaryEntry* entries = mutableEntries();
  auto* block = static_cast<DictionaryBlock*>(block_);
  if (block->index != nullptr) detail::removeFromIndex(*block, static_cast<uint32_t>(position));
  std::destroy_at(entries + position);
  detail::moveBytes(entries + position, entries + position + 1, size() - position - 1);
  --block->size;
  return true;
}

void Dictionary::merge(const Dictionary& other) {
  if (empty()) {
    *this = other;
    return;
  }
  const Dictionary source(other);  // NOLINT(performance-*): other may be this very object
  for (const DictionaryEntry& entry : source) set(entry.key, entry.value);
}

DictionaryEntry* Dictionary::mutableEntries() {
  if (block_ == nullptr) return nullptr;
  if (!detail::isUnique(block_)) reserve(size());
  return static_cast<DictionaryBlock*>(block_)->entries();
}

void Dictionary::eraseMarked(size_t newSize) noexcept {
  auto* block = static_cast<DictionaryBlock*>(block_);
  detail::destroyEntries(block->entries() + newSize, block->size - newSize);
  block->size = static_cast<uint32_t>(newSize);
  if (block->index != nullptr) detail::refillIndex(*block);
}

bool operator==(const Dictionary& a, const Dictionary& b) noexcept {
  if (a.block_ == b.block_) return true;
  if (a.size() != b.size()) return false;
  return std::all_of(a.begin(), a.end(), [&b](const DictionaryEntry& entry) {
    const Value* other = b.find(entry.key);
    return other != nullptr && *other == entry.value;
  });
}

}  // namespace kyt
