// A client's file in memory, as a test describes it, and what became of it. Any thread.
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/FileExtension.h"

namespace kyt {

class FakeFileExtensions final : public FileExtensions {
 public:
  // Set before use.
  bool grants = true;  // whether tokens are worth anything
  bool regular = true;
  bool readable = true;
  bool roomForMore = true;  // for this user
  bool removable = true;
  std::string contents = "contents";

  // What happened.
  std::vector<std::string> tokens, removed;
  std::atomic<int> held{0};  // accesses that are not released yet
  uint64_t heldBytes = 0;    // that the last access said

  [[nodiscard]] std::unique_ptr<FileAccess> consume(std::string_view token,
                                                    std::optional<FileExtension>) override {
    tokens.emplace_back(token);
    if (!grants || token.empty()) return nullptr;
    return std::make_unique<Access>(*this);
  }

 private:
  class Access final : public FileAccess {
   public:
    explicit Access(FakeFileExtensions& file) : file_(file) { ++file_.held; }
    ~Access() override { --file_.held; }
    [[nodiscard]] bool isReadableRegularFile() override { return file_.regular; }
    [[nodiscard]] std::variant<Data, FileReadError> readWhole(uint64_t maxBytes) override {
      if (!file_.readable) return FileReadError::failed;
      if (file_.contents.size() > maxBytes) return FileReadError::tooLarge;
      if (!file_.roomForMore) return FileReadError::tooMuchAtOnce;
      return Data(std::string_view(file_.contents));
    }
    void holdsOnly(uint64_t bytes) override { file_.heldBytes = bytes; }
    [[nodiscard]] bool remove(std::string_view name) override {
      file_.removed.emplace_back(name);
      return file_.removable;
    }

   private:
    FakeFileExtensions& file_;
  };
};

}  // namespace kyt
