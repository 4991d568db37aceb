// kytsource-crashes: what it takes from an entry of systemd-coredump, and what it never does.
#include "sources/crashes/CrashFindings.h"

#include <unistd.h>

#include "tests/sources/EventsFile.h"
#include "tests/sources/SourceFixture.h"

namespace kyt {
namespace {

// As systemd-coredump writes it, with everything that must stay.
WrittenJournal::Fields crashOf(const std::string& program,
                               const std::string& writer = "systemd-coredump@0-1-0.service",
                               const std::string& slice = "system-systemd\\x2dcoredump.slice") {
  return {{"MESSAGE_ID", "fc2e22bc6ee647b6b90729ab34a250b1"},
          {"_SYSTEMD_UNIT", writer},
          {"_SYSTEMD_SLICE", slice},
          {"COREDUMP_EXE", program},
          {"COREDUMP_COMM", "alices-thread"},
          {"COREDUMP_CMDLINE", "tool --password=alice /home/alice-1/letter"},
          {"COREDUMP_ENVIRON", "HOME=/home/alice"},
          {"COREDUMP_CWD", "/home/alice"},
          {"COREDUMP_HOSTNAME", "alices-machine"},
          {"COREDUMP_UID", "1000"},
          {"COREDUMP_SIGNAL", "11"},
          {"COREDUMP_UNIT", "user@1000.service"},
          {"MESSAGE", "Process 4711 (tool) of user 1000 dumped core. Stack of alice"}};
}

class CrashesSource : public SourceOnAStage {
 protected:
  void SetUp() override { folder_.write("units/user@.service", ""); }
  [[nodiscard]] std::optional<sources::Finding> find(const WrittenJournal::Fields& entry) const {
    return sources::crashesProgram().finder({{folder_ / "units"}, {}, {}})([&](const char* name) {
      for (const auto& [key, value] : entry)
        if (key == name) return value;
      return std::string();
    });
  }
  TemporaryFolder folder_;
};

TEST_F(CrashesSource, TakesProgramUnitAndSignalAndNothingElse) {
  const auto finding = find(crashOf("/usr/bin/env"));
  ASSERT_TRUE(finding);
  EXPECT_EQ(finding->fields,
            (Dictionary{{"program", "/usr/bin/env"}, {"unit", "user@.service"}, {"signal", 11}}));
}

TEST_F(CrashesSource, NamesNoProgramThatIsNotTheSystems) {
  for (const char* program : {"/home/alice-1/tool", "/usr/local/bin/alice", "/usr/bin/no-such-program", ""}) {
    const auto finding = find(crashOf(program));
    ASSERT_TRUE(finding);
    EXPECT_EQ(*finding->fields.string("program"), "(local)") << program;
  }
}

TEST_F(CrashesSource, TakesNoEntryThatSomebodyElseWrote) {
  EXPECT_FALSE(find(crashOf("/usr/bin/env", "user@1000.service")));
  EXPECT_FALSE(find(crashOf("/usr/bin/env", "")));
}

// A read costs processor time, of which a look has little: who can make it read can keep it from the true ones.
TEST_F(CrashesSource, ReadsNoEntryThatAnybodyElseWroteUnderTheSameIdentifier) {
  if (!WrittenJournal::canBeWritten()) GTEST_SKIP() << "systemd-journal-remote is not installed";
  WrittenJournal journal;
  for (int i = 0; i < 100; ++i) journal.add(crashOf("/usr/bin/env", "user@1000.service", "user-1000.slice"));
  journal.add(crashOf("/usr/bin/env"));
  journal.write("user-1000.journal");
  const auto program = sources::crashesProgram();
  auto opened = sources::Journal::open({journal.folder(), program.systemAlone, program.matches});
  ASSERT_TRUE(std::holds_alternative<std::unique_ptr<sources::Journal>>(opened));
  sources::Journal& read = *std::get<std::unique_ptr<sources::Journal>>(opened);
  read.goToTime(0);
  ASSERT_TRUE(read.next());
  EXPECT_EQ(read.field("_SYSTEMD_UNIT"), "systemd-coredump@0-1-0.service");
  EXPECT_FALSE(read.next());
}

TEST_F(CrashesSource, TakesWhatIsNoSignalAsNone) {
  for (const char* text : {"", "x", "-1", "99999999999", "65"}) {
    auto entry = crashOf("/usr/bin/env");
    for (auto& [key, value] : entry)
      if (key == "COREDUMP_SIGNAL") value = text;
    EXPECT_EQ(find(entry)->fields.integer("signal", -1), 0) << text;
  }
}

TEST_F(CrashesSource, ReportsToTheServerNothingThatIsAboutAPerson) {
  if (!WrittenJournal::canBeWritten()) GTEST_SKIP() << "systemd-journal-remote is not installed";
  lay("crashes", "fosska");
  folder_.write("state", "1\n@1\n");
  WrittenJournal journal;
  journal.add(crashOf("/usr/bin/env"));
  journal.add(crashOf("/home/alice-1/tool"));
  journal.add(crashOf("/usr/bin/env"));
  journal.write("user-1000.journal");
  const ProgramRun source = run({"--journal", journal.folder(), "--state", folder_ / "state", "--units-from",
                                 folder_ / "units", "--packages", folder_ / "none"});
  EXPECT_EQ(source.status, 0) << source.text;
  const auto events = arrived(302, 2);
  ASSERT_EQ(events.size(), 2U);
  int count = 0;
  for (const Dictionary& event : events) {
    const Dictionary& record = *event.dictionary("record");
    count += record.integer("count");
    EXPECT_EQ(description(Value(event)).find("alice"), std::string::npos) << description(Value(event));
    EXPECT_EQ(description(Value(event)).find("4711"), std::string::npos) << description(Value(event));
  }
  EXPECT_EQ(count, 3);
}

TEST_F(CrashesSource, ReportsTheFieldsThatItsEventsFileNames) {
  sources::Summary summary(sources::crashesProgram().category);
  const auto finding = find(crashOf("/usr/bin/env"));
  ASSERT_TRUE(finding);
  summary.add(finding->type, finding->fields, 1);
  summary.addUnread(1);
  for (const auto& event : summary.events(1)) {
    EXPECT_EQ(fieldsOf(event.payload), declaredFields("crashes", event.category, event.type)) << event.type;
    EXPECT_EQ(misdeclaredFields("crashes", event.category, event.type, event.payload), FieldNames())
        << event.type;
  }
}

}  // namespace
}  // namespace kyt
