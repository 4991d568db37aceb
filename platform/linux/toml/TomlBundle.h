// A bundle: a folder with info.toml (`version = "8.0"`) and resources named NAME.TYPE. The version is read at
// construction and constant afterwards; only what the machine could not read then (no descriptor, no memory) is read
// when it is asked for. A resource is read each time that it is asked for: one that is put there later counts, and so
// does its replacement. A missing or bad info.toml means no version, a missing resource no resource: what that means is
// its user's to say. Any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/Bundle.h"
#include "platform/base/Mutex.h"
#include "platform/linux/files/Files.h"
#include "platform/queues/Log.h"

namespace kyt {

class TomlBundle final : public Bundle {
 public:
  static constexpr size_t kMaxResourceBytes = 1u << 20;

  TomlBundle(const std::string& folder, Log& log);
  [[nodiscard]] std::optional<String> version() override EXCLUDES(mutex_);
  // Logs what is there and cannot be read.
  [[nodiscard]] std::optional<Data> resource(std::string_view name, std::string_view type) override;

 private:
  void readVersion() REQUIRES(mutex_);
  // Logs it; whether to try again.
  [[nodiscard]] bool failed(const std::string& path, const ReadProblem& problem);

  const std::string folder_;
  Log& log_;
  Mutex mutex_;
  bool versionUnread_ GUARDED_BY(mutex_) = true;
  std::optional<String> version_ GUARDED_BY(mutex_);
};

}  // namespace kyt
