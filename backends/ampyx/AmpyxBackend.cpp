#include "backends/ampyx/AmpyxBackend.h"

#include <utility>

#include "platform/Platform.h"
#include "platform/PowerLog.h"
#include "platform/base/Counters.h"

namespace kyt {

namespace {

constexpr uint32_t kAgent = 28;
constexpr char kEventName[] = "Medsrv-KYT";

}  // namespace

std::shared_ptr<AmpyxBackend> AmpyxBackend::initWithName(Configuration& configuration, String name,
                                                         Dictionary profile, SharedSessionFacts facts) {
  return std::make_shared<AmpyxBackend>(Making(), configuration.platform, std::move(name), std::move(profile),
                                        std::move(facts));
}

Value AmpyxBackend::sendMessage(const Dictionary& message, const TimeValue&, uint16_t method,
                                uint16_t respCode, EventID eventID) {
  if (method == 0 || message.empty()) {
    platform().counters.add(Reason::notForThisBackEnd);
    return {};
  }
  Dictionary entry = message;
  entry.set("method", unsigned{method});
  entry.set("respCode", unsigned{respCode});
  entry.set("event", static_cast<unsigned>(eventID));
  platform().powerLog.registeredEvent(kAgent, kEventName, entry);
  return {};
}

}  // namespace kyt
