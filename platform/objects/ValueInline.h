// The parts of platform/objects/Value.h that stand on the road of every event and so must be inlined: blocks,
// reference counts, short strings, look-ups in small dictionaries. Included by Value.h alone.
//
// A reference count whose highest bit is set belongs to a permanent string and is never changed. Whoever
// reads a count of one is the block's only owner: nobody else can add a reference, so the block may be
// changed or freed without an atomic exchange.
#pragma once

#include <atomic>
#include <bit>
#include <cassert>
#include <cstdlib>
#include <new>

#include "platform/objects/Value.h"

namespace kyt {
namespace detail {

// A string's or data's bytes follow at once; a string's end in a NUL that `size` does not count.
struct KYT_OBJECT Block {
  std::atomic<uint32_t> references;
  uint32_t size;  // bytes, or entries
  [[nodiscard]] char* text() noexcept { return reinterpret_cast<char*>(this + 1); }
  [[nodiscard]] const char* text() const noexcept { return reinterpret_cast<const char*>(this + 1); }
};

struct KYT_OBJECT ArrayBlock : Block {
  uint32_t capacity;
  uint32_t unused;
  [[nodiscard]] Value* entries() noexcept { return reinterpret_cast<Value*>(this + 1); }
};

struct IndexBlock;

struct KYT_OBJECT alignas(8) DictionaryBlock : Block {
  uint32_t capacity;
  uint32_t unused;
  IndexBlock* index;  // null up to kMaxScanned entries
  [[nodiscard]] DictionaryEntry* entries() noexcept { return reinterpret_cast<DictionaryEntry*>(this + 1); }
};
static_assert(sizeof(Block) == 8 && sizeof(ArrayBlock) == 16 && sizeof(DictionaryBlock) == 24);

inline constexpr uint32_t kMaxScanned = 32;          // entries of a dictionary that is searched by scanning
inline constexpr uint32_t kPermanent = 0x80000000U;  // the bit of a count that is not counted
inline constexpr size_t kMaxInlineText = 15;

// Frees a block without owners and releases what it refers to.
void destroyBlock(Block* block, uint8_t tag) noexcept;

inline void retainBlock(Block* block) noexcept {
  if ((block->references.load(std::memory_order_relaxed) & kPermanent) == 0)
    block->references.fetch_add(1, std::memory_order_relaxed);
}

inline bool dropReference(Block* block) noexcept {  // whether that was the last one
  const uint32_t references = block->references.load(std::memory_order_acquire);
  if (references == 1) return true;
  if ((references & kPermanent) != 0) return false;
  return block->references.fetch_sub(1, std::memory_order_acq_rel) == 1;
}

inline bool isUnique(const Block* block) noexcept {
  return block->references.load(std::memory_order_acquire) == 1;
}

inline void retain(const Cell& cell) noexcept {
  retainBlock(cell.block);
}
inline void release(const Cell& cell) noexcept {
  if (dropReference(cell.block)) destroyBlock(cell.block, cell.tag);
}

inline uint64_t secondWord(const Cell& cell) noexcept {
  uint64_t word;
  std::memcpy(&word, cell.pad, sizeof word);
  return word;
}
inline bool sameWords(const Cell& a, const Cell& b) noexcept {
  return ((a.word ^ b.word) | (secondWord(a) ^ secondWord(b))) == 0;
}

inline uint64_t load64(const char* bytes) noexcept {
  uint64_t word;
  std::memcpy(&word, bytes, sizeof word);
  return word;
}
inline uint32_t load32(const char* bytes) noexcept {
  uint32_t word;
  std::memcpy(&word, bytes, sizeof word);
  return word;
}

// The cell of a text of up to 15 bytes, read with few overlapping loads and none past its end.
inline void makeInlineText(Cell& cell, const char* bytes, size_t size) noexcept {
  if constexpr (std::endian::native == std::endian::little) {
    uint64_t low = 0;
    uint64_t high = static_cast<uint64_t>(kMaxInlineText - size) << 56;
    if (size > 8) {
      low = load64(bytes);
      high |= load64(bytes + size - 8) >> (8 * (16 - size));
    } else if (size == 8) {
      low = load64(bytes);
    } else if (size >= 4) {
      low = load32(bytes) | static_cast<uint64_t>(load32(bytes + size - 4)) << (8 * (size - 4));
    } else if (size > 0) {
      const auto at = [bytes](size_t i) {
        return static_cast<uint64_t>(static_cast<unsigned char>(bytes[i]));
      };
      low = at(0) | at(size / 2) << (8 * (size / 2)) | at(size - 1) << (8 * (size - 1));
    }
    cell.word = low;
    std::memcpy(cell.pad, &high, sizeof high);
  } else {
    std::memset(&cell, 0, sizeof cell);
    std::memcpy(&cell, bytes, size);
    cell.tag = static_cast<uint8_t>(kMaxInlineText - size);
  }
}

void makeHeapText(Cell& cell, std::string_view text);

inline void makeText(Cell& cell, std::string_view text) {
  if (text.size() <= kMaxInlineText) {
    makeInlineText(cell, text.data(), text.size());
  } else {
    makeHeapText(cell, text);
  }
}

inline std::string_view textOf(const Cell& cell) noexcept {
  if (cell.tag == kTagHeapString) return {cell.block->text(), cell.block->size};
  return {cell.text(), kMaxInlineText - cell.tag};
}

inline bool sameText(const Cell& a, const Cell& b) noexcept {
  if (sameWords(a, b)) return true;
  if (a.tag != kTagHeapString || b.tag != kTagHeapString) return false;
  return textOf(a) == textOf(b);
}

// The entry that a value found in a dictionary belongs to.
inline const DictionaryEntry* entryOf(const Value* value) noexcept {
  return reinterpret_cast<const DictionaryEntry*>(reinterpret_cast<const char*>(value) -
                                                  offsetof(DictionaryEntry, value));
}

// The whole cell but its first eight bytes: zeros and the tag.
inline void makeScalar(Cell& cell, uint64_t word, Tag tag) noexcept {
  cell.word = word;
  std::memset(cell.pad, 0, sizeof cell.pad);
  cell.tag = tag;
}

}  // namespace detail

inline String::String(std::string_view text) {
  detail::makeText(cell_, text);
}

inline String& String::operator=(const String& other) noexcept {
  if (detail::ownsBlock(other.cell_)) detail::retain(other.cell_);
  const detail::Cell old = cell_;
  cell_ = other.cell_;
  if (detail::ownsBlock(old)) detail::release(old);
  return *this;
}

inline String& String::operator=(String&& other) noexcept {
  const detail::Cell old = cell_;
  cell_ = other.cell_;
  other.makeEmpty();
  if (detail::ownsBlock(old)) detail::release(old);
  return *this;
}

inline std::string_view String::view() const noexcept {
  return detail::textOf(cell_);
}

inline bool operator==(const String& a, const String& b) noexcept {
  return detail::sameText(a.cell_, b.cell_);
}

inline Data::Data(const Data& other) noexcept : block_(other.block_) {
  if (block_ != nullptr) detail::retainBlock(block_);
}
inline Data::~Data() {
  if (block_ != nullptr && detail::dropReference(block_)) detail::destroyBlock(block_, detail::kTagData);
}
inline Data& Data::operator=(const Data& other) noexcept {
  Data copy(other);
  std::swap(block_, copy.block_);
  return *this;
}
inline Data& Data::operator=(Data&& other) noexcept {
  Data taken(std::move(other));
  std::swap(block_, taken.block_);
  return *this;
}
inline std::string_view Data::view() const noexcept {
  return block_ == nullptr ? std::string_view() : std::string_view(block_->text(), block_->size);
}
inline std::span<const std::byte> Data::bytes() const noexcept {
  return std::as_bytes(std::span(view().data(), view().size()));
}

inline Value::Value(bool value) noexcept {
  detail::makeScalar(cell_, static_cast<uint64_t>(value), detail::kTagBoolean);
}
inline Value::Value(long long value) noexcept {
  detail::makeScalar(cell_, static_cast<uint64_t>(value), detail::kTagInteger);
}
inline Value::Value(unsigned long long value) noexcept {
  detail::makeScalar(cell_, value, detail::kTagUnsigned);
}
inline Value::Value(double value) noexcept {
  detail::makeScalar(cell_, std::bit_cast<uint64_t>(value), detail::kTagDouble);
}
inline Value::Value(Date value) noexcept {
  detail::makeScalar(cell_, std::bit_cast<uint64_t>(value.secondsSince1970), detail::kTagDate);
}
inline Value::Value(std::string_view text) {
  detail::makeText(cell_, text);
}
inline Value::Value(const String& text) noexcept : cell_(text.cell_) {
  if (detail::ownsBlock(cell_)) detail::retain(cell_);
}
inline Value::Value(String&& text) noexcept : cell_(text.cell_) {
  text.makeEmpty();
}
inline Value::Value(Data data) noexcept {
  detail::makeScalar(cell_, 0, detail::kTagData);
  cell_.block = std::exchange(data.block_, nullptr);
}
inline Value::Value(Array array) noexcept {
  detail::makeScalar(cell_, 0, detail::kTagArray);
  cell_.block = std::exchange(array.block_, nullptr);
}
inline Value::Value(Dictionary dictionary) noexcept {
  detail::makeScalar(cell_, 0, detail::kTagDictionary);
  cell_.block = std::exchange(dictionary.block_, nullptr);
}

inline Value& Value::operator=(const Value& other) noexcept {
  if (detail::ownsBlock(other.cell_)) detail::retain(other.cell_);
  const detail::Cell old = cell_;
  cell_ = other.cell_;
  if (detail::ownsBlock(old)) detail::release(old);
  return *this;
}

inline Value& Value::operator=(Value&& other) noexcept {
  const detail::Cell old = cell_;
  cell_ = other.cell_;
  other.makeNull();
  if (detail::ownsBlock(old)) detail::release(old);
  return *this;
}

inline bool Value::isNumber() const noexcept {
  return cell_.tag >= detail::kTagBoolean && cell_.tag <= detail::kTagDouble;
}
inline Value::Kind Value::kind() const noexcept {
  switch (cell_.tag) {
    case detail::kTagData:
      return Kind::data;
    case detail::kTagArray:
      return Kind::array;
    case detail::kTagDictionary:
      return Kind::dictionary;
    case detail::kTagNull:
      return Kind::null;
    case detail::kTagBoolean:
      return Kind::boolean;
    case detail::kTagInteger:
      return Kind::integer;
    case detail::kTagUnsigned:
      return Kind::unsignedInteger;
    case detail::kTagDouble:
      return Kind::real;
    case detail::kTagDate:
      return Kind::date;
    default:
      return Kind::string;
  }
}

inline const String* Value::string() const noexcept {
  return isString() ? reinterpret_cast<const String*>(&cell_) : nullptr;
}
inline const Data* Value::data() const noexcept {
  return cell_.tag == detail::kTagData ? reinterpret_cast<const Data*>(&cell_) : nullptr;
}
inline const Array* Value::array() const noexcept {
  return isArray() ? reinterpret_cast<const Array*>(&cell_) : nullptr;
}
inline const Dictionary* Value::dictionary() const noexcept {
  return isDictionary() ? reinterpret_cast<const Dictionary*>(&cell_) : nullptr;
}
inline Array* Value::mutableArray() noexcept {
  return isArray() ? reinterpret_cast<Array*>(&cell_) : nullptr;
}
inline Dictionary* Value::mutableDictionary() noexcept {
  return isDictionary() ? reinterpret_cast<Dictionary*>(&cell_) : nullptr;
}
inline std::optional<Date> Value::date() const noexcept {
  if (cell_.tag != detail::kTagDate) return std::nullopt;
  return Date{std::bit_cast<double>(cell_.word)};
}
inline std::optional<bool> Value::boolean() const noexcept {
  if (cell_.tag != detail::kTagBoolean) return std::nullopt;
  return cell_.word != 0;
}
inline std::optional<int64_t> Value::integer() const noexcept {
  if (cell_.tag != detail::kTagInteger) return std::nullopt;
  return static_cast<int64_t>(cell_.word);
}
inline std::optional<uint64_t> Value::unsignedInteger() const noexcept {
  if (cell_.tag != detail::kTagUnsigned) return std::nullopt;
  return cell_.word;
}
inline std::optional<double> Value::real() const noexcept {
  if (cell_.tag != detail::kTagDouble) return std::nullopt;
  return std::bit_cast<double>(cell_.word);
}

inline Array::Array(const Array& other) noexcept : block_(other.block_) {
  if (block_ != nullptr) detail::retainBlock(block_);
}
inline Array::~Array() {
  if (block_ != nullptr && detail::dropReference(block_)) detail::destroyBlock(block_, detail::kTagArray);
}
inline Array& Array::operator=(const Array& other) noexcept {
  Array copy(other);
  std::swap(block_, copy.block_);
  return *this;
}
inline Array& Array::operator=(Array&& other) noexcept {
  Array taken(std::move(other));
  std::swap(block_, taken.block_);
  return *this;
}
inline size_t Array::size() const noexcept {
  return block_ == nullptr ? 0 : block_->size;
}
inline const Value* Array::begin() const noexcept {
  return block_ == nullptr ? nullptr : static_cast<detail::ArrayBlock*>(block_)->entries();
}
inline const Value* Array::end() const noexcept {
  return begin() + size();
}
inline const Value& Array::operator[](size_t index) const noexcept {
  assert(index < size());
  return begin()[index];
}
inline void Array::append(Value value) {
  auto* block = static_cast<detail::ArrayBlock*>(block_);
  if (block == nullptr || block->size == block->capacity || !detail::isUnique(block)) {
    const size_t count = size();
    const size_t grown = count + count / 2;
    reserve(grown < count + 4 ? count + 4 : grown);
    block = static_cast<detail::ArrayBlock*>(block_);
  }
  ::new (static_cast<void*>(block->entries() + block->size)) Value(std::move(value));
  ++block->size;
}

inline Dictionary::Dictionary(const Dictionary& other) noexcept : block_(other.block_) {
  if (block_ != nullptr) detail::retainBlock(block_);
}
inline Dictionary::~Dictionary() {
  if (block_ != nullptr && detail::dropReference(block_))
    detail::destroyBlock(block_, detail::kTagDictionary);
}
inline Dictionary& Dictionary::operator=(const Dictionary& other) noexcept {
  Dictionary copy(other);
  std::swap(block_, copy.block_);
  return *this;
}
inline Dictionary& Dictionary::operator=(Dictionary&& other) noexcept {
  Dictionary taken(std::move(other));
  std::swap(block_, taken.block_);
  return *this;
}
inline size_t Dictionary::size() const noexcept {
  return block_ == nullptr ? 0 : block_->size;
}
inline const DictionaryEntry* Dictionary::begin() const noexcept {
  return block_ == nullptr ? nullptr : static_cast<detail::DictionaryBlock*>(block_)->entries();
}
inline const DictionaryEntry* Dictionary::end() const noexcept {
  return begin() + size();
}
inline const void* Dictionary::indexBlock() const noexcept {
  return block_ == nullptr ? nullptr : static_cast<detail::DictionaryBlock*>(block_)->index;
}

[[gnu::noinline]] inline const Value* Dictionary::findInline(const detail::Cell& key) const noexcept {
  auto* block = static_cast<detail::DictionaryBlock*>(block_);
  const uint64_t low = key.word;
  const uint64_t high = detail::secondWord(key);
  const DictionaryEntry* entry = block->entries();
  for (const DictionaryEntry* end = entry + block->size; entry != end; ++entry)
    if (entry->key.cell_.word == low && detail::secondWord(entry->key.cell_) == high) return &entry->value;
  return nullptr;
}
inline const Value* Dictionary::find(const String& key) const noexcept {
  if (block_ == nullptr) return nullptr;
  if (key.cell_.tag <= detail::kTagInlineStringLast && block_->size <= detail::kMaxScanned)
    return findInline(key.cell_);
  return findSlowly(key.view());
}
[[gnu::always_inline]] inline const Value* Dictionary::find(std::string_view key) const noexcept {
  if (block_ == nullptr) return nullptr;
  if (key.size() <= detail::kMaxInlineText && block_->size <= detail::kMaxScanned) {
    detail::Cell cell;
    detail::makeInlineText(cell, key.data(), key.size());
    return findInline(cell);
  }
  return findSlowly(key);
}

// Inlined always, like find() of a literal key.
template <typename Key>
[[gnu::always_inline]] inline const String* Dictionary::string(const Key& key) const noexcept {
  const Value* value = find(key);
  return value != nullptr ? value->string() : nullptr;
}
template <typename Key>
[[gnu::always_inline]] inline const Array* Dictionary::array(const Key& key) const noexcept {
  const Value* value = find(key);
  return value != nullptr ? value->array() : nullptr;
}
template <typename Key>
[[gnu::always_inline]] inline const Dictionary* Dictionary::dictionary(const Key& key) const noexcept {
  const Value* value = find(key);
  return value != nullptr ? value->dictionary() : nullptr;
}
template <typename Key>
[[gnu::always_inline]] inline int32_t Dictionary::integer(const Key& key, int32_t absent) const noexcept {
  const Value* value = find(key);
  return value != nullptr ? value->intValue() : absent;
}
template <typename Key>
[[gnu::always_inline]] inline uint32_t Dictionary::unsignedInteger(const Key& key,
                                                                   uint32_t absent) const noexcept {
  const Value* value = find(key);
  return value != nullptr ? value->unsignedIntValue() : absent;
}
template <typename Key>
[[gnu::always_inline]] inline bool Dictionary::boolean(const Key& key) const noexcept {
  const Value* value = find(key);
  return value != nullptr && value->boolValue();
}

template <typename Key, typename Content>
inline void Dictionary::append(Key&& key, Content&& value) {
  assert(find(String(key)) == nullptr);
  auto* block = static_cast<detail::DictionaryBlock*>(block_);
  if (block == nullptr || block->size == block->capacity || block->size >= detail::kMaxScanned ||
      !detail::isUnique(block)) [[unlikely]] {
    appendSlowly(std::forward<Key>(key), std::forward<Content>(value));
    return;
  }
  ::new (static_cast<void*>(block->entries() + block->size))
      DictionaryEntry{String(std::forward<Key>(key)), Value(std::forward<Content>(value))};
  ++block->size;
}

inline void Dictionary::set(String key, Value value) {
  const Value* found = find(key);
  if (found == nullptr) {
    append(std::move(key), std::move(value));
  } else if (detail::isUnique(block_)) {
    *const_cast<Value*>(found) = std::move(value);  // the entries of a block without other owners may change
  } else {
    const auto position = detail::entryOf(found) - begin();
    mutableEntries()[position].value = std::move(value);
  }
}

}  // namespace kyt
