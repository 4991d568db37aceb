// Plug-ins: a bundle at a path, a class in it by name, an object of the class, and operations by name. Used by
// the back end for the diagnostics adaptor. Everything may be missing, which is answered and never fatal.
//
// Any thread; one object is used by one thread at a time. Loading and calling may block as long as the
// plug-in's code does.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "platform/objects/Value.h"

namespace kyt {

class PluginObject {
 public:
  virtual ~PluginObject() = default;
  [[nodiscard]] virtual bool respondsTo(std::string_view operation) const = 0;
  // Precondition: respondsTo(operation).
  virtual void invoke(std::string_view operation, uint16_t method, uint16_t respCode,
                      const Dictionary& dictionary) = 0;
  [[nodiscard]] virtual std::string description() const = 0;
};

class PluginClass {
 public:
  virtual ~PluginClass() = default;
  // With the class's plain initialiser; null when that makes none. The class outlives its objects.
  [[nodiscard]] virtual std::unique_ptr<PluginObject> newInstance() = 0;
};

class PluginBundle {
 public:
  virtual ~PluginBundle() = default;
  [[nodiscard]] virtual bool isLoaded() const = 0;
  // Once loaded, code stays for the life of the process.
  virtual bool load() = 0;
  // Null when the bundle is not loaded or has no such class.
  [[nodiscard]] virtual std::shared_ptr<PluginClass> classNamed(std::string_view name) = 0;
};

class PluginBundles {
 public:
  virtual ~PluginBundles() = default;
  // Null when there is none.
  [[nodiscard]] virtual std::shared_ptr<PluginBundle> bundleWithPath(std::string_view path) = 0;
};

}  // namespace kyt
