// XML property lists to and from objects. Any thread, no state, never blocks. Input is hostile: depth is limited
// to `Limits::maxObjectDepth`, no external entity is ever resolved, UTF-8 is checked.
#pragma once

#include <string>
#include <string_view>
#include <variant>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"

namespace kyt {

class PropertyLists {
 public:
  virtual ~PropertyLists() = default;
  // The root object of an XML property list, or an error whose description says what is wrong and where.
  [[nodiscard]] virtual std::variant<Value, Error> parse(std::string_view bytes) = 0;
  // XML; objects that a property list cannot carry (null) are left out.
  [[nodiscard]] virtual std::string serialize(const Value& value) = 0;
};

}  // namespace kyt
