#include "platform/linux/service/ServiceManager.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/linux/files/Files.h"
#include "platform/queues/SerialQueue.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

sockaddr_un addressOf(const std::string& path) {
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  return address;
}

TEST(ServiceManager, TellsItsStateWhenSomeoneListens) {
  const TemporaryFolder folder;
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              ::unsetenv("NOTIFY_SOCKET");
              ServiceManager::ready("nobody listens");
              const Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
              const sockaddr_un address = addressOf(folder / "notify");
              if (::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
                return "bind";
              ::setenv("NOTIFY_SOCKET", address.sun_path, 1);
              ServiceManager::ready("Listening");
              ServiceManager::status("5 sessions\nREADY=0");
              ServiceManager::stopping();
              std::string all;
              for (int i = 0; i < 3; ++i) {
                char buffer[512];
                const ssize_t count = ::recv(socket.get(), buffer, sizeof buffer, 0);
                all += std::string(buffer, static_cast<size_t>(count > 0 ? count : 0)) + "|";
              }
              return all;
            }),
            "READY=1\nSTATUS=Listening|STATUS=5 sessions\\nREADY=0|STOPPING=1\nSTATUS=Stopping|");
}

TEST(ServiceClass, UtilityGivesWayToOthers) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              const int before = ::getpriority(PRIO_PROCESS, 0);
              if (!enterUtilityServiceClass()) return "refused";
              const int after = ::getpriority(PRIO_PROCESS, 0);
              const long io = ::syscall(SYS_ioprio_get, 1, 0);
              if (after != std::max(before, 5)) return "nice " + std::to_string(after);
              if (io != (2 << 13 | 6)) return "ioprio " + std::to_string(io);
              if (::setpriority(PRIO_PROCESS, 0, 12) != 0 || !enterUtilityServiceClass())
                return "refused again";
              return ::getpriority(PRIO_PROCESS, 0) == 12 ? "" : "made more important";
            }),
            "");
}

class LinuxProcessTransactionTest : public testing::Test {
 protected:
  std::unique_ptr<LinuxProcessTransaction> make(bool socketActivated) {
    return std::make_unique<LinuxProcessTransaction>(LinuxProcessTransaction::Options{socketActivated, 30},
                                                     timers_, queue_, [this] {
                                                       ++asked_;
                                                       return mayEnd_;
                                                     });
  }
  void advance(int seconds) {
    timers_.advance(std::chrono::seconds(seconds), [this] { executor_.runAll(); });
  }
  ManualClock clock_;
  ManualTimers timers_{clock_};
  ManualExecutor executor_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test", executor_);
  bool mayEnd_ = true;
  int asked_ = 0;
};

TEST_F(LinuxProcessTransactionTest, EndsAnIdleProcessThatNobodyConnectedTo) {
  const auto transaction = make(true);
  advance(29);
  EXPECT_EQ(asked_, 0);
  advance(1);
  EXPECT_EQ(asked_, 1);
  advance(100);
  EXPECT_EQ(asked_, 1);
}

TEST_F(LinuxProcessTransactionTest, AnOpenTransactionKeepsTheProcess) {
  const auto transaction = make(true);
  advance(29);
  transaction->begin();
  EXPECT_TRUE(transaction->isOpen());
  EXPECT_EQ(timers_.pending(), 0u) << "no wake-ups meanwhile";
  advance(1000);
  EXPECT_EQ(asked_, 0);
  transaction->end();
  EXPECT_FALSE(transaction->isOpen());
  advance(29);
  EXPECT_EQ(asked_, 0) << "counted from the end of the last session";
  advance(1);
  EXPECT_EQ(asked_, 1);
}

TEST_F(LinuxProcessTransactionTest, OutstandingWorkBeginsTheWaitAnew) {
  mayEnd_ = false;
  const auto transaction = make(true);
  advance(30);
  EXPECT_EQ(asked_, 1);
  advance(29);
  EXPECT_EQ(asked_, 1);
  mayEnd_ = true;
  advance(1);
  EXPECT_EQ(asked_, 2);
  advance(1000);
  EXPECT_EQ(asked_, 2);
}

TEST_F(LinuxProcessTransactionTest, ABeginThatOvertakesTheTimersWorkWins) {
  const auto transaction = make(true);
  timers_.advance(std::chrono::seconds(30));  // due, handed to the queue, not run yet
  transaction->begin();
  executor_.runAll();
  EXPECT_EQ(asked_, 0);
  transaction->end();
  executor_.runAll();
  EXPECT_EQ(asked_, 0);
}

TEST_F(LinuxProcessTransactionTest, ASessionThatCameAndWentBeforeTheTimersWorkRanCountsAnew) {
  const auto transaction = make(true);
  timers_.advance(std::chrono::seconds(30));  // due, handed to the queue, not run yet
  transaction->begin();
  transaction->end();
  executor_.runAll();
  EXPECT_EQ(asked_, 0);
  advance(30);
  EXPECT_EQ(asked_, 1);
}

TEST_F(LinuxProcessTransactionTest, WithoutSocketActivationNothingEnds) {
  const auto transaction = make(false);
  transaction->begin();
  transaction->end();
  EXPECT_EQ(timers_.pending(), 0u);
  advance(1000);
  EXPECT_EQ(asked_, 0);
}

TEST_F(LinuxProcessTransactionTest, MayEndWhileItsWorkIsOnItsWay) {
  auto transaction = make(true);
  timers_.advance(std::chrono::seconds(30));
  transaction.reset();
  executor_.runAll();
  EXPECT_EQ(asked_, 0);
}

}  // namespace
}  // namespace kyt
