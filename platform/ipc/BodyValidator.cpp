#include "platform/ipc/BodyValidator.h"

#include <cstring>

#include "platform/base/Limits.h"
#include "platform/ipc/WireText.h"

namespace kyt {

bool BodyValidator::align(size_t alignment) {
  const size_t to = (at_ + alignment - 1) & ~(alignment - 1);
  if (to > bytes_.size()) return false;
  for (; at_ < to; ++at_) {
    if (bytes_[at_] != 0) return false;
  }
  return true;
}

bool BodyValidator::number(uint32_t& out) {
  if (!align(4) || left() < 4) return false;
  std::memcpy(&out, bytes_.data() + at_, 4);
  if (swapped_) out = __builtin_bswap32(out);
  at_ += 4;
  return true;
}

bool BodyValidator::fixed(size_t size) {
  if (!align(size) || left() < size) return false;
  at_ += size;
  return true;
}

bool BodyValidator::boolean() {
  uint32_t value = 0;
  return number(value) && value <= 1;
}

bool BodyValidator::text(bool isPath) {
  uint32_t length = 0;
  if (!number(length) || left() <= length) return false;
  const std::string_view content(reinterpret_cast<const char*>(bytes_.data() + at_), length);
  if (bytes_[at_ + length] != 0) return false;
  at_ += size_t{length} + 1;
  return isPath ? wire::isValidObjectPath(content) : wire::isValidText(content);
}

bool BodyValidator::signature(std::string_view& out) {
  if (left() < 1) return false;
  const size_t length = bytes_[at_];
  if (left() < length + 2) return false;
  out = {reinterpret_cast<const char*>(bytes_.data() + at_ + 1), length};
  if (bytes_[at_ + 1 + length] != 0) return false;
  at_ += length + 2;
  return true;
}

bool BodyValidator::variant(int depth) {
  std::string_view type;
  return depth < Limits::maxIPCDepth && signature(type) && wire::isValidSingleSignature(type) &&
         value(type, depth + 1);
}

bool BodyValidator::array(std::string_view type, int depth) {
  uint32_t length = 0;
  if (depth >= Limits::maxIPCDepth || !number(length) || length > wire::kMaxArrayBytes) return false;
  const std::string_view element = type.substr(1);
  if (!align(wire::alignmentOf(element[0])) || left() < length) return false;
  const size_t end = at_ + length;
  while (at_ < end) {
    if (!value(element, depth + 1)) return false;
  }
  return at_ == end;
}

bool BodyValidator::value(std::string_view type, int depth) {
  switch (type[0]) {
    case 'y':
      return fixed(1);
    case 'b':
      return boolean();
    case 's':
    case 'o':
      return text(type[0] == 'o');
    case 'g': {
      std::string_view ignored;
      return signature(ignored) && wire::isValidSignature(ignored);
    }
    case 'v':
      return variant(depth);
    case 'a':
      return array(type, depth);
    case '(':
    case '{':
      return depth < Limits::maxIPCDepth && align(8) && values(type.substr(1, type.size() - 2), depth + 1);
    default:
      return fixed(wire::alignmentOf(type[0]));
  }
}

bool BodyValidator::values(std::string_view signature, int depth) {
  while (!signature.empty()) {
    // A dictionary's entry is no complete type, so its key and value come here one by one.
    const size_t length = wire::firstTypeLength(signature);
    if (!value(signature.substr(0, length), depth)) return false;
    signature.remove_prefix(length);
  }
  return true;
}

bool validateBody(const Message& message) {
  const std::span body(reinterpret_cast<const uint8_t*>(message.body.data()), message.body.size());
  BodyValidator validator(body, 0, message.swapped);
  return validator.validate(message.signature) && validator.position() == body.size();
}

}  // namespace kyt
