// What the sources have in common as programs: options, and what they say on standard error. One thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>

#include "sources/Delivery.h"
#include "sources/State.h"

namespace kyt {
class CommandLine;
}

namespace kyt::sources {

struct CommonOptions {
  // The state lies in the folder that the service manager made for it, by default.
  CommonOptions(const char* name, int type);
  void addTo(const CommandLine& line);
  [[nodiscard]] Delivery::Options delivery() const;

  std::string program;  // its name, also its "ClientName"
  std::string socket, state;
  int clientType, patience = 30;  // the patience in seconds
};

class Voice {
 public:
  explicit Voice(std::string program) : program_(std::move(program)) {}
  void say(const std::string& text) const;
  // Once for each problem, however long it lasts. Empty: there is none now.
  void tell(std::string problem);

 private:
  const std::string program_;
  std::string told_;
};

[[nodiscard]] std::chrono::microseconds since1970();
// stateAtStart() of the options' file, now; tells what was there in its place.
[[nodiscard]] State stateAtStart(const CommonOptions& options, const Voice& voice);

}  // namespace kyt::sources
