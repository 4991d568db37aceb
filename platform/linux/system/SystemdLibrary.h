// The functions of libsystemd, loaded only where there is a journal or a handed-over socket: it and
// the libraries it brings along would be a tenth of an idle daemon's memory elsewhere.
#pragma once

#include <systemd/sd-daemon.h>
#include <systemd/sd-journal.h>

#include <string>
#include <variant>

namespace kyt {

struct SystemdLibrary {
  // Any thread; cheap when it is loaded already. The text says why it cannot be.
  [[nodiscard]] static std::variant<SystemdLibrary, std::string> load(const char* name = "libsystemd.so.0");

  decltype(::sd_listen_fds)* listenDescriptors = nullptr;
  decltype(::sd_is_socket)* isSocket = nullptr;
  decltype(::sd_journal_sendv)* journalSend = nullptr;
};

}  // namespace kyt
