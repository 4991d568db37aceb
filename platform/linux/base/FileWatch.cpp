#include "platform/linux/base/FileWatch.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <cstring>
#include <utility>

namespace kyt {

FileWatch::FileWatch(Reactor& reactor, const std::string& folder, std::string name, Function<void()> changed)
    : name_(std::move(name)),
      changed_(std::move(changed)),
      events_(ownDescriptor(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK))) {
  constexpr uint32_t kChanges = IN_CLOSE_WRITE | IN_MODIFY | IN_MOVED_FROM | IN_MOVED_TO | IN_CREATE |
                                IN_DELETE | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
  if (events_.get() < 0 || ::inotify_add_watch(events_.get(), folder.c_str(), kChanges) < 0) return;
  watch_ = reactor.watch(events_.get(), ready::readable, [this](unsigned) { read(); });
}

void FileWatch::read() {
  alignas(inotify_event) char bytes[4096];
  bool isMeant = false;
  for (ssize_t size = 0; (size = ::read(events_.get(), bytes, sizeof bytes)) > 0;) {
    for (ssize_t at = 0; at < size;) {
      inotify_event event{};
      std::memcpy(&event, bytes + at, sizeof event);
      const char* name =
          event.len != 0 ? bytes + at + sizeof event : "";  // none: the folder itself, or events were lost
      isMeant = isMeant || *name == '\0' || name_ == name;
      at += static_cast<ssize_t>(sizeof event + event.len);
    }
  }
  if (isMeant) changed_();
}

}  // namespace kyt
