// A client as `kytctl entitlements-check` looks at it: what the daemon would learn of it from its socket, found for a
// process or a user instead.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/entitlements/TomlEntitlements.h"
#include "platform/linux/helpers/ProgramInspector.h"

namespace kyt::tools {

struct EntitlementClient {
  // An error's text when it cannot be found; a user has a name or a number.
  [[nodiscard]] static std::variant<EntitlementClient, std::string> ofProcess(int32_t pid);
  [[nodiscard]] static std::variant<EntitlementClient, std::string> ofUser(const std::string& text);

  // Any process of that user that runs this program file.
  [[nodiscard]] static std::variant<EntitlementClient, std::string> ofProgram(const std::string& path,
                                                                              const std::string& user);

  // True once the process has ended; its number may be another's by now.
  [[nodiscard]] bool hasEnded() const;
  [[nodiscard]] std::string groupsText() const;

  PeerCredentials peer;
  Descriptor process;                   // to see that it has not ended meanwhile; empty for a user
  std::string program;                  // what its link says; empty when that may not be known
  bool isProcess = false;               // otherwise any process of a user: its label is not known,
  std::optional<ProgramIdentity> file;  // and its program where there is none here
};

[[nodiscard]] std::string userText(uint32_t number);  // "name (number)"

}  // namespace kyt::tools
