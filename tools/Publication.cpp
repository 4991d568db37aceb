#include "tools/Publication.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <optional>

#include "platform/base/Descriptor.h"

namespace kyt::tools {

namespace {

constexpr int kMostOfOneTime = 1000;  // documents of one name and time that are kept

Error failure(const std::string& path) {
  return Error{"KYTToolsErrorDomain", errno, path + ": " + std::strerror(errno)};
}

Descriptor owned(int descriptor) {
  return {descriptor, [](int open) { ::close(open); }};
}

std::string timeText(int64_t seconds) {
  const time_t time = seconds;
  tm parts{};
  gmtime_r(&time, &parts);
  char text[32];
  return {text, std::strftime(text, sizeof text, "%Y%m%dT%H%M%SZ", &parts)};
}

bool writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t written = write(fd, bytes.data(), bytes.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return false;
    bytes.remove_prefix(static_cast<size_t>(written));
  }
  return true;
}

// A file beside the others, with its bytes and time on disk.
std::optional<Error> writeBeside(std::string& path, std::string_view document, int64_t modified) {
  const Descriptor file = owned(mkostemp(path.data(), O_CLOEXEC));
  if (!file) return failure(path);
  const timespec times[2] = {{modified, 0}, {modified, 0}};
  if (fchmod(file.get(), 0644) == 0 && writeAll(file.get(), document) && futimens(file.get(), times) == 0 &&
      fsync(file.get()) == 0)
    return std::nullopt;
  Error error = failure(path);
  unlink(path.c_str());
  return error;
}

bool isSameFile(const std::string& one, const std::string& another) {
  struct stat first {
  }, second{};
  return stat(one.c_str(), &first) == 0 && stat(another.c_str(), &second) == 0 &&
         first.st_dev == second.st_dev && first.st_ino == second.st_ino;
}

// A second name for the document that is about to be replaced: `kept`, or where another document has that name, since it had
// the same time, the first of "KEPT.2", "KEPT.3" and so on that is free.
std::optional<Error> keep(const std::string& file, const std::string& folder, std::string& kept) {
  if (mkdir(folder.c_str(), 0755) != 0 && errno != EEXIST) return failure(folder);
  const std::string first = kept;
  for (int number = 2; link(file.c_str(), kept.c_str()) != 0; ++number) {
    if (errno != EEXIST || number > kMostOfOneTime) return failure(kept);
    if (isSameFile(file, kept)) break;  // an attempt that got no further
    kept = first + "." + std::to_string(number);
  }
  const Descriptor opened = owned(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!opened || fsync(opened.get()) != 0) return failure(folder);
  return std::nullopt;
}

}  // namespace

std::variant<Publication, Error> publish(std::string_view document, const std::string& folder,
                                         const std::string& name, int64_t now) {
  const Descriptor opened = owned(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!opened || flock(opened.get(), LOCK_EX) != 0) return failure(folder);
  Publication made;
  made.file = folder + "/" + name;
  made.modified = now;
  struct stat before {};
  if (stat(made.file.c_str(), &before) == 0) {
    // Servers tell whole seconds.
    made.modified = std::max<int64_t>(now, before.st_mtim.tv_sec + 1);
    const std::string keeping = folder + "/" + kPublishedBefore;
    made.kept = keeping + "/" + name + "." + timeText(before.st_mtim.tv_sec);
    if (auto error = keep(made.file, keeping, made.kept)) return *error;
  } else if (errno != ENOENT) {
    return failure(made.file);
  }
  made.isAhead = made.modified > now;
  std::string temporary = folder + "/." + name + ".XXXXXX";
  if (auto error = writeBeside(temporary, document, made.modified)) return *error;
  if (rename(temporary.c_str(), made.file.c_str()) != 0 || fsync(opened.get()) != 0) {
    Error error = failure(made.file);
    unlink(temporary.c_str());
    return error;
  }
  return made;
}

}  // namespace kyt::tools
