// kytsource-units in front of a real daemon and a server.
#include "sources/units/UnitFindings.h"

#include <sys/resource.h>

#include <chrono>

#include "tests/sources/EventsFile.h"
#include "tests/sources/SourceFixture.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

class UnitsSource : public SourceOnAStage {
 protected:
  void SetUp() override {
    if (!WrittenJournal::canBeWritten()) GTEST_SKIP() << "systemd-journal-remote is not installed";
    folder_.write("units/cron.service", "");
    folder_.write("state", "1\n@1\n");
  }
  [[nodiscard]] std::vector<std::string> arguments() const {
    return {"--journal",    journal_.folder(), "--state",    folder_ / "state",
            "--units-from", folder_ / "units", "--packages", folder_ / "none"};
  }
  [[nodiscard]] std::vector<Dictionary> arrivedUnits(int count) const { return arrived(301, count); }
  WrittenJournal journal_;
  TemporaryFolder folder_;
};

TEST_F(UnitsSource, ReportsToTheServerWhatFailedOnceAndNothingOfWhoseNameNobodyKnows) {
  lay("units", "emrit");
  journal_.add(failureOf("cron.service"));
  journal_.add(failureOf("backup-alice.service"));
  journal_.add(restartOf("cron.service"));
  journal_.write();
  EXPECT_EQ(run(arguments()).status, 0);
  ASSERT_EQ(arrivedUnits(3).size(), 3U);
  for (const Dictionary& event : arrivedUnits(3))
    EXPECT_EQ(description(Value(event)).find("alice"), std::string::npos) << description(Value(event));
  // Nothing is told again.
  EXPECT_EQ(run(arguments()).status, 0);
  journal_.add(failureOf("cron.service", "timeout"));
  journal_.write();
  EXPECT_EQ(run(arguments()).status, 0);
  EXPECT_EQ(arrivedUnits(4).size(), 4U);
}

TEST_F(UnitsSource, SendsNothingWithoutTheOwnersConsentAndDoesNotKeepItForLater) {
  lay("units", "emrit", false);
  journal_.add(failureOf("cron.service"));
  journal_.write();
  EXPECT_EQ(run(arguments()).status, 0);
  EXPECT_EQ(folder_.read("state").substr(0, 2), "2\n");
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  EXPECT_EQ(stage_->query("/api/totals").dictionary()->integer("posts"), 0);
}

TEST_F(UnitsSource, SaysThatThereIsNoDaemonAndKeepsItsPlace) {
  journal_.add(failureOf("cron.service"));
  journal_.write();
  auto all = arguments();
  all.insert(all.end(), {"--once", "--patience", "1", "--socket", folder_ / "none"});
  const ProgramRun run = runProgram(std::string(KYT_PROGRAMS) + "/kytsource-units", all);
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.text, "kytsource-units: what was found waits, summed up: " + (folder_ / "none") +
                          ": No such file or directory\n");
  EXPECT_EQ(folder_.read("state"), "1\n@1\n");
}

TEST_F(UnitsSource, FollowsTheJournalUntilItIsToldToEndAndReportsThenWhatItFound) {
  lay("units", "emrit");
  journal_.add(anyLine("nothing"));
  journal_.write();
  auto all = arguments();
  all.insert(all.end(), {"--period", "1", "--socket", stage_->socketPath()});
  tools::ChildProcess::Options how;
  how.outputFile = folder_ / "output";
  auto source = tools::ChildProcess::start(stage_->program("kytsource-units"), all, how);
  ASSERT_TRUE(source);
  journal_.add(failureOf("cron.service"));
  journal_.write();
  EXPECT_EQ(arrivedUnits(1).size(), 1U) << folder_.read("output");
  source->signal(SIGTERM);
  EXPECT_EQ(source->wait(std::chrono::seconds(60)), 0) << folder_.read("output");
  EXPECT_EQ(folder_.read("output"), "");
}

TEST_F(UnitsSource, ReportsTheFieldsThatItsEventsFileNames) {
  const auto finder = sources::unitsProgram().finder({{folder_ / "units"}, {}, {}});
  sources::Summary summary(sources::unitsProgram().category);
  for (const auto& entry : {failureOf("cron.service"), restartOf("cron.service")}) {
    const auto finding = finder([&](const char* name) {
      for (const auto& [key, value] : entry)
        if (key == name) return value;
      return std::string();
    });
    ASSERT_TRUE(finding);
    summary.add(finding->type, finding->fields, 1);
  }
  summary.addUnread(1);
  const auto events = summary.events(1);
  ASSERT_EQ(events.size(), 3U);
  for (const auto& event : events) {
    EXPECT_EQ(fieldsOf(event.payload), declaredFields("units", event.category, event.type)) << event.type;
    EXPECT_EQ(misdeclaredFields("units", event.category, event.type, event.payload), FieldNames())
        << event.type;
  }
}

// Of all children that were waited for.
std::chrono::microseconds processorTimeOfChildren() {
  rusage used = {};
  ::getrusage(RUSAGE_CHILDREN, &used);
  return std::chrono::seconds(used.ru_utime.tv_sec + used.ru_stime.tv_sec) +
         std::chrono::microseconds(used.ru_utime.tv_usec + used.ru_stime.tv_usec);
}

// Ten seconds of ten thousand entries each, all there at once, and every one a failure: more than it reads in this time.
TEST_F(UnitsSource, SpendsAHundredthOfAProcessorOnAFloodAndPassesOneEventOn) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer has costs of its own";
  constexpr int kFlood = 100'000;
  lay("units", "emrit");
  journal_.add(anyLine("nothing"));
  journal_.write();
  // What it takes to start, to find nothing, and to end.
  auto all = arguments();
  const auto atFirst = processorTimeOfChildren();
  EXPECT_EQ(run(all).status, 0);
  const auto starting = processorTimeOfChildren() - atFirst;

  for (int i = 0; i < kFlood; ++i) journal_.add(failureOf("cron.service"));
  journal_.write();
  all.insert(all.end(), {"--period", "20", "--socket", stage_->socketPath()});
  tools::ChildProcess::Options how;
  how.outputFile = folder_ / "output";
  const auto before = processorTimeOfChildren();
  const auto began = std::chrono::steady_clock::now();
  auto source = tools::ChildProcess::start(stage_->program("kytsource-units"), all, how);
  ASSERT_TRUE(source);
  const auto events = arrivedUnits(1);
  source->signal(SIGTERM);
  EXPECT_EQ(source->wait(std::chrono::seconds(60)), 0) << folder_.read("output");
  const auto elapsed =
      std::chrono::duration_cast<std::chrono::microseconds>(std::chrono::steady_clock::now() - began);
  const auto spent = processorTimeOfChildren() - before;
  EXPECT_LT((spent - starting).count(), elapsed.count() / 100)
      << "starting takes " << starting.count() << " us, all took " << spent.count() << " us";
  ASSERT_EQ(events.size(), 1U);
  const int count = events.front().dictionary("record")->integer("count");
  EXPECT_GT(count, 1000);
  EXPECT_LT(count, kFlood) << "all of the flood was read: that shows nothing of its share";
}

}  // namespace
}  // namespace kyt
