// The events of events.toml, made by kytctl events generate --lang c++: change that file, not this one.
//
// A struct for each. payload() is what it has under its fields' keys; send() sends it, and returns whether it
// was taken. Flags: 1 realtime, 2 expedite, 3 both.
// clang-format off
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include <kytreporting/KYTReporting.h>

namespace kyt::events {

// boot_ended, category 303, type 1: How an earlier run of the system ended.
struct BootEnded {
  static constexpr std::uint16_t kCategory = 303, kType = 1;
  // "reboot", "power-off", "halt", "kexec", "shutdown", "panic", "watchdog" or "unclean".
  std::string reason;
  // From its first to its last entry in the journal.
  std::uint64_t seconds = 0;
  // When its last entry was written, seconds since 1970.
  std::uint64_t ended = 0;
  // The report's number; one that comes twice has it twice.
  std::uint64_t report = 0;

  [[nodiscard]] ::kyt::Dictionary payload() const {
    ::kyt::Dictionary entries;
    entries.reserve(4);
    entries.set("reason", ::kyt::Value(reason));
    entries.set("seconds", ::kyt::Value(seconds));
    entries.set("ended", ::kyt::Value(ended));
    entries.set("report", ::kyt::Value(report));
    return entries;
  }
  bool send(::kyt::KYTReporting& session, std::uint32_t flag = 0) const {
    return session.sendMessage(kCategory, kType, payload(), flag);
  }
};

// boot_began, category 303, type 2: The system started.
struct BootBegan {
  static constexpr std::uint16_t kCategory = 303, kType = 2;
  // How long the start took; left out where the service manager has not said. Left out where it has no value.
  std::optional<std::uint64_t> startupMilliseconds = std::nullopt;
  // The report's number.
  std::uint64_t report = 0;

  [[nodiscard]] ::kyt::Dictionary payload() const {
    ::kyt::Dictionary entries;
    entries.reserve(2);
    if (startupMilliseconds) entries.set("startupMilliseconds", ::kyt::Value(*startupMilliseconds));
    entries.set("report", ::kyt::Value(report));
    return entries;
  }
  bool send(::kyt::KYTReporting& session, std::uint32_t flag = 0) const {
    return session.sendMessage(kCategory, kType, payload(), flag);
  }
};

}  // namespace kyt::events
