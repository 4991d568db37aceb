// From which level on lines are logged. Its own file, since settings name it too.
#pragma once

namespace kyt {

enum class LogLevel : int {
  debug = 0,
  normal = 1,  // "default" in settings and on the command line
  error = 2
};

}  // namespace kyt
