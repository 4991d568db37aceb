// What a confined process may do with files, and with what lies outside of it, by Landlock.
//
// Everything beneath `read` may be read and listed; beneath `write` also written, created, renamed and
// removed (files, not folders); beneath `folders` the same, and folders may be made; beneath `sockets` sockets
// may be made and removed; nothing may be executed, linked into other folders or made a device, and nowhere
// else a socket. A path of `read` that does not exist is left out, the others must exist. Files that are open
// before stay usable.
//
// As far as the kernel can, besides: no TCP port is bound (connecting is free, since storebags decide the
// addresses), and no process outside is signalled or reached by an abstract Unix socket.
#pragma once

#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/linux/confinement/ConfinementProfile.h"
#include "platform/linux/files/Files.h"

namespace kyt {

class LandlockRules {
 public:
  struct Options {
    // Abstract sockets outside stay reachable: the service manager may have one.
    bool abstractSockets = false;
  };
  // The rules of that profile, not entered yet. Otherwise why they cannot be.
  [[nodiscard]] static std::variant<LandlockRules, std::string> of(const ConfinementProfile& profile,
                                                                   const Options& options);
  // No value: they hold for the calling thread and the threads that it starts, for ever. Precondition: no_new_privs.
  [[nodiscard]] std::optional<std::string> enter() const;
  // What this kernel's Landlock does not know, each the end of the sentence "this kernel cannot …".
  [[nodiscard]] const std::vector<std::string>& missing() const { return missing_; }

 private:
  Descriptor ruleset_;
  std::vector<std::string> missing_;
};

}  // namespace kyt
