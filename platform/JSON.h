// JSON to and from objects. Any thread, no state, never blocks. Input is hostile: depth is limited to
// `Limits::maxObjectDepth`, UTF-8 is checked.
#pragma once

#include <string>
#include <string_view>
#include <variant>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"

namespace kyt {

class JSON {
 public:
  virtual ~JSON() = default;
  // Appends to `out`. Doubles as the shortest decimal that reads back the same; a not finite number, a date or data
  // is written as null (callers remove those first). Keys in enumeration order.
  virtual void writeCompact(const Value& value, std::string& out) = 0;
  virtual void writePretty(const Value& value, std::string& out) = 0;
  [[nodiscard]] virtual std::variant<Value, Error> parse(std::string_view text) = 0;
};

}  // namespace kyt
