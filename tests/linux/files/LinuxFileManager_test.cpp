// The system's files where they are unlike those in memory: rights, links, dates, a full disk.
#include "platform/linux/files/LinuxFileManager.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/queues/Log.h"
#include "session/MessageLogFiles.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr uid_t kNobody = 65534;

struct RealLog {
  explicit RealLog(const std::string& folder)
      : messages(folder, files, clock, log, counters, Limits::maxMessageLogBytesPerUser) {}
  LinuxClock clock;
  LinuxFileManager files;
  MemoryLogSink sink;
  Log log{sink, LogLevel::debug};
  Counters counters;
  MessageLogFiles messages;
};

std::string nameWith(const std::string& start) {
  return "kytreportingd_" + start + "_messageLog.diag";
}

// Both times, seconds from now.
void setModified(const std::string& path, time_t fromNow) {
  const timespec times[2] = {{::time(nullptr) + fromNow, 0}, {::time(nullptr) + fromNow, 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

size_t entries(const std::string& folder) {
  LinuxFileManager files;
  const auto names = files.contentsOfDirectory(folder);
  const auto* found = std::get_if<std::vector<std::string>>(&names);
  return found != nullptr ? found->size() : 0;
}

TEST(LinuxFileManager, TheEarlierOfBirthAndModificationIsTheCreation) {
  TemporaryFolder folder;
  LinuxFileManager files;
  const std::string path = folder.write("f", "bytes");
  const double born = files.attributesOfItem(path)->creationDate->secondsSince1970;
  setModified(path, -5000);
  EXPECT_NEAR(files.attributesOfItem(path)->creationDate->secondsSince1970, born - 5000, 60);
  setModified(path, 5000);
  EXPECT_NEAR(files.attributesOfItem(path)->creationDate->secondsSince1970, born, 1);
}

TEST(LinuxFileManager, MakesFilesForTheUserAlone) {
  TemporaryFolder folder;
  LinuxFileManager files;
  ASSERT_EQ(files.createFile(folder / "f"), std::nullopt);
  struct stat status = {};
  ASSERT_EQ(::stat((folder / "f").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
}

TEST(LinuxFileManager, FollowsNoLinkAndWaitsForNoPipe) {
  TemporaryFolder folder;
  LinuxFileManager files;
  const std::string target = folder.write("target", "safe");
  ASSERT_EQ(::symlink(target.c_str(), (folder / "link").c_str()), 0);
  EXPECT_FALSE(files.attributesOfItem(folder / "link")->isRegularFile);
  EXPECT_NE(files.append(folder / "link", "more"), std::nullopt);
  EXPECT_NE(files.createFile(folder / "link"), std::nullopt);
  ASSERT_EQ(::mkfifo((folder / "pipe").c_str(), 0600), 0);
  EXPECT_FALSE(files.attributesOfItem(folder / "pipe")->isRegularFile);
  EXPECT_NE(files.append(folder / "pipe", "more"), std::nullopt);
  EXPECT_EQ(folder.read("target"), "safe");
}

TEST(MessageLogOnDisk, ExpiresByTheFilesOwnDates) {
  TemporaryFolder folder;
  const std::string old = folder.write(nameWith("1"), "old\n");
  setModified(old, -86400 - 60);
  RealLog log(folder.path());
  log.messages.writeToLogFile(1, "%@", {"text"});
  EXPECT_NE(::access(old.c_str(), F_OK), 0);
  EXPECT_EQ(entries(folder.path()), 1U);
  EXPECT_TRUE(log.sink.contains("Saved log message to " + folder.path() + "/kytreportingd_"));
}

TEST(MessageLogOnDisk, AppendsToTheNewerOfTwo) {
  TemporaryFolder folder;
  setModified(folder.write(nameWith("1"), "newer\n"), -60);
  setModified(folder.write(nameWith("2"), "older\n"), -120);
  RealLog log(folder.path());
  log.messages.writeToLogFile(1, "%@", {"text"});
  EXPECT_EQ(folder.read(nameWith("1")).substr(0, 7), "newer\n(");
  EXPECT_EQ(entries(folder.path()), 1U);
}

TEST(MessageLogOnDisk, MakesItsFolder) {
  TemporaryFolder folder;
  RealLog log(folder / "var/mobile/Retired");
  log.messages.writeToLogFile(1, "%@", {"text"});
  EXPECT_EQ(entries(folder / "var/mobile/Retired"), 1U);
}

// The rights of a folder do not hold for root, so this part runs as somebody else.
TEST(MessageLogOnDisk, AFolderThatMayNotBeListedIsWrittenToAllTheSame) {
  TemporaryFolder folder;
  ASSERT_EQ(::chmod(folder.path().c_str(), 0333), 0);
  const std::string said = inChildProcess([&]() -> std::string {
    if (::geteuid() == 0 && ::setuid(kNobody) != 0) return "skip";
    RealLog log(folder.path());
    log.messages.writeToLogFile(1, "%@", {"text"});
    if (!log.sink.contains(LogLevel::error,
                           "writeToLogFile: Error reading from log directory: Permission denied"))
      return "not said: unreadable";
    return log.sink.contains("Saved log message to") ? "" : "not saved";
  });
  ASSERT_EQ(::chmod(folder.path().c_str(), 0700), 0);
  if (said == "skip") GTEST_SKIP() << "cannot become another user";
  EXPECT_EQ(said, "");
  EXPECT_EQ(entries(folder.path()), 1U);
}

TEST(MessageLogOnDisk, AFolderThatMayNotBeWrittenToLosesTheLine) {
  TemporaryFolder folder;
  ASSERT_EQ(::chmod(folder.path().c_str(), 0555), 0);
  const std::string said = inChildProcess([&]() -> std::string {
    if (::geteuid() == 0 && ::setuid(kNobody) != 0) return "skip";
    RealLog log(folder.path());
    log.messages.writeToLogFile(1, "%@", {"text"});
    if (log.counters.value(Reason::messageLogLineLost) != 1) return "not counted";
    return log.sink.contains(LogLevel::error, "writeToLogFile: Failed to create new kytreportingd log file")
               ? ""
               : "not said";
  });
  ASSERT_EQ(::chmod(folder.path().c_str(), 0700), 0);
  if (said == "skip") GTEST_SKIP() << "cannot become another user";
  EXPECT_EQ(said, "");
}

// In a mount namespace of the child's own, so nothing is left mounted.
TEST(MessageLogOnDisk, AFullDiskCostsTheFile) {
  if (::geteuid() != 0) GTEST_SKIP() << "mounting a small disk needs root";
  TemporaryFolder folder;
  const std::string said = inChildProcess([&]() -> std::string {
    if (!unshareMounts() || ::mount("tmpfs", folder.path().c_str(), "tmpfs", 0, "size=64k") != 0)
      return "skip";
    RealLog log(folder.path());
    log.messages.writeToLogFile(1, "%@", {"first"});
    if (!log.sink.contains("Saved log message to")) return "a small line does not fit";
    log.sink.clear();
    log.messages.writeToLogFile(1, "%@", {std::string(100000, 'x')});
    if (!log.sink.contains(LogLevel::error, ": No space left on device")) return "not said: full";
    if (!log.sink.contains("writeToLogFile: Deleted expired kytreportingd log file")) return "not deleted";
    if (entries(folder.path()) != 0) return "the file stays";
    log.messages.writeToLogFile(1, "%@", {"again"});
    return entries(folder.path()) == 1 ? "" : "nothing is written after that";
  });
  if (said == "skip") GTEST_SKIP() << "cannot mount here";
  EXPECT_EQ(said, "");
}

}  // namespace
}  // namespace kyt
