// A bundle: a folder with info.toml (`version = "8.0"`) and resources named NAME.TYPE. All of it is read at
// construction and constant afterwards; only what the machine could not read then (no descriptor, no memory) is read
// when it is asked for. A missing or bad info.toml means no version, a missing resource no resource: what that means is
// its user's to say. Any thread.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Log.h"
#include "platform/Mutex.h"
#include "platform/System.h"
#include "platform/linux/system/Files.h"

namespace kyt {

class TomlBundle final : public Bundle {
 public:
  static constexpr size_t kMaxResourceBytes = 1u << 20;

  TomlBundle(const std::string& folder, Log& log);
  [[nodiscard]] std::optional<String> version() override EXCLUDES(mutex_);
  [[nodiscard]] std::optional<Data> resource(std::string_view name, std::string_view type) override
      EXCLUDES(mutex_);

 private:
  void readAgain() REQUIRES(mutex_);
  void readVersion() REQUIRES(mutex_);
  void readResources() REQUIRES(mutex_);
  // Logs it; whether to try again.
  [[nodiscard]] bool failed(const std::string& path, const ReadProblem& problem);

  const std::string folder_;
  Log& log_;
  Mutex mutex_;
  bool versionUnread_ GUARDED_BY(mutex_) = true, resourcesUnread_ GUARDED_BY(mutex_) = true;
  std::optional<String> version_ GUARDED_BY(mutex_);
  std::map<std::string, Data, std::less<>> resources_ GUARDED_BY(mutex_);  // by file name
};

}  // namespace kyt
