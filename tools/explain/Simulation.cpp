#include "tools/explain/Simulation.h"

#include <algorithm>
#include <map>
#include <random>
#include <set>
#include <tuple>

#include "platform/JSON.h"
#include "platform/fake/FakeConsent.h"
#include "platform/fake/FakeDeviceProperties.h"
#include "platform/fake/FakeUserDefaults.h"
#include "platform/objects/Keys.h"
#include "platform/objects/MemoryInfo.h"
#include "tools/KeyRules.h"

namespace kyt::tools {

namespace {

constexpr uint32_t kDraws = 101;
constexpr TimeValue kNow{1769860800, 0};  // always: compressed times count as bytes
constexpr char kOther[] = "other";        // what no list names

// The standard says what the engine gives, and nothing of its distributions: so this is the same everywhere.
class Chance {
 public:
  explicit Chance(uint64_t seed) : engine_(seed) {}
  double fraction() { return static_cast<double>(engine_() >> 11) * 0x1p-53; }
  uint32_t below(uint32_t bound) { return static_cast<uint32_t>(engine_() % bound); }
  const std::string& of(const Weights& weights) {
    double sum = 0;
    for (const auto& [name, weight] : weights) sum += weight;
    double at = fraction() * sum;
    for (const auto& [name, weight] : weights)
      if ((at -= weight) < 0) return name;
    return weights.back().first;
  }

 private:
  std::mt19937_64 engine_;
};

// Sessions tell at their end what the process has of memory, which would be another number each time.
class FixedMemory final : public MemoryInfo {
 public:
  size_t blockSize(const void* block) override { return block != nullptr ? 64 : 0; }
  uint64_t internalMemory() override { return 4u << 20; }
};

struct Share {
  uint64_t sessions = 0, reporting = 0;
};

struct Fates {
  uint64_t taken = 0, leaves = 0;
  std::map<std::string, uint64_t> lost;  // by rule
};

// The rule that keeps a back end from posting, where one does.
std::string ruleOf(const std::vector<JudgedRule>& rules, const std::string& backend) {
  for (const JudgedRule& rule : rules)
    if (rule.backend == backend && !rule.passes) return rule.rule;
  return {};
}

class Count {
 public:
  void add(const WholeSession& session, const std::vector<JudgedRule>& rules, double perDay) {
    for (const BookRow& row : session.rows) {
      Fates& fates = fates_[row.backEnd];
      fates.taken += row.taken;
      fates.leaves += row.delivered;
      for (size_t i = 0; i < kFates.size(); ++i) {
        if (row.dropped[i] == 0) continue;
        const bool isByState =
            kFates[i] == Reason::eventDroppedByState || kFates[i] == Reason::batchDiscarded;
        std::string rule = isByState ? ruleOf(rules, row.backEnd) : std::string();
        if (rule.empty()) rule = reasonName(kFates[i]);
        fates.lost[rule] += row.dropped[i];
      }
    }
    posts_ += perDay * static_cast<double>(session.posts);
    bytes_ += perDay * static_cast<double>(session.bytes);
  }
  [[nodiscard]] Array events() const {
    Array rows;
    for (const auto& [backend, fates] : fates_) {
      Dictionary lost;
      for (const auto& [rule, count] : fates.lost) lost.set(rule, count);
      rows.append(
          Dictionary{{"backend", backend}, {"sent", fates.taken}, {"leave", fates.leaves}, {"lostBy", lost}});
    }
    return rows;
  }
  [[nodiscard]] Dictionary aDay(uint32_t devices) const {
    return Dictionary{{"posts", posts_},
                      {"bytes", bytes_},
                      {"postsOfADevice", posts_ / devices},
                      {"bytesOfADevice", bytes_ / devices}};
  }

 private:
  std::map<std::string, Fates> fates_;
  double posts_ = 0, bytes_ = 0;
};

bool reports(const WholeSession& session) {
  return std::any_of(session.rows.begin(), session.rows.end(),
                     [](const BookRow& row) { return row.delivered != 0; });
}

Dictionary shareRow(Dictionary row, const Share& share) {
  row.set("sessions", share.sessions);
  row.set("reporting", share.reporting);
  row.set("share", share.sessions != 0
                       ? static_cast<double>(share.reporting) / static_cast<double>(share.sessions)
                       : 0.0);
  return row;
}

Dictionary dictionaryOf(const Weights& weights) {
  Dictionary dictionary;
  for (const auto& [name, weight] : weights) dictionary.set(name.empty() ? "unknown" : name, weight);
  return dictionary;
}

// ---- Reading a scenario.

std::variant<Weights, std::string> weightsIn(const Dictionary& step, const char* key) {
  Weights weights;
  const Dictionary* given = step.dictionary(key);
  if (given == nullptr) return weights;
  for (const DictionaryEntry& entry : *given) {
    if (!entry.value.isNumber() || !(entry.value.doubleValue() > 0))
      return std::string("\"") + key + "\": a weight is a number over 0";
    weights.emplace_back(entry.key.view() == "unknown" ? "" : entry.key.str(), entry.value.doubleValue());
  }
  return weights;
}

class ScenarioReader {
 public:
  // What is wrong with the step, or none.
  std::optional<std::string> take(const Dictionary& step) {
    const String* what = step.string("do");
    if (what == nullptr) return "a step has \"do\"";
    Dictionary rest = step;
    rest.remove("do");
    if (*what == "devices") return devices(rest);
    if (*what == "open") return open(rest);
    if (*what == "send") return send(rest);
    if (*what == "flush" && !scenario.sessions.empty()) scenario.sessions.back().messages.emplace_back();
    return std::nullopt;
  }

  Scenario scenario;

 private:
  std::optional<std::string> devices(const Dictionary& step) {
    constexpr KeyRule kRules[] = {{"countries", KeyKind::object},
                                  {"families", KeyKind::object},
                                  {"models", KeyKind::object},
                                  {"consent", KeyKind::real}};
    if (auto problem = problemIn(step, kRules)) return problem;
    Population population;
    const std::pair<const char*, Weights*> parts[] = {{"countries", &population.countries},
                                                      {"families", &population.families},
                                                      {"models", &population.models}};
    for (const auto& [key, weights] : parts) {
      auto read = weightsIn(step, key);
      if (auto* wrong = std::get_if<std::string>(&read)) return std::move(*wrong);
      *weights = std::get<Weights>(std::move(read));
    }
    if (const Value* consent = step.find("consent")) population.consent = consent->doubleValue();
    if (!(population.consent >= 0 && population.consent <= 1)) return "\"consent\" is a share, 0 to 1";
    scenario.population = std::move(population);
    return std::nullopt;
  }

  std::optional<std::string> open(const Dictionary& step) {
    constexpr KeyRule kRules[] = {{"sessionInfo", KeyKind::object, true},
                                  {"userInfo", KeyKind::object},
                                  {"aggregate", KeyKind::boolean},
                                  {"perDay", KeyKind::real}};
    if (auto problem = problemIn(step, kRules)) return problem;
    SimulatedSession session;
    session.program.sessionInfo = *step.dictionary("sessionInfo");
    if (const Dictionary* userInfo = step.dictionary("userInfo")) session.program.userInfo = *userInfo;
    if (const Value* perDay = step.find("perDay")) session.perDay = perDay->doubleValue();
    if (!(session.perDay >= 0)) return "\"perDay\" is a number from 0 on";
    scenario.sessions.push_back(std::move(session));
    return std::nullopt;
  }

  std::optional<std::string> send(const Dictionary& step) {
    constexpr KeyRule kRules[] = {{"category", KeyKind::number, true, 0, 65535},
                                  {"type", KeyKind::number, true, 0, 65535},
                                  {"payload", KeyKind::object},
                                  {"flag", KeyKind::number, false, 0, 3},
                                  {"repeat", KeyKind::number, false, 1, 100000},
                                  {"reply", KeyKind::boolean}};
    if (auto problem = problemIn(step, kRules)) return problem;
    if (scenario.sessions.empty()) return "a session is opened first";
    Dictionary message{{kKYTReportingMessageParametersCategory, step.unsignedInteger("category")},
                       {kKYTReportingMessageParametersType, step.unsignedInteger("type")},
                       {kKYTReportingMessageParametersFlag, step.unsignedInteger("flag")}};
    if (const Dictionary* payload = step.dictionary("payload"))
      message.set(kKYTReportingMessageParametersPayload, *payload);
    const uint32_t repeat = step.contains("repeat") ? step.unsignedInteger("repeat") : 1;
    auto& messages = scenario.sessions.back().messages;
    messages.insert(messages.end(), repeat, message);
    return std::nullopt;
  }
};

Error failure(size_t line, const std::string& text) {
  return {"KYTToolsErrorDomain", -1, "line " + std::to_string(line) + ": " + text};
}

// ---- What a bag names.

void addTexts(const Array* list, std::set<std::string>& names) {
  if (list == nullptr) return;
  for (const Value& element : *list)
    if (const String* text = element.string(); text != nullptr && !text->empty()) names.insert(text->str());
}

Weights equally(const std::set<std::string>& names, const char* other) {
  Weights weights;
  for (const std::string& name : names) weights.emplace_back(name, 1);
  if (names.count(other) == 0) weights.emplace_back(other, 1);
  return weights;
}

}  // namespace

std::variant<Scenario, Error> readScenario(JSON& json, std::string_view text) {
  ScenarioReader reader;
  size_t number = 0;
  while (!text.empty()) {
    const size_t end = std::min(text.find('\n'), text.size());
    const std::string_view line = text.substr(0, end);
    text.remove_prefix(std::min(end + 1, text.size()));
    ++number;
    const size_t first = line.find_first_not_of(" \t\r");
    if (first == std::string_view::npos || line[first] == '#') continue;
    const auto step = json.parse(line);
    if (const auto* error = std::get_if<Error>(&step)) return failure(number, error->localizedDescription);
    const Dictionary* dictionary = std::get<Value>(step).dictionary();
    if (dictionary == nullptr) return failure(number, "a step is a JSON object");
    if (const auto problem = reader.take(*dictionary)) return failure(number, *problem);
  }
  if (reader.scenario.sessions.empty())
    return Error{"KYTToolsErrorDomain", -1, "no session is opened: there is no step \"open\""};
  return std::move(reader.scenario);
}

Population populationOf(const Dictionary& section) {
  std::set<std::string> countries, families, models;
  for (const DictionaryEntry& backend : section) {
    const Dictionary* profile = backend.value.dictionary();
    const Array* clients = profile != nullptr ? profile->array("clients") : nullptr;
    if (clients == nullptr) continue;
    for (const Value& element : *clients) {
      const Dictionary* entry = element.dictionary();
      if (entry == nullptr) continue;
      addTexts(entry->array("locale_whitelist"), countries);
      addTexts(entry->array("device_whitelist"), families);
      addTexts(entry->array("device_blacklist"), models);
      if (const Array* thresholds = entry->array("per_country_sampling_thresholds"))
        for (const Value& threshold : *thresholds)
          if (const Dictionary* row = threshold.dictionary()) addTexts(row->array("country"), countries);
    }
  }
  return {equally(countries, "ZZ"), equally(families, kOther), equally(models, kOther), 1};
}

Dictionary simulate(const RehearsedDevice& device, const Rehearsal::StorebagServer& server,
                    const Population& population, const std::vector<SimulatedSession>& sessions,
                    const SimulationOptions& options) {
  Chance chance(options.seed);
  FixedMemory memory;
  Count count;
  Share all;
  std::map<std::string, Share> byCountry;
  std::map<std::pair<std::string, std::string>, Share> byDevice;
  for (uint32_t i = 0; i < options.devices; ++i) {
    const std::string &country = chance.of(population.countries), &family = chance.of(population.families),
                      &model = chance.of(population.models);
    FakeConsent consent(chance.fraction() < population.consent);
    FakeDeviceProperties properties;
    if (!country.empty()) properties.setCountryCode(country);
    properties.setProperty("DeviceName", family);
    properties.setProperty("ProductType", model);
    FakeUserDefaults defaults;
    const RehearsedDevice one{.userDefaults = defaults,
                              .deviceProperties = properties,
                              .consent = consent,
                              .cryptography = device.cryptography,
                              .propertyLists = device.propertyLists,
                              .json = device.json,
                              .deflate = device.deflate,
                              .memory = memory,
                              .clientBundle = device.clientBundle,
                              .daemonBundle = device.daemonBundle,
                              .hosts = device.hosts,
                              .limits = device.limits,
                              .refusals = {},
                              .now = kNow};
    for (const SimulatedSession& session : sessions) {
      Rehearsal rehearsal(one, server, session.program, chance.below(kDraws));
      const WholeSession whole = rehearsal.runWhole(session.messages);
      count.add(whole, rehearsal.rules(), session.perDay);
      const bool isReporting = reports(whole);
      for (Share* share :
           {&all, &byCountry[country.empty() ? "unknown" : country], &byDevice[{family, model}]}) {
        ++share->sessions;
        if (isReporting) ++share->reporting;
      }
    }
  }
  Array countries, devices;
  for (const auto& [country, share] : byCountry)
    countries.append(shareRow(Dictionary{{"country", country}}, share));
  for (const auto& [names, share] : byDevice)
    devices.append(shareRow(Dictionary{{"family", names.first}, {"model", names.second}}, share));
  return Dictionary{{"devices", options.devices},
                    {"seed", options.seed},
                    {"population", Dictionary{{"countries", dictionaryOf(population.countries)},
                                              {"families", dictionaryOf(population.families)},
                                              {"models", dictionaryOf(population.models)},
                                              {"consent", population.consent}}},
                    {"sessions", shareRow({}, all)},
                    {"byCountry", countries},
                    {"byDevice", devices},
                    {"events", count.events()},
                    {"aDay", count.aDay(options.devices)}};
}

}  // namespace kyt::tools
