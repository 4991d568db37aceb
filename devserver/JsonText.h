// Writes the JSON that the query interface returns: a thin layer over RapidJSON's writer that takes string
// views and makes every text valid UTF-8, whatever a client sent. Used by one thread at a time.
#pragma once

#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <cmath>
#include <concepts>
#include <optional>
#include <string>
#include <string_view>

#include "devserver/Text.h"

namespace kyt::devserver {

class JsonText {
 public:
  JsonText() : writer_(buffer_) {}
  JsonText(const JsonText&) = delete;
  JsonText& operator=(const JsonText&) = delete;

  JsonText& object() { return writer_.StartObject(), *this; }
  JsonText& endObject() { return writer_.EndObject(), *this; }
  JsonText& array() { return writer_.StartArray(), *this; }
  JsonText& endArray() { return writer_.EndArray(), *this; }
  JsonText& key(std::string_view name) {
    writer_.Key(name.data(), static_cast<rapidjson::SizeType>(name.size()));
    return *this;
  }
  JsonText& value(std::string_view text) {
    const std::string valid = validText(text);
    writer_.String(valid.data(), static_cast<rapidjson::SizeType>(valid.size()));
    return *this;
  }
  JsonText& value(const char* text) { return value(std::string_view(text)); }
  JsonText& value(std::same_as<bool> auto flag) { return writer_.Bool(flag), *this; }
  JsonText& value(std::signed_integral auto number) { return writer_.Int64(number), *this; }
  JsonText& value(std::unsigned_integral auto number) requires(!std::same_as<decltype(number), bool>) {
    return writer_.Uint64(number), *this;
  }
  JsonText& value(double number) {
    if (std::isfinite(number)) {
      writer_.Double(number);
    } else {
      writer_.Null();
    }
    return *this;
  }
  template <typename T>
  JsonText& value(const std::optional<T>& optional) {
    if (optional) return value(*optional);
    writer_.Null();
    return *this;
  }
  // Text that is JSON already.
  JsonText& json(std::string_view text) {
    writer_.RawValue(text.data(), text.size(), rapidjson::kObjectType);
    return *this;
  }
  template <typename T>
  JsonText& member(std::string_view name, const T& content) {
    return key(name).value(content);
  }
  [[nodiscard]] std::string text() const { return {buffer_.GetString(), buffer_.GetSize()}; }

 private:
  rapidjson::StringBuffer buffer_;
  rapidjson::Writer<rapidjson::StringBuffer> writer_;
};

}  // namespace kyt::devserver
