#include "platform/linux/base/SharedLibrary.h"

#include <dlfcn.h>

namespace kyt {
namespace {

std::string lastProblem() {
  const char* text = dlerror();
  return text != nullptr ? text : "the dynamic linker gives no reason";
}

}  // namespace

SharedLibrary::SharedLibrary(const char* name)
    : handle_(dlopen(name, RTLD_NOW | RTLD_LOCAL | RTLD_NODELETE)) {
  if (handle_ == nullptr) problem_ = lastProblem();
}

void* SharedLibrary::address(const char* name) {
  if (problem_) return nullptr;
  void* found = dlsym(handle_, name);
  if (found == nullptr) problem_ = lastProblem();
  return found;
}

}  // namespace kyt
