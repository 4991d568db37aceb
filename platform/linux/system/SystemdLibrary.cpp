#include "platform/linux/system/SystemdLibrary.h"

#include "platform/linux/base/SharedLibrary.h"

namespace kyt {

std::variant<SystemdLibrary, std::string> SystemdLibrary::load(const char* name) {
  SharedLibrary library(name);
  SystemdLibrary functions;
  library.resolve(functions.journalSend, "sd_journal_sendv");
  if (library.problem()) return *library.problem();
  return functions;
}

}  // namespace kyt
