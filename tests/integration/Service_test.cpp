// The daemon as a service manager runs it: started by its socket, watched, with the rights of a service, logging to the
// journal.
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "tests/integration/FailingDaemon.h"
#include "tests/integration/TestClient.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/OrdinaryUser.h"
#include "tests/support/TestJournal.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

// A datagram socket that programs tell something: a service manager's, or the journal's.
class ToldSocket {
 public:
  explicit ToldSocket(const std::string& path) {
    address_.sun_family = AF_UNIX;
    path.copy(address_.sun_path, sizeof address_.sun_path - 1);
    if (::bind(socket_.get(), reinterpret_cast<const sockaddr*>(&address_), sizeof address_) != 0 ||
        ::chmod(path.c_str(), 0666) != 0)
      std::abort();
  }
  // Until nothing more can be told.
  void fill() const {
    const Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    while (::sendto(socket.get(), "", 1, MSG_DONTWAIT, reinterpret_cast<const sockaddr*>(&address_),
                    sizeof address_) == 1) {
    }
  }
  // What has come until now.
  const std::vector<std::string>& told() {
    char buffer[16384];
    for (ssize_t count = 0; (count = ::recv(socket_.get(), buffer, sizeof buffer, MSG_DONTWAIT)) >= 0;)
      told_.emplace_back(buffer, static_cast<size_t>(count));
    return told_;
  }
  [[nodiscard]] ptrdiff_t count(std::string_view part) {
    const auto& all = told();
    return std::count_if(all.begin(), all.end(),
                         [&](const std::string& text) { return text.find(part) != std::string::npos; });
  }

 private:
  const Descriptor socket_ = ownDescriptor(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un address_ = {};
  std::vector<std::string> told_;
};

class Service : public ::testing::Test {
 protected:
  // `process`: "" to leave it out, "own" for the daemon's own number.
  void watch(const std::string& microseconds, const std::string& process) {
    daemon_.setBeforeExecution([this, microseconds, process] {
      ::setenv("NOTIFY_SOCKET", (daemon_.root() / "notify").c_str(), 1);
      ::setenv("WATCHDOG_USEC", microseconds.c_str(), 1);
      if (!process.empty())
        ::setenv("WATCHDOG_PID", process == "own" ? std::to_string(::getpid()).c_str() : process.c_str(), 1);
    });
  }
  // Reading what it tells, as a service manager does: it waits when nobody does.
  int statusAfterReading(ToldSocket& socket) {
    EXPECT_TRUE(eventually([&] {
      static_cast<void>(socket.told());
      return daemon_.hasEnded();
    })) << daemon_.log();
    return daemon_.exitStatus();
  }
  // The capabilities of each of the process's threads.
  static std::set<std::string> capabilitiesOfThreads(pid_t process) {
    std::set<std::string> all;
    for (const auto& thread :
         std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/task"))
      all.insert(capabilitiesOf(thread.path()));
    return all;
  }
  static pid_t childNamed(pid_t parent, const std::string& name) {
    const std::string process = "/proc/" + std::to_string(parent);
    std::ifstream children(process + "/task/" + std::to_string(parent) + "/children");
    for (pid_t child = 0; children >> child;) {
      std::string text;
      std::ifstream("/proc/" + std::to_string(child) + "/comm") >> text;
      if (text == name) return child;
    }
    return 0;
  }

  DaemonProcess daemon_{"http://127.0.0.1:9"};
  ToldSocket manager_{daemon_.root() / "notify"};
};

TEST_F(Service, IsStartedByAClientAndEndsWhenIdleAndIsStartedByTheNextOne) {
  daemon_.activateBySocket();
  for (int round = 0; round < 2; ++round) {
    TestClient client(daemon_.socketPath(), 5);
    ASSERT_TRUE(daemon_.isWantedBySomeone());
    daemon_.start();
    EXPECT_EQ(client.configure(), "none") << daemon_.log();
    client.close();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
    EXPECT_TRUE(daemon_.logged("main: Ending, idle for 0.2 seconds")) << daemon_.log();
  }
}

// The service manager is slow to read: two seconds pass between the decision to end and the end.
TEST_F(Service, LeavesWhoComesAfterItsDecisionToEndToTheNextOne) {
  daemon_.activateBySocket();
  watch("", "");
  daemon_.start();
  ASSERT_TRUE(eventually([&] { return manager_.count("READY=1") == 1; })) << daemon_.log();
  manager_.fill();
  ASSERT_TRUE(eventually([&] { return daemon_.logged("main: Ending, idle for 0.2 seconds"); }));
  TestClient client(daemon_.socketPath(), 5);
  ASSERT_TRUE(daemon_.isWantedBySomeone());
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_FALSE(daemon_.logged("listener: Accepting new VRP connection")) << daemon_.log();
  static_cast<void>(manager_.told());
  daemon_.start();
  EXPECT_EQ(client.configure(), "none") << daemon_.log();
  EXPECT_EQ(client->statistics().connections, 1U) << "no connection of it was cut";
  client.close();
  EXPECT_EQ(statusAfterReading(manager_), 0) << daemon_.log();
}

// Its idle time is over and a client is at its door when it may run again: whichever it sees first.
TEST_F(Service, CutsNobodyWhoComesAtTheMomentOfItsEnd) {
  daemon_.writeSettings(
      "[storebag]\ninternal_host = \"http://127.0.0.1:9\"\npublic_host = \"http://127.0.0.1:9\"\n"
      "[log]\ntarget = \"stderr\"\n[service]\nidle_exit_seconds = 0.1\n");
  daemon_.activateBySocket();
  for (int round = 0; round < 20; ++round) {
    daemon_.start({"--log-level", "default"});
    ASSERT_TRUE(eventually([&] { return daemon_.logged("main: Listener resumes"); })) << daemon_.log();
    daemon_.terminate(SIGSTOP);
    const auto over = std::chrono::steady_clock::now() + std::chrono::milliseconds(100);
    ASSERT_TRUE(eventually([&] { return std::chrono::steady_clock::now() >= over; }));
    TestClient client(daemon_.socketPath(), 5);
    ASSERT_TRUE(daemon_.isWantedBySomeone());
    daemon_.terminate(SIGCONT);
    auto answer = std::async(std::launch::async, [&] { return client.configure(); });
    while (answer.wait_for(20ms) != std::future_status::ready)
      if (daemon_.hasEnded()) {
        EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
        daemon_.start({"--log-level", "default"});
      }
    EXPECT_EQ(answer.get(), "none") << daemon_.log();
    EXPECT_EQ(client->statistics().connections, 1U) << round;
    client.close();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
}

// A client is being accepted while the idle time ends: it is not there yet when the daemon looks for the first time.
TEST_F(Service, LooksAgainAtItsConnectionsOnceItHasStoppedAccepting) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer's own library must be loaded first";
  FailingDaemon daemon("http://127.0.0.1:9");
  daemon.writeSettings(
      "[storebag]\ninternal_host = \"http://127.0.0.1:9\"\npublic_host = \"http://127.0.0.1:9\"\n"
      "[log]\ntarget = \"stderr\"\n[service]\nidle_exit_seconds = 2\n");
  daemon.activateBySocket();
  ASSERT_TRUE(daemon.startAndWait()) << daemon.log();
  const auto idleEnds = std::chrono::steady_clock::now() + 2s;
  daemon.fail(kyt_failing_accept4, kyt_failing_hangs);
  TestClient first(daemon.socketPath(), 5);
  ASSERT_TRUE(eventually([&] { return daemon.failures() == 1 || daemon.hasEnded(); }));
  ASSERT_TRUE(eventually([&] { return std::chrono::steady_clock::now() >= idleEnds + 200ms; }));
  ASSERT_FALSE(daemon.hasEnded()) << "it ended before it could be held up";
  daemon.goOn();
  EXPECT_EQ(first.configure(), "none") << daemon.log();
  TestClient second(daemon.socketPath(), 6);
  EXPECT_EQ(second.configure(), "none") << daemon.log();
  EXPECT_EQ(first->statistics().connections, 1U) << daemon.log();
  EXPECT_FALSE(daemon.logged("main: Ending")) << "both are served by the one";
  first.close();
  second.close();
  EXPECT_EQ(daemon.exitStatus(), 0) << daemon.log();
}

TEST_F(Service, IsStartedBySystemdsOwnSocketActivation) {
  if (::access("/usr/bin/systemd-socket-activate", X_OK) != 0)
    GTEST_SKIP() << "needs systemd-socket-activate";
  std::filesystem::create_directories(daemon_.root() / "run/kytreportingd");
  std::vector<std::string> launcher = {"/usr/bin/systemd-socket-activate", "-l", daemon_.socketPath()};
  for (const char* name : {"ASAN_OPTIONS", "TSAN_OPTIONS", "UBSAN_OPTIONS", "LSAN_OPTIONS"})
    if (const char* value = ::getenv(name))
      launcher.insert(launcher.end(), {"-E", std::string(name) + "=" + value});
  daemon_.setLauncher(launcher);
  daemon_.start();
  ASSERT_TRUE(eventually([&] { return daemon_.logged("Listening on"); })) << daemon_.log();
  EXPECT_FALSE(daemon_.logged("startLogging")) << "nobody has connected yet";
  TestClient client(daemon_.socketPath(), 5);
  EXPECT_EQ(client.configure(), "none") << daemon_.log();
  EXPECT_TRUE(daemon_.logged("listener: Accepting new VRP connection")) << daemon_.log();
  client.close();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("main: Ending, idle for 0.2 seconds")) << daemon_.log();
  EXPECT_TRUE(std::filesystem::exists(daemon_.socketPath())) << "the socket is the service manager's";
}

TEST_F(Service, TellsThatItIsReadyAndThatItStops) {
  watch("", "");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  EXPECT_TRUE(eventually([&] { return manager_.count("READY=1") == 1; }));
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  ASSERT_EQ(manager_.told().size(), 2U);
  EXPECT_EQ(manager_.told()[0], "READY=1\nSTATUS=Listening");
  EXPECT_EQ(manager_.told()[1], "STOPPING=1\nSTATUS=Stopping");
}

TEST_F(Service, GivesASignOfLifeTwiceInEachInterval) {
  const auto begin = std::chrono::steady_clock::now();
  watch("100000", "own");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  ASSERT_TRUE(eventually([&] { return manager_.count("WATCHDOG=1") >= 5; })) << daemon_.log();
  const auto signs = manager_.count("WATCHDOG=1");
  EXPECT_LE(signs, (std::chrono::steady_clock::now() - begin) / 50ms);
  daemon_.terminate();
  EXPECT_EQ(statusAfterReading(manager_), 0) << daemon_.log();
  EXPECT_EQ(manager_.count("STOPPING=1"), 1);
}

TEST_F(Service, EndsInOrderEvenWhenItsServiceManagerDoesNotListen) {
  daemon_.activateBySocket();
  watch("20000", "own");
  manager_.fill();
  daemon_.start();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("cannot tell the service manager")) << daemon_.log();
}

TEST_F(Service, IsSilentWhenAnotherProcessIsWatched) {
  daemon_.activateBySocket();
  for (const bool own : {true, false}) {
    watch("20000", own ? "own" : "1");
    const auto before = manager_.count("WATCHDOG=1");
    daemon_.start();
    EXPECT_EQ(statusAfterReading(manager_), 0) << daemon_.log();  // it has been idle for 0.2 seconds
    EXPECT_EQ(manager_.count("WATCHDOG=1") > before, own);
  }
  EXPECT_EQ(manager_.count("READY=1"), 2);
}

TEST_F(Service, RunAsAnOrdinaryUserKeepsNoCapabilityAndItsHelpersTheirOwn) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to start it with capabilities";
  constexpr CapabilitySet kTakingUsers = capabilitySet(CAP_SETUID) | capabilitySet(CAP_SETGID);
  constexpr CapabilitySet kUnit = kTakingUsers | capabilitySet(CAP_SYS_PTRACE);
  if ((effectiveCapabilities() & kUnit) != kUnit) GTEST_SKIP() << "root lacks a capability here";
  constexpr uint32_t kUser = 54321;
  // The build may be where only root can go.
  std::filesystem::copy_file(KYT_DAEMON, daemon_.root() / "kytreportingd");
  daemon_.setProgram(daemon_.root() / "kytreportingd");
  daemon_.root().write("log", "");
  ASSERT_EQ(::chown(daemon_.root().path().c_str(), kUser, kUser), 0);
  for (const auto& entry : std::filesystem::recursive_directory_iterator(daemon_.root().path()))
    ASSERT_EQ(::chown(entry.path().c_str(), kUser, kUser), 0);
  daemon_.setBeforeExecution([] {
    if (!becomeOrdinaryUser(kUser, kUnit)) ::_exit(126);
  });
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  // The bounding set stays as the service manager made it: emptying it needs a capability more.
  EXPECT_EQ(capabilitiesOfThreads(daemon_.process()), std::set<std::string>{"0 0 0 800c0 0"});
  const auto helper = [this](const char* name) {
    const pid_t child = childNamed(daemon_.process(), name);
    return capabilitiesOf("/proc/" + std::to_string(child));
  };
  EXPECT_TRUE(eventually([&] { return helper("kyt-broker") == "0 c0 c0 800c0 0"; })) << helper("kyt-broker");
  EXPECT_TRUE(eventually([&] { return helper("kyt-inspector") == "0 80000 80000 800c0 0"; }))
      << helper("kyt-inspector");
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(Service, RunByRootKeepsOnlyWhatReachesFilesOfOthers) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  const CapabilitySet files =
      capabilitySet(CAP_CHOWN) | capabilitySet(CAP_DAC_OVERRIDE) | capabilitySet(CAP_FOWNER);
  const std::set<std::string> all = capabilitiesOfThreads(daemon_.process());
  const bool holdsThem = (effectiveCapabilities() & files) == files;
  EXPECT_EQ(all.size(), 1U);
  EXPECT_TRUE(!holdsThem || *all.begin() == "0 b b 0 0") << *all.begin();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(Service, LogsToTheJournalWhereThereIsOne) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  daemon_.writeSettings(
      "[storebag]\ninternal_host = \"http://127.0.0.1:9\"\npublic_host = \"http://127.0.0.1:9\"\n");
  const std::string folder = daemon_.root() / "journal";
  std::filesystem::create_directory(folder);
  ToldSocket journal(folder + "/socket");
  daemon_.setBeforeExecution([&folder] {
    const char* const place = "/run/systemd/journal";
    const bool mounted = TestJournal::hideRun() && ::mkdir("/run/systemd", 0755) == 0 &&
                         ::mkdir(place, 0755) == 0 &&
                         ::mount(folder.c_str(), place, nullptr, MS_BIND, nullptr) == 0;
    if (!mounted) ::_exit(126);
  });
  daemon_.start();
  ASSERT_TRUE(eventually([&] { return journal.count("start loop.") == 1; })) << daemon_.log();
  // Once confined it still reaches the journal, also from other threads.
  TestClient client(daemon_.socketPath(), 5);
  auto answer = std::async(std::launch::async, [&client] { return client.configure(); });
  EXPECT_TRUE(eventually([&] {
    static_cast<void>(journal.told());
    return answer.wait_for(0s) == std::future_status::ready;
  }));
  EXPECT_EQ(answer.get(), "none");
  EXPECT_TRUE(eventually([&] { return journal.count("listener: Accepting new VRP connection") == 1; }));
  client.close();
  daemon_.terminate();
  EXPECT_EQ(statusAfterReading(journal), 0) << daemon_.log();
  EXPECT_EQ(journal.count("MESSAGE=main: Ending on signal 15\nPRIORITY=6\nSYSLOG_IDENTIFIER=kytreportingd\n"
                          "KYT_OPERATION=main"),
            1);
  EXPECT_EQ(daemon_.log(), "") << "nothing is said twice";
}

}  // namespace
}  // namespace kyt
