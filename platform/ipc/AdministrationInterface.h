// What a peer of the administration socket may ask of the daemon: the window of administrators, which shows and changes
// nothing of what sessions do. The wire form is docs/com.vantu.kytreportingd.Administration.xml, which also tells the
// dictionaries' keys; AdministrationDispatcher translates.
//
// One object for each connection, called on its queue, one call at a time. No operation waits for a session: what a
// session shows is published by it.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/ipc/Listener.h"
#include "platform/objects/Value.h"

namespace kyt {

class AdministrationInterface : public ExportedObject {
 public:
  // Why this peer may ask nothing; null where it may.
  [[nodiscard]] virtual const char* refusal() const = 0;

  [[nodiscard]] virtual Dictionary status() = 0;
  [[nodiscard]] virtual std::vector<Dictionary> sessions() = 0;
  [[nodiscard]] virtual std::vector<Dictionary> books() = 0;
  [[nodiscard]] virtual std::vector<Dictionary> storebags() = 0;
  [[nodiscard]] virtual std::string metrics() = 0;
  // "debug", "default" or "error", until the daemon ends. What is wrong with it, or none.
  [[nodiscard]] virtual std::optional<std::string> setLogLevel(std::string_view level) = 0;
  // Takes up changed settings: a line for each that differs, in `lines`. What is wrong with their file, when nothing was
  // taken up; or none.
  [[nodiscard]] virtual std::optional<std::string> reload(std::vector<std::string>& lines) = 0;
};

}  // namespace kyt
