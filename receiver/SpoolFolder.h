// The spool's folder, for this process alone until the object ends. One thread at a time.
#pragma once

#include <optional>
#include <string>
#include <utility>

#include "platform/linux/base/Descriptors.h"

namespace kyt::receiver {

class SpoolFolder {
 public:
  explicit SpoolFolder(std::string folder) : folder_(std::move(folder)) {}

  // What keeps it from being ours, or none. May be tried again, also where isOurs() no longer holds.
  [[nodiscard]] std::optional<std::string> take();
  // Another process has it.
  [[nodiscard]] bool isTaken() const { return isTaken_; }
  // It was taken, and nobody has removed it since or put another in its place.
  [[nodiscard]] bool isOurs() const;

 private:
  const std::string folder_;
  Descriptor lock_;
  bool isTaken_ = false;
};

}  // namespace kyt::receiver
