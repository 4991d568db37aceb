#include "client/Command.h"

#include <utility>

#include "platform/linux/client/ClientSocket.h"

namespace kyt::client {

Error clientError(ClientError code, std::string text) {
  return Error{kKYTReportingClientErrorDomain, static_cast<int32_t>(code), std::move(text)};
}

std::string outOfRange(uint32_t category, uint32_t type) {
  return "category " + std::to_string(category) + ", type " + std::to_string(type) +
         ": both are whole numbers from 0 to 65535";
}

Command::~Command() {
  for (const int descriptor : descriptors) linux_client::closeDescriptor(descriptor);
}

bool Command::hasCompletion() const {
  return statesCompletion || objectCompletion || textCompletion || successCompletion;
}

bool Command::staysGiven() const {
  switch (kind) {
    case Kind::startConfiguration:
    case Kind::fetchStates:
    case Kind::updateSharedData:
    case Kind::updateSharedDataForKey:
    case Kind::setDigestKey:
      return true;
    default:
      return false;
  }
}

std::unique_ptr<Command> Command::takeCompletions() {
  auto taken = std::make_unique<Command>(kind);
  taken->statesCompletion = std::move(statesCompletion);
  taken->objectCompletion = std::move(objectCompletion);
  taken->textCompletion = std::move(textCompletion);
  taken->successCompletion = std::move(successCompletion);
  return taken;
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
