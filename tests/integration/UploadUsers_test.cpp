// Files of clients that are other users than the daemon: read through their descriptors, removed with their rights and
// no others. Needs root, to become such users.
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <string>

#include "tests/integration/UploadFixture.h"
#include "tests/support/ChildProcess.h"

namespace kyt {
namespace {

constexpr uid_t kDaemonUser = 54320, kClientUser = 54321, kClientGroup = 54323;

class UploadsOfOtherUsers : public UploadTest {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to become other users";
    ASSERT_EQ(::chmod(files_.path().c_str(), 0755), 0);
    std::filesystem::create_directory(programs_.path() + "/bin");
  }
  tools::Stage::Options options() const {
    tools::Stage::Options made;
    made.logLevel = "debug";
    made.clientUser = tools::User::of(std::to_string(kClientUser));
    return made;
  }
  void start(tools::Stage::Options made) {
    lay(std::move(made));
    putUploadBag();
    startDaemon();
  }
  // A folder with one file in it, each with its owner and mode.
  std::string file(const std::string& folder, uid_t owner, gid_t group, mode_t mode, uid_t fileOwner) {
    const std::string path = files_.write(folder + "/report.log", folder);
    EXPECT_EQ(::chown(path.c_str(), fileOwner, fileOwner), 0);
    EXPECT_EQ(::chown((files_ / folder).c_str(), owner, group), 0);
    EXPECT_EQ(::chmod((files_ / folder).c_str(), mode), 0);
    return path;
  }
  // The client's answer, in a process of that user, which opens the files itself.
  std::string uploadAsClient(const std::string& path) {
    return inChildProcess([&]() -> std::string {
      const gid_t groups[] = {kClientGroup};
      if (::setgroups(1, groups) != 0 || ::setresgid(kClientUser, kClientUser, kClientUser) != 0 ||
          ::setresuid(kClientUser, kClientUser, kClientUser) != 0)
        return "cannot become the user";
      const int file = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
      const int folder = ::open(std::filesystem::path(path).parent_path().c_str(), O_PATH | O_CLOEXEC);
      if (file < 0 || folder < 0) return std::string("cannot open: ") + std::strerror(errno);
      PlainUploader client(socket());
      if (!client.configured()) return "not configured";
      return client.upload(path, {file, folder});
    });
  }
  [[nodiscard]] bool wasKept(const std::string& path, int error) const {
    return exists(path) && logged("LinuxFileExtensions(remove): Cannot remove report.log: " +
                                  std::string(std::strerror(error)));
  }
  // What a daemon that may take users removes and what it leaves.
  void expectTheClientsRights() {
    const std::string own = file("own", kClientUser, kClientUser, 0700, kClientUser);
    EXPECT_EQ(uploadAsClient(own), "yes") << daemonLog();
    EXPECT_EQ(received("report.log"), "own");
    EXPECT_FALSE(exists(own)) << daemonLog();
    const std::string ofGroup = file("ofGroup", 0, kClientGroup, 0770, kClientUser);
    EXPECT_EQ(uploadAsClient(ofGroup), "yes") << daemonLog();
    EXPECT_FALSE(exists(ofGroup)) << daemonLog();
    // What it may read, but not remove.
    const std::string others = file("others", 0, 0, 0755, 0);
    EXPECT_EQ(uploadAsClient(others), "yes") << daemonLog();
    EXPECT_TRUE(wasKept(others, EACCES)) << daemonLog();
    const std::string sticky = file("sticky", 0, 0, 01777, 0);
    EXPECT_EQ(uploadAsClient(sticky), "yes") << daemonLog();
    EXPECT_TRUE(wasKept(sticky, EPERM)) << daemonLog();
  }

  const TemporaryFolder files_, programs_;
};

TEST_F(UploadsOfOtherUsers, ADaemonOfRootRemovesWithItsClientsRightsAlone) {
  start(options());
  expectTheClientsRights();
}

// As a service manager starts it: a user of its own that has nothing but the power to take users.
TEST_F(UploadsOfOtherUsers, ADaemonThatMayTakeUsersRemovesWithItsClientsRightsAlone) {
  ASSERT_EQ(::chmod(programs_.path().c_str(), 0755), 0);
  std::filesystem::copy_file(std::string(KYT_PROGRAMS) + "/kytreportingd", programs_ / "bin/kytreportingd");
  const std::string user = std::to_string(kDaemonUser);
  programs_.write("kytreportingd",
                  "#!/bin/sh\nexec setpriv --reuid=" + user + " --regid=" + user +
                      " --clear-groups --inh-caps=-all,+setuid,+setgid --ambient-caps=-all,+setuid,+setgid " +
                      (programs_ / "bin/kytreportingd") + " \"$@\"\n",
                  0755);
  lay(options());
  putUploadBag();
  const std::string root = stage_->folder();
  for (const char* folder : {"/var/mobile/Library/Logs/Faultbin/Retired", "/var/lib/kytreportingd/defaults",
                             "/run/kytreportingd"}) {
    std::filesystem::create_directories(root + folder);
    ASSERT_EQ(::chown((root + folder).c_str(), kDaemonUser, kDaemonUser), 0);
  }
  ASSERT_FALSE(stage_->startDaemon(programs_ / "kytreportingd")) << daemonLog();
  const std::string status = contents("/proc/" + std::to_string(stage_->daemon()->pid()) + "/status");
  EXPECT_NE(status.find("\nUid:\t" + user), std::string::npos) << status;
  expectTheClientsRights();
}

TEST_F(UploadsOfOtherUsers, ADaemonThatMayNotTakeUsersSendsTheirFilesAndRemovesNone) {
  tools::Stage::Options made = options();
  made.daemonUser = tools::User::of(std::to_string(kDaemonUser));
  start(std::move(made));
  const std::string own = file("own", kClientUser, kClientUser, 0700, kClientUser);
  EXPECT_EQ(uploadAsClient(own), "yes") << daemonLog();
  EXPECT_EQ(received("report.log"), "own");
  EXPECT_TRUE(wasKept(own, EPERM)) << daemonLog();
}

}  // namespace
}  // namespace kyt
