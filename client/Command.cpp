#include "client/Command.h"

#include <utility>

#include "platform/linux/client/ClientSocket.h"

namespace kyt::client {

Error clientError(ClientError code, std::string text) {
  return Error{kKYTReportingClientErrorDomain, static_cast<int32_t>(code), std::move(text)};
}

Command::~Command() {
  for (const int descriptor : descriptors) linux_client::closeDescriptor(descriptor);
}

void Command::fail(ClientError code, const std::string& description) {
  if (auto completion = std::exchange(statesCompletion, nullptr))
    completion(std::nullopt, clientError(code, description));
  if (auto completion = std::exchange(objectCompletion, nullptr))
    completion(Value(), clientError(code, description));
  if (auto completion = std::exchange(textCompletion, nullptr))
    completion({}, clientError(code, description));
  if (auto completion = std::exchange(successCompletion, nullptr))
    completion(false, clientError(code, description));
}

}  // namespace kyt::client
