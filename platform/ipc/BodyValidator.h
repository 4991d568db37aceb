// Checks marshalled values against a signature without making objects of them: what an unknown header field
// holds, what follows where BodyReader stopped, and the bodies of calls that nobody reads. Slow beside
// BodyReader, and complete: every type of the protocol. Pure.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

#include "platform/ipc/MessageReader.h"

namespace kyt {

class BodyValidator {
 public:
  // `bytes` begin where alignment counts from; checking begins at `at`.
  BodyValidator(std::span<const uint8_t> bytes, size_t at, bool swapped)
      : bytes_(bytes), at_(at), swapped_(swapped) {}
  // Whether values of these types (a valid signature) come next; position() is after them.
  [[nodiscard]] bool validate(std::string_view signature) { return values(signature, 0); }
  [[nodiscard]] size_t position() const { return at_; }

 private:
  bool values(std::string_view signature, int depth);
  bool value(std::string_view type, int depth);
  bool array(std::string_view type, int depth);
  bool variant(int depth);
  bool text(bool isPath);
  bool signature(std::string_view& out);
  bool fixed(size_t size);
  bool boolean();
  bool align(size_t alignment);
  bool number(uint32_t& out);
  [[nodiscard]] size_t left() const { return bytes_.size() - at_; }

  std::span<const uint8_t> bytes_;
  size_t at_;
  bool swapped_;
};

// Whether the whole body is well formed by the message's own signature.
[[nodiscard]] bool validateBody(const Message& message);

}  // namespace kyt
