#include "platform/linux/confinement/LandlockRules.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/landlock.h>
#include <netinet/in.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstring>
#include <thread>

#include "platform/linux/files/Files.h"
#include "platform/linux/helpers/ProgramInspector.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

long landlockVersion() {
  return ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
}

// 0, or errno of opening.
int openError(const std::string& path, int flags) {
  const Descriptor file = ownDescriptor(::open(path.c_str(), flags | O_CLOEXEC, 0600));
  return file ? 0 : errno;
}

int errorOf(int result) {
  return result == 0 ? 0 : errno;
}

std::string expectError(const char* what, int actual, int expected) {
  if (actual == expected) return "";
  return std::string(what) + ": " + std::to_string(actual) + " (" + std::strerror(actual) + "); ";
}

class LandlockRulesTest : public testing::Test {
 protected:
  void SetUp() override {
    if (landlockVersion() < 1) GTEST_SKIP() << "this kernel has no Landlock";
    folder_.write("read/file", "r");
    folder_.write("write/file", "w");
    folder_.write("outside/file", "o");
  }
  std::optional<std::string> enter(const ConfinementProfile& profile) {
    auto rules = LandlockRules::of(profile, {});
    if (const auto* error = std::get_if<std::string>(&rules)) return *error;
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return "no_new_privs";
    return std::get<LandlockRules>(rules).enter();
  }
  std::optional<std::string> enter() {
    ConfinementProfile profile;
    profile.read = {folder_ / "read", "/nonexistent"};
    profile.write = {folder_ / "write"};
    return enter(profile);
  }
  // Enters in a process of its own, then runs `work` there.
  std::string confined(const std::function<std::string()>& work) {
    return inChildProcess([&]() -> std::string {
      if (auto error = enter()) return "not entered: " + *error;
      return work();
    });
  }
  TemporaryFolder folder_;
};

TEST_F(LandlockRulesTest, ReadsAndWritesOnlyWhereTheProfileSays) {
  EXPECT_EQ(
      confined([&] {
        std::string wrong;
        wrong += expectError("read", openError(folder_ / "read/file", O_RDONLY), 0);
        wrong += expectError("list", openError(folder_ / "read", O_RDONLY | O_DIRECTORY), 0);
        wrong += expectError("write a read file", openError(folder_ / "read/file", O_WRONLY), EACCES);
        wrong += expectError("make a read file", openError(folder_ / "read/new", O_WRONLY | O_CREAT), EACCES);
        wrong += expectError("remove", errorOf(::unlink((folder_ / "read/file").c_str())), EACCES);
        wrong += expectError("read outside", openError(folder_ / "outside/file", O_RDONLY), EACCES);
        wrong += expectError("list outside", openError(folder_ / "outside", O_RDONLY | O_DIRECTORY), EACCES);
        wrong += expectError("write outside", openError(folder_ / "outside/file", O_WRONLY), EACCES);
        wrong += expectError("make outside", openError(folder_ / "outside/new", O_WRONLY | O_CREAT), EACCES);
        wrong += expectError("password file", openError("/etc/passwd", O_RDONLY), EACCES);
        return wrong;
      }),
      "");
}

TEST_F(LandlockRulesTest, MakesReplacesAndRemovesFilesInAWritableFolder) {
  EXPECT_EQ(confined([&] {
              const std::string made = folder_ / "write/new", file = folder_ / "write/file";
              std::string wrong;
              wrong += expectError("read", openError(file, O_RDONLY), 0);
              wrong += expectError("truncate", openError(file, O_WRONLY | O_TRUNC), 0);
              wrong += expectError("make", openError(made, O_WRONLY | O_CREAT), 0);
              wrong += expectError("rename", errorOf(::rename(made.c_str(), file.c_str())), 0);
              wrong += expectError("read what replaced it", openError(file, O_RDONLY), 0);
              wrong += expectError("remove", errorOf(::unlink(file.c_str())), 0);
              wrong += expectError("make a folder", errorOf(::mkdir(made.c_str(), 0700)), EACCES);
              wrong += expectError("make a link", errorOf(::symlink("/etc", made.c_str())), EACCES);
              wrong += expectError("make a pipe", errorOf(::mkfifo(made.c_str(), 0600)), EACCES);
              return wrong;
            }),
            "");
}

TEST_F(LandlockRulesTest, CutsNoFileThatMayOnlyBeRead) {
  if (landlockVersion() < 3) GTEST_SKIP() << "this kernel's Landlock does not know truncation";
  EXPECT_EQ(confined([&] {
              return expectError("truncate", errorOf(::truncate((folder_ / "read/file").c_str(), 0)), EACCES);
            }),
            "");
  EXPECT_EQ(folder_.read("read/file"), "r");
}

TEST_F(LandlockRulesTest, RunsNoProgram) {
  std::filesystem::copy_file("/bin/true", folder_ / "read/program");
  EXPECT_EQ(confined([&] {
              const std::string program = folder_ / "read/program";
              char* const none[] = {nullptr};
              const int own = errorOf(::execve(program.c_str(), none, none));
              std::string wrong;
              wrong += expectError("execute", own, EACCES);
              wrong += expectError("execute a shell", errorOf(::execve("/bin/sh", none, none)), EACCES);
              return wrong;
            }),
            "");
}

TEST_F(LandlockRulesTest, HoldsForThreadsThatStartLater) {
  EXPECT_EQ(confined([&] {
              int error = 0;
              std::thread([&] { error = openError(folder_ / "outside/file", O_RDONLY); }).join();
              std::string wrong;
              wrong += expectError("read outside", error, EACCES);
              return wrong;
            }),
            "");
}

TEST_F(LandlockRulesTest, ConnectsToAnyTCPPortAndBindsNone) {
  if (landlockVersion() < 4) GTEST_SKIP() << "this kernel's Landlock does not know TCP";
  const Descriptor server = ownDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in address = {};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof address;
  ASSERT_EQ(::bind(server.get(), reinterpret_cast<sockaddr*>(&address), size), 0);
  ASSERT_EQ(::listen(server.get(), 1), 0);
  ASSERT_EQ(::getsockname(server.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
  EXPECT_EQ(
      confined([&] {
        const Descriptor client = ownDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        const int connected =
            errorOf(::connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address));
        const Descriptor other = ownDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_in any = address;
        any.sin_port = 0;
        const int bound = errorOf(::bind(other.get(), reinterpret_cast<const sockaddr*>(&any), sizeof any));
        std::string wrong;
        wrong += expectError("connect", connected, 0);
        wrong += expectError("bind", bound, EACCES);
        return wrong;
      }),
      "");
}

TEST_F(LandlockRulesTest, AWritablePathMustExist) {
  ConfinementProfile profile;
  profile.write = {folder_ / "missing"};
  EXPECT_EQ(enter(profile), (folder_ / "missing") + ": No such file or directory");
}

// Why the program inspector is a process of its own.
TEST_F(LandlockRulesTest, AskingWhatAProcessOutsideRunsNeedsTheInspector) {
  const int32_t outside = ::getpid();
  ConfinementProfile proc;
  proc.read = {"/proc"};
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              auto inspector = ProgramInspectorProcess::start();
              if (const auto* error = std::get_if<std::string>(&inspector)) return *error;
              if (auto error = enter(proc)) return *error;
              DirectProgramInspector direct;
              if (!std::holds_alternative<int>(direct.runningProgram(outside)))
                return "a confined process could ask";
              const auto program = std::get<0>(inspector)->runningProgram(outside);
              struct stat status = {};
              if (::stat("/proc/self/exe", &status) != 0) return "stat";
              if (const int* error = std::get_if<int>(&program)) return std::strerror(*error);
              return std::get<ProgramIdentity>(program) == ProgramIdentity{status.st_dev, status.st_ino}
                         ? ""
                         : "another";
            }),
            "");
}

}  // namespace
}  // namespace kyt
