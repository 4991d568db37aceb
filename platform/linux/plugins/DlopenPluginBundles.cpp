#include "platform/linux/plugins/DlopenPluginBundles.h"

#include <dlfcn.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <utility>

#include "platform/base/Blocking.h"
#include "platform/linux/files/Files.h"
#include "platform/queues/Gate.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

constexpr uint32_t kABI = 1;  // KYT_PLUGIN_ABI

// As kytplugin.h declares it.
struct PluginDictionary {
  const char* json;
  size_t length;
};
using New = void* (*)();
using Delete = void (*)(void* self);
using Describe = const char* (*)(void* self);
using Operation = void (*)(void* self, uint16_t method, uint16_t respCode,
                           const PluginDictionary* dictionary);

template <typename Symbol>
Symbol symbol(void* library, const std::string& name) {
  return reinterpret_cast<Symbol>(::dlsym(library, name.c_str()));
}

std::string operationSymbol(std::string_view className, std::string_view operation) {
  std::string name(className);
  name.append("_").append(operation);
  std::replace(name.begin(), name.end(), ':', '_');
  return name;
}

// Each call into a plug-in is announced as a wait: it may block, and that is to hold up its own session alone.
class LoadedObject final : public PluginObject {
 public:
  LoadedObject(void* library, std::string className, void* self)
      : library_(library), class_(std::move(className)), self_(self) {}
  ~LoadedObject() override {
    const BlockingScope blocking;
    if (const auto end = symbol<Delete>(library_, class_ + "_delete")) end(self_);
  }
  LoadedObject(const LoadedObject&) = delete;
  LoadedObject& operator=(const LoadedObject&) = delete;

  [[nodiscard]] bool respondsTo(std::string_view operation) const override {
    return find(operation) != nullptr;
  }
  void invoke(std::string_view operation, uint16_t method, uint16_t respCode,
              const Dictionary& dictionary) override {
    const std::string json = kyt::description(Value(dictionary));
    const PluginDictionary view = {json.c_str(), json.size()};
    const BlockingScope blocking;
    if (const Operation call = find(operation)) call(self_, method, respCode, &view);
  }
  [[nodiscard]] std::string description() const override {
    const auto describe = symbol<Describe>(library_, class_ + "_description");
    const BlockingScope blocking;
    const char* text = describe != nullptr ? describe(self_) : nullptr;
    return text != nullptr ? text : "<" + class_ + ">";
  }

 private:
  // Asked of the loader once for each name.
  [[nodiscard]] Operation find(std::string_view operation) const {
    if (operation != known_ || found_ == nullptr) {
      found_ = symbol<Operation>(library_, operationSymbol(class_, operation));
      known_ = operation;
    }
    return found_;
  }
  void* const library_;
  const std::string class_;
  void* const self_;
  mutable std::string known_;
  mutable Operation found_ = nullptr;
};

class LoadedClass final : public PluginClass {
 public:
  LoadedClass(void* library, std::string name, New make)
      : library_(library), name_(std::move(name)), make_(make) {}
  [[nodiscard]] std::unique_ptr<PluginObject> newInstance() override {
    const BlockingScope blocking;
    void* self = make_();
    if (self == nullptr) return nullptr;
    return std::make_unique<LoadedObject>(library_, name_, self);
  }

 private:
  void* const library_;
  const std::string name_;
  const New make_;
};

// Why the file may not be loaded, or nothing.
std::string objectionTo(const std::string& file) {
  struct stat status = {};
  if (::stat(file.c_str(), &status) != 0) return errorText(errno);
  if (!S_ISREG(status.st_mode)) return "is no regular file";
  if (status.st_uid != 0 && status.st_uid != ::geteuid()) return "belongs to another user";
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) return "can be written by others";
  return {};
}

}  // namespace

class DlopenPluginBundles::LoadableBundle final : public PluginBundle {
 public:
  LoadableBundle(std::string file, Log& log) : file_(std::move(file)), log_(log) {}

  [[nodiscard]] bool isLoaded() const override { return library_ != nullptr; }
  // The disk may be slow, and so may what the library does while it is loaded.
  bool load() override {
    if (isLoaded()) return true;
    const GateLock lock(loading_);
    if (isLoaded()) return true;
    const BlockingScope blocking;
    std::string objection = objectionTo(file_);
    if (objection.empty()) objection = open();
    if (objection.empty()) return true;
    log_.error("DlopenPluginBundles(load): Cannot load %s: %s", file_.c_str(), objection.c_str());
    return false;
  }
  [[nodiscard]] std::shared_ptr<PluginClass> classNamed(std::string_view name) override {
    void* const library = library_;
    if (library == nullptr) return nullptr;
    const auto make = symbol<New>(library, std::string(name) + "_new");
    if (make == nullptr) return nullptr;
    return std::make_shared<LoadedClass>(library, std::string(name), make);
  }

 private:
  std::string open() REQUIRES(loading_) {
    void* library = ::dlopen(file_.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (library == nullptr) {
      const char* text = ::dlerror();
      return text != nullptr ? text : "unknown";
    }
    const auto* abi = symbol<const uint32_t*>(library, "kyt_plugin_abi");
    if (abi == nullptr || *abi != kABI) {
      ::dlclose(library);
      return "was not built for this version of plug-ins (kyt_plugin_abi)";
    }
    library_ = library;
    return {};
  }

  const std::string file_;
  Log& log_;
  Gate loading_;
  std::atomic<void*> library_{nullptr};  // set once, by who is in the gate
};

DlopenPluginBundles::DlopenPluginBundles(std::string root, Log& log) : root_(std::move(root)), log_(log) {}

DlopenPluginBundles::~DlopenPluginBundles() = default;

std::shared_ptr<PluginBundle> DlopenPluginBundles::bundleWithPath(std::string_view path) {
  const std::string folder = root_ + std::string(path);
  std::string name = folder.substr(folder.rfind('/') + 1);
  name = name.substr(0, name.rfind('.'));
  const std::string file = folder + "/" + name + ".so";
  {
    MutexLock lock(mutex_);
    const auto known = bundles_.find(file);
    if (known != bundles_.end()) return known->second;
  }
  {
    const BlockingScope blocking;
    if (::access(file.c_str(), F_OK) != 0) return nullptr;
  }
  auto bundle = std::make_shared<LoadableBundle>(file, log_);
  MutexLock lock(mutex_);
  return bundles_.emplace(file, std::move(bundle)).first->second;  // the first of several that looked for it
}

}  // namespace kyt
