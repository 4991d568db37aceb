// Roughly what objects take on the wire; cheap, since the caller of sendMessage pays for it.
#pragma once

#include <cstddef>

#include "platform/objects/Value.h"

namespace kyt::client {

inline size_t wireBytes(const Value& value, int depth) {
  if (depth > 8) return 64;
  if (const String* text = value.string()) return 12 + text->size();
  if (const Data* data = value.data()) return 12 + data->size();
  size_t bytes = 16;
  if (const Dictionary* dictionary = value.dictionary()) {
    for (const DictionaryEntry& entry : *dictionary)
      bytes += 8 + entry.key.size() + wireBytes(entry.value, depth + 1);
  } else if (const Array* array = value.array()) {
    for (const Value& element : *array) bytes += wireBytes(element, depth + 1);
  }
  return bytes;
}

inline size_t entryBytes(const DictionaryEntry& entry) {
  return 8 + entry.key.size() + wireBytes(entry.value, 1);
}

inline size_t messageBytes(const Dictionary& payload) {
  size_t bytes = 256;
  for (const DictionaryEntry& entry : payload) bytes += entryBytes(entry);
  return bytes;
}

}  // namespace kyt::client
