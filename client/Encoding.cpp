// How the session's calls and messages become bytes, and answers become completions.
#include <utility>

#include "client/Session.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/MessageWriter.h"

namespace kyt::client {

namespace {

constexpr uint64_t kMaxCallBytes = 1048576;  // what a daemon takes by default (max_message_bytes)

MessageWriter::Call callOf(Method method) {
  MessageWriter::Call call;
  call.member = wire::contractOf(method).member;
  call.signature = wire::contractOf(method).signature;
  return call;
}

}  // namespace

bool Session::encodeMessage(const MessageArguments& message) {
  MessageWriter writer(out_, kMaxCallBytes);
  MessageWriter::Call call = callOf(Method::sendMessageWithDictionary);
  call.expectsReply = false;
  writer.beginCall(++serial_, call);
  writeArguments(writer, message);
  return writer.end();
}

bool Session::encodeCall(Call& given, uint32_t serial) {
  MessageWriter writer(out_, kMaxCallBytes);
  MessageWriter::Call call = callOf(given.method);
  call.expectsReply = given.method != Method::setSessionInfo;
  auto* const upload = std::get_if<UploadFileArguments>(&given.arguments);
  const bool withDescriptors = upload != nullptr && handshake_.descriptorsAgreed();
  if (withDescriptors) call.unixFds = static_cast<uint32_t>(upload->extension.size());
  const size_t start = out_.size();
  writer.beginCall(serial, call);
  writeArguments(writer, given.arguments, call.unixFds);
  if (!writer.end()) return false;
  if (withDescriptors) marks_.push_back({start, std::exchange(upload->extension, {})});
  return true;
}

bool Session::encodePing(uint32_t serial) {
  MessageWriter writer(out_, kMaxCallBytes);
  MessageWriter::Call call;
  call.interface = wire::kPeerInterface;
  call.member = "Ping";
  writer.beginCall(serial, call);
  return writer.end();
}

void Session::complete(Command& command, const Message& message) {
  const Method method = command.call.method;
  if (message.type == wire::MessageType::error) {
    const std::string text = daemonError(message).localizedDescription;
    standing_.say(std::string(wire::contractOf(method).member) + ": " + text);
    if (command.replayed) figures_.replayFailed.add();
    command.call.answer.fail(ClientError::refused, text);
    return;
  }
  std::optional<Reply> reply = readReply(method, message);
  if (!reply)
    return command.call.answer.fail(ClientError::refused,
                                    "the daemon's answer has another form than this library knows");
  if (const auto* names = std::get_if<StateNames>(&reply->result)) learnStates(*names);
  command.call.answer.give(std::move(*reply));
}

void Session::learnStates(const StateNames& names) {
  using State = KYTReporting::State;
  if (!kept_.isConfigured()) return;
  if (!names) return standing_.become(State::noStorebag, kept_.whyNoStorebag());
  if (names->empty()) return standing_.become(State::noLiveBackEnd, kept_.whyNotLive());
  std::string live;
  for (const std::string& name : *names) live += (live.empty() ? "" : " ") + name;
  standing_.become(State::live, std::move(live));
}

void Session::handleCall(const Message& message) {
  const bool ours = message.path == wire::kClientPath && message.member == wire::kSendMessageToClient &&
                    (message.interface.empty() || message.interface == wire::kReplyInterface);
  AggregatedMessage aggregated;
  BodyReader reader(message);
  if (ours && reader.hasSignature(wire::kSendMessageToClientSignature) &&
      reader.readOptionalDictionary(aggregated.sessionInfo) && reader.readDouble(aggregated.timestamp) &&
      reader.readUInt16(aggregated.category) && reader.readUInt16(aggregated.type) &&
      reader.readOptionalDictionary(aggregated.payload) && reader.finish() == BodyStatus::ok) {
    if (aggregationBlock_) {
      // Kept aside while it runs: the program may close the session from inside.
      auto block = std::move(aggregationBlock_);
      block(aggregated);
      if (!done_) aggregationBlock_ = std::move(block);
    }
    return;
  }
  if (!message.expectsReply()) return;
  MessageWriter writer(out_, kMaxCallBytes);
  [[maybe_unused]] const bool written = writer.writeError(
      ++serial_, message.serial, wire::kErrorUnknownMethod, "clients take SendMessageToClient alone");
}

}  // namespace kyt::client
