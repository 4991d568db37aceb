// The C interface's dictionaries and arrays: thin over the C++ ones. Nothing thrown leaves them.
#include "client/CObjects.h"

#include <new>
#include <string_view>
#include <utility>

namespace {

using kyt::Value;

static_assert(static_cast<int>(Value::Kind::null) == KYT_KIND_NULL);
static_assert(static_cast<int>(Value::Kind::unsignedInteger) == KYT_KIND_UINT);
static_assert(static_cast<int>(Value::Kind::date) == KYT_KIND_DATE);
static_assert(static_cast<int>(Value::Kind::dictionary) == KYT_KIND_DICTIONARY);

void set(kyt_dictionary* dictionary, const char* key, Value value) {
  if (dictionary != nullptr && key != nullptr) dictionary->value.set(kyt::String(key), std::move(value));
}

const Value* find(const kyt_dictionary* dictionary, const char* key) {
  return dictionary != nullptr && key != nullptr ? dictionary->value.find(key) : nullptr;
}

void append(kyt_array* array, Value value) {
  if (array != nullptr) array->value.append(std::move(value));
}

// A kyt_value is a Value in a dictionary or an array, known to C by name alone.
const Value* valueOf(const kyt_value* value) {
  return reinterpret_cast<const Value*>(value);
}
const kyt_value* inC(const Value* value) {
  return reinterpret_cast<const kyt_value*>(value);
}

const kyt_value* entry(const kyt::Dictionary* dictionary, size_t index, const char** key) {
  const bool exists = dictionary != nullptr && index < dictionary->size();
  const kyt::DictionaryEntry* found = exists ? dictionary->begin() + index : nullptr;
  if (key != nullptr) *key = found != nullptr ? found->key.c_str() : nullptr;
  return found != nullptr ? inC(&found->value) : nullptr;
}

}  // namespace

extern "C" {

kyt_array* kyt_array_new(void) {
  return new (std::nothrow) kyt_array;
}
void kyt_array_free(kyt_array* array) {
  delete array;
}
void kyt_array_append_string(kyt_array* array, const char* value) {
  append(array, value != nullptr ? Value(value) : Value());
}
void kyt_array_append_int(kyt_array* array, int64_t value) {
  append(array, value);
}
void kyt_array_append_uint(kyt_array* array, uint64_t value) {
  append(array, value);
}
void kyt_array_append_bool(kyt_array* array, int value) {
  append(array, value != 0);
}
void kyt_array_append_date(kyt_array* array, double seconds) {
  append(array, kyt::Date{seconds});
}
void kyt_array_append_double(kyt_array* array, double value) {
  append(array, value);
}
void kyt_array_append_data(kyt_array* array, const void* bytes, size_t length) {
  if (bytes != nullptr || length == 0)
    append(array, kyt::Data(std::string_view(static_cast<const char*>(bytes), length)));
}
void kyt_array_append_dictionary(kyt_array* array, const kyt_dictionary* value) {
  if (value != nullptr) append(array, value->value);
}
void kyt_array_append_array(kyt_array* array, const kyt_array* value) {
  if (value != nullptr) append(array, value->value);
}
size_t kyt_array_count(const kyt_array* array) {
  return array != nullptr ? array->value.size() : 0;
}

kyt_dictionary* kyt_dictionary_new(void) {
  return new (std::nothrow) kyt_dictionary;
}
void kyt_dictionary_free(kyt_dictionary* dictionary) {
  delete dictionary;
}
void kyt_dictionary_set_string(kyt_dictionary* dictionary, const char* key, const char* value) {
  set(dictionary, key, value != nullptr ? Value(value) : Value());
}
void kyt_dictionary_set_int(kyt_dictionary* dictionary, const char* key, int64_t value) {
  set(dictionary, key, value);
}
void kyt_dictionary_set_uint(kyt_dictionary* dictionary, const char* key, uint64_t value) {
  set(dictionary, key, value);
}
void kyt_dictionary_set_double(kyt_dictionary* dictionary, const char* key, double value) {
  set(dictionary, key, value);
}
void kyt_dictionary_set_bool(kyt_dictionary* dictionary, const char* key, int value) {
  set(dictionary, key, Value(value != 0));
}
void kyt_dictionary_set_date(kyt_dictionary* dictionary, const char* key, double seconds) {
  set(dictionary, key, kyt::Date{seconds});
}
void kyt_dictionary_set_data(kyt_dictionary* dictionary, const char* key, const void* bytes, size_t length) {
  if (bytes != nullptr || length == 0)
    set(dictionary, key, kyt::Data(std::string_view(static_cast<const char*>(bytes), length)));
}
void kyt_dictionary_set_dictionary(kyt_dictionary* dictionary, const char* key, const kyt_dictionary* value) {
  if (value != nullptr) set(dictionary, key, value->value);
}
void kyt_dictionary_set_array(kyt_dictionary* dictionary, const char* key, const kyt_array* value) {
  if (value != nullptr) set(dictionary, key, value->value);
}
void kyt_dictionary_remove(kyt_dictionary* dictionary, const char* key) {
  if (dictionary != nullptr && key != nullptr) dictionary->value.remove(key);
}
size_t kyt_dictionary_count(const kyt_dictionary* dictionary) {
  return dictionary != nullptr ? dictionary->value.size() : 0;
}
const char* kyt_dictionary_get_string(const kyt_dictionary* dictionary, const char* key) {
  const Value* value = find(dictionary, key);
  return value != nullptr && value->isString() ? value->string()->c_str() : nullptr;
}
int64_t kyt_dictionary_get_int(const kyt_dictionary* dictionary, const char* key, int64_t otherwise) {
  const Value* value = find(dictionary, key);
  return value != nullptr ? value->longLongValue() : otherwise;
}
double kyt_dictionary_get_double(const kyt_dictionary* dictionary, const char* key, double otherwise) {
  const Value* value = find(dictionary, key);
  return value != nullptr ? value->doubleValue() : otherwise;
}

const kyt_value* kyt_dictionary_at(const kyt_dictionary* dictionary, size_t index, const char** key) {
  return entry(dictionary != nullptr ? &dictionary->value : nullptr, index, key);
}
kyt_kind kyt_value_kind(const kyt_value* value) {
  return value != nullptr ? static_cast<kyt_kind>(valueOf(value)->kind()) : KYT_KIND_NULL;
}
int64_t kyt_value_int(const kyt_value* value) {
  return value != nullptr ? valueOf(value)->longLongValue() : 0;
}
uint64_t kyt_value_uint(const kyt_value* value) {
  return value != nullptr ? valueOf(value)->unsignedLongLongValue() : 0;
}
double kyt_value_double(const kyt_value* value) {
  if (value == nullptr) return 0;
  const auto date = valueOf(value)->date();
  return date ? date->secondsSince1970 : valueOf(value)->doubleValue();
}
const char* kyt_value_bytes(const kyt_value* value, size_t* length) {
  std::string_view bytes;
  if (value != nullptr && valueOf(value)->isString()) bytes = valueOf(value)->string()->view();
  if (const kyt::Data* data = value != nullptr ? valueOf(value)->data() : nullptr) {
    bytes = data->view();
    if (bytes.data() == nullptr) bytes = "";  // empty data is no null
  }
  if (length != nullptr) *length = bytes.size();
  return bytes.data();
}
size_t kyt_value_count(const kyt_value* value) {
  if (value == nullptr) return 0;
  if (const kyt::Dictionary* dictionary = valueOf(value)->dictionary()) return dictionary->size();
  const kyt::Array* array = valueOf(value)->array();
  return array != nullptr ? array->size() : 0;
}
const kyt_value* kyt_value_at(const kyt_value* value, size_t index, const char** key) {
  const kyt::Dictionary* dictionary = value != nullptr ? valueOf(value)->dictionary() : nullptr;
  if (dictionary != nullptr) return entry(dictionary, index, key);
  if (key != nullptr) *key = nullptr;
  const kyt::Array* array = value != nullptr ? valueOf(value)->array() : nullptr;
  return array != nullptr && index < array->size() ? inC(array->begin() + index) : nullptr;
}

}  // extern "C"
