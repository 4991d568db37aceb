// Names in reports: what packages brought is named, what people made is not.
#include "sources/Names.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "tests/support/TemporaryFolder.h"

namespace kyt::sources {
namespace {

TEST(ReportedUnit, IsNamedWhereAPackageBroughtItsFile) {
  const TemporaryFolder folder;
  folder.write("cron.service", "");
  EXPECT_EQ(reportedUnit("cron.service", {folder / "none", folder.path()}), "cron.service");
  EXPECT_EQ(reportedUnit("backup-alice.service", {folder.path()}), kLocal);
  EXPECT_EQ(reportedUnit("home-alice.mount", {folder.path()}), kLocal);
}

TEST(ReportedUnit, IsNamedWithoutItsInstance) {
  const TemporaryFolder folder;
  folder.write("user@.service", "");
  EXPECT_EQ(reportedUnit("user@1000.service", {folder.path()}), "user@.service");
  EXPECT_EQ(reportedUnit("user@alice@example.org.service", {folder.path()}), "user@.service");
}

TEST(ReportedUnit, LeavesNoFolder) {
  const TemporaryFolder folder;
  folder.write("secret/alice", "");
  EXPECT_EQ(reportedUnit("secret/alice", {folder.path()}), kLocal);
  EXPECT_EQ(reportedUnit("secret", {folder.path()}), kLocal);
  EXPECT_EQ(reportedUnit("", {folder.path()}), kLocal);
  EXPECT_EQ(reportedUnit("a b.service", {folder.path()}), kLocal);
}

TEST(ReportedProgram, IsNamedWhereItIsTheSystems) {
  if (::geteuid() != 0) GTEST_SKIP() << "files of root's are needed";
  const TemporaryFolder root;
  for (const char* file :
       {"usr/bin/tool", "opt/maker/tool", "usr/local/bin/tool", "tmp/tool", "usr/bin/theirs"})
    root.write(file, "");
  ASSERT_EQ(::chown((root / "usr/bin/theirs").c_str(), 1000, 1000), 0);
  EXPECT_EQ(reportedProgram("/usr/bin/tool", root.path()), "/usr/bin/tool");
  EXPECT_EQ(reportedProgram("/opt/maker/tool", root.path()), "/opt/maker/tool");
  EXPECT_EQ(reportedProgram("/usr/local/bin/tool", root.path()), kLocal);
  EXPECT_EQ(reportedProgram("/tmp/tool", root.path()), kLocal);
  EXPECT_EQ(reportedProgram("/usr/bin/theirs", root.path()), kLocal);
  EXPECT_EQ(reportedProgram("/usr/bin/alices-secret", root.path()), kLocal);
  EXPECT_EQ(reportedProgram("/usr/../tmp/tool", root.path()), kLocal);
}

}  // namespace
}  // namespace kyt::sources
