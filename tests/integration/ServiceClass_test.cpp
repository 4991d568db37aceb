// The daemon gives way to what people wait for: every one of its threads, also those that come later.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "tests/integration/DaemonProcess.h"
#include "tests/support/PlainClient.h"

namespace kyt {
namespace {

constexpr int kUtilityNice = 5;
constexpr long kUtilityIO = 2 << 13 | 6;  // best effort, priority 6
constexpr int kOfThread = 1;

std::vector<pid_t> threadsOf(pid_t process) {
  std::vector<pid_t> threads;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/task"))
    threads.push_back(std::stoi(entry.path().filename()));
  return threads;
}

TEST(DaemonServiceClass, EveryThreadGivesWayToOthers) {
  DaemonProcess daemon("http://127.0.0.1:1");
  ASSERT_TRUE(daemon.startAndWait()) << daemon.log();
  test::PlainClient client(daemon.socketPath());
  ASSERT_TRUE(client.connected() && client.shakeHands());
  const auto accepted = [&] { return daemon.logged("initWithSessionDelegate: Initialized session"); };
  ASSERT_TRUE(eventually(accepted)) << daemon.log();  // a worker has run
  const std::vector<pid_t> threads = threadsOf(daemon.process());
  EXPECT_GE(threads.size(), 2U);
  const int expected = std::max(kUtilityNice, ::getpriority(PRIO_PROCESS, 0));
  for (const pid_t thread : threads) {
    errno = 0;
    const int nice = ::getpriority(PRIO_PROCESS, static_cast<id_t>(thread));
    if (errno == ESRCH) continue;  // a worker that was done
    EXPECT_EQ(nice, expected) << thread;
    const long io = ::syscall(SYS_ioprio_get, kOfThread, thread);
    if (io < 0 && errno == ESRCH) continue;
    EXPECT_EQ(io, kUtilityIO) << thread;
  }
  daemon.terminate();
  EXPECT_EQ(daemon.exitStatus(), 0);
}

}  // namespace
}  // namespace kyt
