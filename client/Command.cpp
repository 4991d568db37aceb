#include "client/Command.h"

namespace kyt::client {

std::string outOfRange(uint32_t category, uint32_t type) {
  return "category " + std::to_string(category) + ", type " + std::to_string(type) +
         ": both are whole numbers from 0 to 65535";
}

bool Command::staysGiven() const {
  switch (call.method) {
    case Method::startConfigWithCompletionHandler:
    case Method::fetchStatesWithUserInfo:
    case Method::updateSharedDataWithDictionary:
    case Method::updateSharedDataForKey:
    case Method::setDigestKey:
      return true;
    default:
      return false;
  }
}

}  // namespace kyt::client
