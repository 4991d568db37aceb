// Whether grants of entitlements.d match one client: by its user, its groups, the program that it runs and its security
// label. For one connection and one thread; which program the client runs is asked at most once.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>

#include "platform/Entitlements.h"
#include "platform/linux/entitlements/AccountNumbers.h"
#include "platform/linux/entitlements/EntitlementsFile.h"
#include "platform/linux/helpers/ProgramInspector.h"

namespace kyt {

class EntitlementMatch {
 public:
  enum class Program : uint8_t {
    matches,
    otherProgram,
    missing,       // no file can be seen at the grant's path (`error`)
    processEnded,  // or has no program any more
    unknown  // the kernel does not tell which process is connected, or what it runs (`error`; 0: the former)
  };
  struct ProgramResult {
    Program program = Program::unknown;
    int error = 0;
    ProgramIdentity wanted, running;  // zeros when not known
  };

  // All outlive this.
  EntitlementMatch(const PeerCredentials& peer, ProgramInspector& inspector, AccountNumbers& numbers)
      : peer_(peer), inspector_(inspector), numbers_(numbers) {}

  [[nodiscard]] bool isUser(const NameOrNumber& user) const;
  [[nodiscard]] bool isMember(const NameOrNumber& group) const;
  [[nodiscard]] bool hasLabel(const std::string& label) const { return label == peer_.securityLabel; }
  [[nodiscard]] ProgramResult runs(const std::string& executable);

  // Whether the process that connected has not ended yet; false where the kernel does not tell which it is.
  [[nodiscard]] bool isAlive() const;
  // All criteria that the grant has.
  [[nodiscard]] bool matches(const EntitlementGrant& grant);
  // Why a criterion could not be judged, when one was met that could not: a line's end for the log.
  [[nodiscard]] const std::optional<std::string>& lack() const { return lack_; }

 private:
  const PeerCredentials& peer_;
  ProgramInspector& inspector_;
  AccountNumbers& numbers_;
  std::optional<std::variant<ProgramIdentity, int>> running_;
  std::optional<std::string> lack_;
};

}  // namespace kyt
