#include "client/Output.h"

#include <utility>

#include "platform/ipc/MessageWriter.h"

namespace kyt::client {

namespace {

using linux_client::Outcome;

constexpr uint64_t kMaxCallBytes = 1048576;  // what a daemon takes by default (max_message_bytes)

MessageWriter::Call callOf(Method method) {
  MessageWriter::Call call;
  call.member = wire::contractOf(method).member;
  call.signature = wire::contractOf(method).signature;
  return call;
}

}  // namespace

void Output::restart(std::string opening) {
  bytes_ = std::move(opening);
  at_ = 0;
  marks_.clear();
}

Output::Output()
    : messageHeader_([] {
        MessageWriter::Call header = callOf(Method::sendMessageWithDictionary);
        header.expectsReply = false;
        return MessageWriter::prepare(header);
      }()) {}

std::optional<uint32_t> Output::message(const MessageArguments& message) {
  MessageWriter writer(bytes_, kMaxCallBytes);
  writer.beginCall(++serial_, messageHeader_);
  writeArguments(writer, message);
  if (!writer.end()) return std::nullopt;
  return serial_;
}

std::optional<uint32_t> Output::call(Call& call, bool passesDescriptors) {
  MessageWriter writer(bytes_, kMaxCallBytes);
  MessageWriter::Call header = callOf(call.method);
  header.expectsReply = call.method != Method::setSessionInfo;
  auto* const upload = passesDescriptors ? std::get_if<UploadFileArguments>(&call.arguments) : nullptr;
  if (upload != nullptr) header.unixFds = static_cast<uint32_t>(upload->extension.size());
  const size_t start = bytes_.size();
  writer.beginCall(++serial_, header);
  writeArguments(writer, call.arguments, header.unixFds);
  if (!writer.end()) return std::nullopt;
  if (upload != nullptr) marks_.push_back({start, std::exchange(upload->extension, {})});
  return serial_;
}

std::optional<uint32_t> Output::ping() {
  MessageWriter writer(bytes_, kMaxCallBytes);
  MessageWriter::Call header;
  header.interface = wire::kPeerInterface;
  header.member = "Ping";
  writer.beginCall(++serial_, header);
  if (!writer.end()) return std::nullopt;
  return serial_;
}

void Output::refuse(uint32_t replySerial) {
  MessageWriter writer(bytes_, kMaxCallBytes);
  [[maybe_unused]] const bool written = writer.writeError(++serial_, replySerial, wire::kErrorUnknownMethod,
                                                          "clients take SendMessageToClient alone");
}

Output::Written Output::writeTo(linux_client::ClientSocket& socket) {
  Written result;
  while (waiting() > 0) {
    std::vector<int> descriptors;  // of the mark, which owns them until they have left
    const bool marked = !marks_.empty() && marks_.front().offset == at_;
    if (marked)
      for (const Descriptor& descriptor : marks_.front().descriptors) descriptors.push_back(descriptor.get());
    const size_t next = marked ? 1 : 0;
    const size_t end = marks_.size() > next ? marks_[next].offset : bytes_.size();
    size_t written = 0;
    const Outcome outcome =
        socket.write(std::string_view(bytes_).substr(at_, end - at_), descriptors, written);
    result.ended = outcome == Outcome::ended;
    if (outcome != Outcome::done) return result;
    if (marked) marks_.pop_front();
    at_ += written;
    result.any = true;
  }
  bytes_.clear();
  at_ = 0;
  return result;
}

}  // namespace kyt::client
