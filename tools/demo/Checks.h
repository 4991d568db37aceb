// What must have arrived at the development server, looked up there.
#pragma once

#include <string>
#include <vector>

namespace kyt::tools {

class Stage;

struct Check {
  std::string what;
  bool holds = false;
  std::string found;  // what was there instead
};

[[nodiscard]] std::vector<Check> checkArrivals(const Stage& stage);
// A table of the events by address, client and method.
void printArrivals(const Stage& stage);

}  // namespace kyt::tools
