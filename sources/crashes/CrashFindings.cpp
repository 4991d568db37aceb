#include "sources/crashes/CrashFindings.h"

#include <charconv>
#include <memory>

#include "sources/Names.h"

namespace kyt::sources {

namespace {

constexpr uint32_t kCategory = 302;
constexpr uint8_t kClientType = 10;
constexpr char kCoredump[] = "fc2e22bc6ee647b6b90729ab34a250b1";
// The services that systemd starts for crashes are in this slice, and nobody else's programs are.
constexpr char kSlice[] = "system-systemd\\x2dcoredump.slice";
constexpr int kHighestSignal = 64;

int signalOf(const std::string& text) {
  int number = 0;
  const auto read = std::from_chars(text.data(), text.data() + text.size(), number);
  return read.ec == std::errc() && number > 0 && number <= kHighestSignal ? number : 0;
}

std::optional<Finding> crashFinding(const FieldReader& field, SystemNames& names) {
  // The journal itself says of which unit the writer was.
  if (!field("_SYSTEMD_UNIT").starts_with("systemd-coredump@")) return std::nullopt;
  const std::string unit = field("COREDUMP_UNIT");
  return Finding{kProgramCrashed,
                 {{"program", names.program(field("COREDUMP_EXE"))},
                  {"unit", unit.empty() ? std::string("(none)") : names.unit(unit)},
                  {"signal", signalOf(field("COREDUMP_SIGNAL"))}}};
}

}  // namespace

JournalProgram crashesProgram() {
  JournalProgram program;
  program.name = "kytsource-crashes";
  program.description = "Reports programs that crash";
  program.category = kCategory;
  program.clientType = kClientType;
  // The crash of a person's program stands in that person's journal.
  program.systemAlone = false;
  // By the journal's index: the entries that anyone may write with this identifier are not even read.
  program.matches = {std::string("MESSAGE_ID=") + kCoredump, std::string("_SYSTEMD_SLICE=") + kSlice};
  program.finder = [](SystemNames::Options options) {
    return [names = std::make_shared<SystemNames>(std::move(options))](const FieldReader& field) {
      return crashFinding(field, *names);
    };
  };
  return program;
}

}  // namespace kyt::sources
