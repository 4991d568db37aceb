// JSON with RapidJSON, written straight from the objects and read straight into them: no document stands in
// between, and writing a record allocates nothing but the text itself.
#pragma once

#include "platform/JSON.h"

namespace kyt {

inline constexpr char kJSONErrorDomain[] = "KYTJSONErrorDomain";

class RapidJSON : public JSON {
 public:
  void writeCompact(const Value& value, std::string& out) override;
  void writePretty(const Value& value, std::string& out) override;
  // Whole numbers become integers, or unsigned ones above the signed range; others doubles. Of equal keys the
  // last wins. An error's code is RapidJSON's, or -1 for what this class refuses: containers nested too
  // deep, numbers too large.
  [[nodiscard]] std::variant<Value, Error> parse(std::string_view text) override;
};

}  // namespace kyt
