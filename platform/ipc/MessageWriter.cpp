#include "platform/ipc/MessageWriter.h"

#include <bit>
#include <cstring>

#include "platform/base/Limits.h"
#include "platform/ipc/WireText.h"

namespace kyt {
namespace {

constexpr char kByteOrder = std::endian::native == std::endian::little ? 'l' : 'B';

}  // namespace

void MessageWriter::align(size_t alignment) {
  const size_t padding = (start_ - out_.size()) & (alignment - 1);
  if (padding != 0) out_.append(padding, '\0');
}

void MessageWriter::put32(uint32_t value) {
  char bytes[8] = {};
  const size_t padding = (start_ - out_.size()) & 3;
  std::memcpy(bytes + padding, &value, 4);
  out_.append(bytes, padding + 4);
}

void MessageWriter::put64(uint64_t value) {
  align(8);
  out_.append(reinterpret_cast<const char*>(&value), 8);
}

void MessageWriter::putSignature(std::string_view signature) {
  out_.push_back(static_cast<char>(signature.size()));
  out_.append(signature);
  out_.push_back('\0');
}

void MessageWriter::begin(wire::MessageType type, uint8_t flags, uint32_t serial) {
  start_ = out_.size();
  failed_ = false;
  const char fixed[4] = {kByteOrder, static_cast<char>(type), static_cast<char>(flags),
                         static_cast<char>(wire::kProtocolVersion)};
  out_.append(fixed, 4);
  put32(0);  // the body's length, known at the end
  put32(serial);
  put32(0);  // the length of the fields
  fieldsStart_ = out_.size();
}

void MessageWriter::endHeader() {
  const auto length = static_cast<uint32_t>(out_.size() - fieldsStart_);
  std::memcpy(out_.data() + fieldsStart_ - 4, &length, 4);
  align(8);
  bodyStart_ = out_.size();
}

void MessageWriter::fieldText(wire::Field field, char type, std::string_view text) {
  if (text.empty()) return;
  align(8);
  const char lead[4] = {static_cast<char>(field), 1, type, 0};
  out_.append(lead, 4);
  if (type == 'g') {
    putSignature(text);
    return;
  }
  put32(static_cast<uint32_t>(text.size()));
  out_.append(text);
  out_.push_back('\0');
}

void MessageWriter::fieldNumber(wire::Field field, uint32_t value) {
  align(8);
  const char lead[4] = {static_cast<char>(field), 1, 'u', 0};
  out_.append(lead, 4);
  put32(value);
}

void MessageWriter::beginCall(uint32_t serial, const Call& call) {
  begin(wire::MessageType::methodCall, call.expectsReply ? 0 : wire::kNoReplyExpected, serial);
  fieldText(wire::Field::path, 'o', call.path);
  fieldText(wire::Field::interface, 's', call.interface);
  fieldText(wire::Field::member, 's', call.member);
  fieldText(wire::Field::destination, 's', call.destination);
  fieldText(wire::Field::signature, 'g', call.signature);
  if (call.unixFds != 0) fieldNumber(wire::Field::unixFds, call.unixFds);
  endHeader();
}

void MessageWriter::beginReply(uint32_t serial, uint32_t replySerial, std::string_view signature,
                               std::string_view destination, std::string_view sender) {
  begin(wire::MessageType::methodReturn, wire::kNoReplyExpected, serial);
  fieldNumber(wire::Field::replySerial, replySerial);
  fieldText(wire::Field::destination, 's', destination);
  fieldText(wire::Field::sender, 's', sender);
  fieldText(wire::Field::signature, 'g', signature);
  endHeader();
}

bool MessageWriter::writeError(uint32_t serial, uint32_t replySerial, std::string_view errorName,
                               std::string_view text, std::string_view destination, std::string_view sender) {
  begin(wire::MessageType::error, wire::kNoReplyExpected, serial);
  fieldText(wire::Field::errorName, 's', errorName);
  fieldNumber(wire::Field::replySerial, replySerial);
  fieldText(wire::Field::destination, 's', destination);
  fieldText(wire::Field::sender, 's', sender);
  fieldText(wire::Field::signature, 'g', "s");
  endHeader();
  writeString(text);
  return end();
}

bool MessageWriter::end() {
  const size_t body = out_.size() - bodyStart_;
  if (failed_ || out_.size() - start_ > maxMessageBytes_) {
    out_.resize(start_);
    return false;
  }
  const auto length = static_cast<uint32_t>(body);
  std::memcpy(out_.data() + start_ + 4, &length, 4);
  return true;
}

void MessageWriter::writeBoolean(bool value) {
  put32(value ? 1 : 0);
}

void MessageWriter::writeUInt16(uint16_t value) {
  align(2);
  out_.append(reinterpret_cast<const char*>(&value), 2);
}

void MessageWriter::writeInt32(int32_t value) {
  put32(static_cast<uint32_t>(value));
}

void MessageWriter::writeUInt32(uint32_t value) {
  put32(value);
}

void MessageWriter::writeDouble(double value) {
  put64(std::bit_cast<uint64_t>(value));
}

void MessageWriter::writeString(std::string_view text) {
  put32(static_cast<uint32_t>(text.size()));
  const size_t contents = out_.size();
  wire::appendValidText(text, out_);
  const size_t written = out_.size() - contents;
  if (written != text.size()) {
    const auto length = static_cast<uint32_t>(written);
    std::memcpy(out_.data() + contents - 4, &length, 4);
  }
  out_.push_back('\0');
}

void MessageWriter::writeData(std::span<const std::byte> bytes) {
  if (bytes.size() > wire::kMaxArrayBytes) {
    failed_ = true;
    return;
  }
  put32(static_cast<uint32_t>(bytes.size()));
  out_.append(reinterpret_cast<const char*>(bytes.data()), bytes.size());
}

MessageWriter::ArrayMark MessageWriter::beginArray(size_t elementAlignment) {
  put32(0);
  const size_t lengthAt = out_.size() - 4;
  align(elementAlignment);
  return {lengthAt, out_.size()};
}

void MessageWriter::endArray(const ArrayMark& mark) {
  const size_t bytes = out_.size() - mark.firstElement;
  if (bytes > wire::kMaxArrayBytes) failed_ = true;
  const auto length = static_cast<uint32_t>(bytes);
  std::memcpy(out_.data() + mark.lengthAt, &length, 4);
}

void MessageWriter::writeEntries(const Dictionary& dictionary, int depth) {
  if (depth + 2 > Limits::maxIPCDepth) {
    failed_ = true;
    return;
  }
  const ArrayMark mark = beginArray(8);
  for (const DictionaryEntry& entry : dictionary) {
    if (entry.value.isNull()) continue;
    align(8);
    writeString(entry.key);
    writeVariant(entry.value, depth + 2);
  }
  endArray(mark);
}

void MessageWriter::writeElements(const Array& array, int depth) {
  if (depth + 1 > Limits::maxIPCDepth) {
    failed_ = true;
    return;
  }
  const ArrayMark mark = beginArray(1);
  for (const Value& value : array) {
    if (!value.isNull()) writeVariant(value, depth + 1);
  }
  endArray(mark);
}

void MessageWriter::writeVariant(const Value& value, int depth) {
  if (depth + 1 > Limits::maxIPCDepth) failed_ = true;
  if (failed_) return;
  switch (value.kind()) {
    case Value::Kind::null:
      break;
    case Value::Kind::boolean:
      out_.append("\1b\0", 3);
      writeBoolean(*value.boolean());
      break;
    case Value::Kind::integer:
      out_.append("\1x\0", 3);
      put64(static_cast<uint64_t>(*value.integer()));
      break;
    case Value::Kind::unsignedInteger:
      out_.append("\1t\0", 3);
      put64(*value.unsignedInteger());
      break;
    case Value::Kind::real:
      out_.append("\1d\0", 3);
      writeDouble(*value.real());
      break;
    case Value::Kind::date:
      out_.append("\3(d)\0", 5);
      if (depth + 2 > Limits::maxIPCDepth) failed_ = true;
      writeDouble(value.date()->secondsSince1970);
      break;
    case Value::Kind::string:
      out_.append("\1s\0", 3);
      writeString(*value.string());
      break;
    case Value::Kind::data:
      out_.append("\2ay\0", 4);
      if (depth + 2 > Limits::maxIPCDepth) failed_ = true;
      writeData(value.data()->bytes());
      break;
    case Value::Kind::array:
      out_.append("\2av\0", 4);
      writeElements(*value.array(), depth + 1);
      break;
    case Value::Kind::dictionary:
      out_.append("\5a{sv}\0", 7);
      writeEntries(*value.dictionary(), depth + 1);
      break;
  }
}

void MessageWriter::writeDictionary(const Dictionary& dictionary) {
  writeEntries(dictionary, 0);
}

void MessageWriter::writeEmptyDictionary() {
  endArray(beginArray(8));
}

void MessageWriter::writeOptionalDictionary(const std::optional<Dictionary>& value) {
  const ArrayMark mark = beginArray(4);
  if (value) writeEntries(*value, 1);
  endArray(mark);
}

void MessageWriter::writeOptionalValue(const Value& value) {
  const ArrayMark mark = beginArray(1);
  if (!value.isNull()) writeVariant(value, 1);
  endArray(mark);
}

void MessageWriter::writeArray(const Array& array) {
  writeElements(array, 0);
}

void MessageWriter::writeOptionalStrings(const std::optional<Array>& strings) {
  const ArrayMark mark = beginArray(4);
  if (strings) {
    const ArrayMark inner = beginArray(4);
    for (const Value& value : *strings) {
      if (const String* string = value.string()) writeString(*string);
    }
    endArray(inner);
  }
  endArray(mark);
}

void MessageWriter::writeOptionalError(const std::optional<Error>& error) {
  const ArrayMark mark = beginArray(8);
  if (error) {
    writeString(error->domain);
    writeInt32(error->code);
    writeString(error->localizedDescription);
  }
  endArray(mark);
}

void MessageWriter::writeDescriptorIndexes(uint32_t count) {
  const ArrayMark mark = beginArray(4);
  for (uint32_t i = 0; i < count; ++i) put32(i);
  endArray(mark);
}

}  // namespace kyt
