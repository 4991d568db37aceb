#include "platform/ipc/AdministrationDispatcher.h"

#include <utility>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
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
  const std::shared_ptr<ConnectionOutput>& output;
};

using Handler = void (*)(const Call&, std::string_view replySignature);

// What is told in detail, or in less where that does not fit what may wait for the peer.
constexpr size_t kSessionsShown[] = {Limits::maxShownSessions, 256, 32, 4};
constexpr size_t kRowsOfUser[] = {Limits::maxBookRows, 64, 8, 1, 0};

void sayItDoesNotFit(const Call& call) {
  call.reply.error(wire::kErrorLimitsExceeded,
                   "The answer is larger than what may wait for one client (limits.max_queued_bytes, "
                   "limits.max_bytes_per_user)");
}

// `write(MessageWriter&)` writes the body.
template <typename Write>
void answer(const Call& call, std::string_view signature, Write write) {
  if (!call.reply.answerIfItFits(signature, write)) sayItDoesNotFit(call);
}

void status(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  const Dictionary status = call.window.status();
  answer(call, signature, [&](MessageWriter& out) { out.writeDictionary(status); });
}

void sessions(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  for (const size_t most : kSessionsShown) {
    const std::vector<Dictionary> shown = call.window.sessions(most);
    if (call.reply.answerIfItFits(signature, [&](MessageWriter& out) { out.writeDictionaries(shown); }))
      return;
  }
  sayItDoesNotFit(call);
}

void books(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  for (const size_t most : kRowsOfUser) {
    const std::vector<Dictionary> rows = call.window.books(most);
    if (call.reply.answerIfItFits(signature, [&](MessageWriter& out) { out.writeDictionaries(rows); }))
      return;
  }
  sayItDoesNotFit(call);
}

template <std::vector<Dictionary> (AdministrationInterface::*list)()>
void dictionaries(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  const std::vector<Dictionary> all = (call.window.*list)();
  answer(call, signature, [&](MessageWriter& out) { out.writeDictionaries(all); });
}

void metrics(const Call& call, std::string_view signature) {
  if (call.in.finish() != BodyStatus::ok) return;
  for (const size_t most : kRowsOfUser) {
    const std::string text = call.window.metrics(most);
    if (call.reply.answerIfItFits(signature, [&](MessageWriter& out) { out.writeString(text); })) return;
  }
  sayItDoesNotFit(call);
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

// What is too large for a message is lost as if it were sent: no later moment is better.
PassedSignal passedSignal(const std::shared_ptr<ConnectionOutput>& output) {
  return [output](const Dictionary& passed) {
    const auto sent = output->send(
        [&](MessageWriter& out, uint32_t serial) {
          out.beginSignal(serial, wire::kSessionPath, wire::kAdministrationInterface, kPassedSignal,
                          kPassedSignature);
          out.writeDictionary(passed);
          return out.end();
        },
        ConnectionOutput::Kind::optional);
    return sent == ConnectionOutput::Sent::yes || sent == ConnectionOutput::Sent::refused;
  };
}

std::string_view errorName(AdministrationRefusal::Why why) {
  switch (why) {
    case AdministrationRefusal::Why::tooMany:
      return wire::kErrorLimitsExceeded;
    case AdministrationRefusal::Why::notAllowed:
      return wire::kErrorAccessDenied;
    case AdministrationRefusal::Why::isOff:
    case AdministrationRefusal::Why::failed:
      return wire::kErrorFailed;
    case AdministrationRefusal::Why::wrongFilter:
      break;
  }
  return wire::kErrorInvalidArgs;
}

void watch(const Call& call, std::string_view /*signature*/) {
  Dictionary filter;
  call.in.readDictionary(filter);
  if (call.in.finish() != BodyStatus::ok) return;
  if (const auto refusal = call.window.watch(filter, passedSignal(call.output)))
    call.reply.error(errorName(refusal->why), refusal->text);
  else
    call.reply.answerNothing();
}

void storebag(const Call& call, std::string_view signature) {
  std::string_view name;
  call.in.readStringView(name);
  if (call.in.finish() != BodyStatus::ok) return;
  if (const auto bag = call.window.storebag(name))
    answer(call, signature, [&](MessageWriter& out) { out.writeDictionary(*bag); });
  else
    call.reply.error(wire::kErrorFailed, "no storebag of that name is in force");
}

void flushOutbox(const Call& call, std::string_view /*signature*/) {
  if (call.in.finish() != BodyStatus::ok) return;
  if (const auto refusal = call.window.flushOutbox())
    call.reply.error(errorName(refusal->why), refusal->text);
  else
    call.reply.answerNothing();
}

void dropOutbox(const Call& call, std::string_view signature) {
  Dictionary filter;
  call.in.readDictionary(filter);
  if (call.in.finish() != BodyStatus::ok) return;
  uint64_t dropped = 0;
  if (const auto refusal = call.window.dropOutbox(filter, dropped))
    call.reply.error(errorName(refusal->why), refusal->text);
  else
    call.reply.answer(signature, [&](MessageWriter& out) { out.writeUInt64(dropped); });
}

// Each at the place of its row in kAdministrationMethods.
constexpr std::array<Handler, kAdministrationMethods.size()> kHandlers{
    status, sessions, books,    dictionaries<&AdministrationInterface::storebags>, metrics,     setLogLevel,
    reload, watch,    storebag, dictionaries<&AdministrationInterface::outbox>,    flushOutbox, dropOutbox,
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
    kHandlers[number]({window, in, reply, peer.output}, kAdministrationMethods[number].reply);
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
