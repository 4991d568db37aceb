#include "sources/crashes/CrashFindings.h"

#include <charconv>

#include "sources/Names.h"

namespace kyt::sources {

namespace {

constexpr uint32_t kCategory = 302;
constexpr uint8_t kClientType = 10;
constexpr char kCoredump[] = "fc2e22bc6ee647b6b90729ab34a250b1";
constexpr int kHighestSignal = 64;

int signalOf(const std::string& text) {
  int number = 0;
  const auto read = std::from_chars(text.data(), text.data() + text.size(), number);
  return read.ec == std::errc() && number > 0 && number <= kHighestSignal ? number : 0;
}

std::optional<Finding> crashFinding(const FieldReader& field, const std::vector<std::string>& folders) {
  // The journal itself says of which unit the writer was: anyone may write an entry with this identifier.
  if (!field("_SYSTEMD_UNIT").starts_with("systemd-coredump@")) return std::nullopt;
  const std::string unit = field("COREDUMP_UNIT");
  return Finding{kProgramCrashed,
                 {{"program", reportedProgram(field("COREDUMP_EXE"))},
                  {"unit", unit.empty() ? std::string("(none)") : reportedUnit(unit, folders)},
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
  program.matches = {std::string("MESSAGE_ID=") + kCoredump};
  program.finder = [](std::vector<std::string> folders) {
    return [folders = std::move(folders)](const FieldReader& field) { return crashFinding(field, folders); };
  };
  return program;
}

}  // namespace kyt::sources
