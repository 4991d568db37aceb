#include "platform/ipc/AdministrationDispatcher.h"

#include <utility>

#include "platform/base/Counters.h"
#include "platform/ipc/AdministrationInterface.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/CallReply.h"
#include "platform/ipc/InterfaceDescription.h"

namespace kyt {
namespace {

// One call, while it is handled.
struct Call {
  AdministrationInterface& window;
  BodyReader& in;
  CallReply& reply;
};

using Handler = void (*)(const Call&, std::string_view replySignature);

void status(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  const Dictionary answer = call.window.status();
  call.reply.answer(signature, [&](MessageWriter& out) { out.writeDictionary(answer); });
}

template <std::vector<Dictionary> (AdministrationInterface::*list)()>
void dictionaries(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  const std::vector<Dictionary> answer = (call.window.*list)();
  call.reply.answer(signature, [&](MessageWriter& out) { out.writeDictionaries(answer); });
}

void metrics(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  const std::string answer = call.window.metrics();
  call.reply.answer(signature, [&](MessageWriter& out) { out.writeString(answer); });
}

void setLogLevel(const Call& call, std::string_view /*signature*/) {
  std::string_view level;
  call.in.readStringView(level);
  if (call.in.finish() != BodyStatus::ok) return;
  if (const auto problem = call.window.setLogLevel(level))
    call.reply.error(wire::kErrorInvalidArgs, *problem);
  else
    call.reply.answerNothing();
}

void reload(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  std::vector<std::string> lines;
  if (const auto problem = call.window.reload(lines))
    call.reply.error(wire::kErrorFailed, *problem);
  else
    call.reply.answer(signature, [&](MessageWriter& out) { out.writeStrings(lines); });
}

// Each at the place of its row in kAdministrationMethods.
constexpr std::array<Handler, kAdministrationMethods.size()> kHandlers{
    status,
    dictionaries<&AdministrationInterface::sessions>,
    dictionaries<&AdministrationInterface::books>,
    dictionaries<&AdministrationInterface::storebags>,
    metrics,
    setLogLevel,
    reload,
};

size_t numberOf(std::string_view member) {
  size_t number = 0;
  while (number < kAdministrationMethods.size() && kAdministrationMethods[number].member != member) ++number;
  return number;
}

}  // namespace

std::string administrationIntrospection() {
  return introspectionOf(administrationDescription());
}

AdministrationDispatcher::AdministrationDispatcher(Counters& counters, std::string machineId)
    : counters_(counters),
      standard_(counters, {.interface = wire::kAdministrationInterface,
                           .machineId = std::move(machineId),
                           .introspection = administrationIntrospection()}) {}

const char* AdministrationDispatcher::handle(const Message& message, const Peer& peer) const {
  // Nobody is called here, so there are no replies, and there is no signal that the daemon knows.
  if (message.type != wire::MessageType::methodCall)
    return validateBody(message) ? nullptr : "the body is malformed";
  const bool ours = message.interface == wire::kAdministrationInterface || message.interface.empty();
  const size_t number = ours ? numberOf(message.member) : kAdministrationMethods.size();
  if (number == kAdministrationMethods.size() || message.path != wire::kSessionPath)
    return standard_.handle(message, peer);
  auto& window = static_cast<AdministrationInterface&>(peer.object);
  if (const char* refusal = window.refusal()) {
    counters_.add(Reason::administrationRefused);
    return StandardInterfaces::refuse(message, peer, wire::kErrorAccessDenied, refusal);
  }
  CallReply reply(message, peer.output);
  BodyReader in(message);
  if (in.hasSignature(kAdministrationMethods[number].signature))
    kHandlers[number]({window, in, reply}, kAdministrationMethods[number].reply);
  switch (in.finish()) {
    case BodyStatus::ok:
      return nullptr;
    case BodyStatus::malformed:
      reply.forget();
      return in.problem();
    case BodyStatus::invalidArguments:
      break;
  }
  counters_.add(Reason::invalidArguments);
  reply.error(wire::kErrorInvalidArgs, in.problem());
  return nullptr;
}

}  // namespace kyt
