// What is used of libsystemd, loaded only where there is a journal: it and the libraries it brings along would be
// a tenth of an idle daemon's memory elsewhere.
#pragma once

#include <systemd/sd-journal.h>

#include <string>
#include <variant>

namespace kyt {

struct SystemdLibrary {
  // Any thread; cheap when it is loaded already. The text says why it cannot be.
  [[nodiscard]] static std::variant<SystemdLibrary, std::string> load(const char* name = "libsystemd.so.0");

  decltype(::sd_journal_sendv)* journalSend = nullptr;
};

}  // namespace kyt
