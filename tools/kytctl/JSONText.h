// JSON for people, programs and files: valid UTF-8 whatever the values' texts hold, and what a terminal would obey stands in
// it as its number (\u009b). Clients choose names, and an administrator reads them. No state; any thread.
#pragma once

#include <string>

#include "platform/objects/Value.h"

namespace kyt::tools {

[[nodiscard]] std::string compactJSON(const Value& value);  // one line, without its end
[[nodiscard]] std::string prettyJSON(const Value& value);   // likewise without the last one's end

}  // namespace kyt::tools
