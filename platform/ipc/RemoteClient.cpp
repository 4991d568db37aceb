#include "platform/ipc/RemoteClient.h"

#include "platform/base/Clock.h"
#include "platform/ipc/Contract.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/Log.h"

namespace kyt {

std::optional<Error> RemoteClient::sendMessageToClient(std::optional<Dictionary> sessionInfo,
                                                       double timestamp, uint16_t category, uint16_t type,
                                                       std::optional<Dictionary> payload) {
  // The end of an aggregation. A client that missed it would wait for messages for ever. There is at most one for
  // each time that the client asks for aggregation, and while its output is full it is not heard.
  const bool isEnd = !sessionInfo && timestamp == 0 && category == 0 && type == 0 && !payload;
  const auto sent = output_.send(
      [&](MessageWriter& out, uint32_t serial) {
        out.beginCall(serial, {.path = wire::kClientPath,
                               .interface = wire::kReplyInterface,
                               .member = wire::kSendMessageToClient,
                               .signature = wire::kSendMessageToClientSignature,
                               .expectsReply = false});
        out.writeOptionalDictionary(sessionInfo);
        out.writeDouble(timestamp);
        out.writeUInt16(category);
        out.writeUInt16(type);
        out.writeOptionalDictionary(payload);
        return out.end();
      },
      isEnd ? ConnectionOutput::Kind::vital : ConnectionOutput::Kind::droppable);
  switch (sent) {
    case ConnectionOutput::Sent::yes:
      return std::nullopt;
    case ConnectionOutput::Sent::queueFull:
      if (services_.counters.addAndMayLog(Reason::aggregatorMessageDropped, services_.clock.monotonic())) {
        services_.log.normal(
            "DBusConnection(sendMessageToClient): message dropped, connection %llu of user %u reads too slowly",
            static_cast<unsigned long long>(connection_), user_);
      }
      return std::nullopt;
    case ConnectionOutput::Sent::refused:
    case ConnectionOutput::Sent::closed:
      break;
  }
  // Nobody misses the end of an aggregation when its client is gone.
  if (!isEnd) services_.counters.add(Reason::aggregatorMessageDropped);
  if (sent == ConnectionOutput::Sent::refused)
    return Error{"KYTReportingErrorDomain", -1, "The message is too large or nested too deeply"};
  return Error{"KYTReportingErrorDomain", -1, "The connection was invalidated"};
}

}  // namespace kyt
