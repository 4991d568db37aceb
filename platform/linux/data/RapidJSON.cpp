#include "platform/linux/data/RapidJSON.h"

#include <rapidjson/allocators.h>
#include <rapidjson/encodedstream.h>
#include <rapidjson/error/en.h>
#include <rapidjson/memorystream.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/reader.h>
#include <rapidjson/writer.h>

#include <charconv>
#include <cmath>
#include <cstdlib>
#include <type_traits>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/data/JSONTextStream.h"

namespace kyt {
namespace {

// The writer's record of open containers lives on the stack up to this depth.
constexpr size_t kLevels = 64;
using LevelAllocator = rapidjson::MemoryPoolAllocator<>;
using CompactBase = rapidjson::Writer<JSONTextStream, rapidjson::UTF8<>, rapidjson::UTF8<>, LevelAllocator>;
using PrettyBase =
    rapidjson::PrettyWriter<JSONTextStream, rapidjson::UTF8<>, rapidjson::UTF8<>, LevelAllocator>;

// RapidJSON's writer for objects. Punctuation is its own; texts are copied by words, and doubles are the
// shortest decimal in every case (RapidJSON's algorithm misses some).
template <typename Base>
class ObjectWriter : public Base {
 public:
  ObjectWriter(JSONTextStream& stream, LevelAllocator& allocator) : Base(stream, &allocator, kLevels) {}

  void write(const Value& value) {
    switch (value.kind()) {
      case Value::Kind::string:
        return text(value.string()->view());
      case Value::Kind::integer:
        return integer(*value.integer());
      case Value::Kind::unsignedInteger:
        return integer(*value.unsignedInteger());
      case Value::Kind::boolean:
        this->Bool(*value.boolean());
        return;
      case Value::Kind::real:
        return real(*value.real());
      case Value::Kind::dictionary:
        return dictionary(*value.dictionary());
      case Value::Kind::array:
        return array(*value.array());
      case Value::Kind::null:
      case Value::Kind::date:
      case Value::Kind::data:
        this->Null();
        return;
    }
  }

 private:
  void begin(rapidjson::Type type) {
    if constexpr (std::is_same_v<Base, PrettyBase>) {
      this->PrettyPrefix(type);
    } else {
      this->Prefix(type);
    }
  }

  void text(std::string_view view) {
    begin(rapidjson::kStringType);
    this->os_->appendQuoted(view);
    this->EndValue(true);
  }

  void integer(auto number) {
    begin(rapidjson::kNumberType);
    char* to = this->os_->room(24);
    if constexpr (std::is_signed_v<decltype(number)>) {
      this->os_->advance(rapidjson::internal::i64toa(number, to));
    } else {
      this->os_->advance(rapidjson::internal::u64toa(number, to));
    }
    this->EndValue(true);
  }

  void real(double number) {
    if (!std::isfinite(number)) {
      this->Null();
      return;
    }
    begin(rapidjson::kNumberType);
    // Without an exponent where people would write none, as decimalText() does.
    const double magnitude = std::fabs(number);
    const bool plain = magnitude == 0 || (magnitude >= 1e-6 && magnitude < 1e17);
    char* to = this->os_->room(64);
    const auto result = plain ? std::to_chars(to, to + 64, number, std::chars_format::fixed)
                              : std::to_chars(to, to + 64, number);
    this->os_->advance(result.ptr);
    this->EndValue(true);
  }

  void dictionary(const Dictionary& entries) {
    this->StartObject();
    for (const DictionaryEntry& entry : entries) {
      text(entry.key.view());
      write(entry.value);
    }
    this->EndObject();
  }

  void array(const Array& elements) {
    this->StartArray();
    for (const Value& element : elements) write(element);
    this->EndArray();
  }
};

template <typename Base>
void writeObject(const Value& value, std::string& out) {
  alignas(std::max_align_t) char levels[kLevels * 16 + 128];
  LevelAllocator allocator(levels, sizeof levels);
  JSONTextStream stream(out);
  ObjectWriter<Base> writer(stream, allocator);
  writer.write(value);
}

// Builds objects from the reader's events. Answering false ends the parse.
class Builder {
 public:
  using Ch = char;

  bool Null() { return take(Value()); }
  bool Bool(bool truth) { return take(Value(truth)); }
  // Numbers come as their text: the reader's own conversion of some ("0e47") is undefined.
  bool RawNumber(const char* text, rapidjson::SizeType length, bool) {
    const char* end = text + length;
    if (std::string_view(text, length).find_first_of(".eE") == std::string_view::npos) {
      int64_t integer = 0;
      if (std::from_chars(text, end, integer).ec == std::errc()) return take(Value(integer));
      uint64_t large = 0;
      if (*text != '-' && std::from_chars(text, end, large).ec == std::errc()) return take(Value(large));
    }
    double number = 0;
    if (std::from_chars(text, end, number).ec == std::errc()) return take(Value(number));
    // Too near to zero for a double is zero or nearly so; too far from it is an error.
    number = std::strtod(std::string(text, length).c_str(), nullptr);
    if (std::isfinite(number)) return take(Value(number));
    error_ = "Number too big to be stored in double.";
    return false;
  }
  bool Int(int) { return false; }  // this and the next four are never asked for
  bool Uint(unsigned) { return false; }
  bool Int64(int64_t) { return false; }
  bool Uint64(uint64_t) { return false; }
  bool Double(double) { return false; }
  bool String(const char* text, rapidjson::SizeType length, bool) {
    return isText({text, length}) && take(Value(std::string_view(text, length)));
  }
  bool Key(const char* text, rapidjson::SizeType length, bool) {
    open_.back().key = kyt::String(std::string_view(text, length));
    return isText({text, length});
  }
  bool StartObject() { return start(Value(Dictionary())); }
  bool StartArray() { return start(Value(Array())); }
  bool EndObject(rapidjson::SizeType) { return end(); }
  bool EndArray(rapidjson::SizeType) { return end(); }

  // Why this ended the parse, or null.
  [[nodiscard]] const char* error() const { return error_; }
  [[nodiscard]] Value& root() { return root_; }

 private:
  struct Container {
    Value value;
    kyt::String key;  // the one that waits for its value
  };

  bool take(Value value) {
    if (open_.empty()) {
      root_ = std::move(value);
    } else if (Array* array = open_.back().value.mutableArray()) {
      array->append(std::move(value));
    } else {
      open_.back().value.mutableDictionary()->set(std::move(open_.back().key), std::move(value));
    }
    return true;
  }
  bool start(Value container) {
    if (open_.size() >= static_cast<size_t>(Limits::maxObjectDepth)) {
      error_ = "Containers are nested too deep.";
      return false;
    }
    open_.push_back({std::move(container), {}});
    return true;
  }
  bool end() {
    Value value = std::move(open_.back().value);
    open_.pop_back();
    return take(std::move(value));
  }

  std::vector<Container> open_;
  // The reader takes an escaped low surrogate that stands alone and makes what is no UTF-8 of it.
  bool isText(std::string_view text) {
    if (isValidUTF8(text)) return true;
    error_ = "The surrogate pair in string is invalid.";
    return false;
  }
  Value root_;
  const char* error_ = nullptr;
};

Error errorAt(size_t offset, int code, const char* what) {
  return {kJSONErrorDomain, code, std::string(what) + " (offset " + std::to_string(offset) + ")"};
}

}  // namespace

void RapidJSON::writeCompact(const Value& value, std::string& out) {
  writeObject<CompactBase>(value, out);
}

void RapidJSON::writePretty(const Value& value, std::string& out) {
  writeObject<PrettyBase>(value, out);
}

std::variant<Value, Error> RapidJSON::parse(std::string_view text) {
  // The reader takes a NUL for the end of the text, and would not look at what follows it.
  if (const size_t zero = text.find('\0'); zero != text.npos)
    return errorAt(zero, rapidjson::kParseErrorValueInvalid, "Invalid value.");
  rapidjson::MemoryStream bytes(text.data(), text.size());
  rapidjson::EncodedInputStream<rapidjson::UTF8<>, rapidjson::MemoryStream> stream(bytes);
  rapidjson::Reader reader;
  Builder builder;
  constexpr unsigned kOptions = rapidjson::kParseValidateEncodingFlag | rapidjson::kParseNumbersAsStringsFlag;
  const rapidjson::ParseResult result = reader.Parse<kOptions>(stream, builder);
  if (builder.error() != nullptr) return errorAt(result.Offset(), -1, builder.error());
  if (result.IsError())
    return errorAt(result.Offset(), result.Code(), rapidjson::GetParseError_En(result.Code()));
  return std::move(builder.root());
}

}  // namespace kyt
