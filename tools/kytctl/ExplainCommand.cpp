// What becomes of an event on this device.
#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <utility>
#include <variant>

#include "config/ClientTypes.h"
#include "platform/objects/Keys.h"
#include "tools/StorebagFile.h"
#include "tools/explain/Explanation.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/DevicePorts.h"
#include "tools/kytctl/ExplainText.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/StorebagSource.h"

namespace kyt::tools {

namespace {

constexpr int kCannotTell = static_cast<int>(Verdict::cannotBeTold);

int cannotTell(const std::string& text) {
  failed(text);
  return kCannotTell;
}

std::variant<Dictionary, std::string> object(JSON& json, const std::string& text, const std::string& what) {
  auto parsed = json.parse(text);
  if (auto* error = std::get_if<Error>(&parsed)) return what + ": " + error->localizedDescription;
  const Dictionary* dictionary = std::get<Value>(parsed).dictionary();
  if (dictionary == nullptr) return what + " is a JSON object";
  return *dictionary;
}

// The session and the user information that the options describe; a text says what is wrong with them.
std::variant<RehearsedProgram, std::string> programOf(const ExplainOptions& options, JSON& json) {
  RehearsedProgram program;
  program.single = options.single;
  program.user = ::getuid();
  program.sessionInfo = {
      {kKYTReportingSessionInfoSessionID, options.sessionID},
      {kKYTReportingSessionInfoClientType, options.clientType},
      {kKYTReportingSessionInfoClientVersion, static_cast<unsigned>(options.clientVersion)},
      {kKYTReportingSessionInfoBatchEvent, options.batch},
      {kKYTReportingSessionInfoRequireUserInfo, options.requireUserInfo}};
  if (!options.sessionInfoJSON.empty()) {
    auto given = object(json, options.sessionInfoJSON, "--session-info");
    if (auto* wrong = std::get_if<std::string>(&given)) return std::move(*wrong);
    program.sessionInfo = std::get<Dictionary>(std::move(given));
  }
  Dictionary userInfo;
  if (!options.client.empty()) userInfo.set(kKYTReportingUserInfoClientName, options.client);
  if (!options.service.empty()) userInfo.set(kKYTReportingUserInfoServiceName, options.service);
  if (!userInfo.empty()) program.userInfo = std::move(userInfo);
  if (!options.userInfoJSON.empty()) {
    auto given = object(json, options.userInfoJSON, "--user-info");
    if (auto* wrong = std::get_if<std::string>(&given)) return std::move(*wrong);
    program.userInfo = std::get<Dictionary>(std::move(given));
  }
  return program;
}

std::variant<std::unique_ptr<StorebagSource>, Error> storebagOf(const std::string& root,
                                                                const ExplainOptions& options,
                                                                const RehearsedProgram& program,
                                                                DevicePorts& ports) {
  if (!options.storebag.empty()) return StorebagSource::file(options.storebag, ports);
  const auto name =
      storebagNameForClientType(program.sessionInfo.integer(kKYTReportingSessionInfoClientType));
  if (name && !options.fetch)
    if (auto source = StorebagSource::daemon(root, name->str(), ports)) return source;
  return StorebagSource::server(ports);
}

}  // namespace

int explainCommand(const std::string& root, const ExplainOptions& options) {
  DevicePorts ports(root, options.storebag.empty());
  std::string text = options.event;
  if (text == "-") {
    auto input = readFile("-");
    if (auto* error = std::get_if<Error>(&input)) return cannotTell(error->localizedDescription);
    text = std::get<std::string>(std::move(input));
  }
  ExplainFacts facts;
  auto message = object(ports.json(), text, "the event");
  if (auto* wrong = std::get_if<std::string>(&message)) return cannotTell(*wrong);
  facts.message = std::get<Dictionary>(std::move(message));
  auto program = programOf(options, ports.json());
  if (auto* wrong = std::get_if<std::string>(&program)) return cannotTell(*wrong);
  facts.program = std::get<RehearsedProgram>(std::move(program));
  if (options.draw >= 0) facts.draw = static_cast<uint32_t>(std::lround(options.draw * 100));
  CheckOptions whom = options.program;
  if (whom.user.empty() && whom.pid == 0) whom.user = std::to_string(::getuid());
  facts.entitlement = checkEntitlement(root, whom, facts.entitlementLines);

  auto made = storebagOf(root, options, facts.program, ports);
  if (auto* error = std::get_if<Error>(&made)) return cannotTell(error->localizedDescription);
  StorebagSource& source = *std::get<std::unique_ptr<StorebagSource>>(made);
  facts.storebagSignature = source.signature();
  facts.unreadable = ports.unreadable();
  const Explanation explanation =
      explain(ports.device(source.isSigned()),
              {.server = source.answers(), .from = source.from(), .problem = source.problem()}, facts);
  if (options.json) {
    std::printf("%s\n", prettyJSON(explanation.report).c_str());
  } else {
    std::fputs(explainText(explanation.report).c_str(), stdout);
  }
  return static_cast<int>(explanation.verdict);
}

}  // namespace kyt::tools
