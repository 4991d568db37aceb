#include "platform/ipc/MessageReader.h"

#include <bit>
#include <cstring>

#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/WireText.h"

namespace kyt {
namespace {

constexpr bool kLittleEndianMachine = std::endian::native == std::endian::little;

uint32_t load32(const uint8_t* at, bool swapped) {
  uint32_t value;
  std::memcpy(&value, at, sizeof value);
  return swapped ? __builtin_bswap32(value) : value;
}

size_t roundUp8(size_t n) {
  return (n + 7) & ~size_t{7};
}

// Reads the fields of one header. Positions are relative to the message's beginning, which is what alignment
// counts from.
class HeaderParser {
 public:
  HeaderParser(const uint8_t* begin, size_t at, size_t end, Message& message)
      : begin_(begin), at_(at), end_(end), message_(message) {}

  const char* parse() {
    while (at_ < end_) {
      const size_t aligned = roundUp8(at_);
      if (aligned >= end_) return "a header field is cut off";
      if (!skipPadding(aligned)) return "header padding is not zero";
      if (const char* problem = parseField()) return problem;
    }
    return checkRequired();
  }

 private:
  bool skipPadding(size_t to) {
    for (; at_ < to; ++at_) {
      if (begin_[at_] != 0) return false;
    }
    return true;
  }

  // A field is a code and a variant: one byte each for the code, the signature's length, the type and the
  // NUL, when the type is one of those that known fields have.
  const char* parseField() {
    const uint8_t code = begin_[at_];
    if (code == 0) return "a header field has the code 0";
    if (code > static_cast<uint8_t>(wire::Field::unixFds)) return skipUnknownField();
    if (end_ - at_ < 6) return "a header field is cut off";
    const unsigned bit = 1u << code;
    if ((seen_ & bit) != 0) return "a header field appears twice";
    seen_ |= bit;
    const uint8_t* const signature = begin_ + at_ + 1;
    if (signature[0] != 1 || signature[2] != 0) return "a header field has the wrong type";
    const char type = static_cast<char>(signature[1]);
    at_ += 4;
    return type == 'g' ? parseSignature(code) : type == 'u' ? parseNumber(code) : parseText(code, type);
  }

  const char* parseNumber(uint8_t code) {
    if (end_ - at_ < 4) return "a header field is cut off";
    const uint32_t value = load32(begin_ + at_, message_.swapped);
    at_ += 4;
    if (code == static_cast<uint8_t>(wire::Field::replySerial)) {
      if (value == 0) return "the reply serial is 0";
      message_.replySerial = value;
      return nullptr;
    }
    if (code != static_cast<uint8_t>(wire::Field::unixFds)) return "a header field has the wrong type";
    message_.unixFds = value;
    return nullptr;
  }

  const char* parseSignature(uint8_t code) {
    if (code != static_cast<uint8_t>(wire::Field::signature)) return "a header field has the wrong type";
    const size_t length = begin_[at_];
    if (end_ - at_ < length + 2) return "a header field is cut off";
    message_.signature = {reinterpret_cast<const char*>(begin_ + at_ + 1), length};
    if (begin_[at_ + 1 + length] != 0) return "a signature is not terminated";
    at_ += length + 2;
    return wire::isValidSignature(message_.signature) ? nullptr : "the signature is not valid";
  }

  const char* parseText(uint8_t code, char type) {
    const bool isPath = code == static_cast<uint8_t>(wire::Field::path);
    if (type != (isPath ? 'o' : 's')) return "a header field has the wrong type";
    if (end_ - at_ < 4) return "a header field is cut off";
    const size_t length = load32(begin_ + at_, message_.swapped);
    at_ += 4;
    if (end_ - at_ < length + 1) return "a header field is cut off";
    const std::string_view text(reinterpret_cast<const char*>(begin_ + at_), length);
    if (begin_[at_ + length] != 0) return "a header text is not terminated";
    at_ += length + 1;
    return takeText(static_cast<wire::Field>(code), text);
  }

  const char* takeText(wire::Field field, std::string_view text) {
    switch (field) {
      case wire::Field::path:
        message_.path = text;
        return text == wire::kSessionPath || wire::isValidObjectPath(text) ? nullptr
                                                                           : "the object path is not valid";
      case wire::Field::interface:
        message_.interface = text;
        return text == wire::kSessionInterface || wire::isValidInterfaceName(text)
                   ? nullptr
                   : "the interface is not valid";
      case wire::Field::member:
        message_.member = text;
        return wire::isValidMemberName(text) ? nullptr : "the member is not valid";
      case wire::Field::errorName:
        message_.errorName = text;
        return wire::isValidInterfaceName(text) ? nullptr : "the error name is not valid";
      case wire::Field::destination:
        message_.destination = text;
        return wire::isValidBusName(text) ? nullptr : "the destination is not valid";
      case wire::Field::sender:
        message_.sender = text;
        return wire::isValidBusName(text) ? nullptr : "the sender is not valid";
      default:
        return "a header field has the wrong type";
    }
  }

  // Fields that this version of the protocol does not know are ignored, but not unchecked.
  const char* skipUnknownField() {
    ++at_;
    BodyValidator validator({begin_, end_}, at_, message_.swapped);
    if (!validator.validate("v")) return "an unknown header field is malformed";
    at_ = validator.position();
    return nullptr;
  }

  const char* checkRequired() const {
    const auto has = [this](wire::Field field) {
      return (seen_ & (1u << static_cast<unsigned>(field))) != 0;
    };
    switch (message_.type) {
      case wire::MessageType::methodCall:
        return has(wire::Field::path) && has(wire::Field::member) ? nullptr
                                                                  : "a required header field is missing";
      case wire::MessageType::signal:
        return has(wire::Field::path) && has(wire::Field::interface) && has(wire::Field::member)
                   ? nullptr
                   : "a required header field is missing";
      case wire::MessageType::error:
        return has(wire::Field::errorName) && has(wire::Field::replySerial)
                   ? nullptr
                   : "a required header field is missing";
      case wire::MessageType::methodReturn:
        return has(wire::Field::replySerial) ? nullptr : "a required header field is missing";
    }
    return "the message type is not known";
  }

  const uint8_t* begin_;
  size_t at_, end_;
  Message& message_;
  unsigned seen_ = 0;
};

const char* parseHeader(const uint8_t* header, size_t end, Message& message) {
  return HeaderParser(header, wire::kFixedHeaderBytes, end, message).parse();
}

Frame malformed(const char* problem) {
  return {FrameStatus::malformed, 0, problem};
}

}  // namespace

const char* HeaderMemory::parse(const uint8_t* header, size_t end, Message& message) {
  // Where the fields begin. Before them flags, length of the body and serial may differ, order and type not.
  constexpr size_t kFields = 12;
  if (end > sizeof bytes_) return parseHeader(header, end, message);
  if (end != end_ || std::memcmp(header + kFields, bytes_ + kFields, end - kFields) != 0 ||
      message.type != message_.type || message.swapped != message_.swapped) {
    end_ = 0;
    message_ = message;
    std::memcpy(bytes_, header, end);
    if (const char* problem = parseHeader(bytes_, end, message_)) return problem;
    end_ = end;
  }
  message = message_;
  return nullptr;
}

Frame readMessage(std::span<const std::byte> bytes, uint64_t maxMessageBytes, Message& message,
                  HeaderMemory* memory) {
  if (bytes.size() < wire::kFixedHeaderBytes)
    return {FrameStatus::incomplete, wire::kFixedHeaderBytes, nullptr};
  const auto* begin = reinterpret_cast<const uint8_t*>(bytes.data());
  if (begin[0] != 'l' && begin[0] != 'B') return malformed("the byte order is not known");
  if (begin[1] == 0) return malformed("the message type is 0");
  if (begin[3] != wire::kProtocolVersion) return malformed("the protocol version is not 1");
  const bool swapped = (begin[0] == 'l') != kLittleEndianMachine;
  const uint64_t bodyLength = load32(begin + 4, swapped);
  const uint32_t serial = load32(begin + 8, swapped);
  const uint64_t fieldsLength = load32(begin + 12, swapped);
  if (serial == 0) return malformed("the serial is 0");
  const uint64_t fieldsEnd = wire::kFixedHeaderBytes + fieldsLength;
  const uint64_t bodyStart = (fieldsEnd + 7) & ~uint64_t{7};
  const uint64_t total = bodyStart + bodyLength;
  if (fieldsLength > wire::kMaxArrayBytes || total > wire::kMaxMessageBytes || total > maxMessageBytes) {
    return {FrameStatus::tooLong, 0, "the message is longer than the limit"};
  }
  if (bytes.size() < total) return {FrameStatus::incomplete, static_cast<size_t>(total), nullptr};

  for (uint64_t i = fieldsEnd; i < bodyStart; ++i) {
    if (begin[i] != 0) return malformed("header padding is not zero");
  }
  if (begin[1] > static_cast<uint8_t>(wire::MessageType::signal)) {
    return {FrameStatus::skip, static_cast<size_t>(total), nullptr};
  }
  message = Message{};
  message.type = static_cast<wire::MessageType>(begin[1]);
  message.swapped = swapped;
  const auto end = static_cast<size_t>(fieldsEnd);
  const char* problem =
      memory != nullptr ? memory->parse(begin, end, message) : parseHeader(begin, end, message);
  if (problem != nullptr) return malformed(problem);
  message.flags = begin[2];
  message.serial = serial;
  message.body = bytes.subspan(static_cast<size_t>(bodyStart), static_cast<size_t>(bodyLength));
  if (bodyLength != 0 && message.signature.empty()) return malformed("a body without a signature");
  return {FrameStatus::complete, static_cast<size_t>(total), nullptr};
}

}  // namespace kyt
