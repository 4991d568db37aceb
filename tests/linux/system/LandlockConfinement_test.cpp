#include "platform/linux/system/LandlockConfinement.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/landlock.h>
#include <netinet/in.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <thread>

#include "platform/linux/system/Files.h"
#include "platform/linux/system/ProgramInspector.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

long landlockVersion() {
  return ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
}

// 0, or errno of opening.
int openError(const std::string& path, int flags) {
  const FileHandle file(::open(path.c_str(), flags | O_CLOEXEC, 0600));
  return file ? 0 : errno;
}

int errorOf(int result) {
  return result == 0 ? 0 : errno;
}

// 0, or errno of binding a Unix socket there.
int makeSocket(const std::string& path) {
  const FileHandle socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  return errorOf(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address));
}

std::string expectError(const char* what, int actual, int expected) {
  if (actual == expected) return "";
  return std::string(what) + ": " + std::to_string(actual) + " (" + std::strerror(actual) + "); ";
}

class LandlockConfinementTest : public testing::Test {
 protected:
  void SetUp() override {
    if (landlockVersion() < 1) GTEST_SKIP() << "this kernel has no Landlock";
    folder_.write("profiles/test.profile", "read = ['${READ}', '/nonexistent']\nwrite = ['${WRITE}']\n");
    folder_.write("read/file", "r");
    folder_.write("write/file", "w");
    folder_.write("outside/file", "o");
  }
  std::optional<std::string> enter(const std::string& name = "test") {
    LandlockConfinement confinement(folder_ / "profiles", {{"READ", folder_ / "read"},
                                                           {"WRITE", folder_ / "write"},
                                                           {"MISSING", folder_ / "missing"},
                                                           {"EMPTY", ""}});
    return confinement.enter(name);
  }
  // Enters in a process of its own, then runs `work` there.
  std::string confined(const std::function<std::string()>& work) {
    return inChildProcess([&]() -> std::string {
      if (auto error = enter()) return "not entered: " + *error;
      return work();
    });
  }
  // The error text of entering that profile, and that nothing was set up by the attempt.
  std::string refusal(const std::string& profile) {
    folder_.write("profiles/bad.profile", profile);
    return inChildProcess([&]() -> std::string {
      const auto error = enter("bad");
      if (!error) return "entered";
      if (::prctl(PR_GET_NO_NEW_PRIVS, 0, 0, 0, 0) != 0) return "no_new_privs is set";
      if (openError(folder_ / "outside/file", O_RDWR) != 0) return "is confined";
      return *error;
    });
  }
  TemporaryFolder folder_;
};

TEST_F(LandlockConfinementTest, ReadsAndWritesOnlyWhereTheProfileSays) {
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

TEST_F(LandlockConfinementTest, MakesReplacesAndRemovesFilesInAWritableFolder) {
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

TEST_F(LandlockConfinementTest, CutsNoFileThatMayOnlyBeRead) {
  if (landlockVersion() < 3) GTEST_SKIP() << "this kernel's Landlock does not know truncation";
  EXPECT_EQ(confined([&] {
              return expectError("truncate", errorOf(::truncate((folder_ / "read/file").c_str(), 0)), EACCES);
            }),
            "");
  EXPECT_EQ(folder_.read("read/file"), "r");
}

TEST_F(LandlockConfinementTest, RunsNoProgram) {
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

TEST_F(LandlockConfinementTest, HoldsForThreadsThatStartLater) {
  EXPECT_EQ(confined([&] {
              int error = 0;
              std::thread([&] { error = openError(folder_ / "outside/file", O_RDONLY); }).join();
              std::string wrong;
              wrong += expectError("read outside", error, EACCES);
              return wrong;
            }),
            "");
}

TEST_F(LandlockConfinementTest, GivesUpPrivilegesAndCoreDumps) {
  const int dumpable = LandlockConfinement::staysDumpable() ? 1 : 0;
  EXPECT_EQ(confined([&] {
              std::string wrong;
              wrong += expectError("no_new_privs", ::prctl(PR_GET_NO_NEW_PRIVS, 0, 0, 0, 0), 1);
              wrong += expectError("dumpable", ::prctl(PR_GET_DUMPABLE, 0, 0, 0, 0), dumpable);
              return wrong;
            }),
            "");
}

TEST_F(LandlockConfinementTest, ConnectsToAnyTCPPortAndBindsNone) {
  if (landlockVersion() < 4) GTEST_SKIP() << "this kernel's Landlock does not know TCP";
  const FileHandle server(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in address = {};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof address;
  ASSERT_EQ(::bind(server.get(), reinterpret_cast<sockaddr*>(&address), size), 0);
  ASSERT_EQ(::listen(server.get(), 1), 0);
  ASSERT_EQ(::getsockname(server.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
  EXPECT_EQ(
      confined([&] {
        const FileHandle client(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        const int connected =
            errorOf(::connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address));
        const FileHandle other(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
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

TEST_F(LandlockConfinementTest, AMissingProfileIsAnError) {
  EXPECT_EQ(inChildProcess([&] { return enter("none").value_or("entered"); }),
            (folder_ / "profiles/none.profile") + ": No such file or directory");
}

TEST_F(LandlockConfinementTest, WhatIsWrongInAProfileIsAnErrorWithItsLine) {
  const std::string file = folder_ / "profiles/bad.profile";
  EXPECT_EQ(refusal("read = []\nexecute = ['/bin']\n"), file + ":2: unknown key \"execute\"");
  EXPECT_EQ(refusal("read = '/etc'\n"), file + ":1: \"read\" must be an array of texts");
  EXPECT_EQ(refusal("write = [\n 1 ]\n"), file + ":2: \"write\" must be an array of texts");
  EXPECT_EQ(refusal("read = ['${HOME}/x']\n"), file + ":1: \"${HOME}/x\" names an unknown variable");
  EXPECT_EQ(refusal("read = ['${HOME']\n"), file + ":1: \"${HOME\" has a variable without an end");
  EXPECT_EQ(refusal("read = ['/a/${READ}']\n"), file + ":1: \"/a/${READ}\" has a variable in its middle");
  EXPECT_EQ(refusal("read = ['etc']\n"), file + ":1: \"etc\" is no absolute path");
  EXPECT_NE(refusal("read = [\n").find(file + ":"), std::string::npos);
}

TEST_F(LandlockConfinementTest, AWritablePathMustExist) {
  EXPECT_EQ(refusal("write = ['${MISSING}']\n"), (folder_ / "missing") + ": No such file or directory");
}

TEST_F(LandlockConfinementTest, AnEntryOfAnEmptyVariableFallsAway) {
  const auto profile =
      std::get<ConfinementProfile>(parseProfile("read = ['${A}', '${B}/x']", "p", {{"A", ""}, {"B", "/b"}}));
  EXPECT_EQ(profile.read, std::vector<std::string>{"/b/x"});
  EXPECT_TRUE(profile.write.empty());
}

// Why the program inspector is a process of its own.
TEST_F(LandlockConfinementTest, AskingWhatAProcessOutsideRunsNeedsTheInspector) {
  const int32_t outside = ::getpid();
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              folder_.write("profiles/proc.profile", "read = ['/proc']\nwrite = []\n");
              auto inspector = ProgramInspectorProcess::start();
              if (const auto* error = std::get_if<std::string>(&inspector)) return *error;
              if (auto error = enter("proc")) return *error;
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

TEST_F(LandlockConfinementTest, TheShippedProfileLetsTheDaemonWorkAndNoMore) {
  for (const char* name : {"config", "share", "plugins", "state", "logs", "run", "ca"}) {
    folder_.write(std::string(name) + "/file", "x");
  }
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              LandlockConfinement confinement(KYT_PACKAGING_SHARE, {{"CONFIG", folder_ / "config"},
                                                                    {"SHARE", folder_ / "share"},
                                                                    {"PLUGINS", folder_ / "plugins"},
                                                                    {"STATE", folder_ / "state"},
                                                                    {"LOGS", folder_ / "logs"},
                                                                    {"RUN", folder_ / "run"},
                                                                    {"CA", folder_ / "ca"}});
              if (auto error = confinement.enter("com.vantu.kytreportingd")) return *error;
              std::string wrong;
              for (const char* name : {"config", "share", "plugins", "ca"}) {
                const std::string file = folder_ / (std::string(name) + "/file");
                wrong += expectError(name, openError(file, O_RDONLY), 0);
                wrong += expectError(name, openError(file, O_WRONLY), EACCES);
              }
              wrong += expectError("socket", makeSocket(folder_ / "run/socket"), 0);
              wrong += expectError("stale socket", errorOf(::unlink((folder_ / "run/socket").c_str())), 0);
              wrong += expectError("socket elsewhere", makeSocket(folder_ / "state/socket"), EACCES);
              for (const char* name : {"state", "logs"}) {
                const std::string file = folder_ / (std::string(name) + "/file");
                wrong += expectError(name, openError(file, O_RDWR), 0);
                wrong += expectError(name, errorOf(::unlink(file.c_str())), 0);
              }
              for (const char* file :
                   {"/etc/passwd", "/proc/self/status", "/proc/self/smaps_rollup", "/dev/urandom"}) {
                wrong += expectError(file, openError(file, O_RDONLY), 0);
              }
              wrong += expectError("/etc", openError("/etc/kyt-must-not-be", O_WRONLY | O_CREAT), EACCES);
              wrong += expectError("/tmp", openError(folder_ / "outside/file", O_RDONLY), EACCES);
              wrong += expectError("/usr/bin/env", openError("/usr/bin/env", O_RDONLY), EACCES);
              return wrong;
            }),
            "");
}

}  // namespace
}  // namespace kyt
