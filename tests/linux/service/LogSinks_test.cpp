#include "platform/linux/service/LogSinks.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <iterator>
#include <memory>
#include <thread>
#include <vector>

#include "platform/linux/files/Files.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/TestJournal.h"

namespace kyt {
namespace {

// A pipe whose packets are single writes.
struct Pipe {
  Pipe() {
    int ends[2];
    EXPECT_EQ(::pipe2(ends, O_CLOEXEC | O_DIRECT), 0);
    in = ownDescriptor(ends[0]);
    out = ownDescriptor(ends[1]);
  }
  std::string next() const {
    char buffer[4096];
    const ssize_t count = ::read(in.get(), buffer, sizeof buffer);
    return count > 0 ? std::string(buffer, static_cast<size_t>(count)) : std::string();
  }
  Descriptor in, out;
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

// A pipe that is full, as when nobody reads it.
struct FullPipe {
  FullPipe() {
    int ends[2];
    EXPECT_EQ(::pipe2(ends, O_CLOEXEC | O_NONBLOCK), 0);
    in = ownDescriptor(ends[0]);
    out = ownDescriptor(ends[1]);
    while (::write(out.get(), "-", 1) == 1) {
    }
    EXPECT_EQ(::fcntl(out.get(), F_SETFL, 0), 0);
  }
  // All that is read up to a line that has this text in it, without what filled the pipe.
  std::string linesUntil(const std::string& text) const {
    std::string all;
    const bool came = eventually([&] {
      char buffer[4096];
      const ssize_t count = ::read(in.get(), buffer, sizeof buffer);
      if (count > 0) all.append(buffer, static_cast<size_t>(count));
      const size_t found = all.find(text);
      return found != std::string::npos && all.find('\n', found) != std::string::npos;
    });
    EXPECT_TRUE(came) << all;
    all.erase(0, all.find_first_not_of('-'));
    return all;
  }
  Descriptor in, out;
};

TEST(PatientStderrSink, WritesAtOnceWhatHasRoom) {
  const Pipe pipe;
  Counters counters;
  PatientStderrSink sink(counters, pipe.out.get());
  sink.write(LogLevel::normal, "client \"a\n<3>forged\"");
  EXPECT_EQ(pipe.next(), "<6>client \"a\\n<3>forged\"\n");
  sink.write(LogLevel::error, "x");
  EXPECT_EQ(pipe.next(), "<3>x\n");
}

TEST(PatientStderrSink, NobodyWaitsForWhoeverReads) {
  const FullPipe pipe;
  Counters counters;
  PatientStderrSink sink(counters, pipe.out.get(), 1000);
  sink.allowThreads();
  for (int i = 0; i < 200; ++i) sink.write(LogLevel::normal, "line " + std::to_string(100 + i));
  const uint64_t dropped = counters.value(Reason::logLineDropped);
  EXPECT_GE(dropped, 100u);
  EXPECT_LT(dropped, 200u);
  const std::string told =
      "<3>log: " + std::to_string(dropped) + " lines were dropped, since nobody read them\n";
  const std::string all = pipe.linesUntil("dropped");
  std::string expected;
  for (uint64_t i = 0; i < 200 - dropped; ++i) expected += "<6>line " + std::to_string(100 + i) + "\n";
  EXPECT_EQ(all, expected + told) << "in their order, and what is missing";
}

TEST(PatientStderrSink, MakesNoThreadBeforeItMay) {
  const FullPipe pipe;
  Counters counters;
  PatientStderrSink sink(counters, pipe.out.get());
  sink.write(LogLevel::normal, "first");
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator("/proc/self/task"), {}), 1);
  char buffer[4096];
  while (::read(pipe.in.get(), buffer, sizeof buffer) > 0) {
  }
  sink.write(LogLevel::normal, "second");
  EXPECT_EQ(pipe.linesUntil("second"), "<6>first\n<6>second\n");
}

TEST(PatientStderrSink, EndsThoughNobodyReads) {
  const FullPipe pipe;
  Counters counters;
  {
    PatientStderrSink sink(counters, pipe.out.get());
    sink.allowThreads();
    sink.write(LogLevel::normal, "lost");
  }
  EXPECT_EQ(pipe.linesUntil("lost"), "<6>lost\n") << "its thread still writes it once somebody reads";
}

TEST(JournalSink, SendsTheFieldsOfEachLine) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(
      inChildProcess([]() -> std::string {
        Counters counters;
        if (!TestJournal::hideRun()) return "no mount namespace";
        if (JournalSink::isAvailable()) return "a journal without a socket";
        if (dynamic_cast<PatientStderrSink*>(makeLogSink(LogTarget::automatic, counters).get()) == nullptr)
          return "no fallback";
        if (dynamic_cast<PatientStderrSink*>(makeLogSink(LogTarget::journal, counters).get()) == nullptr)
          return "no fallback 2";
        const TestJournal journal;
        if (!journal.isOpen()) return "bind";
        if (!JournalSink::isAvailable()) return "the socket is not seen";
        if (dynamic_cast<PatientStderrSink*>(makeLogSink(LogTarget::standardError, counters).get()) ==
            nullptr)
          return "wrong sink";
        const auto sink = makeLogSink(LogTarget::automatic, counters);
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

TEST(JournalSink, NobodyWaitsForAJournalThatIsStopped) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withAJournal([](std::unique_ptr<TestJournal>& journal) -> std::string {
              constexpr uint64_t kLines = 5000;
              Counters counters;
              const auto sink = JournalSink::open(counters, "k", 1000);
              sink->allowThreads();
              for (uint64_t i = 0; i < kLines; ++i)
                sink->write(LogLevel::normal, "line " + std::to_string(i));
              const uint64_t dropped = counters.value(Reason::logLineDropped);
              if (dropped == 0) return "all had room";
              for (uint64_t i = 0; i < kLines - dropped; ++i) {
                const std::string message = messageOf(journal->nextEntry());
                if (message != "MESSAGE=line " + std::to_string(i)) return std::to_string(i) + ": " + message;
              }
              const std::string told = messageOf(journal->nextEntry());
              return told == "MESSAGE=log: " + std::to_string(dropped) +
                                 " lines were dropped, since nobody read them"
                         ? ""
                         : told;
            }),
            "");
}

TEST(JournalSink, EndsThoughTheJournalIsStopped) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withAJournal([](std::unique_ptr<TestJournal>&) -> std::string {
              Counters counters;
              const auto sink = JournalSink::open(counters);
              sink->allowThreads();
              for (int i = 0; i < 5000; ++i) sink->write(LogLevel::normal, "line");
              return "";
            }),
            "");
}

// What `work` says in a process that finds a journal of its own, with a sink for that, and a pipe as standard error.
std::string withASink(
    const std::function<std::string(std::unique_ptr<TestJournal>&, JournalSink&, const Pipe&)>& work) {
  return withAJournal([&](std::unique_ptr<TestJournal>& journal) -> std::string {
    const Pipe standardError;
    if (::dup2(standardError.out.get(), 2) != 2) return "dup2";
    Counters counters;
    return work(journal, *JournalSink::open(counters), standardError);
  });
}

TEST(JournalSink, WritesToStandardErrorWhatIsTooLargeForTheJournalsSocket) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withASink([](std::unique_ptr<TestJournal>& journal, JournalSink& sink,
                         const Pipe& standardError) -> std::string {
              sink.write(LogLevel::error, std::string(1000000, 'x'));
              sink.write(LogLevel::normal, "next");
              return standardError.next().substr(0, 5) + messageOf(journal->nextEntry());
            }),
            "<3>xxMESSAGE=next");
}

TEST(JournalSink, FindsAJournalThatWasStartedAnewAndMeanwhileWritesToStandardError) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withASink([](std::unique_ptr<TestJournal>& journal, JournalSink& sink,
                         const Pipe& standardError) -> std::string {
              sink.write(LogLevel::normal, "first");
              std::string all = messageOf(journal->nextEntry()) + ", ";
              journal = nullptr;
              sink.write(LogLevel::error, "meanwhile\n");
              sink.write(LogLevel::debug, "still");
              all += standardError.next();
              all += standardError.next();
              if (::unlink("/run/systemd/journal/socket") != 0) return "unlink";
              journal = std::make_unique<TestJournal>();
              sink.write(LogLevel::normal, "second");
              return all + messageOf(journal->nextEntry());
            }),
            "MESSAGE=first, <3>meanwhile\\n\n<7>still\nMESSAGE=second");
}

}  // namespace
}  // namespace kyt
