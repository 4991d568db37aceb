// Names in reports: what packages brought is named, what people made is not.
#include "sources/Names.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>

#include "tests/support/TemporaryFolder.h"

namespace kyt::sources {
namespace {

TEST(ReportedUnit, IsNamedWhereAPackageBroughtItsFile) {
  const TemporaryFolder folder;
  folder.write("cron.service", "");
  EXPECT_EQ(SystemNames({{folder / "none", folder.path()}, {}, {}}).unit("cron.service"), "cron.service");
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit("backup-alice.service"), kLocal);
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit("home-alice.mount"), kLocal);
}

TEST(ReportedUnit, IsNamedWithoutItsInstance) {
  const TemporaryFolder folder;
  folder.write("user@.service", "");
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit("user@1000.service"), "user@.service");
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit("user@alice@example.org.service"), "user@.service");
}

TEST(ReportedUnit, LeavesNoFolder) {
  const TemporaryFolder folder;
  folder.write("secret/alice", "");
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit("secret/alice"), kLocal);
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit("secret"), kLocal);
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit(""), kLocal);
  EXPECT_EQ(SystemNames({{folder.path()}, {}, {}}).unit("a b.service"), kLocal);
}

TEST(ReportedUnit, IsNamedWhereThePackagesListsHaveItsFileAlone) {
  const TemporaryFolder folder;
  folder.write("units/cron.service", "");
  folder.write("units/backup-alice.service", "");
  folder.write("info/cron.list", "/.\n" + (folder / "units") + "\n" + (folder / "units/cron.service") + "\n");
  SystemNames names({{folder / "units"}, folder / "info", {}});
  EXPECT_EQ(names.unit("cron.service"), "cron.service");
  EXPECT_EQ(names.unit("backup-alice.service"), kLocal);
}

class ReportedProgram : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "files of root's are needed";
    for (const char* file : {"usr/bin/tool", "usr/bin/alices-tool", "opt/maker/tool", "opt/alice/tool",
                             "usr/share/alice/x", "usr/local/bin/tool", "tmp/tool", "usr/bin/theirs"})
      root_.write(file, "");
    ASSERT_EQ(::chown((root_ / "usr/bin/theirs").c_str(), 1000, 1000), 0);
  }
  TemporaryFolder root_;
};

TEST_F(ReportedProgram, IsNamedWhereThePackagesListsHaveIt) {
  root_.write("info/maker.list", "/.\n/opt\n/opt/maker\n/opt/maker/tool\n/usr/bin/theirs\n");
  root_.write("info/tool.list", "/bin/tool\n/usr/bin/gone\n/tmp\n");
  root_.write("info/tool.conffiles", "/tmp/tool\n");
  SystemNames names({{}, root_ / "info", root_.path()});
  EXPECT_EQ(names.program("/usr/bin/tool"), "/usr/bin/tool")
      << "the list names it as it was before the merge";
  EXPECT_EQ(names.program("/opt/maker/tool"), "/opt/maker/tool");
  for (const char* program :
       {"/usr/bin/alices-tool", "/opt/alice/tool", "/usr/share/alice/x", "/usr/local/bin/tool", "/tmp/tool",
        "/usr/bin/theirs", "/usr/bin/gone", "/opt/maker", ""})
    EXPECT_EQ(names.program(program), kLocal) << program;
}

TEST_F(ReportedProgram, IsNamedOnceItsPackageIsInstalled) {
  root_.write("info/tool.list", "/usr/bin/tool\n");
  SystemNames names({{}, root_ / "info", root_.path()});
  EXPECT_EQ(names.program("/opt/maker/tool"), kLocal);
  root_.write("info/maker.list", "/opt/maker/tool\n");
  // The clock of files may not have moved on since.
  const std::filesystem::path lists = root_ / "info";
  std::filesystem::last_write_time(lists, std::filesystem::last_write_time(lists) + std::chrono::seconds(1));
  EXPECT_EQ(names.program("/opt/maker/tool"), "/opt/maker/tool");
}

TEST_F(ReportedProgram, IsNamedWithoutListsWherePackagesAloneShouldWrite) {
  SystemNames names({{}, root_ / "none", root_.path()});
  EXPECT_EQ(names.program("/usr/bin/tool"), "/usr/bin/tool");
  for (const char* folder : {"bin", "sbin", "lib", "lib32", "lib64"}) {
    const std::string program = std::string("/") + folder + "/tool";
    root_.write(program.substr(1), "");
    EXPECT_EQ(names.program(program), program);
  }
  for (const char* program : {"/opt/maker/tool", "/usr/local/bin/tool", "/tmp/tool", "/usr/bin/theirs",
                              "/usr/bin/no-such-program", "/usr/../tmp/tool"})
    EXPECT_EQ(names.program(program), kLocal) << program;
}

}  // namespace
}  // namespace kyt::sources
