#include "session/MessageLogFiles.h"

#include <gtest/gtest.h>

#include <chrono>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/fake/FakeFileManager.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

class MessageLogFilesTest : public testing::Test {
 protected:
  // 2026-01-31 12:00:00
  static constexpr double kNow = 1769860800;
  static inline const std::string kFolder = "/var/mobile/Library/Logs/Faultbin/Retired";

  static std::string path(const std::string& name) { return kFolder + "/" + name; }
  static std::string logFile(const std::string& start) {
    return path("kytreportingd_" + start + "_messageLog.diag");
  }
  void put(const std::string& file, double age, const std::string& bytes = "old\n") {
    files_.put(file, {bytes, Date{kNow - age}, true});
  }
  void write(const std::string& text = "text", uint32_t user = 1) {
    log_.writeToLogFile(user, "[%@ -> flushMessages] %@", {"qrs", text});
  }
  std::map<std::string, std::string> contents() const {
    std::map<std::string, std::string> bytes;
    for (const auto& [name, file] : files_.files()) bytes[name] = file.bytes;
    return bytes;
  }
  bool logged(LogLevel level, const std::string& text) const { return sink_.contains(level, text); }
  static std::string line(const std::string& text) {
    return "(2026-01-31 12:00:00 +0000) [qrs -> flushMessages] " + text + "\n";
  }

  ManualClock clock_;
  FakeFileManager files_{clock_};
  MemoryLogSink sink_;
  Log systemLog_{sink_, LogLevel::debug};
  Counters counters_;
  MessageLogFiles log_{kFolder, files_, clock_, systemLog_, counters_, Limits::maxMessageLogBytesPerUser};
};

TEST_F(MessageLogFilesTest, MakesTheFolderAndAFileNamedAfterTheSecond) {
  clock_.advance(std::chrono::milliseconds(999));
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1769860800"), line("text")}}));
  EXPECT_EQ(sink_.lines(),
            (std::vector<MemoryLogSink::Line>{
                {LogLevel::normal, "writeToLogFile: Creating kytreportingd log directory at " + kFolder},
                {LogLevel::normal, "writeToLogFile: Created new kytreportingd log file " +
                                       logFile("1769860800") + " (2026-01-31 12:00:00 +0000)"},
                {LogLevel::normal, "writeToLogFile: Saved log message to " + logFile("1769860800")}}));
}

TEST_F(MessageLogFilesTest, LaterLinesGoToTheSameFile) {
  write("one");
  clock_.advance(std::chrono::hours(5));
  sink_.clear();
  write("two");
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{
                            {logFile("1769860800"), line("one") + "(2026-01-31 17:00:00 +0000) [qrs -> "
                                                                  "flushMessages] two\n"}}));
  EXPECT_EQ(sink_.lines().size(), 1U) << "only that it was saved";
}

TEST_F(MessageLogFilesTest, AFileOfExactlyADayIsKept) {
  put(logFile("1"), 86400);
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1"), "old\n" + line("text")}}));
}

TEST_F(MessageLogFilesTest, AnOlderFileIsDeletedAndANewOneStarted) {
  put(logFile("1"), 86400.001);
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1769860800"), line("text")}}));
  EXPECT_TRUE(logged(LogLevel::normal, "writeToLogFile: Deleted expired kytreportingd log file " +
                                           logFile("1") + " (2026-01-30 11:59:59 +0000)"));
}

TEST_F(MessageLogFilesTest, OfTwoFilesTheOlderIsDeletedInWhicheverOrderTheyAreListed) {
  for (const auto& [older, newer] : {std::pair("1", "2"), std::pair("2", "1")}) {
    put(logFile(older), 20);
    put(logFile(newer), 10);
    write();
    EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile(newer), "old\n" + line("text")}}));
    EXPECT_TRUE(logged(LogLevel::normal, "Deleted expired kytreportingd log file " + logFile(older) +
                                             " (2026-01-31 11:59:40 +0000)"));
    sink_.clear();
    ASSERT_EQ(files_.removeItem(logFile(newer)), std::nullopt);
  }
}

TEST_F(MessageLogFilesTest, OfTwoEquallyOldFilesTheFirstListedStays) {
  put(logFile("1"), 10);
  put(logFile("2"), 10);
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1"), "old\n" + line("text")}}));
}

TEST_F(MessageLogFilesTest, AFileFromTheFutureIsCurrent) {
  put(logFile("1"), -1000);
  write();
  EXPECT_EQ(contents().count(logFile("1")), 1U);
}

TEST_F(MessageLogFilesTest, OtherNamesAreLeftAlone) {
  const std::vector<std::string> names = {"kytreportingd_x_other.log",
                                          "kytreportingd_1_2_messageLog.diag",
                                          "kytreportingd_messageLog.diag",
                                          "other_1_messageLog.diag",
                                          "kytreportingd_1_messageLog.diag2",
                                          "Kytreportingd_1_messageLog.diag",
                                          "kytreportingd",
                                          "_",
                                          "crash.diag"};
  for (const std::string& name : names) put(path(name), 1000000);
  write();
  EXPECT_EQ(contents().size(), names.size() + 1);
  for (const std::string& name : names) EXPECT_EQ(contents().at(path(name)), "old\n") << name;
  EXPECT_EQ(contents().at(logFile("1769860800")), line("text"));
}

TEST_F(MessageLogFilesTest, OnlyTheFieldsAtBothEndsAreLookedAt) {
  put(logFile("x"), 10);
  put(logFile(""), 20);
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("x"), "old\n" + line("text")}}));
}

TEST_F(MessageLogFilesTest, WhatIsNoFileIsLeftAlone) {
  files_.put(logFile("1"), {"", Date{kNow - 1000000}, false});
  write();
  EXPECT_EQ(contents(),
            (std::map<std::string, std::string>{{logFile("1"), ""}, {logFile("1769860800"), line("text")}}));
}

TEST_F(MessageLogFilesTest, AFileWithoutADateIsWrittenToWhenItIsTheOnlyOne) {
  files_.put(logFile("1"), {"", std::nullopt, true});
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1"), line("text")}}));
}

TEST_F(MessageLogFilesTest, AFileWithoutADateGivesWayAndStays) {
  files_.put(logFile("1"), {"", std::nullopt, true});
  put(logFile("2"), 10);
  write();
  EXPECT_EQ(contents(),
            (std::map<std::string, std::string>{{logFile("1"), ""}, {logFile("2"), "old\n" + line("text")}}));
}

TEST_F(MessageLogFilesTest, AFileWithoutADateIsNotLaterThanOneWithADate) {
  put(logFile("1"), 10);
  files_.put(logFile("2"), {"", std::nullopt, true});
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1"), "old\n" + line("text")}}));
  EXPECT_TRUE(
      logged(LogLevel::normal, "Deleted expired kytreportingd log file " + logFile("2") + " ((null))"));
}

TEST_F(MessageLogFilesTest, AnUnreadableFolderIsSaidAndANewFileStarted) {
  put(logFile("1"), 1000000);
  files_.setFaults({.list = true});
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1"), "old\n"},
                                                            {logFile("1769860800"), line("text")}}));
  EXPECT_TRUE(
      logged(LogLevel::error, "writeToLogFile: Error reading from log directory: Input/output error"));
  EXPECT_FALSE(sink_.contains("Creating kytreportingd log directory"));
}

TEST_F(MessageLogFilesTest, TwoCallsWithinASecondInAnUnreadableFolderBothKeepTheirLines) {
  put(path("other"), 0);
  files_.setFaults({.list = true});
  write("one");
  write("two");
  EXPECT_EQ(contents().at(logFile("1769860800")), line("one") + line("two"));
}

TEST_F(MessageLogFilesTest, AFileThatCannotBeMadeLosesTheLine) {
  put(path("other"), 0);
  files_.setFaults({.createFile = true});
  write();
  EXPECT_EQ(contents().size(), 1U);
  EXPECT_TRUE(logged(LogLevel::error,
                     "writeToLogFile: Failed to create new kytreportingd log file " + logFile("1769860800")));
  EXPECT_FALSE(sink_.contains("Saved log message"));
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 1U);
}

TEST_F(MessageLogFilesTest, AFolderThatCannotBeMadeLosesTheLine) {
  files_.setFaults({.createDirectory = true});
  write();
  EXPECT_TRUE(contents().empty());
  EXPECT_TRUE(logged(LogLevel::normal, "writeToLogFile: Creating kytreportingd log directory at " + kFolder));
  EXPECT_TRUE(logged(LogLevel::error, "writeToLogFile: Failed to create new kytreportingd log file"));
}

TEST_F(MessageLogFilesTest, AFileThatCannotBeWrittenIsDeleted) {
  put(logFile("1"), 10);
  files_.setFaults({.append = true});
  write();
  EXPECT_TRUE(contents().empty());
  EXPECT_TRUE(logged(LogLevel::error,
                     "writeToLogFile: Error writing to log file " + logFile("1") + ": Input/output error"));
  EXPECT_TRUE(logged(LogLevel::normal, "writeToLogFile: Deleted expired kytreportingd log file " +
                                           logFile("1") + " (2026-01-31 11:59:50 +0000)"));
  EXPECT_FALSE(sink_.contains("Saved log message"));
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 1U);
  files_.setFaults({});
  write();
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1769860800"), line("text")}}));
}

TEST_F(MessageLogFilesTest, AFileThatAnotherCallHasDeletedIsNotDeletedAgain) {
  put(logFile("1"), 10);
  files_.setBeforeAppend([this] { static_cast<void>(files_.removeItem(logFile("1"))); });
  write();
  EXPECT_TRUE(contents().empty());
  EXPECT_TRUE(logged(LogLevel::error, "writeToLogFile: Error writing to log file " + logFile("1")));
  EXPECT_FALSE(sink_.contains("Cannot delete"));
  EXPECT_FALSE(sink_.contains("Deleted expired"));
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 1U);
}

TEST_F(MessageLogFilesTest, AFileThatCannotBeDeletedIsNotSaidToBe) {
  put(logFile("1"), 90000);
  files_.setFaults({.remove = true});
  write();
  EXPECT_TRUE(logged(LogLevel::error,
                     "writeToLogFile: Cannot delete log file " + logFile("1") + ": Input/output error"));
  EXPECT_FALSE(sink_.contains("Deleted expired"));
  EXPECT_EQ(contents().at(logFile("1769860800")), line("text"));
}

TEST_F(MessageLogFilesTest, AFullFileGivesWayToTheNext) {
  put(logFile("1"), 10, std::string(Limits::maxMessageLogBytes - line("fits").size(), '.'));
  write("fits");
  EXPECT_EQ(contents().at(logFile("1")).size(), Limits::maxMessageLogBytes);
  write("next");
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1769860800"), line("next")}}));
  EXPECT_TRUE(
      logged(LogLevel::normal, "writeToLogFile: Deleted expired kytreportingd log file " + logFile("1")));
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 0U);
}

TEST_F(MessageLogFilesTest, AFileThatIsFullWithinItsSecondTakesNoMore) {
  put(logFile("1769860800"), 0, std::string(Limits::maxMessageLogBytes, '.'));
  write("no more");
  write("no more");
  EXPECT_EQ(contents().at(logFile("1769860800")).size(), Limits::maxMessageLogBytes);
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 2U);
  EXPECT_EQ(sink_.count(LogLevel::error, "writeToLogFile: " + logFile("1769860800") + " is full"), 1U);
  clock_.advance(std::chrono::seconds(1));
  write("next");
  EXPECT_EQ(contents().size(), 1U);
  EXPECT_EQ(contents().begin()->first, logFile("1769860801"));
}

TEST_F(MessageLogFilesTest, AFullFileStaysWhenTheNextCannotBeMade) {
  put(logFile("1"), 10, std::string(Limits::maxMessageLogBytes, '.'));
  files_.setFaults({.createFile = true});
  write("lost");
  EXPECT_EQ(contents().size(), 1U);
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 1U);
}

// Of a line so long that four fill a user's share to the byte.
std::string quarterOfAShare(size_t lineWithoutText) {
  return std::string(Limits::maxMessageLogBytesPerUser / 4 - lineWithoutText, '.');
}

TEST_F(MessageLogFilesTest, AUserWhoHasUsedHisShareOfTheFileLeavesTheRestToOthers) {
  const std::string much = quarterOfAShare(line("").size());
  for (int i = 0; i < 4; ++i) write(much, 1);
  const std::string file = logFile("1769860800");
  EXPECT_EQ(contents().at(file).size(), Limits::maxMessageLogBytesPerUser);
  write("left out", 1);
  write("left out", 1);
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 2U);
  EXPECT_EQ(
      sink_.count(LogLevel::error, "writeToLogFile: User 1 has used his part of " + file + ", his lines"),
      1U);
  clock_.advance(std::chrono::minutes(1));
  write("left out", 1);
  EXPECT_EQ(sink_.count(LogLevel::error, "writeToLogFile: User 1 has used his part"), 2U);
  clock_.setTimeOfDay({static_cast<int64_t>(kNow), 0});
  write("another's", 2);
  ASSERT_EQ(contents().size(), 1U) << "the file stays";
  EXPECT_TRUE(contents().at(file).ends_with(line("another's")));
  EXPECT_EQ(contents().at(file).size(), Limits::maxMessageLogBytesPerUser + line("another's").size());
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 0U);
}

TEST_F(MessageLogFilesTest, TheNextFileHasAShareForEachUserAgain) {
  const std::string much = quarterOfAShare(line("").size());
  for (int i = 0; i < 5; ++i) write(much, 1);
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 1U);
  clock_.advance(std::chrono::hours(25));
  write("again", 1);
  EXPECT_EQ(contents().size(), 1U);
  EXPECT_TRUE(contents().begin()->second.ends_with(" again\n"));
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 1U);
}

TEST_F(MessageLogFilesTest, AUserWhoHasUsedHisShareDoesNotBeginTheNextFile) {
  for (uint32_t user = 1; user <= 4; ++user)
    for (int i = 0; i < 4; ++i) write(quarterOfAShare(line("").size()), user);
  EXPECT_EQ(contents().begin()->second.size(), Limits::maxMessageLogBytes);
  clock_.advance(std::chrono::seconds(1));
  write("left out", 1);
  EXPECT_EQ(contents().begin()->second.size(), Limits::maxMessageLogBytes);
  write("another's", 5);
  EXPECT_EQ(contents().size(), 1U);
  EXPECT_TRUE(contents().begin()->second.ends_with(" another's\n"));
}

TEST_F(MessageLogFilesTest, LinesThatAreLostDoNotUseAUsersShare) {
  put(logFile("1"), 10, std::string(Limits::maxMessageLogBytes, '.'));
  const std::string much = quarterOfAShare(line("").size());
  files_.setFaults({.createFile = true});
  for (int i = 0; i < 5; ++i) write(much, 1);
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 5U);
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 0U);
  files_.setFaults({});
  write("next", 1);
  ASSERT_EQ(contents().size(), 1U);
  EXPECT_EQ(contents().begin()->first, logFile("1769860800"));
}

TEST_F(MessageLogFilesTest, LinesThatCouldNotBeWrittenDoNotUseAUsersShare) {
  const std::string much = quarterOfAShare(line("").size());
  files_.setFaults({.append = true});
  for (int i = 0; i < 5; ++i) write(much, 1);
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 5U);
  files_.setFaults({});
  write("next", 1);
  EXPECT_EQ(contents(), (std::map<std::string, std::string>{{logFile("1769860800"), line("next")}}));
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 0U);
}

TEST_F(MessageLogFilesTest, TakesALineAsLongAsTheUsersShareHasRoomForIt) {
  EXPECT_TRUE(log_.takesLine(1, 100)) << "nothing has been written";
  EXPECT_TRUE(files_.files().empty()) << "and nothing was looked at";
  EXPECT_FALSE(log_.takesLine(1, Limits::maxMessageLogBytesPerUser + 1));
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 1U);
  const std::string much = quarterOfAShare(line("").size());
  for (int i = 0; i < 4; ++i) write(much, 1);
  const std::string file = logFile("1769860800");
  sink_.clear();
  clock_.advance(std::chrono::minutes(1));
  EXPECT_FALSE(log_.takesLine(1, 1));
  EXPECT_FALSE(log_.takesLine(1, 1));
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 3U) << "as if it had been written";
  EXPECT_EQ(
      sink_.count(LogLevel::error, "writeToLogFile: User 1 has used his part of " + file + ", his lines"),
      1U);
  EXPECT_TRUE(log_.takesLine(2, 1)) << "another user's";
  EXPECT_EQ(contents().at(file).size(), Limits::maxMessageLogBytesPerUser);
}

TEST_F(MessageLogFilesTest, TakesALineAgainWhenTheNextFileIsDue) {
  for (int i = 0; i < 4; ++i) write(quarterOfAShare(line("").size()), 1);
  EXPECT_FALSE(log_.takesLine(1, 1));
  clock_.advance(std::chrono::hours(25));
  EXPECT_TRUE(log_.takesLine(1, 1));
  write("again", 1);
  EXPECT_TRUE(contents().begin()->second.ends_with(" again\n"));
  EXPECT_EQ(counters_.value(Reason::messageLogShareUsed), 1U);
}

TEST_F(MessageLogFilesTest, TakesNoLineWhereTheOneBeforeFoundNoFile) {
  files_.setFaults({.createFile = true});
  EXPECT_TRUE(log_.takesLine(1, 1)) << "nobody knows yet";
  write();
  EXPECT_FALSE(log_.takesLine(1, 1));
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 2U);
  files_.setFaults({});
  EXPECT_TRUE(log_.takesLine(1, 1));
  write();
  EXPECT_EQ(counters_.value(Reason::messageLogLineLost), 2U);
}

TEST_F(MessageLogFilesTest, KeepsLineBreaksAndEscapesOtherControlCharacters) {
  write("{\n    \"a\" : 1\n}\x1b[2J\r\xff\xe2\x80\xae\x7f\t.");
  EXPECT_EQ(contents().at(logFile("1769860800")),
            line("{\n    \"a\" : 1\n}\\x1b[2J\\r\\xff\\xe2\\x80\\xae\\x7f\\t."));
}

TEST_F(MessageLogFilesTest, PrintsAMissingObjectAndContainers) {
  log_.writeToLogFile(1, "%@ %@ %@", {nullptr, Dictionary{{"k", Array{1, "v"}}}, true});
  EXPECT_EQ(contents().at(logFile("1769860800")), "(2026-01-31 12:00:00 +0000) (null) {\"k\":[1,\"v\"]} 1\n");
}

TEST_F(MessageLogFilesTest, TheFilesNameIsASigned32BitNumber) {
  clock_.setTimeOfDay({2147483648, 0});
  write();
  EXPECT_EQ(contents().begin()->first, logFile("-2147483648"));
  write();
  EXPECT_EQ(contents().size(), 1U);
}

TEST_F(MessageLogFilesTest, KeepsTheLinesOfManyThreads) {
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i)
    threads.emplace_back([this] {
      for (int j = 0; j < 50; ++j) write();
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(contents().size(), 1U);
  EXPECT_EQ(contents().begin()->second.size(), 200 * line("text").size());
}

}  // namespace
}  // namespace kyt
