// Events by hand: one without a session, or the lines of standard input in one.
#include <chrono>
#include <cstdio>
#include <iostream>
#include <limits>
#include <memory>
#include <variant>

#include "kytreporting/KYTReporting.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "platform/linux/data/RapidJSON.h"
#include "tools/kytctl/Answers.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/SessionScript.h"

namespace kyt::tools {

namespace {

Dictionary sessionInfoOf(const SendOptions& given) {
  return {{kKYTReportingSessionInfoSessionID, given.sessionID},
          {kKYTReportingSessionInfoClientType, given.clientType},
          {kKYTReportingSessionInfoClientVersion, static_cast<unsigned>(given.clientVersion)},
          {kKYTReportingSessionInfoRequireUserInfo, given.requireUserInfo}};
}

// An object of the command line; an error says which option it stands behind.
std::variant<Dictionary, Error> objectIn(const std::string& text, const char* option) {
  auto parsed = RapidJSON().parse(text);
  if (auto* error = std::get_if<Error>(&parsed)) {
    error->localizedDescription.insert(0, std::string(option) + ": ");
    return std::move(*error);
  }
  const Value& value = std::get<Value>(parsed);
  if (!value.isDictionary()) return Error{{}, 1, std::string(option) + " is a JSON object"};
  return *value.dictionary();
}

int wrongUsage(const char* what) {
  std::fprintf(stderr, "kytctl: %s\nTry 'kytctl send --help'.\n", what);
  return kWrongUsage;
}

int sendOne(const ConnectionOptions& connection, const SendOptions& given, KYTReporting::Options options) {
  if (!given.category) return wrongUsage("--category is required");
  if (!given.type) return wrongUsage("--type is required");
  auto payload = objectIn(given.payloadJSON, "--payload");
  if (auto* error = std::get_if<Error>(&payload)) return failed(error->localizedDescription);
  auto answer = std::make_shared<Answer>();
  KYTReporting::sendSingleMessage(std::move(options), *given.category, *given.type,
                                  std::get<Dictionary>(std::move(payload)),
                                  [answer](std::string text, std::optional<Error> error) {
                                    answer->set(std::move(text), std::move(error));
                                  });
  const auto said = answer->wait(connection.timeoutSeconds);
  if (!said) return failedCall(connection, "send", "no answer in time");
  if (said->second) return failedCall(connection, "send", said->second->localizedDescription);
  std::printf("%s\n", escapedText(said->first).c_str());
  return said->first == "finished" ? 0 : 1;
}

int sendLines(const ConnectionOptions& connection, const KYTReporting::Options& options) {
  SessionScript script(connection);
  Dictionary open{{"do", "open"}, {"sessionInfo", options.sessionInfo}};
  if (options.userInfo) open.set("userInfo", *options.userInfo);
  if (const int status = script.run(open); status != 0) return status;
  if (const int status = script.run({{"do", "configure"}}); status != 0) return status;
  RapidJSON json;
  int status = 0;
  std::string line;
  for (int number = 1; std::getline(std::cin, line); ++number) {
    if (line.find_first_not_of(" \t\r") == std::string::npos) continue;
    auto parsed = json.parse(line);
    const auto* event = std::get_if<Value>(&parsed);
    if (event == nullptr || !event->isDictionary()) {
      status = failed("line " + std::to_string(number) + " is no JSON object");
      break;
    }
    Dictionary step = *event->dictionary();
    step.set("do", "send");
    status = script.run(step);
    if (status != 0) {
      failed("line " + std::to_string(number));
      break;
    }
  }
  // What stood before a line that is wrong was asked for too.
  const int finished = script.run({{"do", "finish"}});
  if (status != 0 || finished != 0) return status != 0 ? status : finished;
  if (const uint64_t missing = script.missing(); missing > 0)
    return failed(std::to_string(missing) + " events may not have arrived");
  return 0;
}

}  // namespace

int sendCommand(const ConnectionOptions& connection, const SendOptions& given) {
  if (given.quietIfNoDaemon && nobodyListens(connection)) {
    // Read all the same: a producer that writes into a closed pipe would be killed.
    if (given.fromStandardInput) std::cin.ignore(std::numeric_limits<std::streamsize>::max());
    return 0;
  }
  KYTReporting::Options options;
  options.socketPath = socketPath(connection);
  options.sessionInfo = sessionInfoOf(given);
  if (!given.userInfoJSON.empty()) {
    auto userInfo = objectIn(given.userInfoJSON, "--user-info");
    if (auto* error = std::get_if<Error>(&userInfo)) return failed(error->localizedDescription);
    options.userInfo = std::get<Dictionary>(std::move(userInfo));
  }
  options.callDeadline = std::chrono::milliseconds(0);  // --timeout counts
  if (given.fromStandardInput) return sendLines(connection, options);
  return sendOne(connection, given, std::move(options));
}

}  // namespace kyt::tools
