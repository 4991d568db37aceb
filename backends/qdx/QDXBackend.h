// The back end that forwards each event to an adaptor object of a plug-in bundle, for three client types. Made
// by the factory, owned by one session, called on its queue. Without the bundle it exists all the same and
// says in the log what it could not forward.
#pragma once

#include <memory>
#include <optional>

#include "backend/KYTReportingBackend.h"
#include "config/Configuration.h"
#include "platform/PluginBundle.h"

namespace kyt {

class QDXBackend : public KYTReportingBackend {
 public:
  // Null, with a line in the log, for a session of a client type that is not allowed.
  static std::shared_ptr<QDXBackend> initWithName(Configuration& configuration, String name,
                                                  Dictionary profile, SharedSessionFacts facts);
  using KYTReportingBackend::KYTReportingBackend;
  [[nodiscard]] static bool isClientTypeAllowed(int32_t clientType);

  using KYTReportingBackend::sendMessage;
  Value sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method, uint16_t respCode,
                    EventID eventID, MessageFlag flag) override;

 private:
  void loadAdaptor();

  std::shared_ptr<PluginBundle> clientBundle_;
  std::shared_ptr<PluginClass> qdxAdaptorClass_;
  std::unique_ptr<PluginObject> qdxAdaptor_;  // null when the class could not be found
};

}  // namespace kyt
