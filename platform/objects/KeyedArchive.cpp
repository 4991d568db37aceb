#include "platform/objects/KeyedArchive.h"

#include <bit>
#include <cmath>
#include <cstdint>
#include <string>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"

namespace kyt {

namespace {

enum Major : uint8_t { kUnsigned, kNegative, kBytes, kText, kArray, kMap, kTag, kSimple };
constexpr uint8_t kFalse = 20, kTrue = 21, kNull = 22, kUndefined = 23, kHalf = 25, kSingle = 26,
                  kDouble = 27;
constexpr uint64_t kDateTag = 1;
constexpr double kExactIntegers = 9007199254740992.0;  // 2^53

class Writer {
 public:
  [[nodiscard]] bool write(const Value& value, int depth);
  [[nodiscard]] const std::string& bytes() const { return out_; }

 private:
  void head(Major major, uint64_t argument);
  void bigEndian(uint64_t number, int width) {
    while (width-- > 0) out_ += static_cast<char>(number >> (8 * width));
  }
  void real(double number) {
    out_ += static_cast<char>(kSimple << 5 | kDouble);
    bigEndian(std::bit_cast<uint64_t>(number), 8);
  }
  void integer(int64_t number) {
    if (number >= 0) return head(kUnsigned, static_cast<uint64_t>(number));
    head(kNegative, ~static_cast<uint64_t>(number));  // -1 - number
  }
  void date(double seconds);
  [[nodiscard]] bool text(std::string_view content);
  [[nodiscard]] bool array(const Array& values, int depth);
  [[nodiscard]] bool dictionary(const Dictionary& entries, int depth);

  std::string out_;
};

void Writer::head(Major major, uint64_t argument) {
  const int first = major << 5;
  if (argument < 24) {
    out_ += static_cast<char>(first | static_cast<int>(argument));
    return;
  }
  const int width = argument <= 0xFF ? 1 : argument <= 0xFFFF ? 2 : argument <= 0xFFFFFFFF ? 4 : 8;
  out_ += static_cast<char>(first | (23 + std::countr_zero(static_cast<unsigned>(width)) + 1));
  bigEndian(argument, width);
}

void Writer::date(double seconds) {
  head(kTag, kDateTag);
  if (std::trunc(seconds) == seconds && std::abs(seconds) <= kExactIntegers)
    integer(static_cast<int64_t>(seconds));
  else
    real(seconds);
}

bool Writer::text(std::string_view content) {
  if (!isValidUTF8(content)) return false;
  head(kText, content.size());
  out_ += content;
  return true;
}

bool Writer::array(const Array& values, int depth) {
  head(kArray, values.size());
  for (const Value& value : values)
    if (!write(value, depth + 1)) return false;
  return true;
}

bool Writer::dictionary(const Dictionary& entries, int depth) {
  head(kMap, entries.size());
  for (const DictionaryEntry& entry : entries)
    if (!text(entry.key) || !write(entry.value, depth + 1)) return false;
  return true;
}

bool Writer::write(const Value& value, int depth) {
  if (depth > Limits::maxObjectDepth) return false;
  switch (value.kind()) {
    case Value::Kind::null:
      head(kSimple, kNull);
      return true;
    case Value::Kind::boolean:
      head(kSimple, value.boolValue() ? kTrue : kFalse);
      return true;
    case Value::Kind::integer:
      integer(*value.integer());
      return true;
    case Value::Kind::unsignedInteger:
      head(kUnsigned, *value.unsignedInteger());
      return true;
    case Value::Kind::real:
      real(value.doubleValue());
      return true;
    case Value::Kind::date:
      date(value.date()->secondsSince1970);
      return true;
    case Value::Kind::string:
      return text(*value.string());
    case Value::Kind::data:
      head(kBytes, value.data()->size());
      out_ += value.data()->view();
      return true;
    case Value::Kind::array:
      return array(*value.array(), depth);
    case Value::Kind::dictionary:
      return dictionary(*value.dictionary(), depth);
  }
  return false;
}

class Reader {
 public:
  explicit Reader(std::string_view bytes) : bytes_(bytes) {}
  [[nodiscard]] std::variant<Value, Error> readWhole() {
    Value value;
    if (read(value, 1) && at_ != bytes_.size()) fail("there is more after the object");
    if (wrong_ != nullptr)
      return Error{kKeyedArchiveErrorDomain, static_cast<int32_t>(at_),
                   "at byte " + std::to_string(at_) + ": " + wrong_};
    return value;
  }

 private:
  struct Head {
    uint8_t major = 0, information = 0;
    uint64_t argument = 0;
  };
  // Only the first fault is kept.
  bool fail(const char* what) {
    if (wrong_ == nullptr) wrong_ = what;
    return false;
  }
  [[nodiscard]] size_t left() const { return bytes_.size() - at_; }
  [[nodiscard]] bool readHead(Head& head);
  [[nodiscard]] bool read(Value& value, int depth);
  [[nodiscard]] bool readInteger(const Head& head, Value& value);
  [[nodiscard]] bool readRun(const Head& head, std::string_view& run);
  [[nodiscard]] bool readText(const Head& head, String& text);
  [[nodiscard]] bool readArray(const Head& head, Value& value, int depth);
  [[nodiscard]] bool readDictionary(const Head& head, Value& value, int depth);
  [[nodiscard]] bool readDate(const Head& head, Value& value, int depth);
  [[nodiscard]] bool readSimple(const Head& head, Value& value);

  const std::string_view bytes_;
  size_t at_ = 0;
  const char* wrong_ = nullptr;
};

double fromHalf(uint64_t bits) {
  const auto exponent = static_cast<int>(bits >> 10 & 0x1F);
  const auto mantissa = static_cast<double>(bits & 0x3FF);
  double number = 0;
  if (exponent == 0)
    number = std::ldexp(mantissa, -24);
  else if (exponent != 31)
    number = std::ldexp(mantissa + 1024, exponent - 25);
  else
    number = mantissa == 0 ? INFINITY : NAN;
  return (bits & 0x8000) != 0 ? -number : number;
}

bool Reader::readHead(Head& head) {
  if (left() == 0) return fail("it ends too early");
  const auto first = static_cast<uint8_t>(bytes_[at_]);
  head.major = first >> 5;
  head.information = first & 0x1F;
  if (head.information > 27) return fail("a length that is not given, or a reserved one");
  const size_t width = head.information < 24 ? 0 : size_t{1} << (head.information - 24);
  if (left() < 1 + width) return fail("it ends too early");
  ++at_;
  head.argument = width == 0 ? head.information : 0;
  for (size_t i = 0; i < width; ++i) head.argument = head.argument << 8 | static_cast<uint8_t>(bytes_[at_++]);
  return true;
}

bool Reader::read(Value& value, int depth) {
  if (depth > Limits::maxObjectDepth) return fail("it is nested too deep");
  Head head;
  if (!readHead(head)) return false;
  std::string_view run;
  String text;
  switch (head.major) {
    case kUnsigned:
    case kNegative:
      return readInteger(head, value);
    case kBytes:
      if (!readRun(head, run)) return false;
      value = Data(run);
      return true;
    case kText:
      if (!readText(head, text)) return false;
      value = std::move(text);
      return true;
    case kArray:
      return readArray(head, value, depth);
    case kMap:
      return readDictionary(head, value, depth);
    case kTag:
      return readDate(head, value, depth);
    default:
      return readSimple(head, value);
  }
}

bool Reader::readInteger(const Head& head, Value& value) {
  const bool fits = head.argument <= static_cast<uint64_t>(INT64_MAX);
  if (head.major == kNegative) {
    if (!fits) return fail("an integer is too small");
    value = static_cast<int64_t>(~head.argument);
  } else if (fits) {
    value = static_cast<int64_t>(head.argument);
  } else {
    value = head.argument;
  }
  return true;
}

bool Reader::readRun(const Head& head, std::string_view& run) {
  if (head.argument > left()) return fail("it ends too early");
  run = bytes_.substr(at_, static_cast<size_t>(head.argument));
  at_ += run.size();
  return true;
}

bool Reader::readText(const Head& head, String& text) {
  std::string_view run;
  if (!readRun(head, run)) return false;
  if (!isValidUTF8(run)) return fail("a text is no UTF-8");
  text = String(run);
  return true;
}

bool Reader::readArray(const Head& head, Value& value, int depth) {
  if (head.argument > left()) return fail("it ends too early");  // an entry takes a byte at least
  Array array;
  for (uint64_t i = 0; i < head.argument; ++i) {
    Value entry;
    if (!read(entry, depth + 1)) return false;
    array.append(std::move(entry));
  }
  value = std::move(array);
  return true;
}

bool Reader::readDictionary(const Head& head, Value& value, int depth) {
  if (head.argument > left() / 2) return fail("it ends too early");
  Dictionary dictionary;
  for (uint64_t i = 0; i < head.argument; ++i) {
    Head keyHead;
    String key;
    Value entry;
    if (!readHead(keyHead)) return false;
    if (keyHead.major != kText) return fail("a key is no text");
    if (!readText(keyHead, key) || !read(entry, depth + 1)) return false;
    dictionary.set(std::move(key), std::move(entry));
  }
  value = std::move(dictionary);
  return true;
}

bool Reader::readDate(const Head& head, Value& value, int depth) {
  if (head.argument != kDateTag) return fail("an unknown tag");
  Value seconds;
  if (!read(seconds, depth + 1)) return false;
  if (!seconds.isNumber() || seconds.kind() == Value::Kind::boolean) return fail("a date is no number");
  value = Date{seconds.doubleValue()};
  return true;
}

bool Reader::readSimple(const Head& head, Value& value) {
  switch (head.information) {
    case kFalse:
    case kTrue:
      value = head.information == kTrue;
      return true;
    case kNull:
    case kUndefined:
      value = nullptr;
      return true;
    case kHalf:
      value = fromHalf(head.argument);
      return true;
    case kSingle:
      value = static_cast<double>(std::bit_cast<float>(static_cast<uint32_t>(head.argument)));
      return true;
    case kDouble:
      value = std::bit_cast<double>(head.argument);
      return true;
    default:
      return fail("an unknown simple value");
  }
}

}  // namespace

std::optional<Data> archivedData(const Value& value) {
  Writer writer;
  if (!writer.write(value, 1)) return std::nullopt;
  return Data(std::string_view(writer.bytes()));
}

std::variant<Value, Error> unarchivedObject(std::string_view bytes) {
  return Reader(bytes).readWhole();
}

}  // namespace kyt
