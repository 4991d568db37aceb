#include "platform/fake/FakeFileManager.h"

namespace kyt {

namespace {

Error fault() {
  return Error{kKYTFileErrorDomain, 5, "Input/output error"};
}

Error missing() {
  return Error{kKYTFileErrorDomain, kFileErrorNoSuchFile, "No such file or directory"};
}

std::string folderOfPath(const std::string& path) {
  return path.substr(0, path.rfind('/'));
}

}  // namespace

void FakeFileManager::addFolders(std::string path) {
  for (; !path.empty(); path = folderOfPath(path)) folders_.insert(path);
}

void FakeFileManager::put(const std::string& path, File file) {
  MutexLock lock(mutex_);
  addFolders(folderOfPath(path));
  files_[path] = std::move(file);
}

void FakeFileManager::setFaults(Faults faults) {
  MutexLock lock(mutex_);
  faults_ = faults;
}

std::map<std::string, FakeFileManager::File> FakeFileManager::files() const {
  MutexLock lock(mutex_);
  return files_;
}

bool FakeFileManager::hasFolder(const std::string& path) const {
  MutexLock lock(mutex_);
  return folders_.count(path) != 0;
}

std::variant<std::vector<std::string>, Error> FakeFileManager::contentsOfDirectory(const std::string& path) {
  MutexLock lock(mutex_);
  if (faults_.list) return fault();
  if (folders_.count(path) == 0) return missing();
  std::vector<std::string> names;
  for (const auto& [name, file] : files_)
    if (folderOfPath(name) == path) names.push_back(name.substr(path.size() + 1));
  return names;
}

std::optional<FileAttributes> FakeFileManager::attributesOfItem(const std::string& path) {
  MutexLock lock(mutex_);
  if (folders_.count(path) != 0) return FileAttributes{};
  const auto found = files_.find(path);
  if (found == files_.end()) return std::nullopt;
  return FileAttributes{found->second.isRegularFile, found->second.creationDate, found->second.bytes.size()};
}

std::optional<Error> FakeFileManager::createDirectory(const std::string& path) {
  MutexLock lock(mutex_);
  if (faults_.createDirectory) return fault();
  addFolders(path);
  return std::nullopt;
}

std::optional<Error> FakeFileManager::createFile(const std::string& path) {
  MutexLock lock(mutex_);
  if (faults_.createFile) return fault();
  if (folders_.count(folderOfPath(path)) == 0) return missing();
  files_.try_emplace(path, File{"", Date{clock_.timeOfDay().asSeconds()}, true});
  return std::nullopt;
}

std::optional<Error> FakeFileManager::append(const std::string& path, std::string_view bytes) {
  if (beforeAppend_) beforeAppend_();
  MutexLock lock(mutex_);
  const auto found = files_.find(path);
  if (found == files_.end()) return missing();
  if (!found->second.isRegularFile) return fault();
  // Like a full disk: a part was written.
  const bool fails = faults_.append;
  found->second.bytes += fails ? bytes.substr(0, bytes.size() / 2) : bytes;
  if (fails) return fault();
  return std::nullopt;
}

std::optional<Error> FakeFileManager::removeItem(const std::string& path) {
  MutexLock lock(mutex_);
  if (faults_.remove) return fault();
  if (files_.erase(path) == 0) return missing();
  return std::nullopt;
}

}  // namespace kyt
