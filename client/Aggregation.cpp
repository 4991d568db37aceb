#include "client/Aggregation.h"

#include "platform/ipc/BodyReader.h"
#include "platform/ipc/Contract.h"

namespace kyt::client {

namespace {

bool read(const Message& call, AggregatedMessage& out) {
  BodyReader in(call);
  return in.hasSignature(wire::kSendMessageToClientSignature) && in.readOptionalDictionary(out.sessionInfo) &&
         in.readDouble(out.timestamp) && in.readUInt16(out.category) && in.readUInt16(out.type) &&
         in.readOptionalDictionary(out.payload) && in.finish() == BodyStatus::ok;
}

}  // namespace

bool Aggregation::handle(const Message& call) {
  if (call.path != wire::kClientPath || call.member != wire::kSendMessageToClient) return false;
  if (!call.interface.empty() && call.interface != wire::kReplyInterface) return false;
  AggregatedMessage message;
  if (!read(call, message)) return false;
  block_.run(message);
  return true;
}

}  // namespace kyt::client
