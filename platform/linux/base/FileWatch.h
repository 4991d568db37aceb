// Tells when a file is written, made, replaced or removed: the kernel's events of its folder (inotify). Used for the owner's
// consent, where something must happen at once when that goes. Where the kernel refuses them nothing is told, so whoever must
// know looks by himself now and then.
#pragma once

#include <string>

#include "platform/Reactor.h"
#include "platform/base/Function.h"
#include "platform/linux/base/Descriptors.h"

namespace kyt {

class FileWatch {
 public:
  // `changed` runs on the reactor's thread, perhaps several times for one change, and must not block.
  FileWatch(Reactor& reactor, const std::string& folder, std::string name, Function<void()> changed);
  [[nodiscard]] bool isWatching() const { return static_cast<bool>(watch_); }

 private:
  void read();

  const std::string name_;
  Function<void()> changed_;
  const Descriptor events_;
  Watch watch_;  // ends before what its handler uses
};

}  // namespace kyt
