#include "platform/ipc/Admission.h"

#include <algorithm>

namespace kyt {

Value Admission::entitlementValue(std::string_view key) {
  Value value = entitlements_.valueFor(peer_, key);
  refused_ = !value.boolValue();
  return value;
}

bool Admission::isInGroup(uint32_t group) const {
  return peer_.gid == group ||
         std::find(peer_.groups.begin(), peer_.groups.end(), group) != peer_.groups.end();
}

std::string Admission::advice() const {
  std::string text;
  const std::string executable = entitlements_.executableOf(peer_);
  if (!executable.empty()) text.append(" (").append(executable).append(")");
  return text.append(", see \"kytctl entitlements check --pid ")
      .append(std::to_string(peer_.pid))
      .append("\",");
}

}  // namespace kyt
