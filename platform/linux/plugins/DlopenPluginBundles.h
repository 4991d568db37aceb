// Plug-ins as shared objects, as <kytreporting/kytplugin.h> tells their writers: the bundle is a folder
// NAME.framework with NAME.so in it; a class and its operations are exported functions whose names begin with
// the class's.
//
// The shared object runs in the daemon, so it must belong to root or to the daemon's user and be writable by
// nobody else; otherwise it is refused with a line. What was loaded stays loaded. Any thread.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <string_view>

#include "platform/PluginBundle.h"
#include "platform/base/Mutex.h"

namespace kyt {

class Log;

class DlopenPluginBundles final : public PluginBundles {
 public:
  // `root` stands in front of every bundle's path.
  DlopenPluginBundles(std::string root, Log& log);
  ~DlopenPluginBundles() override;
  [[nodiscard]] std::shared_ptr<PluginBundle> bundleWithPath(std::string_view path) override EXCLUDES(mutex_);

 private:
  class LoadableBundle;
  const std::string root_;
  Log& log_;
  Mutex mutex_;
  std::map<std::string, std::shared_ptr<LoadableBundle>, std::less<>> bundles_ GUARDED_BY(mutex_);
};

}  // namespace kyt
