// The back end that records events with the platform's power-logging service. Made by the factory, owned by
// one session, called on its queue.
#pragma once

#include <memory>
#include <optional>

#include "backend/KYTReportingBackend.h"
#include "config/Configuration.h"

namespace kyt {

class AmpyxBackend : public KYTReportingBackend {
 public:
  static std::shared_ptr<AmpyxBackend> initWithName(Configuration& configuration, String name,
                                                    Dictionary profile, SharedSessionFacts facts);
  using KYTReportingBackend::KYTReportingBackend;

  // Only this operation, deliberately, and not the one with a flag that routed events go through: those reach
  // the base, which does nothing. A device would otherwise write a power-log entry for each event.
  using KYTReportingBackend::sendMessage;
  Value sendMessage(const Dictionary& message, const TimeValue& timestamp, uint16_t method, uint16_t respCode,
                    EventID eventID) override;
};

}  // namespace kyt
