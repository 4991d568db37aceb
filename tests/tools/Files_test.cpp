// What the tools write into: files, and what stands in their place.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "tests/support/TemporaryFolder.h"
#include "tools/StorebagFile.h"

namespace kyt {
namespace {

class FilesOfTools : public ::testing::Test {
 protected:
  [[nodiscard]] static mode_t kindOf(const std::string& path) {
    struct stat status = {};
    return lstat(path.c_str(), &status) == 0 ? status.st_mode & S_IFMT : 0;
  }
  TemporaryFolder folder_;
};

TEST_F(FilesOfTools, ReplaceAFileOrALinkAndNotWhatItLeadsTo) {
  const std::string target = folder_.write("target", "before"), link = folder_ / "link";
  std::filesystem::create_symlink(target, link);
  EXPECT_FALSE(tools::writeFile(link, "after", 0600));
  EXPECT_EQ(kindOf(link), mode_t{S_IFREG});
  EXPECT_EQ(folder_.read("link"), "after");
  EXPECT_EQ(folder_.read("target"), "before");
}

TEST_F(FilesOfTools, LeaveADevice) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  const std::string full = folder_ / "full";
  if (mknod(full.c_str(), S_IFCHR | 0600, makedev(1, 7)) != 0) GTEST_SKIP() << "no device can be made here";
  EXPECT_TRUE(tools::writeFile(full, "text", 0600)) << "there is never room on it";
  EXPECT_EQ(kindOf(full), mode_t{S_IFCHR});
}

TEST_F(FilesOfTools, LeaveADiskUnderWhateverName) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  const std::string disk = folder_ / "disk", link = folder_ / "link";
  if (mknod(disk.c_str(), S_IFBLK | 0600, makedev(240, 1)) != 0) GTEST_SKIP() << "no disk can be made here";
  std::filesystem::create_symlink(disk, link);
  for (const std::string& name : {disk, link}) {
    const auto error = tools::writeFile(name, "text", 0600);
    ASSERT_TRUE(error) << name;
    EXPECT_EQ(error->localizedDescription, name + " is no regular file");
  }
  EXPECT_EQ(kindOf(disk), mode_t{S_IFBLK});
  EXPECT_EQ(kindOf(link), mode_t{S_IFLNK});
}

TEST_F(FilesOfTools, WriteToWhatIsOpenByItsPath) {
  int ends[2];
  ASSERT_EQ(pipe2(ends, O_CLOEXEC), 0);
  for (const char* before : {"/proc/self/fd/", "/dev/fd/"}) {
    const auto error = tools::writeFile(before + std::to_string(ends[1]), "text", 0600);
    EXPECT_FALSE(error) << error->localizedDescription;
    char buffer[8] = "";
    ASSERT_EQ(error ? -1 : read(ends[0], buffer, sizeof buffer), 4) << before;
    EXPECT_STREQ(buffer, "text");
  }
  close(ends[0]);
  close(ends[1]);
}

TEST_F(FilesOfTools, NeitherReplaceNorFillWhatSomebodyElseReads) {
  const std::string fifo = folder_ / "fifo";
  ASSERT_EQ(mkfifo(fifo.c_str(), 0666), 0);
  const auto error = tools::writeFile(fifo, "text", 0600);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->localizedDescription, fifo + " is no regular file");
  EXPECT_EQ(kindOf(fifo), mode_t{S_IFIFO});
}

}  // namespace
}  // namespace kyt
