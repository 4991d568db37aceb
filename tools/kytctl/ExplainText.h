// The report of `kytctl explain` laid out for people.
#pragma once

#include <string>

#include "platform/objects/Value.h"

namespace kyt::tools {

// Lines of at most 100 columns, each with its line feed; longer values are cut, and "..." says so.
[[nodiscard]] std::string explainText(const Dictionary& report);

}  // namespace kyt::tools
