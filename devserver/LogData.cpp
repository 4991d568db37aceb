#include "devserver/LogData.h"

#include <openssl/sha.h>

#include "devserver/Text.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/objects/KeyedArchive.h"

namespace kyt::devserver {
namespace {

// The object as JSON can carry it.
Value shown(const Value& value) {
  if (value.date()) return Value(description(value));
  if (const Data* data = value.data()) return Dictionary{{"base64", base64(data->view())}};
  if (const Array* array = value.array()) {
    Array out;
    for (const Value& entry : *array) out.append(shown(entry));
    return out;
  }
  if (const Dictionary* dictionary = value.dictionary()) {
    Dictionary out;
    for (const DictionaryEntry& entry : *dictionary) out.set(entry.key, shown(entry.value));
    return out;
  }
  return value;
}

}  // namespace

LogData readLogData(std::string_view body) {
  LogData out;
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(body.data()), body.size(), digest);
  for (int i = 0; i < 8; ++i) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", digest[i]);
    out.name += digits;
  }
  const auto read = unarchivedObject(body);
  if (const Error* error = std::get_if<Error>(&read)) {
    out.reason = "the archive is malformed " + error->localizedDescription;
    return out;
  }
  const Value& value = std::get<Value>(read);
  if (const Array* array = value.array())
    out.entries = array->size();
  else
    out.reason = "the archive holds no array";
  out.json.clear();
  RapidJSON().writeCompact(shown(value), out.json);
  return out;
}

}  // namespace kyt::devserver
