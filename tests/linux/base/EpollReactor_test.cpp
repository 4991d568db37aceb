// Watches and timers of the real reactor: what is reported, when it sleeps, and that a destroyed watch is
// silent.
#include "platform/linux/base/EpollReactor.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <pthread.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <system_error>
#include <thread>

#include "platform/base/Semaphore.h"
#include "platform/linux/base/Descriptors.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/Threads.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"
#include "tests/support/TimerServiceContract.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

class EpollHarness {
 public:
  ~EpollHarness() {
    end();
    pool_.shutDown();
  }
  TimerService& service() { return *reactor_; }
  const std::shared_ptr<SerialQueue>& queue() { return queue_; }
  Clock& clock() { return clock_; }
  template <typename Condition>
  [[nodiscard]] bool pass(Condition condition) {
    return eventually(condition);
  }
  void end() { reactor_.reset(); }

 private:
  LinuxClock clock_;
  WorkerPool pool_{WorkerPoolOptions{}};
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("timers", pool_);
  std::unique_ptr<EpollReactor> reactor_ = EpollReactor::create();
};

INSTANTIATE_TYPED_TEST_SUITE_P(Epoll, TimerServiceContract, EpollHarness);

class EpollReactorTest : public testing::Test {
 protected:
  EpollReactorTest() {
    int pair[2] = {-1, -1};
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, pair), 0);
    near_ = ownDescriptor(pair[0]);
    far_ = ownDescriptor(pair[1]);
  }
  void write(size_t bytes) {
    const std::string text(bytes, 'x');
    ASSERT_EQ(::write(far_.get(), text.data(), text.size()), static_cast<ssize_t>(bytes));
  }
  size_t read() {
    char buffer[4096];
    const ssize_t got = ::read(near_.get(), buffer, sizeof buffer);
    return got > 0 ? static_cast<size_t>(got) : 0;
  }
  // Waits until the reactor's thread has handled all that was ready before.
  void settle() {
    Descriptor event = makeEventDescriptor();
    Semaphore seen;
    Watch watch = reactor_->watch(event.get(), ready::readable | ready::edgeTriggered,
                                  [&](unsigned) { seen.signal(); });
    signalEventDescriptor(event.get());
    ASSERT_TRUE(seen.waitFor(kTestDeadline));
  }

  std::unique_ptr<EpollReactor> reactor_ = EpollReactor::create();
  Descriptor near_, far_;
};

TEST_F(EpollReactorTest, ReportsOnItsOwnNamedThread) {
  Semaphore seen;
  char name[16] = "";
  std::atomic<unsigned> bits{0};
  Watch watch = reactor_->watch(near_.get(), ready::readable | ready::edgeTriggered, [&](unsigned b) {
    bits = b;
    pthread_getname_np(pthread_self(), name, sizeof name);
    seen.signal();
  });
  ASSERT_TRUE(watch);
  write(1);
  ASSERT_TRUE(seen.waitFor(kTestDeadline));
  EXPECT_EQ(bits, ready::readable);
  EXPECT_STREQ(name, "kyt-reactor");
}

TEST_F(EpollReactorTest, ReportsEachChangeOnceWhenEdgeTriggered) {
  std::atomic<int> reports{0};
  Watch watch =
      reactor_->watch(near_.get(), ready::readable | ready::edgeTriggered, [&](unsigned) { ++reports; });
  write(10);
  EXPECT_TRUE(eventually([&] { return reports == 1; }));
  settle();
  EXPECT_EQ(reports, 1);
  write(10);
  EXPECT_TRUE(eventually([&] { return reports == 2; }));
}

TEST_F(EpollReactorTest, ReportsAgainAndAgainWhileReadyOtherwise) {
  std::atomic<int> reports{0};
  Watch watch = reactor_->watch(near_.get(), ready::readable, [&](unsigned) {
    if (++reports == 3) read();
  });
  write(10);
  EXPECT_TRUE(eventually([&] { return reports >= 3; }));
  settle();
  EXPECT_EQ(reports, 3);
}

TEST_F(EpollReactorTest, IsSilentAfterAReportUntilItIsRearmed) {
  std::atomic<int> reports{0};
  Watch watch = reactor_->watch(near_.get(), ready::readable | ready::oneShot, [&](unsigned) { ++reports; });
  write(1);
  EXPECT_TRUE(eventually([&] { return reports == 1; }));
  write(1);
  settle();
  EXPECT_EQ(reports, 1);
  EXPECT_TRUE(watch.rearm());
  EXPECT_TRUE(eventually([&] { return reports == 2; }));
}

TEST_F(EpollReactorTest, ReportsOtherEventsAfterModify) {
  std::atomic<unsigned> last{0};
  Watch watch = reactor_->watch(near_.get(), ready::readable | ready::edgeTriggered,
                                [&](unsigned bits) { last = bits; });
  settle();
  EXPECT_EQ(last, 0u);
  EXPECT_TRUE(watch.modify(ready::readable | ready::writable | ready::edgeTriggered));
  EXPECT_TRUE(eventually([&] { return last == ready::writable; }));
}

TEST_F(EpollReactorTest, ReportsTheEndOfTheStream) {
  std::atomic<unsigned> seen{0};
  Watch watch = reactor_->watch(near_.get(), ready::readable | ready::edgeTriggered,
                                [&](unsigned bits) { seen |= bits; });
  shutdown(far_.get(), SHUT_WR);
  EXPECT_TRUE(eventually([&] { return (seen & ready::ended) != 0; }));
}

TEST_F(EpollReactorTest, ReportsASocketErrorUnasked) {
  Descriptor socket = ownDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  sockaddr_storage address{};
  socklen_t length = sizeof address;
  {
    // A port of the loopback interface where nobody listens.
    Descriptor closed = ownDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr any{};
    any.sa_family = AF_INET;
    any.sa_data[2] = 127;
    any.sa_data[5] = 1;
    ASSERT_EQ(bind(closed.get(), &any, sizeof any), 0);
    ASSERT_EQ(getsockname(closed.get(), reinterpret_cast<sockaddr*>(&address), &length), 0);
  }
  (void)connect(socket.get(), reinterpret_cast<sockaddr*>(&address), length);
  std::atomic<unsigned> seen{0};
  Watch watch = reactor_->watch(socket.get(), ready::edgeTriggered, [&](unsigned bits) { seen |= bits; });
  EXPECT_TRUE(eventually([&] { return (seen & ready::failed) != 0; }));
}

TEST_F(EpollReactorTest, RefusesWhatCannotBeWaitedFor) {
  Descriptor file = ownDescriptor(open("/proc/self/exe", O_RDONLY | O_CLOEXEC));
  EXPECT_FALSE(reactor_->watch(file.get(), ready::readable, [](unsigned) {}));
  EXPECT_FALSE(reactor_->watch(-1, ready::readable, [](unsigned) {}));
}

TEST_F(EpollReactorTest, IsSilentAndHasForgottenTheHandlerOnceTheWatchIsDestroyed) {
  auto token = std::make_shared<int>(0);
  {
    Watch watch = reactor_->watch(near_.get(), ready::readable, [token](unsigned) { FAIL(); });
    EXPECT_EQ(token.use_count(), 2);
  }
  EXPECT_EQ(token.use_count(), 1);
  write(1);
  settle();
}

TEST_F(EpollReactorTest, MakesTheDestroyerWaitForAHandlerThatRuns) {
  Semaphore entered, leave;
  std::atomic<bool> left{false}, destroyed{false};
  std::optional<Watch> watch =
      reactor_->watch(near_.get(), ready::readable | ready::edgeTriggered, [&](unsigned) {
        entered.signal();
        leave.wait();
        EXPECT_FALSE(destroyed);
        left = true;
      });
  write(1);
  ASSERT_TRUE(entered.waitFor(kTestDeadline));
  std::thread destroyer([&] {
    watch.reset();
    destroyed = true;
    EXPECT_TRUE(left);
  });
  leave.signal();
  destroyer.join();
}

TEST_F(EpollReactorTest, LetsAHandlerDestroyItsOwnWatch) {
  auto token = std::make_shared<int>(0);
  Watch watch;
  Semaphore armed, done;
  watch = reactor_->watch(near_.get(), ready::readable, [&, token](unsigned) {
    armed.wait();
    watch = Watch();
    EXPECT_GE(token.use_count(), 2);
    done.signal();
  });
  armed.signal();
  write(1);
  ASSERT_TRUE(done.waitFor(kTestDeadline));
  EXPECT_TRUE(eventually([&] { return token.use_count() == 1; }));
}

TEST_F(EpollReactorTest, IsSilentAfterStopAndWatchesMayOutliveIt) {
  Watch watch = reactor_->watch(near_.get(), ready::readable, [](unsigned) { FAIL(); });
  reactor_->stop();
  write(1);
  EXPECT_FALSE(reactor_->watch(far_.get(), ready::readable, [](unsigned) { FAIL(); }));
  reactor_.reset();
  watch = Watch();
}

class EpollTimersTest : public EpollReactorTest {
 protected:
  ~EpollTimersTest() override {
    reactor_->stop();  // it submits to the pool
    pool_.shutDown();
  }
  WorkerPool pool_{WorkerPoolOptions{}};
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test", pool_);
};

TEST_F(EpollTimersTest, SleepsThroughWhatIsNotDue) {
  settle();
  const uint64_t before = reactor_->wakeUps();
  TimerHandle far = reactor_->after(1h, queue_, [] { FAIL(); });
  TimerHandle near = reactor_->after(10s, queue_, [] { FAIL(); });
  near.cancel();
  // What was set and cancelled left the alarm alone: nothing becomes readable in epoll.
  const uint64_t after = reactor_->wakeUps();
  EXPECT_EQ(after, before);
}

TEST_F(EpollTimersTest, SharesAWakeUpAmongTimersWithLeeway) {
  settle();
  const uint64_t before = reactor_->wakeUps();
  const auto begin = std::chrono::steady_clock::now();
  std::atomic<int> runs{0};
  std::vector<TimerHandle> handles;
  for (int i = 0; i < 10; ++i)
    handles.push_back(reactor_->every(10ms + i * 1ms, 60ms, queue_, [&] { ++runs; }));
  ASSERT_TRUE(eventually([&] { return runs >= 10; }));
  // All were due before the first one's leeway was over, and so it is in each round that a slow machine adds.
  const uint64_t wakeUps = reactor_->wakeUps() - before;
  EXPECT_LE(wakeUps, (std::chrono::steady_clock::now() - begin) / 60ms + 1);
}

// The alarm's descriptor of the reactor that was made last.
int alarmDescriptor() {
  int found = -1;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code gone;
    if (std::filesystem::read_symlink(entry, gone) == "anon_inode:[timerfd]")
      found = std::max(found, std::stoi(entry.path().filename()));
  }
  return found;
}

TEST_F(EpollTimersTest, FiresAlsoThoseWhoseAlarmTheSystemRefusedForAMoment) {
  const int alarm = alarmDescriptor();
  ASSERT_GE(alarm, 0);
  const Descriptor kept = ownDescriptor(::dup(alarm)), noAlarm = ownDescriptor(::open("/dev/null", O_RDONLY));
  Semaphore first, second;
  ASSERT_EQ(::dup2(noAlarm.get(), alarm), alarm);
  const TimerHandle refused = reactor_->after(1ms, queue_, [&] { first.signal(); });
  ASSERT_EQ(::dup2(kept.get(), alarm), alarm);
  const TimerHandle later = reactor_->after(2ms, queue_, [&] { second.signal(); });
  EXPECT_TRUE(first.waitFor(kTestDeadline));
  EXPECT_TRUE(second.waitFor(kTestDeadline));
}

TEST_F(EpollTimersTest, DoesNotMakeUpForMissedTicks) {
  std::atomic<int> runs{0};
  Semaphore entered, leave;
  // A handler that holds the reactor's thread over several periods.
  Watch watch = reactor_->watch(near_.get(), ready::readable | ready::edgeTriggered, [&](unsigned) {
    entered.signal();
    leave.wait();
  });
  const auto begin = std::chrono::steady_clock::now();
  TimerHandle handle = reactor_->every(20ms, Duration::zero(), queue_, [&] { ++runs; });
  write(1);
  ASSERT_TRUE(entered.waitFor(kTestDeadline));
  EXPECT_TRUE(eventually([&] { return std::chrono::steady_clock::now() - begin >= 120ms; }));
  leave.signal();
  ASSERT_TRUE(eventually([&] { return runs >= 2; }));
  // The second run is a whole period's phase later than the missed ones, which count as one.
  EXPECT_GE(std::chrono::steady_clock::now() - begin, 120ms);
  const auto periods = (std::chrono::steady_clock::now() - begin) / 20ms;
  EXPECT_LE(runs, periods - 3);
}

TEST_F(EpollTimersTest, KeepsOneTickAtMostWaitingForItsQueue) {
  std::atomic<int> runs{0};
  TimerHandle handle;
  queue_->sync([&] {
    const auto begin = std::chrono::steady_clock::now();
    handle = reactor_->every(1ms, Duration::zero(), queue_, [&] {
      handle.cancel();
      ++runs;
    });
    EXPECT_TRUE(eventually([&] { return std::chrono::steady_clock::now() - begin >= 20ms; }));
  });
  ASSERT_TRUE(eventually([&] { return runs >= 1; }));
  settle();
  queue_->sync([] {});
  EXPECT_LE(runs, 2) << "one that waited, and one that came due before it cancelled";
}

TEST(EpollReactorStress, WatchesComeAndGoWhileEventsArrive) {
  auto reactor = EpollReactor::create();
  std::atomic<int> wrong{0}, reports{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&] {
      for (int round = 0; round < 200; ++round) {
        int pair[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, pair) != 0) return;
        Descriptor near = ownDescriptor(pair[0]);
        Descriptor far = ownDescriptor(pair[1]);
        auto alive = std::make_unique<std::atomic<bool>>(true);
        {
          Watch watch = reactor->watch(near.get(), ready::readable, [&, flag = alive.get()](unsigned) {
            if (!*flag) ++wrong;
            ++reports;
            char buffer[16];
            (void)!::read(near.get(), buffer, sizeof buffer);
          });
          (void)!::write(far.get(), "x", 1);
          if (round % 2 == 0) std::this_thread::yield();
        }
        *alive = false;
        alive.reset();
      }
    });
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
  EXPECT_GT(reports, 0);
}

TEST(EpollReactorStress, TimersComeAndGo) {
  WorkerPool pool{WorkerPoolOptions{}};
  auto reactor = EpollReactor::create();
  std::atomic<int> runs{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&, t] {
      auto queue = SerialQueue::create("test", pool);
      for (int round = 0; round < 300; ++round) {
        TimerHandle once = reactor->after(std::chrono::microseconds(round % 7 * 50), queue, [&] { ++runs; });
        TimerHandle often = reactor->every(1ms, Duration::zero(), queue, [&] { ++runs; });
        if (round % 10 != t) continue;
        EXPECT_TRUE(eventually([&, before = runs.load()] { return runs > before; }));
      }
    });
  for (auto& thread : threads) thread.join();
  EXPECT_GT(runs, 0);
  reactor->stop();
  pool.shutDown();
}

TEST(LinuxClock, AgreesWithTheSystem) {
  LinuxClock clock;
  const auto before = std::chrono::steady_clock::now();
  const MonotonicTime now = clock.monotonic();
  EXPECT_GE(now, before);
  EXPECT_LE(now, std::chrono::steady_clock::now());
  const TimeValue day = clock.timeOfDay();
  EXPECT_NEAR(day.asSeconds(),
              std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count(),
              5.0);
  EXPECT_GE(day.microseconds, 0);
  EXPECT_LT(day.microseconds, 1000000);
}

TEST(Threads, KeepSignalsToTheProcessAway) {
  std::thread([] {
    beginServiceThread("a-name-of-more-than-fifteen-bytes");
    char name[16] = "";
    pthread_getname_np(pthread_self(), name, sizeof name);
    EXPECT_STREQ(name, "a-name-of-more-");
    sigset_t blocked;
    pthread_sigmask(SIG_SETMASK, nullptr, &blocked);
    EXPECT_EQ(sigismember(&blocked, SIGTERM), 1);
    EXPECT_EQ(sigismember(&blocked, SIGSEGV), 0);
  }).join();
}

}  // namespace
}  // namespace kyt
