// The command lines of kytctl defaults, consent, owner and entitlements.
#include <cstdint>
#include <limits>
#include <optional>
#include <utility>

#include "tools/kytctl/Arguments.h"

namespace kyt::tools {

void addDefaults(const Command& program, Arguments& a) {
  const Command defaults = program.command("defaults", "User defaults by domain and key");
  defaults.needsCommand();
  const Command read = defaults.command("read", "Print a value, or all of a domain");
  read.option("domain", a.domain, "The domain, as com.vantu.kytreporting").required();
  read.option("key", a.key, "The key; without one all are printed");
  read.runs([&a] { a.status = defaultsReadCommand(a.connection.root, a.domain, a.key); });
  const Command write = defaults.command("write", "Store a value");
  write.option("domain", a.domain, "The domain, as com.vantu.kytreporting").required();
  write.option("key", a.key, "The key").required();
  write.option("value", a.value, "The value; put -- before one that begins with a minus sign").required();
  write.option("--type", a.type, "What the value is")
      .oneOf({"string", "integer", "real", "boolean"})
      .showsDefault();
  write.runs([&a] { a.status = defaultsWriteCommand(a.connection.root, a.domain, a.key, a.type, a.value); });
  const Command erase = defaults.command("delete", "Remove a value");
  erase.option("domain", a.domain, "The domain, as com.vantu.kytreporting").required();
  erase.option("key", a.key, "The key").required();
  erase.runs(
      [&a] { a.status = defaultsWriteCommand(a.connection.root, a.domain, a.key, a.type, std::nullopt); });

  const Command consent = program.command("consent", "The owner's consent to diagnostics-and-usage upload");
  consent.needsCommand();
  const std::pair<const char*, const char*> changes[] = {
      {"show", "Print whether it is given"}, {"grant", "Give it"}, {"withdraw", "Take it back"}};
  for (const auto& [change, what] : changes)
    consent.command(change, what).runs([&a, change = change] {
      a.status = consentCommand(a.connection.root, change);
    });
}

void addOwner(const Command& program, Arguments& a) {
  const Command owner = program.command("owner", "What left the device, for its owner");
  owner.needsCommand();
  const Command show = owner.command("show", "Print what left in the last day, identifiers, and what waits");
  show.flag("--json", a.json, "As one JSON object");
  show.runs([&a] { a.status = ownerShowCommand(a.connection.root, a.json); });
  const Command take = owner.command("export", "Write all that is kept about it on the device into a file");
  take.option("file", a.document, "The file, JSON; - for standard output").required();
  take.runs([&a] { a.status = ownerExportCommand(a.connection.root, a.document); });
  const Command erase = owner.command("erase", "Erase identifiers, local logs and what waits");
  erase.runs([&a] { a.status = ownerEraseCommand(a.connection.root); });
}

void addEntitlements(const Command& program, Arguments& a) {
  const Command entitlements = program.command("entitlements", "Who may connect");
  entitlements.needsCommand();
  const Command check = entitlements.command("check", "Tell why a client is served or refused");
  const CommandOption pid =
      check.option("--pid", a.check.pid, "A process").between(1, std::numeric_limits<int32_t>::max());
  check.option("--user", a.check.user, "Any process of a user, by name or number").notEmpty().excludes(pid);
  check.runs([&a] {
    a.unwritten = 2;  // 1 would tell that the client is refused
    a.status = entitlementsCheckCommand(a.connection.root, a.check);
  });
}

}  // namespace kyt::tools
