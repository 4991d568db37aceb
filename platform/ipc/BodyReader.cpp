#include "platform/ipc/BodyReader.h"

#include <bit>
#include <cstring>
#include <memory>
#include <new>
#include <utility>

#include "platform/Limits.h"
#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/WireText.h"

// The cursor functions answer false, or null, at the first failure and leave its reason in the cursor, whose
// status every reader looks at first.
namespace kyt {
namespace {

using Cursor = WireCursor;

// On the road of every event: a call each for the few instructions of an aligned number would cost more than
// they do.
#define KYT_HOT [[gnu::always_inline]] inline

[[gnu::cold, gnu::noinline]] bool stop(Cursor& c, BodyStatus status, const char* problem) {
  if (c.status == BodyStatus::ok) {
    c.status = status;
    c.problem = problem;
  }
  return false;
}
bool malformed(Cursor& c, const char* problem) {
  return stop(c, BodyStatus::malformed, problem);
}
bool invalid(Cursor& c, const char* problem) {
  return stop(c, BodyStatus::invalidArguments, problem);
}

size_t left(const Cursor& c) {
  return static_cast<size_t>(c.end - c.at);
}

template <size_t kAlignment>
KYT_HOT bool align(Cursor& c) {
  const size_t padding = static_cast<size_t>(c.begin - c.at) & (kAlignment - 1);
  if (padding == 0) return true;
  if (padding > left(c)) [[unlikely]]
    return malformed(c, "a value is cut off");
  uint8_t bits = 0;
  for (size_t i = 0; i < padding; ++i) bits |= c.at[i];
  if (bits != 0) [[unlikely]]
    return malformed(c, "padding is not zero");
  c.at += padding;
  return true;
}

uint16_t swap(uint16_t v) {
  return __builtin_bswap16(v);
}
uint32_t swap(uint32_t v) {
  return __builtin_bswap32(v);
}
uint64_t swap(uint64_t v) {
  return __builtin_bswap64(v);
}

template <typename T>
KYT_HOT T load(const uint8_t* at, bool swapped) {
  T value;
  std::memcpy(&value, at, sizeof value);
  return swapped ? swap(value) : value;
}

template <typename T>
KYT_HOT bool number(Cursor& c, T& out) {
  if (!align<sizeof(T)>(c)) return false;
  if (left(c) < sizeof(T)) [[unlikely]]
    return malformed(c, "a value is cut off");
  out = load<T>(c.at, c.swapped);
  c.at += sizeof(T);
  return true;
}

KYT_HOT bool boolean(Cursor& c, bool& out) {
  uint32_t value = 0;
  if (!number(c, value)) return false;
  if (value > 1) return malformed(c, "a boolean is neither 0 nor 1");
  out = value == 1;
  return true;
}

KYT_HOT bool text(Cursor& c, std::string_view& out) {
  uint32_t length = 0;
  if (!number(c, length)) return false;
  if (left(c) <= length) [[unlikely]]
    return malformed(c, "a text is cut off");
  const std::string_view view(reinterpret_cast<const char*>(c.at), length);
  if (c.at[length] != 0) [[unlikely]]
    return malformed(c, "a text is not terminated");
  if (!wire::isValidText(view)) [[unlikely]]
    return malformed(c, "a text is not UTF-8");
  c.at += size_t{length} + 1;
  out = view;
  return true;
}

// The text of a signature, whose contents are not checked yet.
KYT_HOT bool signature(Cursor& c, std::string_view& out) {
  if (left(c) < 2) [[unlikely]]
    return malformed(c, "a signature is cut off");
  const size_t length = c.at[0];
  if (left(c) < length + 2) [[unlikely]]
    return malformed(c, "a signature is cut off");
  if (c.at[length + 1] != 0) [[unlikely]]
    return malformed(c, "a signature is not terminated");
  out = {reinterpret_cast<const char*>(c.at + 1), length};
  c.at += length + 2;
  return true;
}

// Enters an array: `end` is where its elements stop.
template <size_t kElementAlignment>
KYT_HOT bool array(Cursor& c, const uint8_t*& end) {
  uint32_t length = 0;
  if (!number(c, length)) return false;
  if (length > wire::kMaxArrayBytes) return malformed(c, "an array is longer than 64 MiB");
  if (!align<kElementAlignment>(c)) return false;
  if (left(c) < length) [[unlikely]]
    return malformed(c, "an array is cut off");
  end = c.at + length;
  return true;
}

bool endOfArray(Cursor& c, const uint8_t* end) {
  return c.at == end || malformed(c, "an array's last element is longer than the array");
}

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
  void gathered() {
    DictionaryEntry& entry = entries()[count_++];
    const uint64_t bit = uint64_t{1} << hash(entry.key);
    if ((seen_ & bit) != 0) [[unlikely]]
      mergeLast();
    seen_ |= bit;
  }
  // All of them; afterwards there are none.
  [[nodiscard]] Dictionary take() { return Dictionary::takingOver(entries(), std::exchange(count_, 0)); }

 private:
  DictionaryEntry* entries() { return std::launder(reinterpret_cast<DictionaryEntry*>(storage_)); }

  // Six bits.
  static unsigned hash(const String& key) {
    uint64_t low = 0, high = 0;
    const std::string_view text = key.view();
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

Value variantValue(Cursor& c, int depth);
Value containerValue(Cursor& c, std::string_view type, int depth);

Value rareValue(Cursor& c, char type);

// A value of a basic type; here those that our own client library sends.
KYT_HOT Value basicValue(Cursor& c, char type) {
  switch (type) {
    case 's': {
      std::string_view view;
      if (!text(c, view)) [[unlikely]]
        return {};
      return String(view);
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

[[gnu::noinline]] Value rareValue(Cursor& c, char type) {
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
      if (!wire::isValidObjectPath(view)) return malformed(c, "an object path is not valid"), Value();
      return Value(String(view));
    }
    case 'g': {
      std::string_view view;
      if (!signature(c, view)) return {};
      if (!wire::isValidSignature(view)) return malformed(c, "a signature is not valid"), Value();
      return Value(String(view));
    }
    default:
      return malformed(c, "a signature is not valid"), Value();
  }
}

// A value of a type that objects can hold. `depth`: how many containers are around it.
Value valueOf(Cursor& c, std::string_view type, int depth) {
  if (type[0] == 'v') return variantValue(c, depth);
  if (type[0] == 'a' || type[0] == '(') return containerValue(c, type, depth);
  return basicValue(c, type[0]);
}

bool enter(Cursor& c, int depth) {
  if (depth < Limits::maxIPCDepth) [[likely]]
    return true;
  return malformed(c, "containers are nested too deeply");
}

Value variantValue(Cursor& c, int depth) {
  std::string_view type;
  if (!enter(c, depth) || !signature(c, type)) return {};
  if (type.size() == 1 && type[0] != 'v' && type[0] != 'h') [[likely]]
    return basicValue(c, type[0]);
  if (type != "a{sv}") {
    if (!wire::isValidSingleSignature(type))
      return malformed(c, "a variant's signature is not valid"), Value();
    if (!isObjectType(type)) return invalid(c, "a variant holds what no object can"), Value();
  }
  return valueOf(c, type, depth + 1);
}

Value entryValue(Cursor& c, std::string_view type, int depth) {
  return type[0] == 'v' ? variantValue(c, depth) : valueOf(c, type, depth);
}

// The entries of a{sX}. `depth`: how many containers are around the array.
bool dictionary(Cursor& c, std::string_view valueType, Dictionary& out, int depth) {
  const uint8_t* end = nullptr;
  if (!enter(c, depth) || !array<8>(c, end)) return false;
  if (c.at == end) return true;
  if (!enter(c, depth + 1)) return false;
  EntryGatherer first;
  while (c.at < end && !first.full()) {
    std::string_view key;
    if (!align<8>(c) || !text(c, key)) return false;
    ::new (first.next()) DictionaryEntry{String(key), entryValue(c, valueType, depth + 2)};
    first.gathered();
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

template <size_t kAlignment>
bool elements(Cursor& c, std::string_view elementType, Array& out, int depth) {
  const uint8_t* end = nullptr;
  if (!enter(c, depth) || !array<kAlignment>(c, end)) return false;
  if (wire::alignmentOf(elementType[0]) == kAlignment && kAlignment != 1 &&
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

Value bytes(Cursor& c, int depth) {
  const uint8_t* end = nullptr;
  if (!enter(c, depth) || !array<1>(c, end)) return {};
  Data data(std::as_bytes(std::span(c.at, end)));
  c.at = end;
  return data;
}

Value containerValue(Cursor& c, std::string_view type, int depth) {
  if (type[0] == '(') {
    uint64_t bits = 0;
    if (!enter(c, depth) || !align<8>(c) || !number(c, bits)) return {};
    return Date{std::bit_cast<double>(bits)};
  }
  if (type[1] == '{') {
    Dictionary entries;
    return dictionary(c, type.substr(3, type.size() - 4), entries, depth) ? Value(std::move(entries))
                                                                          : Value();
  }
  if (type[1] == 'y') return bytes(c, depth);
  Array array;
  const std::string_view element = type.substr(1);
  bool read = false;
  switch (wire::alignmentOf(element[0])) {
    case 8:
      read = elements<8>(c, element, array, depth);
      break;
    case 4:
      read = elements<4>(c, element, array, depth);
      break;
    case 2:
      read = elements<2>(c, element, array, depth);
      break;
    default:
      read = elements<1>(c, element, array, depth);
  }
  return read ? Value(std::move(array)) : Value();
}

#undef KYT_HOT

}  // namespace

BodyReader::BodyReader(const Message& message)
    : message_(message),
      cursor_{reinterpret_cast<const uint8_t*>(message.body.data()),
              reinterpret_cast<const uint8_t*>(message.body.data()),
              reinterpret_cast<const uint8_t*>(message.body.data()) + message.body.size(), message.swapped} {}

bool BodyReader::hasSignature(std::string_view expected) {
  return message_.signature == expected ||
         invalid(cursor_, "the arguments have other types than the method's");
}

bool BodyReader::readBoolean(bool& out) {
  return good() && boolean(cursor_, out);
}

bool BodyReader::readUInt16(uint16_t& out) {
  return good() && number(cursor_, out);
}

bool BodyReader::readUInt32(uint32_t& out) {
  return good() && number(cursor_, out);
}

bool BodyReader::readInt32(int32_t& out) {
  uint32_t value = 0;
  if (!good() || !number(cursor_, value)) return false;
  out = static_cast<int32_t>(value);
  return true;
}

bool BodyReader::readDouble(double& out) {
  uint64_t bits = 0;
  if (!good() || !number(cursor_, bits)) return false;
  out = std::bit_cast<double>(bits);
  return true;
}

bool BodyReader::readStringView(std::string_view& out) {
  return good() && text(cursor_, out);
}

bool BodyReader::readString(String& out) {
  std::string_view view;
  if (!readStringView(view)) return false;
  out = String(view);
  return true;
}

bool BodyReader::readData(Data& out) {
  if (!good()) return false;
  const Value value = bytes(cursor_, 0);
  if (!good()) return false;
  out = *value.data();
  return true;
}

bool BodyReader::readDictionary(Dictionary& out) {
  Dictionary entries;
  if (!good() || !dictionary(cursor_, "v", entries, 0)) return false;
  out = std::move(entries);
  return true;
}

bool BodyReader::readOptionalDictionary(std::optional<Dictionary>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !array<4>(cursor_, end)) return false;
  std::optional<Dictionary> result;
  if (cursor_.at < end) {
    if (!dictionary(cursor_, "v", result.emplace(), 1) || !endOfOptional(end)) return false;
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readOptionalValue(Value& out) {
  const uint8_t* end = nullptr;
  if (!good() || !array<1>(cursor_, end)) return false;
  Value result;
  if (cursor_.at < end) {
    result = variantValue(cursor_, 1);
    if (!endOfOptional(end)) return false;
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readArray(Array& out) {
  Array result;
  if (!good() || !elements<1>(cursor_, "v", result, 0)) return false;
  out = std::move(result);
  return true;
}

bool BodyReader::readOptionalStrings(std::optional<Array>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !array<4>(cursor_, end)) return false;
  std::optional<Array> result;
  if (cursor_.at < end) {
    if (!elements<4>(cursor_, "s", result.emplace(), 1) || !endOfOptional(end)) return false;
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readOptionalError(std::optional<Error>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !array<8>(cursor_, end)) return false;
  std::optional<Error> result;
  if (cursor_.at < end) {
    std::string_view domain, description;
    int32_t code = 0;
    if (!readStringView(domain) || !readInt32(code) || !readStringView(description) || !endOfOptional(end))
      return false;
    result = Error{std::string(domain), code, std::string(description)};
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readDescriptorIndexes(std::vector<uint32_t>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !array<4>(cursor_, end)) return false;
  std::vector<uint32_t> result;
  while (cursor_.at < end) {
    if (result.size() == Limits::maxDescriptorsPerMessage)
      return invalid(cursor_, "too many descriptors are named");
    if (!number(cursor_, result.emplace_back())) return false;
  }
  if (!endOfArray(cursor_, end)) return false;
  out = std::move(result);
  return true;
}

bool BodyReader::endOfOptional(const uint8_t* end) {
  if (!good()) return false;
  if (cursor_.at < end) return invalid(cursor_, "an argument that may be none has more than one element");
  return endOfArray(cursor_, end);
}

void BodyReader::refuse(const char* problem) {
  invalid(cursor_, problem);
}

BodyStatus BodyReader::finish() {
  if (cursor_.status == BodyStatus::ok && cursor_.at != cursor_.end) {
    malformed(cursor_, "bytes follow the last argument");
  }
  if (cursor_.status == BodyStatus::invalidArguments && !validateBody(message_)) {
    cursor_.status = BodyStatus::malformed;
    cursor_.problem = "the body is malformed";
  }
  return cursor_.status;
}

}  // namespace kyt
