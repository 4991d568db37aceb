// A library of others that is loaded when something first needs it, not when the program starts: what libcurl
// brings along would be most of an idle daemon's memory. It stays loaded until the process ends, since libraries leave
// handlers behind that would be called after their code is gone.
//
// Used by the seams of such libraries; their tables hold the functions. A library that is missing or too old
// is a text for the log, never the end of the process.
#pragma once

#include <optional>
#include <string>

namespace kyt {

class SharedLibrary {
 public:
  // By its file's name, found as the dynamic linker finds it. Any thread; may read files.
  explicit SharedLibrary(const char* name);

  // Takes the function's address, or keeps the problem. The name must be that of a function of this type.
  template <typename Function>
  void resolve(Function*& function, const char* name) {
    function = reinterpret_cast<Function*>(address(name));
  }
  // What went wrong first; none: the library and all that was asked of it is there.
  [[nodiscard]] const std::optional<std::string>& problem() const { return problem_; }

 private:
  [[nodiscard]] void* address(const char* name);
  void* handle_;
  std::optional<std::string> problem_;
};

}  // namespace kyt
