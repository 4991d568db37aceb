// kytsource-boots: how earlier runs of the system ended, told from journals of several runs.
#include "sources/boots/EndedBoots.h"
#include "tests/sources/EventsFile.h"
#include "tests/sources/SourceFixture.h"

namespace kyt {
namespace {

const std::string kFirst(32, 'a'), kSecond(32, 'b'), kThird(32, 'c'), kCurrent(32, 'd');

class BootsSource : public SourceOnAStage {
 protected:
  void SetUp() override {
    if (!WrittenJournal::canBeWritten()) GTEST_SKIP() << "systemd-journal-remote is not installed";
  }
  // A run of the system, an hour long, with that as its last words.
  void run(const std::string& boot, const std::vector<WrittenJournal::Fields>& last = {}) {
    journal_.add(anyLine("it starts"), boot);
    journal_.setNextTime(journal_.nextTime() + 3'600'000'000 - WrittenJournal::kStep * (last.size() + 1));
    for (const auto& entry : last) journal_.add(entry, boot);
    journal_.add(anyLine("its last line"), boot);
  }
  static WrittenJournal::Fields reached(const std::string& target, const std::string& writer = "1") {
    return {{"_PID", writer}, {"MESSAGE_ID", "39f53479d3a045ac8e11786248231fbf"}, {"UNIT", target}};
  }
  static WrittenJournal::Fields kernel(const std::string& line) {
    return {{"_TRANSPORT", "kernel"}, {"MESSAGE", line}};
  }
  std::vector<std::string> reasons(bool watchdogFired = false, uint64_t after = 0) {
    journal_.write();
    const auto ended = sources::endedBoots(journal_.folder(), kCurrent, after, watchdogFired);
    EXPECT_EQ(ended.problem, "");
    std::vector<std::string> reasons;
    for (const auto& boot : ended.boots) reasons.push_back(boot.reason);
    return reasons;
  }
  using Reasons = std::vector<std::string>;
  WrittenJournal journal_;
  TemporaryFolder folder_;
};

TEST_F(BootsSource, TellsTheWaysToEndInOrderApart) {
  run(kFirst, {reached("shutdown.target"), reached("reboot.target")});
  run(kSecond, {reached("poweroff.target"), reached("shutdown.target")});
  run(kThird, {reached("shutdown.target")});
  run(kCurrent);
  EXPECT_EQ(reasons(), (Reasons{"reboot", "power-off", "shutdown"}));
}

TEST_F(BootsSource, TellsAPanicAWatchdogAndAnUncleanEndApart) {
  run(kFirst, {kernel("Kernel panic - not syncing: Fatal exception"), kernel("---[ end Kernel panic")});
  run(kSecond);
  run(kThird);
  run(kCurrent);
  EXPECT_EQ(reasons(true), (Reasons{"panic", "unclean", "watchdog"}));
}

TEST_F(BootsSource, BelievesTheServiceManagerAndTheKernelAlone) {
  run(kFirst, {reached("reboot.target", "4711"), anyLine("Kernel panic - not syncing: said by a program")});
  run(kCurrent);
  EXPECT_EQ(reasons(), Reasons{"unclean"});
}

TEST_F(BootsSource, LeavesOutWhatEndedBefore) {
  run(kFirst, {reached("reboot.target")});
  const uint64_t end = journal_.nextTime() - WrittenJournal::kStep;
  run(kSecond, {reached("halt.target")});
  EXPECT_EQ(reasons(false, end), Reasons{"halt"});
}

TEST_F(BootsSource, KnowsHowLongARunLasted) {
  run(kFirst);
  journal_.write();
  const auto ended = sources::endedBoots(journal_.folder(), kCurrent, 0, false);
  ASSERT_EQ(ended.boots.size(), 1U);
  EXPECT_NEAR(static_cast<double>(ended.boots[0].ended - ended.boots[0].began), 3.6e9, 1e6);
}

TEST_F(BootsSource, ReportsEachRunOnceWithTheFieldsThatItsEventsFileNames) {
  lay("boots", "gelmar");
  folder_.write("root/sys/class/watchdog/watchdog0/bootstatus", "0x20\n");
  const auto start = [&](const std::string& boot) {
    return SourceOnAStage::run({"--journal", journal_.folder(), "--state", folder_ / "state", "--root",
                                folder_ / "root", "--boot", boot});
  };
  run(kFirst, {reached("reboot.target")});
  journal_.add(anyLine("it starts"), kSecond);
  journal_.write();
  // The first start tells nothing of what was before.
  EXPECT_EQ(start(kSecond).status, 0);
  EXPECT_EQ(arrived(303, 1).size(), 1U);
  EXPECT_EQ(start(kSecond).status, 0);
  run(kSecond);
  journal_.add({{"_PID", "1"},
                {"MESSAGE_ID", "b07a249cd024414a82dd00cd181378ff"},
                {"KERNEL_USEC", "1500000"},
                {"USERSPACE_USEC", "2500000"}},
               kThird);
  journal_.write();
  EXPECT_EQ(start(kThird).status, 0);
  EXPECT_EQ(start(kThird).status, 0);
  const auto events = arrived(303, 3);
  ASSERT_EQ(events.size(), 3U);
  int ends = 0, startups = 0;
  for (const Dictionary& event : events) {
    const Dictionary& record = *event.dictionary("record");
    for (const std::string& name :
         declaredFields("boots", 303, static_cast<uint32_t>(event.integer("status"))))
      EXPECT_TRUE(record.contains(name) || name == "startupMilliseconds") << name;
    if (record.contains("reason")) {
      ++ends;
      EXPECT_EQ(*record.string("reason"), "watchdog");
    }
    if (record.integer("startupMilliseconds") == 4000) ++startups;
    EXPECT_EQ(description(Value(event)).find(kSecond), std::string::npos);
  }
  EXPECT_EQ(ends, 1);
  EXPECT_EQ(startups, 1);
}

TEST_F(BootsSource, KeepsItsPlaceWhereThereIsNoDaemon) {
  run(kFirst);
  journal_.write();
  const ProgramRun source =
      runProgram(std::string(KYT_PROGRAMS) + "/kytsource-boots",
                 {"--journal", journal_.folder(), "--state", folder_ / "state", "--boot", kCurrent, "--once",
                  "--patience", "1", "--socket", folder_ / "none"});
  EXPECT_EQ(source.status, 1);
  EXPECT_EQ(source.text,
            "kytsource-boots: the report waits: " + (folder_ / "none") + ": No such file or directory\n");
  EXPECT_FALSE(std::filesystem::exists(folder_ / "state"));
}

}  // namespace
}  // namespace kyt
