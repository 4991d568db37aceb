// The objects that cross every boundary of this system: strings, numbers, booleans, dates, data, arrays and
// dictionaries. IPC messages, property lists, JSON and archives all read into and are written from these.
//
// A `Value` is 16 bytes. Strings of up to 15 bytes, numbers, booleans and dates live inside it and own no
// heap block; longer strings, data, arrays and dictionaries are one reference-counted heap block each.
// Containers are copy-on-write: copying one copies a pointer, and the first change of a shared one copies its
// entries (not what they refer to). Distinct objects may be used from different threads even when they share
// blocks; one object may not. Nothing here throws but std::bad_alloc.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <initializer_list>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>

// A Value's cell is looked at as a String, an Array and so on, where it lies: the compiler must not take
// accesses through these classes for accesses to different objects.
#define KYT_OBJECT [[gnu::may_alias]]

namespace kyt {

class Value;
struct DictionaryEntry;

namespace detail {

// What every heap block begins with. `references` counts the Values that point to the block.
struct Block;

// The last byte of a 16-byte cell. For an inline string it is 15 minus the length, so that a string of 15
// bytes ends in its own terminator; everything else is 0x10 and above.
enum Tag : uint8_t {
  kTagInlineStringLast = 0x0F,
  kTagHeapString = 0x10,
  kTagData = 0x11,
  kTagArray = 0x12,
  kTagDictionary = 0x13,
  kTagNull = 0x20,
  kTagBoolean = 0x21,
  kTagInteger = 0x22,
  kTagUnsigned = 0x23,
  kTagDouble = 0x24,
  kTagDate = 0x25,
};

struct KYT_OBJECT alignas(8) Cell {
  union {
    Block* block;
    int64_t integer;
    uint64_t unsignedInteger;
    double number;
    uint64_t word;
  };
  uint8_t pad[7];  // an inline string goes on from the eight bytes above into these
  uint8_t tag;
  [[nodiscard]] const char* text() const noexcept { return reinterpret_cast<const char*>(this); }
  [[nodiscard]] char* text() noexcept { return reinterpret_cast<char*>(this); }
};
static_assert(sizeof(Cell) == 16);

// Whether the cell refers to a block (empty containers and data have none).
inline bool ownsBlock(const Cell& cell) noexcept {
  return (cell.tag & 0xF0) == 0x10 && cell.block != nullptr;
}
// Of a cell that owns a block: adds a reference; drops one, and frees the block and what it refers to with
// the last.
void retain(const Cell& cell) noexcept;
void release(const Cell& cell) noexcept;

}  // namespace detail

// Immutable text, meant to be UTF-8 (boundaries check it; this class does not). 16 bytes; up to 15 bytes
// inside.
class KYT_OBJECT String {
 public:
  String() noexcept { makeEmpty(); }
  String(std::string_view text);  // NOLINT(google-explicit-constructor): a literal is a String
  String(const char* text) : String(std::string_view(text)) {}         // NOLINT(google-explicit-constructor)
  String(const std::string& text) : String(std::string_view(text)) {}  // NOLINT(google-explicit-constructor)
  String(const String& other) noexcept : cell_(other.cell_) {
    if (detail::ownsBlock(cell_)) detail::retain(cell_);
  }
  String(String&& other) noexcept : cell_(other.cell_) { other.makeEmpty(); }
  // Text that lives as long as the process: its block is never freed and its references are not counted, so
  // that threads that share a long constant key do not contend for its count. For constants only.
  [[nodiscard]] static String permanent(std::string_view text);
  String& operator=(const String& other) noexcept;
  String& operator=(String&& other) noexcept;
  ~String() {
    if (detail::ownsBlock(cell_)) detail::release(cell_);
  }

  [[nodiscard]] std::string_view view() const noexcept;
  operator std::string_view() const noexcept { return view(); }  // NOLINT(google-explicit-constructor)
  // NUL-terminated; valid while this very object lives and is not assigned to (short text lives inside it).
  [[nodiscard]] const char* c_str() const noexcept { return view().data(); }
  [[nodiscard]] std::string str() const { return std::string(view()); }
  [[nodiscard]] size_t size() const noexcept { return view().size(); }
  [[nodiscard]] bool empty() const noexcept { return size() == 0; }
  // Length in UTF-16 code units, as the platform's strings count characters. Malformed bytes count one each.
  [[nodiscard]] size_t utf16Length() const noexcept;
  // The heap block, or null for text that lives inside.
  [[nodiscard]] const void* block() const noexcept {
    return detail::ownsBlock(cell_) ? cell_.block : nullptr;
  }

  friend bool operator==(const String& a, const String& b) noexcept;
  friend bool operator==(const String& a, std::string_view b) noexcept { return a.view() == b; }
  friend bool operator==(const String& a, const std::string& b) noexcept { return a.view() == b; }
  friend bool operator==(const String& a, const char* b) noexcept { return a.view() == std::string_view(b); }

 private:
  friend class Value;
  friend class Dictionary;
  void makeEmpty() noexcept {
    std::memset(&cell_, 0, sizeof cell_);
    cell_.tag = detail::kTagInlineStringLast;
  }
  detail::Cell cell_;
};

// Immutable bytes, one heap block (none when empty).
class KYT_OBJECT Data {
 public:
  Data() noexcept = default;
  explicit Data(std::span<const std::byte> bytes);
  explicit Data(std::string_view bytes) : Data(std::as_bytes(std::span(bytes))) {}
  Data(const Data& other) noexcept;
  Data(Data&& other) noexcept : block_(std::exchange(other.block_, nullptr)) {}
  Data& operator=(const Data& other) noexcept;
  Data& operator=(Data&& other) noexcept;
  ~Data();
  // A block of `size` bytes to be filled by the caller before anyone else sees it.
  static Data uninitialized(size_t size, std::byte*& bytes);
  // Cuts a block that nobody else refers to (the bytes past `size` stay allocated). Precondition: size <=
  // this->size().
  void truncate(size_t size) noexcept;

  [[nodiscard]] std::span<const std::byte> bytes() const noexcept;
  [[nodiscard]] std::string_view view() const noexcept;
  [[nodiscard]] size_t size() const noexcept { return bytes().size(); }
  [[nodiscard]] bool empty() const noexcept { return size() == 0; }
  [[nodiscard]] const void* block() const noexcept { return block_; }
  friend bool operator==(const Data& a, const Data& b) noexcept { return a.view() == b.view(); }

 private:
  friend class Value;
  detail::Block* block_ = nullptr;
};

// Seconds since 1970, UTC.
struct Date {
  double secondsSince1970 = 0;
  friend bool operator==(const Date&, const Date&) = default;
};

// An ordered list of Values: one heap block (none when empty), copy-on-write.
class KYT_OBJECT Array {
 public:
  Array() noexcept = default;
  Array(std::initializer_list<Value> values);
  Array(const Array& other) noexcept;
  Array(Array&& other) noexcept : block_(std::exchange(other.block_, nullptr)) {}
  Array& operator=(const Array& other) noexcept;
  Array& operator=(Array&& other) noexcept;
  ~Array();

  [[nodiscard]] size_t size() const noexcept;
  [[nodiscard]] bool empty() const noexcept { return size() == 0; }
  [[nodiscard]] const Value& operator[](size_t index) const noexcept;  // precondition: index < size()
  [[nodiscard]] const Value* begin() const noexcept;
  [[nodiscard]] const Value* end() const noexcept;
  void reserve(size_t capacity);
  void append(Value value);
  void removeAt(size_t index);          // precondition: index < size()
  [[nodiscard]] Value* mutableBegin();  // unshares the block; entries may be assigned to
  [[nodiscard]] const void* block() const noexcept { return block_; }
  friend bool operator==(const Array& a, const Array& b) noexcept;

 private:
  friend class Value;
  detail::Block* block_ = nullptr;
};

// String keys to Values, in insertion order, which is the enumeration order everywhere: one heap block (none
// when empty) up to 32 entries, a second one with a hash index above. Copy-on-write. Setting a key that
// exists replaces its value in place; removing one keeps the order of the others.
class KYT_OBJECT Dictionary {
 public:
  Dictionary() noexcept = default;
  Dictionary(std::initializer_list<std::pair<String, Value>> entries);
  Dictionary(const Dictionary& other) noexcept;
  Dictionary(Dictionary&& other) noexcept : block_(std::exchange(other.block_, nullptr)) {}
  Dictionary& operator=(const Dictionary& other) noexcept;
  Dictionary& operator=(Dictionary&& other) noexcept;
  ~Dictionary();

  [[nodiscard]] size_t size() const noexcept;
  [[nodiscard]] bool empty() const noexcept { return size() == 0; }
  // The value under a key or null; valid until the dictionary changes.
  [[nodiscard]] const Value* find(const String& key) const noexcept;
  [[nodiscard]] const Value* find(std::string_view key) const noexcept;
  // Inlined always: the compiler makes the two words of a literal key.
  [[nodiscard, gnu::always_inline]] const Value* find(const char* key) const noexcept {
    return find(std::string_view(key));
  }
  [[nodiscard]] const Value* find(const std::string& key) const noexcept {
    return find(std::string_view(key));
  }
  [[nodiscard]] bool contains(std::string_view key) const noexcept { return find(key) != nullptr; }

  // What stands under a key, as what the caller reads it: any key that find() takes. Null where nothing stands there, or
  // something else; valid until the dictionary changes.
  template <typename Key>
  [[nodiscard]] const String* string(const Key& key) const noexcept;
  template <typename Key>
  [[nodiscard]] const Array* array(const Key& key) const noexcept;
  template <typename Key>
  [[nodiscard]] const Dictionary* dictionary(const Key& key) const noexcept;
  // By the readings of Value (intValue(), boolValue()), thus of a text's digits too; `absent` where nothing stands there.
  template <typename Key>
  [[nodiscard]] int32_t integer(const Key& key, int32_t absent = 0) const noexcept;
  template <typename Key>
  [[nodiscard]] uint32_t unsignedInteger(const Key& key, uint32_t absent = 0) const noexcept;
  template <typename Key>
  [[nodiscard]] bool boolean(const Key& key) const noexcept;

  [[nodiscard]] const DictionaryEntry* begin() const noexcept;
  [[nodiscard]] const DictionaryEntry* end() const noexcept;

  void reserve(size_t capacity);  // unshares the block too
  void set(String key, Value value);
  // For decoders and record builders that know the key is new: no look-up. Precondition: !contains(key). Key
  // and value are made in their place: an object that is written as two words and at once copied as one makes
  // the processor wait for its own stores.
  template <typename Key, typename Content>
  void append(Key&& key, Content&& value);
  // For decoders: a dictionary of exactly `count` entries with different keys, at most 32. They are moved out of raw
  // storage bit by bit, so the caller must not destroy them.
  static Dictionary takingOver(DictionaryEntry* entries, size_t count);
  // For the last user of a dictionary that may be shared: the value under a key, or null, moved out of a block without
  // other owners, which then holds null there.
  [[nodiscard]] Value take(std::string_view key) noexcept;
  bool remove(std::string_view key);    // whether it was there
  void merge(const Dictionary& other);  // set() of each entry of other, in its order
  // Removes the entries for which the predicate (const String& key, Value& value) -> bool returns true; it may assign to
  // the value. Unshares the block at the first call.
  template <typename Predicate>
  void removeIf(Predicate&& predicate);
  [[nodiscard]] const void* block() const noexcept { return block_; }
  // The second block of a large dictionary, or null.
  [[nodiscard]] const void* indexBlock() const noexcept;
  // Equal when both hold equal values under the same keys, whatever their order.
  friend bool operator==(const Dictionary& a, const Dictionary& b) noexcept;

 private:
  friend class Value;
  // Of a small dictionary, a key without a block.
  const Value* findInline(const detail::Cell& key) const noexcept;
  const Value* findSlowly(std::string_view key) const noexcept;
  void appendSlowly(String key, Value value);  // grows, unshares, or keeps the index
  DictionaryEntry* mutableEntries();           // unshares
  void eraseMarked(size_t newSize) noexcept;   // after removeIf moved the kept entries to the front
  detail::Block* block_ = nullptr;
};

// Any of them, or nothing (null: a missing object). Many functions, since each kind has a constructor and readers.
class KYT_OBJECT Value {
 public:
  enum class Kind : uint8_t {
    null,
    boolean,
    integer,
    unsignedInteger,
    real,
    date,
    string,
    data,
    array,
    dictionary
  };

  Value() noexcept { makeNull(); }
  Value(std::nullptr_t) noexcept : Value() {}                           // NOLINT(google-explicit-constructor)
  Value(bool value) noexcept;                                           // NOLINT(google-explicit-constructor)
  Value(int value) noexcept : Value(static_cast<int64_t>(value)) {}     // NOLINT(google-explicit-constructor)
  Value(long value) noexcept : Value(static_cast<long long>(value)) {}  // NOLINT(google-explicit-constructor)
  Value(long long value) noexcept;                                      // NOLINT(google-explicit-constructor)
  Value(unsigned value) noexcept : Value(static_cast<unsigned long long>(value)) {}       // NOLINT
  Value(unsigned long value) noexcept : Value(static_cast<unsigned long long>(value)) {}  // NOLINT
  Value(unsigned long long value) noexcept;                          // NOLINT(google-explicit-constructor)
  Value(double value) noexcept;                                      // NOLINT(google-explicit-constructor)
  Value(Date value) noexcept;                                        // NOLINT(google-explicit-constructor)
  Value(const char* text) : Value(std::string_view(text)) {}         // NOLINT(google-explicit-constructor)
  Value(std::string_view text);                                      // NOLINT(google-explicit-constructor)
  Value(const std::string& text) : Value(std::string_view(text)) {}  // NOLINT(google-explicit-constructor)
  Value(const String& text) noexcept;                                // NOLINT(google-explicit-constructor)
  Value(String&& text) noexcept;                                     // NOLINT(google-explicit-constructor)
  Value(Data data) noexcept;                                         // NOLINT(google-explicit-constructor)
  Value(Array array) noexcept;                                       // NOLINT(google-explicit-constructor)
  Value(Dictionary dictionary) noexcept;                             // NOLINT(google-explicit-constructor)
  Value(const void*) = delete;                                       // no pointer becomes a boolean

  Value(const Value& other) noexcept : cell_(other.cell_) {
    if (detail::ownsBlock(cell_)) detail::retain(cell_);
  }
  Value(Value&& other) noexcept : cell_(other.cell_) { other.makeNull(); }
  Value& operator=(const Value& other) noexcept;
  Value& operator=(Value&& other) noexcept;
  ~Value() {
    if (detail::ownsBlock(cell_)) detail::release(cell_);
  }

  [[nodiscard]] Kind kind() const noexcept;
  [[nodiscard]] bool isNull() const noexcept { return cell_.tag == detail::kTagNull; }
  [[nodiscard]] bool isString() const noexcept { return cell_.tag <= detail::kTagHeapString; }
  [[nodiscard]] bool isNumber() const noexcept;  // boolean, integer, unsigned or double
  [[nodiscard]] bool isDictionary() const noexcept { return cell_.tag == detail::kTagDictionary; }
  [[nodiscard]] bool isArray() const noexcept { return cell_.tag == detail::kTagArray; }

  // The typed object, or null when this is of another kind; valid until this Value changes. (Containers and
  // strings have the same representation on their own as inside a Value, so nothing is copied.)
  [[nodiscard]] const String* string() const noexcept;
  [[nodiscard]] const Data* data() const noexcept;
  [[nodiscard]] const Array* array() const noexcept;
  [[nodiscard]] const Dictionary* dictionary() const noexcept;
  [[nodiscard]] Array* mutableArray() noexcept;
  [[nodiscard]] Dictionary* mutableDictionary() noexcept;
  [[nodiscard]] std::optional<Date> date() const noexcept;
  [[nodiscard]] std::optional<bool> boolean() const noexcept;              // only of a boolean
  [[nodiscard]] std::optional<int64_t> integer() const noexcept;           // only of an integer kind
  [[nodiscard]] std::optional<uint64_t> unsignedInteger() const noexcept;  // only of an unsigned kind
  [[nodiscard]] std::optional<double> real() const noexcept;               // only of a double

  // Readings. Numbers answer themselves (a double is truncated towards zero and saturates); strings answer
  // what they begin with: blanks, a sign, decimal digits, saturating at 64 bits. 32-bit readings are the
  // 64-bit ones cut to the low 32 bits. Dates, data, containers and null read as 0.
  [[nodiscard]] int32_t intValue() const noexcept { return static_cast<int32_t>(longLongValue()); }
  [[nodiscard]] uint32_t unsignedIntValue() const noexcept {
    return static_cast<uint32_t>(unsignedLongLongValue());
  }
  [[nodiscard]] int64_t longLongValue() const noexcept;
  [[nodiscard]] uint64_t unsignedLongLongValue() const noexcept;
  [[nodiscard]] double doubleValue() const noexcept;
  // A number is true when it is not zero; a string when it begins, after blanks, a sign and zeros, with 1-9,
  // T, t, Y, y.
  [[nodiscard]] bool boolValue() const noexcept;

  // The heap block, or null when the value lives inside the 16 bytes.
  [[nodiscard]] const void* block() const noexcept {
    return detail::ownsBlock(cell_) ? cell_.block : nullptr;
  }
  // Equal kinds and contents; numbers compare by value across kinds (1 == 1.0 == true).
  friend bool operator==(const Value& a, const Value& b) noexcept;

 private:
  void makeNull() noexcept {
    std::memset(&cell_, 0, sizeof cell_);
    cell_.tag = detail::kTagNull;
  }
  detail::Cell cell_;
};
static_assert(sizeof(Value) == 16 && sizeof(String) == 16);
static_assert(sizeof(Dictionary) == sizeof(void*) && sizeof(Array) == sizeof(void*));

struct DictionaryEntry {
  String key;
  Value value;
};

template <typename Predicate>
void Dictionary::removeIf(Predicate&& predicate) {
  if (empty()) return;
  const size_t count = size();
  DictionaryEntry* entries = mutableEntries();
  size_t kept = 0;
  for (size_t i = 0; i < count; ++i) {
    if (predicate(static_cast<const String&>(entries[i].key), entries[i].value)) continue;
    if (kept != i) std::swap(entries[kept], entries[i]);
    ++kept;
  }
  if (kept != count) eraseMarked(kept);
}

// The text of an object in log lines, messages and the local message log: a string's own text, the shortest
// decimal that reads back the same, "1"/"0" for a boolean, "2026-01-31 12:00:00 +0000" for a date, lower-case
// hex in angle brackets for data, compact JSON for a container, "(null)" for nothing.
[[nodiscard]] std::string description(const Value& value);
// The shortest decimal that reads back the same: "0.1", "100000", "1e+30", "inf", "nan".
[[nodiscard]] std::string decimalText(double number);

}  // namespace kyt

#include "platform/objects/ValueInline.h"
