// What a storebag makes of the events of many devices.
#include <cinttypes>
#include <cstdio>
#include <utility>
#include <variant>

#include "platform/base/TextEscape.h"
#include "platform/objects/Description.h"
#include "tools/StorebagFile.h"
#include "tools/explain/Simulation.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/DevicePorts.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/StorebagSource.h"

namespace kyt::tools {

namespace {

constexpr double kMiB = 1048576;

std::string shown(const Dictionary& row, const char* key) {
  const Value* value = row.find(key);
  return value != nullptr ? escapedText(description(*value)) : std::string();
}

// Of one name, at most so many bytes.
std::string column(std::string text, size_t width) {
  if (text.size() > width) text = text.substr(0, width - 3) + "...";
  return text + std::string(width - text.size(), ' ');
}

void printShare(const std::string& name, const Dictionary& row) {
  const Value* share = row.find("share");
  std::printf("  %s %10s %10s %7.1f %%\n", column(name, 44).c_str(), shown(row, "sessions").c_str(),
              shown(row, "reporting").c_str(), 100 * share->doubleValue());
}

void printEvents(const Array& rows) {
  std::printf("events%40s%11s\n", "sent", "leave");
  for (const Value& element : rows) {
    const Dictionary& row = *element.dictionary();
    std::printf("  %s %10s %10s\n", column(shown(row, "backend"), 33).c_str(), shown(row, "sent").c_str(),
                shown(row, "leave").c_str());
    for (const DictionaryEntry& lost : *row.dictionary("lostBy"))
      std::printf("    lost by %s %10s\n", column(lost.key.str(), 34).c_str(),
                  description(lost.value).c_str());
  }
}

void print(const Dictionary& report, double bytesADay) {
  std::printf("%s devices, seed %s, storebag %s\n", shown(report, "devices").c_str(),
              shown(report, "seed").c_str(), column(shown(report, "storebag"), 50).c_str());
  std::printf("sessions%50s%11s%10s\n", "made", "reporting", "share");
  printShare("all", *report.dictionary("sessions"));
  for (const Value& row : *report.array("byCountry"))
    printShare("country " + shown(*row.dictionary(), "country"), *row.dictionary());
  for (const Value& row : *report.array("byDevice"))
    printShare("device " + shown(*row.dictionary(), "family") + ", " + shown(*row.dictionary(), "model"),
               *row.dictionary());
  printEvents(*report.array("events"));
  const Dictionary& day = *report.dictionary("aDay");
  std::printf("a day: %.0f posts, %.2f MiB; of a device %.2f posts, %.0f bytes\n",
              day.find("posts")->doubleValue(), bytesADay / kMiB, day.find("postsOfADevice")->doubleValue(),
              day.find("bytesOfADevice")->doubleValue());
}

// The section that devices out in the world get.
std::variant<Dictionary, Error> releaseSection(const std::string& path, DevicePorts& ports) {
  const StorebagFile reader(ports.propertyLists(), ports.json(), ports.cryptography());
  auto bag = reader.openOrRead(path);
  if (auto* error = std::get_if<Error>(&bag)) return std::move(*error);
  if (const Dictionary* section = std::get<Dictionary>(bag).dictionary("release")) return *section;
  return Error{"KYTToolsErrorDomain", -1, path + ": there is no section \"release\""};
}

void fillIn(Weights& weights, Weights otherwise) {
  if (weights.empty()) weights = std::move(otherwise);
}

}  // namespace

int simulateCommand(const std::string& root, const SimulateOptions& options) {
  DevicePorts ports(root, false);
  auto text = readFile(options.events);
  if (auto* error = std::get_if<Error>(&text)) return failed(*error);
  auto scenario = readScenario(ports.json(), std::get<std::string>(text));
  if (auto* error = std::get_if<Error>(&scenario))
    return failed(options.events + ": " + error->localizedDescription);
  auto section = releaseSection(options.bag, ports);
  if (auto* error = std::get_if<Error>(&section)) return failed(*error);
  auto made = StorebagSource::file(options.bag, ports);
  if (auto* error = std::get_if<Error>(&made)) return failed(*error);

  const Scenario& read = std::get<Scenario>(scenario);
  Population population = read.population.value_or(Population());
  Population named = populationOf(std::get<Dictionary>(section));
  fillIn(population.countries, std::move(named.countries));
  fillIn(population.families, std::move(named.families));
  fillIn(population.models, std::move(named.models));
  Dictionary report =
      simulate(ports.device(false), std::get<std::unique_ptr<StorebagSource>>(made)->answers(), population,
               read.sessions, {options.devices, options.seed});
  report.set("storebag", options.bag);
  if (options.json) {
    std::printf("%s\n", prettyJSON(report).c_str());
  } else {
    print(report, report.dictionary("aDay")->find("bytes")->doubleValue());
  }
  return 0;
}

}  // namespace kyt::tools
