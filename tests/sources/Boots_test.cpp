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
    const auto ended = sources::endedBoots(journal_.folder(), kCurrent, after,
                                           {watchdogFired, sources::panicDumps(folder_ / "root")});
    EXPECT_EQ(ended.problem, "");
    std::vector<std::string> reasons;
    for (const auto& boot : ended.boots) reasons.push_back(boot.reason);
    return reasons;
  }
  // A dump of a dying kernel's, of a time in microseconds since 1970.
  void dump(const std::string& file, const std::string& text, uint64_t time) {
    const std::filesystem::path path = folder_ / ("root/" + file);
    std::filesystem::create_directories(path.parent_path());
    folder_.write("root/" + file, text);
    const std::chrono::sys_time<std::chrono::microseconds> when{std::chrono::microseconds(time)};
    std::filesystem::last_write_time(path, std::chrono::file_clock::from_sys(when));
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

TEST_F(BootsSource, FindsThePanicOfTheRunInWhichItsDumpWasWritten) {
  run(kFirst);
  run(kSecond);
  const uint64_t end = journal_.nextTime();
  run(kThird, {reached("reboot.target")});
  journal_.setNextTime(journal_.nextTime() + 60'000'000);
  run(kCurrent);
  dump("sys/fs/pstore/dmesg-efi_pstore-1", "Panic#1 Part1\n<0>Kernel panic - not syncing\n", end + 500);
  EXPECT_EQ(reasons(), (Reasons{"unclean", "unclean", "reboot"})) << "the reboot went through";
  dump("sys/fs/pstore/dmesg-efi_pstore-2", "Panic#1 Part1\n", end - 500);
  EXPECT_EQ(reasons(), (Reasons{"unclean", "panic", "reboot"}));
  dump("sys/fs/pstore/dmesg-efi_pstore-3", "Panic#2 Part1\n", WrittenJournal::kBegin - 1);
  EXPECT_EQ(reasons(), (Reasons{"unclean", "panic", "reboot"})) << "older than all";
}

TEST_F(BootsSource, TellsAPanicOnTheWayToAnOrderlyEnd) {
  run(kFirst, {reached("shutdown.target"), reached("reboot.target"), kernel("Kernel panic - not syncing")});
  run(kSecond, {reached("reboot.target")});
  const uint64_t end = journal_.nextTime();
  journal_.setNextTime(end + 60'000'000);
  run(kThird, {reached("poweroff.target")});
  run(kCurrent);
  EXPECT_EQ(reasons(), (Reasons{"panic", "reboot", "power-off"}));
  dump("sys/fs/pstore/dmesg-efi_pstore-1", "Panic#1 Part1\n", end + 30'000'000);
  EXPECT_EQ(reasons(), (Reasons{"panic", "panic", "power-off"}));
  dump("sys/fs/pstore/dmesg-ramoops-0", "Panic#1 Part1\n", 0);
  EXPECT_EQ(reasons(), (Reasons{"panic", "panic", "panic"}));
}

TEST_F(BootsSource, TellsAHangOnTheWayToAnOrderlyEndThatAWatchdogEnded) {
  run(kFirst, {reached("reboot.target")});
  run(kSecond, {reached("shutdown.target"), reached("reboot.target")});
  run(kCurrent);
  EXPECT_EQ(reasons(true), (Reasons{"reboot", "watchdog"}));
}

TEST_F(BootsSource, TakesADumpWithoutATimeForTheLastRuns) {
  run(kFirst);
  run(kSecond);
  run(kCurrent);
  dump("sys/fs/pstore/dmesg-ramoops-0", "Panic#1 Part1\n", 0);
  EXPECT_EQ(reasons(), (Reasons{"unclean", "panic"}));
}

TEST_F(BootsSource, FindsThePanicWhoseDumpWasMovedInThisRun) {
  run(kFirst);
  run(kSecond);
  const uint64_t began = journal_.nextTime();
  run(kCurrent);
  dump("var/lib/systemd/pstore/1/001/dmesg-efi_pstore-1", "Panic#1 Part1\n", began - 1);
  EXPECT_EQ(reasons(), (Reasons{"unclean", "unclean"})) << "moved in a run before: told then";
  dump("var/lib/systemd/pstore/2/001/dmesg-efi_pstore-1", "Panic#1 Part1\n", began + 1);
  EXPECT_EQ(reasons(), (Reasons{"unclean", "panic"}));
}

TEST_F(BootsSource, TakesNothingElseInPersistentMemoryForAPanic) {
  run(kFirst);
  run(kCurrent);
  dump("sys/fs/pstore/dmesg-erst-1", "Oops#1 Part1\n<1>BUG: Kernel panic is not what this is\n", 0);
  dump("sys/fs/pstore/dmesg-erst-2", "", 0);
  dump("sys/fs/pstore/dmesg-erst-3.enc.z", std::string("\x1f\x8b Panic#1", 11), 0);
  dump("sys/fs/pstore/console-ramoops-0", "Panic#1 Part1\n", 0);
  std::filesystem::create_directory(folder_ / "root/sys/fs/pstore/dmesg-folder");
  std::filesystem::create_symlink(folder_ / "nowhere", folder_ / "root/sys/fs/pstore/dmesg-link");
  EXPECT_EQ(reasons(), Reasons{"unclean"});
}

// What the unit runs as root before the source, with other folders in the place of the machine's.
TEST_F(BootsSource, GetsTheFirstLineOfEachDumpFromItsUnit) {
  const std::string unit = std::get<std::string>(
      tools::readFile(std::string(KYT_SOURCE_DIR) + "/packaging/systemd/kytsource-boots.service.in"));
  const std::string begin = "ExecStartPre=-+/bin/sh -c '";
  const size_t at = unit.find(begin);
  ASSERT_NE(at, std::string::npos);
  std::string script = unit.substr(at + begin.size(), unit.find("'\n", at) - at - begin.size());
  const auto replaceAll = [&script](const std::string& what, const std::string& with) {
    ASSERT_NE(script.find(what), std::string::npos) << what;
    for (size_t i = script.find(what); i != std::string::npos; i = script.find(what, i + with.size()))
      script.replace(i, what.size(), with);
  };
  replaceAll("$$", "$");
  replaceAll("%%", "%");
  replaceAll("cd / ", "cd '" + (folder_ / "root") + "' ");
  replaceAll("/run/kytsource-boots", folder_ / "copies");

  run(kFirst);
  run(kSecond);
  const uint64_t between = journal_.nextTime();
  run(kThird);
  run(kCurrent);
  journal_.write();
  dump("sys/fs/pstore/dmesg-efi_pstore-1", "Panic#1 Part1\n<6>the user's secrets\n", between - 500);
  dump("var/lib/systemd/pstore/1/001/dmesg-efi_pstore-2", "Oops#1 Part1\n", between);
  const ProgramRun copied = runProgram("sh", {"-c", script});
  EXPECT_EQ(copied.status, 0) << copied.text;
  EXPECT_EQ(folder_.read("copies/sys/fs/pstore/dmesg-efi_pstore-1"), "Panic#1 Part1\n");
  EXPECT_EQ(folder_.read("copies/var/lib/systemd/pstore/1/001/dmesg-efi_pstore-2"), "Oops#1 Part1\n");
  const auto panics = sources::panicDumps(folder_ / "copies");
  EXPECT_EQ(panics.written, std::vector<uint64_t>{between - 500});
  EXPECT_EQ(panics.moved, std::vector<uint64_t>{});
  std::filesystem::remove_all(folder_ / "root/sys");
  std::filesystem::remove_all(folder_ / "root/var");
  const ProgramRun none = runProgram("sh", {"-c", script});
  EXPECT_EQ(none.status, 0) << "most machines have no dumps";
  EXPECT_EQ(none.text, "");
  EXPECT_FALSE(std::filesystem::exists(folder_ / "copies"));
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
  const auto ended = sources::endedBoots(journal_.folder(), kCurrent, 0, {});
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

TEST_F(BootsSource, ReportsTheLatestHundredOfMoreRuns) {
  lay("boots", "gelmar");
  const auto start = [&](const std::string& boot) {
    return SourceOnAStage::run({"--journal", journal_.folder(), "--state", folder_ / "state", "--root",
                                folder_ / "root", "--boot", boot})
        .status;
  };
  run(kFirst);
  journal_.write();
  EXPECT_EQ(start(kFirst), 0);
  constexpr int kRuns = 102, kMost = 100;
  for (int i = 0; i < kRuns; ++i) run(std::string(29, 'e') + std::to_string(i + 100));
  journal_.write();
  EXPECT_EQ(start(kSecond), 0);
  // The first start, those, and the second start. What was left out, the first run and two more, is not told later.
  EXPECT_EQ(arrived(303, 1 + kMost + 1).size(), static_cast<size_t>(1 + kMost + 1));
  std::set<int64_t> ends;
  for (const Dictionary& event : arrived(303, 1))
    if (const Dictionary& record = *event.dictionary("record"); record.contains("ended"))
      ends.insert(record.integer("ended"));
  EXPECT_EQ(ends.size(), static_cast<size_t>(kMost));
  EXPECT_NEAR(static_cast<double>(*ends.rbegin() - *ends.begin()), (kMost - 1) * 3600.0, 1);
  EXPECT_EQ(start(kSecond), 0);
  EXPECT_EQ(arrived(303, 1).size(), static_cast<size_t>(1 + kMost + 1));
}

TEST_F(BootsSource, ReportsOnceTheDaemonHasAStorebagWhatItFoundBefore) {
  lay("boots", "gelmar");
  run(kFirst);
  journal_.write();
  const auto start = [&] {
    return SourceOnAStage::run({"--journal", journal_.folder(), "--state", folder_ / "state", "--boot",
                                kSecond, "--patience", "60"});
  };
  // As on a device that starts before its network does.
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/bags/tolvar/gelmar","close":true,"times":0})"));
  const ProgramRun early = start();
  EXPECT_EQ(early.status, 1);
  EXPECT_NE(early.text.find("the report waits: "), std::string::npos) << early.text;
  EXPECT_NE(early.text.find("storebag"), std::string::npos) << early.text;
  EXPECT_FALSE(std::filesystem::exists(folder_ / "state"));
  ASSERT_TRUE(stage_->control("/control/reset", ""));
  // The daemon does not ask again for a quarter of an hour; a fresh one does.
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  ASSERT_FALSE(stage_->startDaemon());
  const ProgramRun later = start();
  EXPECT_EQ(later.status, 0) << later.text;
  EXPECT_EQ(arrived(303, 1).size(), 1U);
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
