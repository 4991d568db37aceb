// The estimate of the memory that objects hold, as the health report and the batch size show it.
//
// For a dictionary: each key's block, each value's estimate and each value's block again; for an array each element's
// estimate and its block again; finally the object's own block(s). Every value's block is so counted twice, leaves too,
// deliberately: the figure is an estimate and servers know it as that. Values that live inside their container own no
// block and count 0. Accumulated in 32 bits.
#pragma once

#include <cstddef>
#include <cstdint>

#include "platform/objects/Value.h"

namespace kyt {

class MemoryInfo;

[[nodiscard]] uint32_t objectSizeEstimate(const Value& value, MemoryInfo& memory);
[[nodiscard]] uint32_t objectSizeEstimate(const Dictionary& dictionary, MemoryInfo& memory);

// What an object holds, roughly, in bytes: for limits, where the estimate above would cost a query of the allocator for
// each block of each event.
[[nodiscard]] size_t roughSize(const Value& value);
[[nodiscard]] size_t roughSize(const Dictionary& dictionary);

}  // namespace kyt
