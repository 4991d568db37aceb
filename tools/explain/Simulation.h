// What a storebag makes of the events of many devices: the report behind `kytctl storebag simulate`. Each device plays each
// of its sessions through (Rehearsal.h), with a country, a family, a model, a consent and a sampling draw that a generator
// with a given seed chooses: the same seed, the same report. One thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"
#include "tools/explain/Rehearsal.h"

namespace kyt::tools {

// Names with their weights, which count in proportion.
using Weights = std::vector<std::pair<std::string, double>>;

struct Population {
  Weights countries;   // "" is a device whose country is not known
  Weights families;    // DeviceName, the records' _productFamily
  Weights models;      // ProductType, the records' _productModel
  double consent = 1;  // the share of devices whose owner gave it
};

// Of one program, `perDay` times a day on each device.
struct SimulatedSession {
  RehearsedProgram program;
  std::vector<Dictionary> messages;  // an empty one is a flush
  double perDay = 1;
};

struct Scenario {
  std::optional<Population> population;
  std::vector<SimulatedSession> sessions;
};

// The steps that `kytctl session` takes, one JSON object a line, with two additions: "perDay" of a step "open", and the step
// "devices". Steps that change nothing here are passed over. An error names the line.
[[nodiscard]] std::variant<Scenario, Error> readScenario(JSON& json, std::string_view text);

// What the bag itself names, in equal shares, and one of each that it does not name.
[[nodiscard]] Population populationOf(const Dictionary& section);

struct SimulationOptions {
  uint32_t devices = 1000;
  uint64_t seed = 1;
};

// `device` gives everything but what the population says, and the time, which stands still.
[[nodiscard]] Dictionary simulate(const RehearsedDevice& device, const Rehearsal::StorebagServer& server,
                                  const Population& population, const std::vector<SimulatedSession>& sessions,
                                  const SimulationOptions& options);

}  // namespace kyt::tools
