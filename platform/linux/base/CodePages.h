// Loading a library touches pages of it that running it does not need: tables of names, relocated code of its
// beginning, whatever the kernel maps around each. They would count as the process's own for as long as it runs.
#pragma once

#include <cstddef>

namespace kyt {

// Gives back the read-only pages of the program and of all its libraries; those in use come back from the
// page cache at their next use. Called once the program has started, and again when much was loaded. Any
// thread, while others run. A debugger's breakpoints in the pages are lost, as is a probe's. Returns the
// number of bytes whose pages were given back, resident or not.
size_t giveBackCodePages();

}  // namespace kyt
