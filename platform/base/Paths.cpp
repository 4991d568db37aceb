#include "platform/base/Paths.h"

namespace kyt {

Paths Paths::of(std::string_view root, std::string_view executableFolder) {
  const auto withoutSlashes = [](std::string_view path) {
    while (!path.empty() && path.back() == '/') path.remove_suffix(1);
    return path;
  };
  Paths paths;
  paths.root = withoutSlashes(root);
  if (!root.empty()) {
    paths.share = paths.root + "/usr/share";
  } else {
    const std::string_view folder = withoutSlashes(executableFolder);
    const size_t slash = folder.rfind('/');
    paths.share = std::string(slash == std::string_view::npos ? "" : folder.substr(0, slash)) + "/share";
  }
  return paths;
}

}  // namespace kyt
