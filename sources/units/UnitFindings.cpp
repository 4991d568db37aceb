#include "sources/units/UnitFindings.h"

#include <algorithm>
#include <memory>

#include "sources/Names.h"

namespace kyt::sources {

namespace {

constexpr uint32_t kCategory = 301;
constexpr uint8_t kClientType = 9;
constexpr char kFailure[] = "d9b373ed55a64feb8242e02dbe79a49c";
constexpr char kRestart[] = "5eb03494b6584870a536b337290809b3";
constexpr size_t kLongestResult = 40;

// "exit-code", "timeout", "oom-kill", …
std::string resultOf(const std::string& text) {
  const bool isWord =
      !text.empty() && text.size() <= kLongestResult &&
      std::all_of(text.begin(), text.end(), [](char c) { return (c >= 'a' && c <= 'z') || c == '-'; });
  return isWord ? text : "unknown";
}

std::optional<Finding> unitFinding(const FieldReader& field, SystemNames& names) {
  const std::string unit = field("UNIT"), message = field("MESSAGE_ID");
  if (unit.empty()) return std::nullopt;
  if (message == kFailure)
    return Finding{kUnitFailed, {{"unit", names.unit(unit)}, {"result", resultOf(field("UNIT_RESULT"))}}};
  if (message == kRestart) return Finding{kUnitRestarted, {{"unit", names.unit(unit)}}};
  return std::nullopt;
}

}  // namespace

JournalProgram unitsProgram() {
  JournalProgram program;
  program.name = "kytsource-units";
  program.description = "Reports units of the system that fail or are started again";
  program.category = kCategory;
  program.clientType = kClientType;
  // The journal itself says who wrote an entry: anyone may write one with these identifiers.
  program.matches = {"_PID=1", std::string("MESSAGE_ID=") + kFailure, std::string("MESSAGE_ID=") + kRestart};
  program.finder = [](SystemNames::Options options) {
    return [names = std::make_shared<SystemNames>(std::move(options))](const FieldReader& field) {
      return unitFinding(field, *names);
    };
  };
  return program;
}

}  // namespace kyt::sources
