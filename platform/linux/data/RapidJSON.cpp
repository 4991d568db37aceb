#include "platform/linux/data/RapidJSON.h"

#include <rapidjson/allocators.h>
#include <rapidjson/encodedstream.h>
#include <rapidjson/error/en.h>
#include <rapidjson/memorystream.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/reader.h>

#include <charconv>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <type_traits>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/data/JSONTextStream.h"

namespace kyt {
namespace {

// Numbers as both writers write them. Doubles are the shortest decimal in every case (RapidJSON's algorithm misses some).
void appendInteger(JSONTextStream& stream, auto number) {
  char* to = stream.room(24);
  if constexpr (std::is_signed_v<decltype(number)>) {
    stream.advance(rapidjson::internal::i64toa(number, to));
  } else {
    stream.advance(rapidjson::internal::u64toa(number, to));
  }
}

void appendReal(JSONTextStream& stream, double number) {
  // Without an exponent where people would write none, as decimalText() does.
  const double magnitude = std::fabs(number);
  const bool plain = magnitude == 0 || (magnitude >= 1e-6 && magnitude < 1e17);
  char* to = stream.room(64);
  const auto result = plain ? std::to_chars(to, to + 64, number, std::chars_format::fixed)
                            : std::to_chars(to, to + 64, number);
  stream.advance(result.ptr);
}

// The compact text. In a list of dictionaries most entries of one are those of the dictionary before, such as a record's
// constant keys: what is the same, bit for bit, is copied from the text that is there already.
class CompactWriter {
 public:
  explicit CompactWriter(std::string& out) : stream_(out) {}

  void write(const Value& value) {
    switch (value.kind()) {
      case Value::Kind::string:
        return stream_.appendQuoted(value.string()->view());
      case Value::Kind::integer:
        return appendInteger(stream_, *value.integer());
      case Value::Kind::unsignedInteger:
        return appendInteger(stream_, *value.unsignedInteger());
      case Value::Kind::boolean:
        return stream_.append(*value.boolean() ? "true" : "false");
      case Value::Kind::real:
        if (std::isfinite(*value.real())) return appendReal(stream_, *value.real());
        return stream_.append("null");
      case Value::Kind::dictionary:
        return dictionary(*value.dictionary());
      case Value::Kind::array:
        return array(*value.array());
      case Value::Kind::null:
      case Value::Kind::date:
      case Value::Kind::data:
        return stream_.append("null");
    }
  }

 private:
  // Where an entry's text begins (behind a comma) and ends.
  struct Place {
    size_t begin, end;
  };
  using Places = std::vector<Place>;

  void dictionary(const Dictionary& entries) {
    stream_.Put('{');
    for (const DictionaryEntry& entry : entries) {
      if (&entry != entries.begin()) stream_.Put(',');
      wholeEntry(entry);
    }
    stream_.Put('}');
  }

  void wholeEntry(const DictionaryEntry& entry) {
    stream_.appendQuoted(entry.key.view());
    stream_.Put(':');
    write(entry.value);
  }

  void array(const Array& elements) {
    stream_.Put('[');
    const Dictionary* before = nullptr;
    Places places, placesBefore;
    for (const Value& element : elements) {
      if (&element != elements.begin()) stream_.Put(',');
      const Dictionary* record = element.dictionary();
      if (record == nullptr || elements.size() == 1) {
        write(element);
      } else {
        places.clear();
        places.reserve(record->size());
        like(*record, before, placesBefore, places);
        std::swap(places, placesBefore);
      }
      before = record;
    }
    stream_.Put(']');
  }

  // A dictionary that is probably like the one before it in the list, which may be none; it says where its entries are.
  void like(const Dictionary& record, const Dictionary* before, const Places& placesBefore, Places& places) {
    stream_.Put('{');
    const size_t size = record.size();
    const size_t sizeBefore = before != nullptr ? before->size() : 0;
    size_t other = 0;  // the entry of the one before that is compared
    for (size_t i = 0; i < size;) {
      if (i != 0) stream_.Put(',');
      // Behind more or fewer entries of the client's, the rest is alike again.
      if (other < sizeBefore && !sameKey(record, i, *before, other) && sizeBefore + i >= size)
        other = sizeBefore + i - size;
      size_t same = 0;
      while (i + same < size && other + same < sizeBefore &&
             sameEntry(record, i + same, *before, other + same))
        ++same;
      if (same != 0) {
        repeatEntries(placesBefore, other, same, places);
      } else {
        same = 1;
        const size_t begin = stream_.position();
        wholeEntry(record.begin()[i]);
        places.push_back({begin, stream_.position()});
      }
      i += same;
      other += same;
    }
    stream_.Put('}');
  }

  void repeatEntries(const Places& from, size_t first, size_t count, Places& places) {
    const size_t begin = from[first].begin;
    const size_t here = stream_.position();
    stream_.repeat(begin, from[first + count - 1].end - begin);
    for (size_t i = first; i < first + count; ++i)
      places.push_back({from[i].begin - begin + here, from[i].end - begin + here});
  }

  // The same bits are the same text, number or block; others may be so too, and are written anew. Both dictionaries are
  // alive, so no block of the one can be another's by now.
  // NOLINTBEGIN(bugprone-suspicious-memory-comparison): the bits are what is asked for.
  static bool sameKey(const Dictionary& a, size_t i, const Dictionary& b, size_t j) {
    return std::memcmp(&a.begin()[i].key, &b.begin()[j].key, sizeof(kyt::String)) == 0;
  }
  static bool sameEntry(const Dictionary& a, size_t i, const Dictionary& b, size_t j) {
    return std::memcmp(&a.begin()[i], &b.begin()[j], sizeof(DictionaryEntry)) == 0;
  }
  // NOLINTEND(bugprone-suspicious-memory-comparison)

  JSONTextStream stream_;
};

// The writer's record of open containers lives on the stack up to this depth.
constexpr size_t kLevels = 64;
using LevelAllocator = rapidjson::MemoryPoolAllocator<>;
using PrettyBase =
    rapidjson::PrettyWriter<JSONTextStream, rapidjson::UTF8<>, rapidjson::UTF8<>, LevelAllocator>;

// The text for people (kytctl shows storebags): indentation and punctuation stay RapidJSON's own. CompactWriter does
// without that library's writer, for whose state at each level every event would pay.
class PrettyObjectWriter : public PrettyBase {
 public:
  PrettyObjectWriter(JSONTextStream& stream, LevelAllocator& allocator)
      : PrettyBase(stream, &allocator, kLevels) {}

  void write(const Value& value) {
    switch (value.kind()) {
      case Value::Kind::string:
        return text(value.string()->view());
      case Value::Kind::integer:
        return integer(*value.integer());
      case Value::Kind::unsignedInteger:
        return integer(*value.unsignedInteger());
      case Value::Kind::boolean:
        Bool(*value.boolean());
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
        Null();
        return;
    }
  }

 private:
  void text(std::string_view view) {
    PrettyPrefix(rapidjson::kStringType);
    os_->appendQuoted(view);
    EndValue(true);
  }

  void integer(auto number) {
    PrettyPrefix(rapidjson::kNumberType);
    appendInteger(*os_, number);
    EndValue(true);
  }

  void real(double number) {
    if (!std::isfinite(number)) {
      Null();
      return;
    }
    PrettyPrefix(rapidjson::kNumberType);
    appendReal(*os_, number);
    EndValue(true);
  }

  void dictionary(const Dictionary& entries) {
    StartObject();
    for (const DictionaryEntry& entry : entries) {
      text(entry.key.view());
      write(entry.value);
    }
    EndObject();
  }

  void array(const Array& elements) {
    StartArray();
    for (const Value& element : elements) write(element);
    EndArray();
  }
};

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
  CompactWriter(out).write(value);
}

void RapidJSON::writePretty(const Value& value, std::string& out) {
  alignas(std::max_align_t) char levels[kLevels * 16 + 128];
  LevelAllocator allocator(levels, sizeof levels);
  JSONTextStream stream(out);
  PrettyObjectWriter(stream, allocator).write(value);
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
