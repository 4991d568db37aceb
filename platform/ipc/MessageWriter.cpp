#include "platform/ipc/MessageWriter.h"

#include <bit>
#include <cstring>

#include "platform/base/Limits.h"
#include "platform/ipc/WireText.h"

namespace kyt {
namespace {

constexpr char kByteOrder = std::endian::native == std::endian::little ? 'l' : 'B';
constexpr size_t kSerialAt = 8;

// A few bytes of a message, put together before they are appended at once: on the road of every event an append for each
// part of an entry would cost more than the parts do.
class Piece {
 public:
  static constexpr size_t kMaxText = 48;

  // `offset` is where the piece goes, from the beginning of its message.
  explicit Piece(size_t offset) : offset_(offset) {}
  void align(size_t alignment) {
    const size_t padding = (0 - offset_ - size_) & (alignment - 1);
    std::memset(bytes_ + size_, 0, 8);
    size_ += padding;
  }
  // A signature of one type: its length, its character and a NUL.
  void signature(char type) {
    const char bytes[3] = {1, type, 0};
    put(bytes, sizeof bytes);
  }
  template <typename Number>
  void number(Number value) {
    align(sizeof value);
    put(&value, sizeof value);
  }
  // Of at most kMaxText bytes.
  void string(std::string_view text) {
    number(static_cast<uint32_t>(text.size()));
    put(text.data(), text.size());
    bytes_[size_++] = '\0';
  }
  [[nodiscard]] std::string_view view() const { return {bytes_, size_}; }

 private:
  void put(const void* from, size_t size) {
    std::memcpy(bytes_ + size_, from, size);
    size_ += size;
  }
  const size_t offset_;
  size_t size_ = 0;
  char bytes_[2 * kMaxText + 48];
};

std::span<const DictionaryEntry> entriesOf(const Dictionary& dictionary) {
  return {dictionary.begin(), dictionary.end()};
}

bool isShortText(std::string_view text) {
  return text.size() <= Piece::kMaxText && wire::isPlainText(text);
}

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

std::string MessageWriter::prepare(const Call& call) {
  std::string header;
  MessageWriter(header).beginCall(0, call);
  return header;
}

void MessageWriter::beginCall(uint32_t serial, std::string_view prepared) {
  start_ = out_.size();
  failed_ = false;
  out_.append(prepared);
  std::memcpy(out_.data() + start_ + kSerialAt, &serial, sizeof serial);
  bodyStart_ = out_.size();
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

void MessageWriter::beginSignal(uint32_t serial, std::string_view path, std::string_view interface,
                                std::string_view member, std::string_view signature) {
  begin(wire::MessageType::signal, wire::kNoReplyExpected, serial);
  fieldText(wire::Field::path, 'o', path);
  fieldText(wire::Field::interface, 's', interface);
  fieldText(wire::Field::member, 's', member);
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

void MessageWriter::writeUInt64(uint64_t value) {
  put64(value);
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

void MessageWriter::writeEntries(std::span<const DictionaryEntry> entries, int depth) {
  if (depth + 2 > Limits::maxIPCDepth) {
    failed_ = true;
    return;
  }
  const ArrayMark mark = beginArray(8);
  for (const DictionaryEntry& entry : entries) {
    if (entry.value.isNull() || writeShortEntry(entry, depth + 2)) continue;
    align(8);
    writeString(entry.key);
    writeVariant(entry.value, depth + 2);
  }
  endArray(mark);
}

// False, and nothing is written: one for the general way.
bool MessageWriter::writeShortEntry(const DictionaryEntry& entry, int depth) {
  const std::string_view key = entry.key.view();
  if (depth + 1 > Limits::maxIPCDepth || !isShortText(key)) return false;
  Piece piece(out_.size() - start_);
  piece.align(8);
  piece.string(key);
  switch (entry.value.kind()) {
    case Value::Kind::boolean:
      piece.signature('b');
      piece.number(uint32_t{*entry.value.boolean()});
      break;
    case Value::Kind::integer:
      piece.signature('x');
      piece.number(*entry.value.integer());
      break;
    case Value::Kind::unsignedInteger:
      piece.signature('t');
      piece.number(*entry.value.unsignedInteger());
      break;
    case Value::Kind::real:
      piece.signature('d');
      piece.number(*entry.value.real());
      break;
    case Value::Kind::string:
      if (!isShortText(entry.value.string()->view())) return false;
      piece.signature('s');
      piece.string(entry.value.string()->view());
      break;
    default:
      return false;
  }
  out_.append(piece.view());
  return true;
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
      writeEntries(entriesOf(*value.dictionary()), depth + 1);
      break;
  }
}

void MessageWriter::writeDictionary(const Dictionary& dictionary) {
  writeEntries(entriesOf(dictionary), 0);
}

void MessageWriter::writeDictionary(std::span<const DictionaryEntry> entries) {
  writeEntries(entries, 0);
}

void MessageWriter::writeEmptyDictionary() {
  endArray(beginArray(8));
}

void MessageWriter::writeOptionalDictionary(const std::optional<Dictionary>& value) {
  const ArrayMark mark = beginArray(4);
  if (value) writeEntries(entriesOf(*value), 1);
  endArray(mark);
}

void MessageWriter::writeDictionaries(std::span<const Dictionary> dictionaries) {
  const ArrayMark mark = beginArray(4);
  for (const Dictionary& dictionary : dictionaries) writeEntries(entriesOf(dictionary), 1);
  endArray(mark);
}

void MessageWriter::writeStrings(std::span<const std::string> strings) {
  const ArrayMark mark = beginArray(4);
  for (const std::string& string : strings) writeString(string);
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
