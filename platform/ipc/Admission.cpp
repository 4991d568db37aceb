#include "platform/ipc/Admission.h"

namespace kyt {

Value Admission::entitlementValue(std::string_view key) {
  Value value = entitlements_.valueFor(peer_, key);
  refused_ = !value.boolValue();
  return value;
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
