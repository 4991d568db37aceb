#include "platform/linux/system/LogSinks.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <thread>
#include <vector>

#include "platform/linux/system/Files.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/TestJournal.h"

namespace kyt {
namespace {

// A pipe whose packets are single writes.
struct Pipe {
  Pipe() {
    int ends[2];
    EXPECT_EQ(::pipe2(ends, O_CLOEXEC | O_DIRECT), 0);
    in = FileHandle(ends[0]);
    out = FileHandle(ends[1]);
  }
  std::string next() const {
    char buffer[4096];
    const ssize_t count = ::read(in.get(), buffer, sizeof buffer);
    return count > 0 ? std::string(buffer, static_cast<size_t>(count)) : std::string();
  }
  FileHandle in, out;
};

TEST(StderrSink, WritesEachLineAtOnceWithItsLevelInFront) {
  const Pipe pipe;
  StderrSink sink(pipe.out.get());
  sink.write(LogLevel::debug, "operation: text");
  EXPECT_EQ(pipe.next(), "<7>operation: text\n");
  sink.write(LogLevel::normal, "");
  EXPECT_EQ(pipe.next(), "<6>\n");
  sink.write(LogLevel::error, "x");
  EXPECT_EQ(pipe.next(), "<3>x\n");
}

TEST(StderrSink, NobodyCanForgeALine) {
  const Pipe pipe;
  StderrSink sink(pipe.out.get());
  sink.write(LogLevel::normal, "client \"a\n<3>forged\x1b[2J\xff\"");
  EXPECT_EQ(pipe.next(), "<6>client \"a\\n<3>forged\\x1b[2J\\xff\"\n");
}

TEST(StderrSink, LinesOfSeveralThreadsDoNotMix) {
  const Pipe pipe;
  StderrSink sink(pipe.out.get());
  std::vector<std::thread> threads;
  for (char letter : {'a', 'b', 'c'}) {
    threads.emplace_back([&sink, letter] {
      for (int i = 0; i < 20; ++i) sink.write(LogLevel::normal, std::string(200, letter));
    });
  }
  for (int i = 0; i < 60; ++i) {
    const std::string line = pipe.next();
    ASSERT_EQ(line, "<6>" + std::string(200, line[3]) + "\n");
  }
  for (std::thread& thread : threads) thread.join();
}

TEST(StderrSink, AClosedEndLosesTheLineAndNothingElse) {
  StderrSink sink(-1);
  sink.write(LogLevel::error, "x");
}

TEST(JournalSink, SendsTheFieldsOfEachLine) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(inChildProcess([]() -> std::string {
              if (!TestJournal::hideRun()) return "no mount namespace";
              if (JournalSink::isAvailable()) return "a journal without a socket";
              if (dynamic_cast<StderrSink*>(makeLogSink(LogTarget::automatic).get()) == nullptr)
                return "no fallback";
              if (dynamic_cast<StderrSink*>(makeLogSink(LogTarget::journal).get()) == nullptr)
                return "no fallback 2";
              const TestJournal journal;
              if (!journal.isOpen()) return "bind";
              if (!JournalSink::isAvailable()) return "the socket is not seen";
              if (dynamic_cast<StderrSink*>(makeLogSink(LogTarget::standardError).get()) == nullptr)
                return "wrong sink";
              const auto sink = makeLogSink(LogTarget::automatic);
              if (dynamic_cast<JournalSink*>(sink.get()) == nullptr) return "the journal is not used";
              std::string all;
              for (LogLevel level : {LogLevel::debug, LogLevel::normal, LogLevel::error}) {
                sink->write(level, "Class(operation): a\nPRIORITY=0\xff");
                all += journal.nextEntry() + "--\n";
              }
              return all;
            }),
            "MESSAGE=Class(operation): a\\nPRIORITY=0\\xff\nPRIORITY=7\nSYSLOG_IDENTIFIER=kytreportingd\n"
            "KYT_OPERATION=Class(operation)\n--\n"
            "MESSAGE=Class(operation): a\\nPRIORITY=0\\xff\nPRIORITY=6\nSYSLOG_IDENTIFIER=kytreportingd\n"
            "KYT_OPERATION=Class(operation)\n--\n"
            "MESSAGE=Class(operation): a\\nPRIORITY=0\\xff\nPRIORITY=3\nSYSLOG_IDENTIFIER=kytreportingd\n"
            "KYT_OPERATION=Class(operation)\n--\n");
}

}  // namespace
}  // namespace kyt
