#include "platform/objects/ObjectSize.h"

#include "platform/objects/MemoryInfo.h"

namespace kyt {
namespace {

constexpr size_t kBlockOverhead = 32;  // header of a block, and the allocator's

uint32_t blockSize(const void* block, MemoryInfo& memory) {
  return block == nullptr ? 0 : static_cast<uint32_t>(memory.blockSize(block));
}

}  // namespace

uint32_t objectSizeEstimate(const Dictionary& dictionary, MemoryInfo& memory) {
  uint32_t size = 0;
  for (const DictionaryEntry& entry : dictionary) {
    size += blockSize(entry.key.block(), memory);
    size += objectSizeEstimate(entry.value, memory);
    size += blockSize(entry.value.block(), memory);
  }
  return size + blockSize(dictionary.block(), memory) + blockSize(dictionary.indexBlock(), memory);
}

uint32_t objectSizeEstimate(const Value& value, MemoryInfo& memory) {
  if (const Dictionary* dictionary = value.dictionary()) return objectSizeEstimate(*dictionary, memory);
  uint32_t size = 0;
  if (const Array* array = value.array())
    for (const Value& element : *array)
      size += objectSizeEstimate(element, memory) + blockSize(element.block(), memory);
  return size + blockSize(value.block(), memory);
}

size_t roughSize(const Value& value) {
  if (value.block() == nullptr) return 0;  // all but long texts, data and containers
  if (const String* text = value.string()) return kBlockOverhead + text->size();
  if (const Data* data = value.data()) return kBlockOverhead + data->size();
  if (const Dictionary* dictionary = value.dictionary()) return roughSize(*dictionary);
  const Array& array = *value.array();
  size_t bytes = kBlockOverhead + array.size() * sizeof(Value);
  for (const Value& element : array) bytes += roughSize(element);
  return bytes;
}

size_t roughSize(const Dictionary& dictionary) {
  size_t bytes = kBlockOverhead + dictionary.size() * sizeof(DictionaryEntry);
  for (const DictionaryEntry& entry : dictionary) {
    if (entry.key.block() != nullptr) bytes += kBlockOverhead + entry.key.size();
    if (entry.value.block() != nullptr) bytes += roughSize(entry.value);
  }
  return bytes;
}

}  // namespace kyt
