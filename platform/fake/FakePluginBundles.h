// A plug-in bundle made of a test's own wishes: whether it is there, its one class, the operations its objects
// know, and what was called. One thread at a time.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/PluginBundle.h"

namespace kyt {

class FakePluginBundles final : public PluginBundles {
 public:
  struct Call {
    std::string operation;
    uint16_t method, respCode;
    Dictionary dictionary;
  };
  struct State {
    std::string className = "QDXAdaptor";
    std::vector<std::string> operations = {"sendMessageWithMethod:respCode:dict:"};
    bool loads = true, initialises = true;
    bool loaded = false;
    int loadCalls = 0, instances = 0;
    std::vector<Call> calls;
  };
  bool present = false;
  std::vector<std::string> paths;  // that were asked for
  const std::shared_ptr<State> state = std::make_shared<State>();

  [[nodiscard]] std::shared_ptr<PluginBundle> bundleWithPath(std::string_view path) override {
    paths.emplace_back(path);
    if (!present) return nullptr;
    return std::make_shared<FakeBundle>(state);
  }

 private:
  class Object final : public PluginObject {
   public:
    explicit Object(std::shared_ptr<State> state) : state_(std::move(state)) { ++state_->instances; }
    ~Object() override { --state_->instances; }
    [[nodiscard]] bool respondsTo(std::string_view operation) const override {
      for (const std::string& known : state_->operations)
        if (known == operation) return true;
      return false;
    }
    void invoke(std::string_view operation, uint16_t method, uint16_t respCode,
                const Dictionary& dictionary) override {
      state_->calls.push_back({std::string(operation), method, respCode, dictionary});
    }
    [[nodiscard]] std::string description() const override { return "<" + state_->className + ">"; }

   private:
    const std::shared_ptr<State> state_;
  };
  class Class final : public PluginClass {
   public:
    explicit Class(std::shared_ptr<State> state) : state_(std::move(state)) {}
    [[nodiscard]] std::unique_ptr<PluginObject> newInstance() override {
      if (!state_->initialises) return nullptr;
      return std::make_unique<Object>(state_);
    }

   private:
    const std::shared_ptr<State> state_;
  };
  class FakeBundle final : public PluginBundle {
   public:
    explicit FakeBundle(std::shared_ptr<State> state) : state_(std::move(state)) {}
    [[nodiscard]] bool isLoaded() const override { return state_->loaded; }
    bool load() override {
      ++state_->loadCalls;
      return state_->loaded = state_->loads;
    }
    [[nodiscard]] std::shared_ptr<PluginClass> classNamed(std::string_view name) override {
      if (!state_->loaded || name != state_->className) return nullptr;
      return std::make_shared<Class>(state_);
    }

   private:
    const std::shared_ptr<State> state_;
  };
};

}  // namespace kyt
