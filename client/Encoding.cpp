// How the session's commands and messages become calls, and answers become completions.
#include <utility>

#include "client/Session.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/MessageWriter.h"

namespace kyt::client {

namespace {

using Kind = Command::Kind;

constexpr uint64_t kMaxCallBytes = 1048576;  // what a daemon takes by default (max_message_bytes)

struct Shape {
  std::string_view member, signature;
};

Shape shapeOf(Kind kind) {
  switch (kind) {
    case Kind::messageWithReply:
      return {"SendMessageWithDictionary", "a{sv}"};
    case Kind::startConfiguration:
      return {"StartConfigWithCompletionHandler", ""};
    case Kind::fetchStates:
      return {"FetchStatesWithUserInfo", "aa{sv}"};
    case Kind::fetchDisplayURL:
      return {"FetchDisplayURL", ""};
    case Kind::flush:
      return {"FlushMessagesWithCompletion", ""};
    case Kind::updateSharedData:
      return {"UpdateSharedDataWithDictionary", "a{sv}"};
    case Kind::updateSharedDataForKey:
      return {"UpdateSharedDataForKey", "sav"};
    case Kind::setDigestKey:
      return {"SetDigestKey", "ayi"};
    case Kind::uploadFile:
      return {"UploadFileAtPath", "ssah"};
    case Kind::uploadLogData:
      return {"UploadLogData", "av"};
    case Kind::finish:
      return {"FinishSessionGracefully", ""};
    case Kind::singleMessage:
      return {"SendMessageWithSessionInfo", "a{sv}aa{sv}qqaa{sv}"};
    case Kind::ping:
      return {"Ping", ""};
  }
  return {};
}

Dictionary messageDictionary(uint16_t category, uint16_t type, uint32_t flag, const Dictionary& payload) {
  Dictionary message;
  message.reserve(4);
  message.append(kKYTReportingMessageParametersCategory, static_cast<unsigned>(category));
  message.append(kKYTReportingMessageParametersType, static_cast<unsigned>(type));
  message.append(kKYTReportingMessageParametersPayload, payload);
  if (flag != 0) message.append(kKYTReportingMessageParametersFlag, flag);
  return message;
}

Error daemonError(const Message& message) {
  std::string text(message.errorName);
  BodyReader reader(message);
  std::string_view detail;
  if (reader.hasSignature("s") && reader.readStringView(detail)) text += ": " + std::string(detail);
  return clientError(ClientError::refused, std::move(text));
}

std::vector<std::string> texts(const Array& array) {
  std::vector<std::string> out;
  out.reserve(array.size());
  for (const Value& value : array)
    if (const String* text = value.string()) out.push_back(text->str());
  return out;
}

}  // namespace

bool Session::encodeMessage(const Item& item) {
  MessageWriter writer(out_, kMaxCallBytes);
  MessageWriter::Call call;
  call.member = "SendMessageWithDictionary";
  call.signature = "a{sv}";
  call.expectsReply = false;
  writer.beginCall(++serial_, call);
  writer.writeDictionary(messageDictionary(item.category, item.type, item.flag, item.payload));
  return writer.end();
}

bool Session::encodeSessionInfo(const std::optional<Dictionary>& userInfo) {
  MessageWriter writer(out_, kMaxCallBytes);
  MessageWriter::Call call;
  call.member = "SetSessionInfo";
  call.signature = "a{sv}aa{sv}avb";
  call.expectsReply = false;
  writer.beginCall(++serial_, call);
  writer.writeDictionary(kept_.sessionInfo);
  writer.writeOptionalDictionary(userInfo);
  writer.writeOptionalValue(kept_.frameworks);
  writer.writeBoolean(static_cast<bool>(aggregationBlock_));
  return writer.end();
}

bool Session::encodeCommand(Command& command, uint32_t serial) {
  const Shape shape = shapeOf(command.kind);
  const bool withDescriptors = command.kind == Kind::uploadFile && handshake_.descriptorsAgreed();
  MessageWriter writer(out_, kMaxCallBytes);
  MessageWriter::Call call;
  call.member = shape.member;
  call.signature = shape.signature;
  if (command.kind == Kind::ping) call.interface = wire::kPeerInterface;
  if (withDescriptors) call.unixFds = static_cast<uint32_t>(command.descriptors.size());
  const size_t start = out_.size();
  writer.beginCall(serial, call);
  switch (command.kind) {
    case Kind::messageWithReply:
      writer.writeDictionary(
          messageDictionary(command.category, command.type, command.flag, *command.dictionary));
      break;
    case Kind::fetchStates:
      writer.writeOptionalDictionary(command.dictionary);
      break;
    case Kind::updateSharedData:
      writer.writeDictionary(*command.dictionary);
      break;
    case Kind::updateSharedDataForKey:
      writer.writeString(command.text);
      writer.writeOptionalValue(command.value);
      break;
    case Kind::setDigestKey:
      writer.writeData(command.data.bytes());
      writer.writeInt32(command.algorithm);
      break;
    case Kind::uploadFile:
      writer.writeString(command.text);
      writer.writeString("libkytreporting");
      writer.writeDescriptorIndexes(withDescriptors ? call.unixFds : 0);
      break;
    case Kind::uploadLogData:
      writer.writeArray(command.array);
      break;
    case Kind::singleMessage:
      writer.writeDictionary(kept_.sessionInfo);
      writer.writeOptionalDictionary(kept_.userInfo);
      writer.writeUInt16(command.category);
      writer.writeUInt16(command.type);
      writer.writeOptionalDictionary(command.dictionary);
      break;
    case Kind::startConfiguration:
    case Kind::fetchDisplayURL:
    case Kind::flush:
    case Kind::finish:
    case Kind::ping:
      break;
  }
  if (!writer.end()) return false;
  if (withDescriptors) marks_.push_back({start, std::exchange(command.descriptors, {})});
  return true;
}

void Session::complete(Command& command, const Message& message) {
  if (message.type == wire::MessageType::error) {
    standing_.say(std::string(shapeOf(command.kind).member) + ": " +
                  daemonError(message).localizedDescription);
    if (command.replayed) replayFailed_.fetch_add(1);
    command.fail(ClientError::refused, daemonError(message).localizedDescription);
    return;
  }
  BodyReader reader(message);
  std::optional<Error> error;
  if (command.kind == Kind::startConfiguration || command.kind == Kind::fetchStates) {
    std::optional<Array> names;
    if (reader.hasSignature("aas") && reader.readOptionalStrings(names) &&
        reader.finish() == BodyStatus::ok) {
      learnStates(names);
      std::optional<std::vector<std::string>> states;
      if (names) states = texts(*names);
      if (auto completion = std::exchange(command.statesCompletion, nullptr))
        completion(std::move(states), std::nullopt);
    }
  } else if (command.kind == Kind::fetchDisplayURL || command.kind == Kind::singleMessage) {
    String text;
    if (reader.hasSignature("s") && reader.readString(text) && reader.finish() == BodyStatus::ok)
      if (auto completion = std::exchange(command.textCompletion, nullptr))
        completion(text.str(), std::nullopt);
  } else if (command.kind == Kind::messageWithReply || command.kind == Kind::flush) {
    Value result;
    const bool flush = command.kind == Kind::flush;
    if (reader.hasSignature(flush ? "ava(sis)" : "av") && reader.readOptionalValue(result) &&
        (!flush || reader.readOptionalError(error)) && reader.finish() == BodyStatus::ok)
      if (auto completion = std::exchange(command.objectCompletion, nullptr))
        completion(std::move(result), std::move(error));
  } else if (command.kind == Kind::uploadFile || command.kind == Kind::uploadLogData) {
    bool success = false;
    const bool log = command.kind == Kind::uploadLogData;
    if (reader.hasSignature(log ? "ba(sis)" : "b") && reader.readBoolean(success) &&
        (!log || reader.readOptionalError(error)) && reader.finish() == BodyStatus::ok)
      if (auto completion = std::exchange(command.successCompletion, nullptr))
        completion(success, std::move(error));
  } else if (auto completion = std::exchange(command.successCompletion, nullptr)) {
    completion(true, std::nullopt);
  }
  command.fail(ClientError::refused, "the daemon's answer has another form than this library knows");
}

void Session::learnStates(const std::optional<Array>& names) {
  using State = KYTReporting::State;
  if (!kept_.configured) return;
  if (!names) return standing_.become(State::noStorebag, kept_.whyNoStorebag());
  if (names->empty()) return standing_.become(State::noLiveBackEnd, kept_.whyNotLive());
  std::string live;
  for (const std::string& name : texts(*names)) live += (live.empty() ? "" : " ") + name;
  standing_.become(State::live, std::move(live));
}

void Session::handleCall(const Message& message) {
  const bool ours = message.path == wire::kClientPath && message.member == "SendMessageToClient" &&
                    (message.interface.empty() || message.interface == wire::kReplyInterface);
  AggregatedMessage aggregated;
  BodyReader reader(message);
  if (ours && reader.hasSignature("aa{sv}dqqaa{sv}") &&
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
