// The steps of reading a body: aligned numbers, texts, signatures, arrays' bounds. BodyReader and WireValues are made of
// them.
//
// Each returns false at the first failure and leaves its reason in the cursor, whose status every reader looks at first.
// They check bounds, zero padding and UTF-8 whatever the bytes are.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>

#include "platform/ipc/Wire.h"
#include "platform/ipc/WireText.h"

namespace kyt {

enum class BodyStatus : uint8_t { ok, invalidArguments, malformed };

// Where reading stands in a body.
struct WireCursor {
  const uint8_t* begin;
  const uint8_t* at;
  const uint8_t* end;
  bool swapped;
  BodyStatus status = BodyStatus::ok;
  const char* problem = nullptr;
};

namespace wire {

// On the road of every event: a call each for the few instructions of an aligned number would cost more than
// they do.
#define KYT_HOT [[gnu::always_inline]] inline

[[gnu::cold, gnu::noinline]] inline bool stop(WireCursor& c, BodyStatus status, const char* problem) {
  if (c.status == BodyStatus::ok) {
    c.status = status;
    c.problem = problem;
  }
  return false;
}
inline bool malformed(WireCursor& c, const char* problem) {
  return stop(c, BodyStatus::malformed, problem);
}
inline bool invalid(WireCursor& c, const char* problem) {
  return stop(c, BodyStatus::invalidArguments, problem);
}

inline size_t left(const WireCursor& c) {
  return static_cast<size_t>(c.end - c.at);
}

template <size_t kAlignment>
KYT_HOT bool align(WireCursor& c) {
  const size_t padding = static_cast<size_t>(c.begin - c.at) & (kAlignment - 1);
  if (padding == 0) return true;
  if (padding > left(c)) [[unlikely]]
    return malformed(c, "a value is cut off");
  uint8_t bits = 0;
  for (size_t i = 0; i < padding; ++i) bits |= c.at[i];
  if (bits != 0) [[unlikely]]
    return malformed(c, "padding is not zero");
  c.at += padding;
  return true;
}

inline uint16_t swap(uint16_t v) {
  return __builtin_bswap16(v);
}
inline uint32_t swap(uint32_t v) {
  return __builtin_bswap32(v);
}
inline uint64_t swap(uint64_t v) {
  return __builtin_bswap64(v);
}

template <typename T>
KYT_HOT T load(const uint8_t* at, bool swapped) {
  T value;
  std::memcpy(&value, at, sizeof value);
  return swapped ? swap(value) : value;
}

template <typename T>
KYT_HOT bool number(WireCursor& c, T& out) {
  if (!align<sizeof(T)>(c)) return false;
  if (left(c) < sizeof(T)) [[unlikely]]
    return malformed(c, "a value is cut off");
  out = load<T>(c.at, c.swapped);
  c.at += sizeof(T);
  return true;
}

KYT_HOT bool boolean(WireCursor& c, bool& out) {
  uint32_t value = 0;
  if (!number(c, value)) return false;
  if (value > 1) return malformed(c, "a boolean is neither 0 nor 1");
  out = value == 1;
  return true;
}

KYT_HOT bool text(WireCursor& c, std::string_view& out) {
  uint32_t length = 0;
  if (!number(c, length)) return false;
  if (left(c) <= length) [[unlikely]]
    return malformed(c, "a text is cut off");
  const std::string_view view(reinterpret_cast<const char*>(c.at), length);
  if (c.at[length] != 0) [[unlikely]]
    return malformed(c, "a text is not terminated");
  if (!wire::isValidText(view)) [[unlikely]]
    return malformed(c, "a text is not UTF-8");
  c.at += size_t{length} + 1;
  out = view;
  return true;
}

// The text of a signature, whose contents are not checked yet.
KYT_HOT bool signature(WireCursor& c, std::string_view& out) {
  if (left(c) < 2) [[unlikely]]
    return malformed(c, "a signature is cut off");
  const size_t length = c.at[0];
  if (left(c) < length + 2) [[unlikely]]
    return malformed(c, "a signature is cut off");
  if (c.at[length + 1] != 0) [[unlikely]]
    return malformed(c, "a signature is not terminated");
  out = {reinterpret_cast<const char*>(c.at + 1), length};
  c.at += length + 2;
  return true;
}

// Enters an array: `end` is where its elements stop.
template <size_t kElementAlignment>
KYT_HOT bool array(WireCursor& c, const uint8_t*& end) {
  uint32_t length = 0;
  if (!number(c, length)) return false;
  if (length > wire::kMaxArrayBytes) return malformed(c, "an array is longer than 64 MiB");
  if (!align<kElementAlignment>(c)) return false;
  if (left(c) < length) [[unlikely]]
    return malformed(c, "an array is cut off");
  end = c.at + length;
  return true;
}

inline bool endOfArray(WireCursor& c, const uint8_t* end) {
  return c.at == end || malformed(c, "an array's last element is longer than the array");
}

}  // namespace wire
}  // namespace kyt
