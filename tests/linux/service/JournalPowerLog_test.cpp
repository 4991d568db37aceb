#include "platform/linux/service/JournalPowerLog.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <memory>
#include <string>

#include "platform/base/Counters.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/DocumentBlock.h"
#include "tests/support/TestJournal.h"

namespace kyt {
namespace {

TEST(JournalPowerLog, WritesAnEntryWhereThereIsAJournalAndCountsWhereThereIsNone) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(inChildProcess([]() -> std::string {
              if (!TestJournal::hideRun()) return "no mount namespace";
              Counters counters;
              JournalPowerLog log(counters);
              // The worked example of docs/WIRE-POWERLOG.md, as its back end hands it over.
              const Dictionary event{
                  {"note", "two\nlines"}, {"ratio", 0.25}, {"method", 2u}, {"respCode", 3u}, {"event", 4u}};
              log.registeredEvent(28, "Medsrv-KYT", event);
              if (counters.value(Reason::powerLogUnavailable) != 1) return "not counted";
              const TestJournal journal;
              if (!journal.isOpen()) return "bind";
              log.registeredEvent(28, "Medsrv-KYT", event);
              const std::string entry = journal.nextEntry();
              return counters.value(Reason::powerLogUnavailable) == 1 ? entry : "counted";
            }),
            documentBlock("WIRE-POWERLOG.md", "text entry") + "\n");
}

TEST(JournalPowerLog, NobodyWaitsForAJournalThatIsStopped) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withAJournal([](std::unique_ptr<TestJournal>& journal) -> std::string {
              constexpr uint64_t kEvents = 5000;
              Counters counters;
              JournalPowerLog log(counters, 2000);
              for (uint64_t i = 0; i < kEvents; ++i) log.registeredEvent(28, std::to_string(i), {});
              const uint64_t dropped = counters.value(Reason::powerLogEventDropped);
              if (dropped == 0) return "all had room";
              for (uint64_t i = 0; i < kEvents - dropped; ++i) {
                const std::string message = messageOf(journal->nextEntry());
                if (message != "MESSAGE=Power-log event " + std::to_string(i) + " of agent 28")
                  return std::to_string(i) + ": " + message;
              }
              if (counters.value(Reason::powerLogUnavailable) != 0) return "taken for a journal that is gone";
              const std::string told = messageOf(journal->nextEntry());
              return told == "MESSAGE=power log: " + std::to_string(dropped) +
                                 " events were dropped, since the journal did not take them"
                         ? ""
                         : told;
            }),
            "");
}

TEST(JournalPowerLog, EndsThoughTheJournalIsStopped) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withAJournal([](std::unique_ptr<TestJournal>&) -> std::string {
              Counters counters;
              JournalPowerLog log(counters);
              for (int i = 0; i < 5000; ++i) log.registeredEvent(28, "event", {});
              return "";
            }),
            "");
}

TEST(JournalPowerLog, FindsAJournalThatWasStartedAnewAndCountsWhatCameMeanwhile) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withAJournal([](std::unique_ptr<TestJournal>& journal) -> std::string {
              Counters counters;
              JournalPowerLog log(counters);
              log.registeredEvent(28, "first", {});
              std::string all = messageOf(journal->nextEntry());
              journal = nullptr;
              log.registeredEvent(28, "meanwhile", {});
              if (::unlink("/run/systemd/journal/socket") != 0) return "unlink";
              log.registeredEvent(28, "still", {});
              journal = std::make_unique<TestJournal>();
              log.registeredEvent(28, "second", {});
              all += ", " + messageOf(journal->nextEntry());
              return all + ", " + std::to_string(counters.value(Reason::powerLogUnavailable));
            }),
            "MESSAGE=Power-log event first of agent 28, MESSAGE=Power-log event second of agent 28, 2");
}

TEST(JournalPowerLog, SendsAnEventThatIsTooLargeForTheJournalsSocketInAFileOfMemory) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withAJournal([](std::unique_ptr<TestJournal>& journal) -> std::string {
              Counters counters;
              JournalPowerLog log(counters);
              const std::string large(1000000, 'x');
              log.registeredEvent(28, "large", {{"text", large}});
              const std::string entry = journal->nextEntryInFile();
              if (entry.find("\nKYT_DICTIONARY={\"text\":\"" + large + "\"}\n") == std::string::npos)
                return "not complete: " + entry.substr(0, 200);
              log.registeredEvent(28, "larger than what may wait", {{"text", large + large}});
              if (counters.value(Reason::powerLogEventDropped) != 1) return "not counted";
              log.registeredEvent(28, "next", {});
              std::string all = messageOf(entry);
              for (int i = 0; i < 2; ++i) all += ", " + messageOf(journal->nextEntry());
              return all;
            }),
            "MESSAGE=Power-log event large of agent 28, MESSAGE=Power-log event next of agent 28, "
            "MESSAGE=power log: 1 events were dropped, since the journal did not take them");
}

TEST(JournalPowerLog, KeepsTheNameOfAnEventOnItsLine) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(withAJournal([](std::unique_ptr<TestJournal>& journal) -> std::string {
              Counters counters;
              JournalPowerLog log(counters);
              log.registeredEvent(1, "a\nPRIORITY=0", {});
              return journal->nextEntry();
            }),
            "MESSAGE=Power-log event a\\nPRIORITY=0 of agent 1\nPRIORITY=6\nSYSLOG_IDENTIFIER=kytreportingd\n"
            "KYT_AGENT=1\nKYT_EVENT=a\\nPRIORITY=0\nKYT_DICTIONARY={}\n");
}

}  // namespace
}  // namespace kyt
