#include "platform/ipc/WireValues.h"

#include <bit>
#include <memory>
#include <new>
#include <span>
#include <utility>

#include "platform/base/Limits.h"

namespace kyt::wire {
namespace {

// Whether objects can hold values of this complete type: no descriptors, no structs but dates, only strings
// as keys.
bool isObjectType(std::string_view type) {
  switch (type[0]) {
    case 'h':
      return false;
    case '(':
      return type == "(d)";
    case 'a':
      if (type[1] == '{') return type[2] == 's' && isObjectType(type.substr(3, type.size() - 4));
      return isObjectType(type.substr(1));
    default:
      return true;
  }
}

// Gathers a dictionary's first entries in place, so that the dictionary is made once, in a block of exactly
// its size. A repeated key is found by comparing with the others, which is done only when its bit in a small
// filter is taken.
class EntryGatherer {
 public:
  static constexpr size_t kMost = 32;
  EntryGatherer() = default;
  EntryGatherer(const EntryGatherer&) = delete;
  EntryGatherer& operator=(const EntryGatherer&) = delete;
  ~EntryGatherer() { std::destroy_n(entries(), count_); }

  [[nodiscard]] bool full() const { return count_ == kMost; }
  // Where the next entry is to be made, before gathered().
  [[nodiscard]] void* next() { return entries() + count_; }
  // `key`: as it lies in the message. Its bytes are older than those of the entry, which the processor may
  // still be writing.
  void gathered(std::string_view key) {
    const uint64_t bit = uint64_t{1} << hash(key, entries()[count_++].key);
    if ((seen_ & bit) != 0) [[unlikely]]
      mergeLast();
    seen_ |= bit;
  }
  // All of them; afterwards there are none.
  [[nodiscard]] Dictionary take() { return Dictionary::takingOver(entries(), std::exchange(count_, 0)); }

 private:
  DictionaryEntry* entries() { return std::launder(reinterpret_cast<DictionaryEntry*>(storage_)); }

  // Six bits.
  static unsigned hash(std::string_view text, const String& key) {
    uint64_t low = 0, high = 0;
    if (text.size() >= 8) {
      std::memcpy(&low, text.data(), 8);
      std::memcpy(&high, text.data() + text.size() - 8, 8);
    } else {
      std::memcpy(&low, &key, 8);  // short text lives in the first bytes of the string itself
    }
    return static_cast<unsigned>(((low ^ (high * 0x9E3779B97F4A7C15u)) * 0xD6E8FEB86659FD93u) >> 58);
  }

  void mergeLast() {
    DictionaryEntry& last = entries()[count_ - 1];
    for (size_t i = 0; i + 1 < count_; ++i) {
      if (entries()[i].key == last.key) {
        entries()[i].value = std::move(last.value);
        std::destroy_at(&last);
        --count_;
        return;
      }
    }
  }

  alignas(DictionaryEntry) std::byte storage_[kMost * sizeof(DictionaryEntry)];
  size_t count_ = 0;
  uint64_t seen_ = 0;
};

Value containerValue(WireCursor& c, std::string_view type, int depth);
Value rareValue(WireCursor& c, char type);

// A value of a basic type; here those that our own client library sends.
KYT_HOT Value basicValue(WireCursor& c, char type) {
  switch (type) {
    case 's': {
      std::string_view view;
      if (!text(c, view)) [[unlikely]]
        return {};
      return view;
    }
    case 'b': {
      bool v = false;
      return boolean(c, v) ? Value(v) : Value();
    }
    case 'x': {
      uint64_t v = 0;
      return number(c, v) ? Value(static_cast<int64_t>(v)) : Value();
    }
    case 't': {
      uint64_t v = 0;
      return number(c, v) ? Value(v) : Value();
    }
    case 'd': {
      uint64_t v = 0;
      return number(c, v) ? Value(std::bit_cast<double>(v)) : Value();
    }
    default:
      return rareValue(c, type);
  }
}

[[gnu::noinline]] Value rareValue(WireCursor& c, char type) {
  switch (type) {
    case 'y':
      if (left(c) == 0) return malformed(c, "a value is cut off"), Value();
      return Value(unsigned{*c.at++});
    case 'n': {
      uint16_t v = 0;
      return number(c, v) ? Value(int{static_cast<int16_t>(v)}) : Value();
    }
    case 'q': {
      uint16_t v = 0;
      return number(c, v) ? Value(unsigned{v}) : Value();
    }
    case 'i': {
      uint32_t v = 0;
      return number(c, v) ? Value(static_cast<int>(v)) : Value();
    }
    case 'u': {
      uint32_t v = 0;
      return number(c, v) ? Value(unsigned{v}) : Value();
    }
    case 'o': {
      std::string_view view;
      if (!text(c, view)) return {};
      if (!isValidObjectPath(view)) return malformed(c, "an object path is not valid"), Value();
      return Value(String(view));
    }
    case 'g': {
      std::string_view view;
      if (!signature(c, view)) return {};
      if (!isValidSignature(view)) return malformed(c, "a signature is not valid"), Value();
      return Value(String(view));
    }
    default:
      return malformed(c, "a signature is not valid"), Value();
  }
}

// A value of a type that objects can hold. `depth`: how many containers are around it.
Value valueOf(WireCursor& c, std::string_view type, int depth) {
  if (type[0] == 'v') return readVariant(c, depth);
  if (type[0] == 'a' || type[0] == '(') return containerValue(c, type, depth);
  return basicValue(c, type[0]);
}

bool enter(WireCursor& c, int depth) {
  if (depth < Limits::maxIPCDepth) [[likely]]
    return true;
  return malformed(c, "containers are nested too deeply");
}

Value entryValue(WireCursor& c, std::string_view type, int depth) {
  return type[0] == 'v' ? readVariant(c, depth) : valueOf(c, type, depth);
}

template <size_t kAlignment>
bool elements(WireCursor& c, std::string_view elementType, Array& out, int depth) {
  const uint8_t* end = nullptr;
  if (!enter(c, depth) || !array<kAlignment>(c, end)) return false;
  if (alignmentOf(elementType[0]) == kAlignment && kAlignment != 1 &&
      std::strchr("sova", elementType[0]) == nullptr) {
    out.reserve(static_cast<size_t>(end - c.at) / kAlignment);
  }
  while (c.at < end) {
    Value value = valueOf(c, elementType, depth + 1);
    if (c.status != BodyStatus::ok) return false;
    out.append(std::move(value));
  }
  return endOfArray(c, end);
}

}  // namespace

Value readVariant(WireCursor& c, int depth) {
  std::string_view type;
  if (!enter(c, depth) || !signature(c, type)) return {};
  if (type.size() == 1 && type[0] != 'v' && type[0] != 'h') [[likely]]
    return basicValue(c, type[0]);
  if (type != "a{sv}") {
    if (!isValidSingleSignature(type)) return malformed(c, "a variant's signature is not valid"), Value();
    if (!isObjectType(type)) return invalid(c, "a variant holds what no object can"), Value();
  }
  return valueOf(c, type, depth + 1);
}

bool readEntries(WireCursor& c, std::string_view valueType, Dictionary& out, int depth) {
  const uint8_t* end = nullptr;
  if (!enter(c, depth) || !array<8>(c, end)) return false;
  if (c.at == end) return true;
  if (!enter(c, depth + 1)) return false;
  EntryGatherer first;
  while (c.at < end && !first.full()) {
    std::string_view key;
    if (!align<8>(c) || !text(c, key)) return false;
    ::new (first.next()) DictionaryEntry{String(key), entryValue(c, valueType, depth + 2)};
    first.gathered(key);
    if (c.status != BodyStatus::ok) [[unlikely]]
      return false;
  }
  out = first.take();
  while (c.at < end) {
    std::string_view key;
    if (!align<8>(c) || !text(c, key)) return false;
    Value value = entryValue(c, valueType, depth + 2);
    if (c.status != BodyStatus::ok) return false;
    out.set(String(key), std::move(value));
  }
  return endOfArray(c, end);
}

bool readElements(WireCursor& c, std::string_view elementType, Array& out, int depth) {
  switch (alignmentOf(elementType[0])) {
    case 8:
      return elements<8>(c, elementType, out, depth);
    case 4:
      return elements<4>(c, elementType, out, depth);
    case 2:
      return elements<2>(c, elementType, out, depth);
    default:
      return elements<1>(c, elementType, out, depth);
  }
}

Value readBytes(WireCursor& c, int depth) {
  const uint8_t* end = nullptr;
  if (!enter(c, depth) || !array<1>(c, end)) return {};
  Data data(std::as_bytes(std::span(c.at, end)));
  c.at = end;
  return data;
}

namespace {

Value containerValue(WireCursor& c, std::string_view type, int depth) {
  if (type[0] == '(') {
    uint64_t bits = 0;
    if (!enter(c, depth) || !align<8>(c) || !number(c, bits)) return {};
    return Date{std::bit_cast<double>(bits)};
  }
  if (type[1] == '{') {
    Dictionary entries;
    return readEntries(c, type.substr(3, type.size() - 4), entries, depth) ? Value(std::move(entries))
                                                                           : Value();
  }
  if (type[1] == 'y') return readBytes(c, depth);
  Array array;
  return readElements(c, type.substr(1), array, depth) ? Value(std::move(array)) : Value();
}

}  // namespace

}  // namespace kyt::wire
