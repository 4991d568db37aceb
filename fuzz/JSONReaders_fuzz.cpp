// JSON files of our own that somebody else may have written: a scenario of `kytctl storebag simulate`, and the daemon's record
// of what left (departures.json). The first byte chooses. What is checked besides memory: an error names a line, what was
// accepted keeps its rules, and a record that was read is written to something that reads back the same.
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <variant>

#include "platform/base/Limits.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/objects/DepartureTable.h"
#include "tools/explain/Simulation.h"

namespace kyt {
namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

void check(const tools::Weights& weights) {
  for (const auto& [name, weight] : weights) require(weight > 0);
}

void scenario(std::string_view text) {
  RapidJSON json;
  const auto read = tools::readScenario(json, text);
  if (const auto* error = std::get_if<Error>(&read)) {
    require(error->localizedDescription.starts_with("line ") ||
            error->localizedDescription.starts_with("no session is opened"));
    return;
  }
  const auto& scenario = std::get<tools::Scenario>(read);
  require(!scenario.sessions.empty());
  for (const tools::SimulatedSession& session : scenario.sessions) require(session.perDay >= 0);
  if (!scenario.population) return;
  require(scenario.population->consent >= 0 && scenario.population->consent <= 1);
  check(scenario.population->countries);
  check(scenario.population->families);
  check(scenario.population->models);
}

void departures(std::string_view text) {
  RapidJSON json;
  const auto parsed = json.parse(text);
  const auto* value = std::get_if<Value>(&parsed);
  if (value == nullptr) return;
  const DepartureTable table = DepartureTable::of(*value);
  const DepartureTable again = DepartureTable::of(table.object());
  require(again.rows().size() == table.rows().size());
  require(table.object() == again.object());
}

}  // namespace
}  // namespace kyt

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const std::string_view text(reinterpret_cast<const char*>(data) + 1, size - 1);
  if ((data[0] & 1) == 0)
    kyt::scenario(text);
  else
    kyt::departures(text);
  return 0;
}
