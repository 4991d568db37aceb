// Lays compact JSON out for people: each entry on a line of its own, four blanks for each level, a blank after each colon,
// empty containers closed at once. Made from the text that is there already, which costs a fraction of writing the objects
// anew. Any thread, no state.
#pragma once

#include <string>
#include <string_view>

namespace kyt {

// Appends. `compact` is JSON as JSON::writeCompact writes it, without blanks outside of texts; of anything else the layout
// is undefined, and nothing more.
void appendLaidOutJSON(std::string& out, std::string_view compact);

}  // namespace kyt
