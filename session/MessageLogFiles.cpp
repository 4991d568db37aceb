#include "session/MessageLogFiles.h"

#include <algorithm>
#include <string_view>
#include <utility>
#include <variant>

#include "platform/FileManager.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/Description.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr double kExpirySeconds = 86400;
constexpr std::string_view kFirstField = "kytreportingd";
constexpr std::string_view kLastField = "messageLog.diag";

// Exactly three fields joined by "_", the first and the last of them ours.
bool isLogFileName(std::string_view name) {
  const size_t first = name.find('_');
  const size_t last = name.rfind('_');
  if (first == name.npos || first == last) return false;
  return name.substr(0, first) == kFirstField && name.substr(last + 1) == kLastField &&
         name.substr(first + 1, last - first - 1).find('_') == name.npos;
}

// Enough for the date and what stands around the objects.
constexpr size_t kRoomForTheRest = 512;

// In one buffer from the beginning: the text of a batch is a megabyte, which costs page faults wherever it is copied.
std::string lineOf(double now, const char* format, std::initializer_list<Value> objects) {
  size_t length = kRoomForTheRest;
  for (const Value& object : objects)
    if (const String* text = object.string()) length += text->size();
  std::string line;
  line.reserve(length);
  appendObjects(line, "(%@) ", {Date{now}});
  const size_t begin = line.size();
  appendObjects(line, format, objects);
  if (!isPlainLines(std::string_view(line).substr(begin))) {
    const std::string text = line.substr(begin);
    line.resize(begin);
    appendEscapedLines(line, text);
  }
  line += '\n';
  return line;
}

std::string dateText(const std::optional<Date>& date) {
  return description(date ? Value(*date) : Value());
}

}  // namespace

MessageLogFiles::MessageLogFiles(std::string folder, FileManager& files, const Clock& clock, Log& log,
                                 Counters& counters, uint64_t mostOfUser)
    : folder_(std::move(folder)),
      files_(files),
      clock_(clock),
      log_(log),
      counters_(counters),
      mostOfUser_(mostOfUser) {}

double MessageLogFiles::now() const {
  return clock_.timeOfDay().asSeconds();
}

void MessageLogFiles::lineIsLost() {
  counters_.add(Reason::messageLogLineLost);
}

void MessageLogFiles::writeToLogFile(uint32_t user, const char* format,
                                     std::initializer_list<Value> objects) {
  std::optional<File> file = fileForALine();
  if (!file) return;
  const std::string line = lineOf(now(), format, objects);
  if (!takeShare(user, file->path, line.size())) return;
  if (file->size + line.size() > Limits::maxMessageLogBytes) {
    if (!beginNext(*file, line.size())) return giveShareBack(user, file->path, line.size());
    if (!takeShare(user, file->path, line.size())) return;
  }
  if (const std::optional<Error> error = files_.append(file->path, line)) {
    log_.error("writeToLogFile: Error writing to log file %s: %s", file->path.c_str(),
               error->localizedDescription.c_str());
    deleteFile(*file);
    giveShareBack(user, file->path, line.size());
    return lineIsLost();
  }
  log_.normal("writeToLogFile: Saved log message to %s", file->path.c_str());
}

bool MessageLogFiles::takesLine(uint32_t user, size_t leastBytes) {
  if (!mayLoseLine(user, leastBytes)) return true;
  const std::optional<File> file = fileForALine();
  if (!file) return false;
  if (hasShare(user, file->path, leastBytes)) return true;
  countShareUsed(user, file->path);
  return false;
}

bool MessageLogFiles::mayLoseLine(uint32_t user, size_t bytes) {
  MutexLock lock(mutex_);
  const auto share = shares_.find(user);
  return hasNoFile_ || bytes > mostOfUser_ - (share != shares_.end() ? share->second : 0);
}

std::optional<MessageLogFiles::File> MessageLogFiles::fileForALine() {
  std::optional<File> file = currentFile();
  if (!file) file = newFile();
  if (!file) lineIsLost();
  MutexLock lock(mutex_);
  hasNoFile_ = !file;
  return file;
}

uint64_t& MessageLogFiles::shareOf(uint32_t user, const std::string& path) {
  if (path != sharedFile_) {
    sharedFile_ = path;
    shares_.clear();
  }
  return shares_[user];
}

bool MessageLogFiles::hasShare(uint32_t user, const std::string& path, size_t bytes) {
  MutexLock lock(mutex_);
  return bytes <= mostOfUser_ - shareOf(user, path);
}

bool MessageLogFiles::takeShare(uint32_t user, const std::string& path, size_t bytes) {
  {
    MutexLock lock(mutex_);
    uint64_t& used = shareOf(user, path);
    if (bytes <= mostOfUser_ - used) {
      used += bytes;
      return true;
    }
  }
  countShareUsed(user, path);
  return false;
}

void MessageLogFiles::countShareUsed(uint32_t user, const std::string& path) {
  if (counters_.addAndMayLog(Reason::messageLogShareUsed, clock_.monotonic()))
    log_.error(
        "writeToLogFile: User %u has used his part of %s, his lines are left out until the next is begun",
        user, path.c_str());
}

// A line that was lost after all uses nothing.
void MessageLogFiles::giveShareBack(uint32_t user, const std::string& path, size_t bytes) {
  MutexLock lock(mutex_);
  if (path != sharedFile_) return;
  uint64_t& used = shares_[user];
  used -= std::min<uint64_t>(used, bytes);
}

// A full file gives way to the next one; there is one a second at most.
bool MessageLogFiles::beginNext(File& full, size_t wanted) {
  if (wanted <= Limits::maxMessageLogBytes) {
    std::optional<File> next = newFile();
    if (next && next->path != full.path) {
      deleteFile(full);
      full = std::move(*next);
      return true;
    }
  }
  if (counters_.addAndMayLog(Reason::messageLogLineLost, clock_.monotonic()))
    log_.error("writeToLogFile: %s is full, lines are lost until the next can be begun", full.path.c_str());
  return false;
}

std::vector<std::string> MessageLogFiles::listing() {
  auto names = files_.contentsOfDirectory(folder_);
  if (auto* found = std::get_if<std::vector<std::string>>(&names)) return std::move(*found);
  const Error& error = std::get<Error>(names);
  if (error.code != kFileErrorNoSuchFile) {
    log_.error("writeToLogFile: Error reading from log directory: %s", error.localizedDescription.c_str());
    return {};
  }
  log_.normal("writeToLogFile: Creating kytreportingd log directory at %s", folder_.c_str());
  // Whether that went well shows when a file is made in it.
  static_cast<void>(files_.createDirectory(folder_));
  return {};
}

// The newest file that has not expired; the others are deleted.
std::optional<MessageLogFiles::File> MessageLogFiles::currentFile() {
  std::optional<File> candidate;
  for (const std::string& name : listing()) {
    if (!isLogFileName(name)) continue;
    File file{folder_ + "/" + name, std::nullopt, 0};
    const std::optional<FileAttributes> attributes = files_.attributesOfItem(file.path);
    if (!attributes || !attributes->isRegularFile) continue;  // deleted meanwhile, or no file
    file.creationDate = attributes->creationDate;
    file.size = attributes->size;
    if (file.creationDate && now() - file.creationDate->secondsSince1970 > kExpirySeconds) {
      deleteFile(file);
    } else if (!candidate || !candidate->creationDate) {
      // One whose age cannot be told gives way, and stays where it is.
      candidate = std::move(file);
    } else if (file.creationDate &&
               file.creationDate->secondsSince1970 > candidate->creationDate->secondsSince1970) {
      deleteFile(*candidate);
      candidate = std::move(file);
    } else {
      deleteFile(file);
    }
  }
  return candidate;
}

std::optional<MessageLogFiles::File> MessageLogFiles::newFile() {
  const int started = static_cast<int32_t>(clock_.timeOfDay().seconds);
  File file{folder_ + "/" + formatObjects("%@_%d_%@", {String(kFirstField), started, String(kLastField)}),
            std::nullopt, 0};
  // What counts is whether it is there.
  static_cast<void>(files_.createFile(file.path));
  const std::optional<FileAttributes> attributes = files_.attributesOfItem(file.path);
  if (!attributes || !attributes->isRegularFile) {
    log_.error("writeToLogFile: Failed to create new kytreportingd log file %s", file.path.c_str());
    return std::nullopt;
  }
  file.creationDate = attributes->creationDate;
  file.size = attributes->size;
  log_.normal("writeToLogFile: Created new kytreportingd log file %s (%s)", file.path.c_str(),
              dateText(file.creationDate).c_str());
  return file;
}

// One text for expired and superseded files.
void MessageLogFiles::deleteFile(const File& file) {
  if (const std::optional<Error> error = files_.removeItem(file.path)) {
    if (error->code == kFileErrorNoSuchFile) return;  // another call was here first
    log_.error("writeToLogFile: Cannot delete log file %s: %s", file.path.c_str(),
               error->localizedDescription.c_str());
    return;
  }
  log_.normal("writeToLogFile: Deleted expired kytreportingd log file %s (%s)", file.path.c_str(),
              dateText(file.creationDate).c_str());
}

}  // namespace kyt
