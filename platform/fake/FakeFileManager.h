// Files in memory, with faults. A folder is there once it was made or something was put beneath it. Time
// comes from the clock given. Any thread.
#pragma once

#include <functional>
#include <map>
#include <set>
#include <string>
#include <utility>

#include "platform/FileManager.h"
#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"

namespace kyt {

class FakeFileManager final : public FileManager {
 public:
  struct File {
    std::string bytes;
    std::optional<Date> creationDate;
    bool isRegularFile = true;
  };
  // What fails from now on, each with the error's number 5.
  struct Faults {
    bool list = false;
    bool createDirectory = false;
    bool createFile = false;
    bool append = false;
    bool remove = false;
  };
  explicit FakeFileManager(const Clock& clock) : clock_(clock) {}

  void put(const std::string& path, File file) EXCLUDES(mutex_);
  void setFaults(Faults faults) EXCLUDES(mutex_);
  // Called by whoever appends, before that: what another does in between. Set before anybody writes.
  void setBeforeAppend(std::function<void()> beforeAppend) { beforeAppend_ = std::move(beforeAppend); }
  [[nodiscard]] std::map<std::string, File> files() const EXCLUDES(mutex_);  // by path
  [[nodiscard]] bool hasFolder(const std::string& path) const EXCLUDES(mutex_);

  [[nodiscard]] std::variant<std::vector<std::string>, Error> contentsOfDirectory(
      const std::string& path) override EXCLUDES(mutex_);
  [[nodiscard]] std::optional<FileAttributes> attributesOfItem(const std::string& path) override
      EXCLUDES(mutex_);
  [[nodiscard]] std::optional<Error> createDirectory(const std::string& path) override EXCLUDES(mutex_);
  [[nodiscard]] std::optional<Error> createFile(const std::string& path) override EXCLUDES(mutex_);
  [[nodiscard]] std::optional<Error> append(const std::string& path, std::string_view bytes) override
      EXCLUDES(mutex_);
  [[nodiscard]] std::optional<Error> removeItem(const std::string& path) override EXCLUDES(mutex_);

 private:
  void addFolders(std::string path) REQUIRES(mutex_);

  const Clock& clock_;
  std::function<void()> beforeAppend_;
  mutable Mutex mutex_;
  std::map<std::string, File> files_ GUARDED_BY(mutex_);
  std::set<std::string> folders_ GUARDED_BY(mutex_);
  Faults faults_ GUARDED_BY(mutex_);
};

}  // namespace kyt
