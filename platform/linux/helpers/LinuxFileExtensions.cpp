#include "platform/linux/helpers/LinuxFileExtensions.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <utility>

#include "platform/base/Blocking.h"
#include "platform/base/Counters.h"
#include "platform/linux/files/Files.h"
#include "platform/queues/Log.h"

namespace kyt {

class LinuxFileExtensions::Access final : public FileAccess {
 public:
  Access(LinuxFileExtensions& owner, FileExtension extension)
      : owner_(owner),
        extension_(std::move(extension)),
        counted_(owner_.budget_.account(extension_.peer.user), Share::uploadedBytes) {}
  Access(const Access&) = delete;
  Access& operator=(const Access&) = delete;

  [[nodiscard]] bool isReadableRegularFile() override {
    const BlockingScope blocking;
    const int flags = ::fcntl(file(), F_GETFL);
    if (flags < 0 || (flags & O_PATH) != 0) return false;
    const int mode = flags & O_ACCMODE;
    if (mode != O_RDONLY && mode != O_RDWR) return false;
    struct stat status = {};
    return ::fstat(file(), &status) == 0 && S_ISREG(status.st_mode);
  }

  [[nodiscard]] std::variant<Data, FileReadError> readWhole(uint64_t maxBytes) override {
    const BlockingScope blocking;
    struct stat status = {};
    if (::fstat(file(), &status) != 0 || status.st_size < 0) return FileReadError::failed;
    const auto size = static_cast<uint64_t>(status.st_size);
    if (size > maxBytes) return FileReadError::tooLarge;
    if (size == 0) return Data();
    counted_.clear();
    if (!counted_.set(size)) return FileReadError::tooMuchAtOnce;
    std::byte* bytes = nullptr;
    Data data = Data::uninitialized(size, bytes);
    size_t done = 0;
    while (done < size) {
      const ssize_t count = ::pread(file(), bytes + done, size - done, static_cast<off_t>(done));
      if (count < 0 && errno == EINTR) continue;
      if (count < 0) return FileReadError::failed;
      if (count == 0) break;
      done += static_cast<size_t>(count);
    }
    if (done < size) return Data(data.view().substr(0, done));
    return data;
  }

  void holdsOnly(uint64_t bytes) override {
    if (bytes < counted_.amount()) counted_.setAnyway(bytes);
  }

  [[nodiscard]] bool remove(std::string_view name) override {
    const int error = owner_.broker_ == nullptr
                          ? ENOSYS
                          : owner_.broker_->remove(file(), extension_.folder.get(), name, extension_.peer);
    if (error == 0) return true;
    owner_.counters_.add(Reason::fileNotRemoved);
    owner_.log_.debug("LinuxFileExtensions(remove): Cannot remove %s: %s", std::string(name).c_str(),
                      errorText(error).c_str());
    return false;
  }

 private:
  [[nodiscard]] int file() const { return extension_.file.get(); }

  LinuxFileExtensions& owner_;
  const FileExtension extension_;
  Charge counted_;
};

std::unique_ptr<FileAccess> LinuxFileExtensions::consume(std::string_view token,
                                                         std::optional<FileExtension> extension) {
  if (token.empty() || !extension) return nullptr;
  if (extension->file.get() < 0 || extension->folder.get() < 0) return nullptr;
  return std::make_unique<Access>(*this, std::move(*extension));
}

}  // namespace kyt
