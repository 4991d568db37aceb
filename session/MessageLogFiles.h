// The local message log as files: one line for each call, in a file that is current for a day after its
// creation and then deleted by the next call, or by the one that finds it full. At most one file stays; every call
// lists the folder, so this is for a low rate of lines. Files of other names in the folder are left alone. Of each
// user's clients no more than a share is written to a file, as far as this object knows: a file's lines do not name their
// user, so after a restart the shares of a day's file begin anew. What is more is dropped and counted.
//
// Takes no lock but for these sums: each call opens, appends and closes within itself, and a line is appended in one
// piece, so two calls at once do no more than start two files, of which the next call keeps the newer.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/objects/Value.h"
#include "session/MessageLog.h"

namespace kyt {

class Clock;
class Counters;
class FileManager;
class Log;

class MessageLogFiles final : public MessageLog {
 public:
  // All that is handed in outlives the log. `mostOfUser` is in bytes (Share::messageLogBytes). The folder is made when it is missing, if the system allows that.
  MessageLogFiles(std::string folder, FileManager& files, const Clock& clock, Log& log, Counters& counters,
                  uint64_t mostOfUser);

  // Answers by the lines of before where that is enough, so that it costs nothing as long as there is room.
  [[nodiscard]] bool takesLine(uint32_t user, size_t leastBytes) override;
  // Line breaks within a line stay: they are those of texts that back ends laid out. Other control characters
  // and invalid UTF-8 are escaped. What a client sent as it is must have been escaped by the caller.
  void writeToLogFile(uint32_t user, const char* format, std::initializer_list<Value> objects) override;

 private:
  struct File {
    std::string path;
    std::optional<Date> creationDate;
    uint64_t size = 0;
  };
  [[nodiscard]] std::vector<std::string> listing();
  [[nodiscard]] std::optional<File> currentFile();
  [[nodiscard]] std::optional<File> newFile();
  // None: no line can be written, which has been counted.
  [[nodiscard]] std::optional<File> fileForALine() EXCLUDES(mutex_);
  // Whether the line before was lost, or one of so many bytes would be past the user's share.
  [[nodiscard]] bool mayLoseLine(uint32_t user, size_t bytes) EXCLUDES(mutex_);
  // False: the line is lost, which has been counted.
  [[nodiscard]] bool beginNext(File& full, size_t wanted);
  // False: the user has used his share of that file, which has been counted.
  [[nodiscard]] bool takeShare(uint32_t user, const std::string& path, size_t bytes) EXCLUDES(mutex_);
  // As the former, without taking it.
  [[nodiscard]] bool hasShare(uint32_t user, const std::string& path, size_t bytes) EXCLUDES(mutex_);
  [[nodiscard]] uint64_t& shareOf(uint32_t user, const std::string& path) REQUIRES(mutex_);
  void countShareUsed(uint32_t user, const std::string& path);
  void giveShareBack(uint32_t user, const std::string& path, size_t bytes) EXCLUDES(mutex_);
  void deleteFile(const File& file);
  void lineIsLost();
  [[nodiscard]] double now() const;

  const std::string folder_;
  FileManager& files_;
  const Clock& clock_;
  Log& log_;
  Counters& counters_;
  const uint64_t mostOfUser_;
  Mutex mutex_;
  std::string sharedFile_ GUARDED_BY(mutex_);               // which one these are the users' parts of
  std::map<uint32_t, uint64_t> shares_ GUARDED_BY(mutex_);  // bytes
  bool hasNoFile_ GUARDED_BY(mutex_) = false;  // the last line found none, and none could be made
};

}  // namespace kyt
