// One event by hand, without a session.
#include <chrono>
#include <cstdio>
#include <memory>

#include "kytreporting/KYTReporting.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/data/RapidJSON.h"
#include "tools/kytctl/Answers.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

int sendCommand(const ConnectionOptions& connection, const SendOptions& given) {
  RapidJSON json;
  auto payload = json.parse(given.payloadJSON);
  if (auto* error = std::get_if<Error>(&payload)) return failed("--payload: " + error->localizedDescription);
  if (!std::get<Value>(payload).isDictionary()) return failed("--payload is a JSON object");
  KYTReporting::Options options;
  options.socketPath = socketPath(connection);
  options.sessionInfo = {{kKYTReportingSessionInfoSessionID, given.sessionID},
                         {kKYTReportingSessionInfoClientType, given.clientType},
                         {kKYTReportingSessionInfoClientVersion, static_cast<unsigned>(given.clientVersion)},
                         {kKYTReportingSessionInfoRequireUserInfo, given.requireUserInfo}};
  if (!given.userInfoJSON.empty()) {
    auto userInfo = json.parse(given.userInfoJSON);
    if (auto* error = std::get_if<Error>(&userInfo))
      return failed("--user-info: " + error->localizedDescription);
    if (!std::get<Value>(userInfo).isDictionary()) return failed("--user-info is a JSON object");
    options.userInfo = *std::get<Value>(userInfo).dictionary();
  }
  options.callDeadline = std::chrono::milliseconds(0);  // --timeout counts
  auto answer = std::make_shared<Answer>();
  KYTReporting::sendSingleMessage(std::move(options), given.category, given.type,
                                  *std::get<Value>(payload).dictionary(),
                                  [answer](std::string text, std::optional<Error> error) {
                                    answer->set(std::move(text), std::move(error));
                                  });
  const auto said = answer->wait(connection.timeoutSeconds);
  if (!said) return failedCall(connection, "send", "no answer in time");
  if (said->second) return failedCall(connection, "send", said->second->localizedDescription);
  std::printf("%s\n", escapedText(said->first).c_str());
  return said->first == "finished" ? 0 : 1;
}

}  // namespace kyt::tools
