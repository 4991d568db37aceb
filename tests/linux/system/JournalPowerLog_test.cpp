#include "platform/linux/system/JournalPowerLog.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/Counters.h"
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

}  // namespace
}  // namespace kyt
