// XML property lists, read with pugixml and written by hand.
//
// The document type declaration is skipped and no entity but XML's five and character references is resolved:
// an unknown one stays as it is written. Elements other than those of property lists, and content where none
// belongs, are errors.
#pragma once

#include "platform/PropertyLists.h"

namespace kyt {

inline constexpr char kPropertyListErrorDomain[] = "KYTPropertyListErrorDomain";

class PugixmlPropertyLists : public PropertyLists {
 public:
  // An error's code is pugixml's status, or -1 for XML that is no property list.
  [[nodiscard]] std::variant<Value, Error> parse(std::string_view bytes) override;
  // What XML or a property list cannot carry: null objects and dates outside the years 0 to 9999 are left
  // out, control characters become U+FFFD, fractions of a second are cut.
  [[nodiscard]] std::string serialize(const Value& value) override;
};

}  // namespace kyt
