// Reads the marshalled values that become objects: variants, dictionaries, arrays, data. The recursive half of
// BodyReader, and its hot one. `depth` says how many containers are around the value; a failure is in the cursor.
#pragma once

#include <string_view>

#include "platform/ipc/WireCursor.h"
#include "platform/objects/Value.h"

namespace kyt::wire {

[[nodiscard]] Value readVariant(WireCursor& c, int depth);
// The entries of a{sX}, X being `valueType`.
bool readEntries(WireCursor& c, std::string_view valueType, Dictionary& out, int depth);
// The elements of aX.
bool readElements(WireCursor& c, std::string_view elementType, Array& out, int depth);
// ay
[[nodiscard]] Value readBytes(WireCursor& c, int depth);

}  // namespace kyt::wire
