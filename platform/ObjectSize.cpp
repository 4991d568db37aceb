#include "platform/ObjectSize.h"

#include "platform/System.h"

namespace kyt {
namespace {

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

}  // namespace kyt
