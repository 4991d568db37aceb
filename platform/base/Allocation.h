// Memory of malloc's, for blocks that are larger than a type (the objects). Refused memory goes the way that it goes for
// operator new: the new-handler is called until there is some, and where none is set std::bad_alloc is thrown. So a
// program decides at one place what becomes of it. Any thread.
#pragma once

#include <cstddef>

namespace kyt {

// Freed with std::free.
[[nodiscard]] void* allocate(size_t bytes);
[[nodiscard]] void* allocateZeros(size_t bytes);

// Whether the system has refused this process memory, so that it ends soon: nothing more is taken in.
[[nodiscard]] bool memoryWasRefused();
void setMemoryWasRefused(bool was);

}  // namespace kyt
