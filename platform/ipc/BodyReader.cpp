#include "platform/ipc/BodyReader.h"

#include <bit>
#include <utility>

#include "platform/base/Limits.h"
#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/WireValues.h"

namespace kyt {

BodyReader::BodyReader(const Message& message)
    : message_(message),
      cursor_{reinterpret_cast<const uint8_t*>(message.body.data()),
              reinterpret_cast<const uint8_t*>(message.body.data()),
              reinterpret_cast<const uint8_t*>(message.body.data()) + message.body.size(), message.swapped} {}

bool BodyReader::hasSignature(std::string_view expected) {
  return message_.signature == expected ||
         wire::invalid(cursor_, "the arguments have other types than the method's");
}

bool BodyReader::readBoolean(bool& out) {
  return good() && wire::boolean(cursor_, out);
}

bool BodyReader::readUInt16(uint16_t& out) {
  return good() && wire::number(cursor_, out);
}

bool BodyReader::readUInt32(uint32_t& out) {
  return good() && wire::number(cursor_, out);
}

bool BodyReader::readUInt64(uint64_t& out) {
  return good() && wire::number(cursor_, out);
}

bool BodyReader::readInt32(int32_t& out) {
  uint32_t value = 0;
  if (!good() || !wire::number(cursor_, value)) return false;
  out = static_cast<int32_t>(value);
  return true;
}

bool BodyReader::readDouble(double& out) {
  uint64_t bits = 0;
  if (!good() || !wire::number(cursor_, bits)) return false;
  out = std::bit_cast<double>(bits);
  return true;
}

bool BodyReader::readStringView(std::string_view& out) {
  return good() && wire::text(cursor_, out);
}

bool BodyReader::readString(String& out) {
  std::string_view view;
  if (!readStringView(view)) return false;
  out = String(view);
  return true;
}

bool BodyReader::readData(Data& out) {
  if (!good()) return false;
  const Value value = wire::readBytes(cursor_, 0);
  if (!good()) return false;
  out = *value.data();
  return true;
}

bool BodyReader::readDictionary(Dictionary& out) {
  Dictionary entries;
  if (!good() || !wire::readEntries(cursor_, "v", entries, 0)) return false;
  out = std::move(entries);
  return true;
}

bool BodyReader::readOptionalDictionary(std::optional<Dictionary>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !wire::array<4>(cursor_, end)) return false;
  std::optional<Dictionary> result;
  if (cursor_.at < end) {
    if (!wire::readEntries(cursor_, "v", result.emplace(), 1) || !endOfOptional(end)) return false;
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readDictionaries(std::vector<Dictionary>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !wire::array<4>(cursor_, end)) return false;
  std::vector<Dictionary> result;
  while (cursor_.at < end)
    if (!wire::readEntries(cursor_, "v", result.emplace_back(), 1)) return false;
  if (!wire::endOfArray(cursor_, end)) return false;
  out = std::move(result);
  return true;
}

bool BodyReader::readStrings(std::vector<std::string>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !wire::array<4>(cursor_, end)) return false;
  std::vector<std::string> result;
  std::string_view text;
  while (cursor_.at < end) {
    if (!readStringView(text)) return false;
    result.emplace_back(text);
  }
  if (!wire::endOfArray(cursor_, end)) return false;
  out = std::move(result);
  return true;
}

bool BodyReader::readOptionalValue(Value& out) {
  const uint8_t* end = nullptr;
  if (!good() || !wire::array<1>(cursor_, end)) return false;
  Value result;
  if (cursor_.at < end) {
    result = wire::readVariant(cursor_, 1);
    if (!endOfOptional(end)) return false;
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readArray(Array& out) {
  Array result;
  if (!good() || !wire::readElements(cursor_, "v", result, 0)) return false;
  out = std::move(result);
  return true;
}

bool BodyReader::readOptionalStrings(std::optional<Array>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !wire::array<4>(cursor_, end)) return false;
  std::optional<Array> result;
  if (cursor_.at < end) {
    if (!wire::readElements(cursor_, "s", result.emplace(), 1) || !endOfOptional(end)) return false;
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readOptionalError(std::optional<Error>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !wire::array<8>(cursor_, end)) return false;
  std::optional<Error> result;
  if (cursor_.at < end) {
    std::string_view domain, description;
    int32_t code = 0;
    if (!readStringView(domain) || !readInt32(code) || !readStringView(description) || !endOfOptional(end))
      return false;
    result = Error{std::string(domain), code, std::string(description)};
  }
  out = std::move(result);
  return true;
}

bool BodyReader::readDescriptorIndexes(std::vector<uint32_t>& out) {
  const uint8_t* end = nullptr;
  if (!good() || !wire::array<4>(cursor_, end)) return false;
  std::vector<uint32_t> result;
  while (cursor_.at < end) {
    if (result.size() == Limits::maxDescriptorsPerMessage)
      return wire::invalid(cursor_, "too many descriptors are named");
    if (!wire::number(cursor_, result.emplace_back())) return false;
  }
  if (!wire::endOfArray(cursor_, end)) return false;
  out = std::move(result);
  return true;
}

bool BodyReader::endOfOptional(const uint8_t* end) {
  if (!good()) return false;
  if (cursor_.at < end)
    return wire::invalid(cursor_, "an argument that may be none has more than one element");
  return wire::endOfArray(cursor_, end);
}

void BodyReader::refuse(const char* problem) {
  wire::invalid(cursor_, problem);
}

BodyStatus BodyReader::finish() {
  if (cursor_.status == BodyStatus::ok && cursor_.at != cursor_.end) {
    wire::malformed(cursor_, "bytes follow the last argument");
  }
  if (cursor_.status == BodyStatus::invalidArguments && !validateBody(message_)) {
    cursor_.status = BodyStatus::malformed;
    cursor_.problem = "the body is malformed";
  }
  return cursor_.status;
}

}  // namespace kyt
