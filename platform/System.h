// Small services of the operating system: randomness, memory figures, bundles, the process transaction, the service
// class of a thread, and confinement.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace kyt {

// Any thread.
class RandomSource {
 public:
  virtual ~RandomSource() = default;
  // Uniform over 0 … bound-1. Precondition: bound > 0.
  [[nodiscard]] virtual uint32_t uniform(uint32_t bound) = 0;
  [[nodiscard]] virtual std::array<std::byte, 16> uuidBytes() = 0;  // a random (version 4) UUID
};
// "xxxxxxxx-xxxx-…", upper case, as identifiers are written everywhere here.
[[nodiscard]] std::string uuidText(const std::array<std::byte, 16>& bytes);
// With no line breaks.
[[nodiscard]] std::string base64(std::span<const std::byte> bytes);
// Characters outside the alphabet are ignored; none when what remains is no base64 (length, padding).
[[nodiscard]] std::optional<Data> base64Decode(std::string_view text);

// Any thread.
class MemoryInfo {
 public:
  virtual ~MemoryInfo() = default;
  // The allocator's size of a heap block; 0 for null.
  [[nodiscard]] virtual size_t blockSize(const void* block) = 0;
  // The process's anonymous memory in bytes; 0 when the query fails.
  [[nodiscard]] virtual uint64_t internalMemory() = 0;
};

// A bundle: a folder with info.toml, read at start-up, and resources, each read when it is asked for.
class Bundle {
 public:
  virtual ~Bundle() = default;
  [[nodiscard]] virtual std::optional<String> version() = 0;
  [[nodiscard]] virtual std::optional<Data> resource(std::string_view name, std::string_view type) = 0;
};

// Keeps the daemon from being ended as idle. begin() and end() alternate; called under the agent's monitor.
class ProcessTransaction {
 public:
  virtual ~ProcessTransaction() = default;
  virtual void begin() = 0;
  virtual void end() = 0;
};

// Entering the sandbox profile of that name. No value: confined. Otherwise the error's text; nothing else was set up.
class Confinement {
 public:
  virtual ~Confinement() = default;
  [[nodiscard]] virtual std::optional<std::string> enter(std::string_view profileName) = 0;
  // Once, when what only the start needs has been done: it is refused from now on. A value: an error's text.
  [[nodiscard]] virtual std::optional<std::string> endStart() = 0;
};

}  // namespace kyt
