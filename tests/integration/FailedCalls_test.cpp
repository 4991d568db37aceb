// What the system refuses once costs that moment at most: each of the first ten calls of each kind fails, at the start, while
// the daemon serves, and when it ends.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <filesystem>
#include <memory>
#include <ostream>
#include <string>

#include "tests/integration/FailingDaemon.h"
#include "tests/integration/TestClient.h"
#include "tests/support/SignedBag.h"
#include "tests/support/TestCertificates.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

constexpr int kCalls = 10;
constexpr std::chrono::seconds kPatience{
    20};  // of an end: the grace time of 5 s, and what has limits of its own
constexpr int kRuleCases = 8;
constexpr int kBefore = 5, kAfterwards = 6;  // client types with storebags of their own

struct Failure {
  kyt_failing_call call;
  const char* name;
  int error;
  const char* errorName;
};

void PrintTo(const Failure& failure, std::ostream* out) {
  *out << failure.name << " " << failure.errorName;
}

#define KYT_FAILURE(call, error)             \
  Failure {                                  \
    kyt_failing_##call, #call, error, #error \
  }

const Failure kFailures[] = {
    KYT_FAILURE(open, EMFILE),
    KYT_FAILURE(openat, EMFILE),
    KYT_FAILURE(read, EIO),
    KYT_FAILURE(read, EINTR),
    KYT_FAILURE(write, ENOSPC),
    KYT_FAILURE(write, EINTR),
    KYT_FAILURE(recvmsg, EINTR),
    KYT_FAILURE(recvmsg, ENOMEM),
    KYT_FAILURE(sendmsg, EAGAIN),
    KYT_FAILURE(sendmsg, ENOBUFS),
    KYT_FAILURE(recv, EINTR),
    KYT_FAILURE(recvfrom, ENOMEM),
    KYT_FAILURE(send, ENOBUFS),
    KYT_FAILURE(sendto, ENOBUFS),
    KYT_FAILURE(accept4, EMFILE),
    KYT_FAILURE(accept4, ENOMEM),
    KYT_FAILURE(accept4, ECONNABORTED),
    KYT_FAILURE(accept4, EPERM),
    KYT_FAILURE(socket, EMFILE),
    KYT_FAILURE(socketpair, EMFILE),
    KYT_FAILURE(bind, EADDRINUSE),
    KYT_FAILURE(listen, ENOMEM),
    KYT_FAILURE(connect, EAGAIN),
    KYT_FAILURE(epoll_create1, EMFILE),
    KYT_FAILURE(epoll_ctl, ENOMEM),
    KYT_FAILURE(epoll_ctl, ENOSPC),
    KYT_FAILURE(epoll_wait, EINTR),
    KYT_FAILURE(eventfd, EMFILE),
    KYT_FAILURE(timerfd_create, EMFILE),
    KYT_FAILURE(timerfd_settime, ENOMEM),
    KYT_FAILURE(signalfd, EMFILE),
    KYT_FAILURE(stat, ENOMEM),
    KYT_FAILURE(lstat, ENOMEM),
    KYT_FAILURE(fstat, ENOMEM),
    KYT_FAILURE(rename, EIO),
    KYT_FAILURE(fsync, EIO),
    KYT_FAILURE(mkdir, ENOSPC),
    KYT_FAILURE(opendir, EMFILE),
    KYT_FAILURE(readdir, EIO),
    KYT_FAILURE(unlink, EIO),
    KYT_FAILURE(fchmod, EIO),
    KYT_FAILURE(chmod, EIO),
    KYT_FAILURE(flock, ENOLCK),
    KYT_FAILURE(ftruncate, EIO),
    KYT_FAILURE(fork, EAGAIN),
    KYT_FAILURE(pthread_create, EAGAIN),
    KYT_FAILURE(poll, EINTR),
    KYT_FAILURE(poll, ENOMEM),
    KYT_FAILURE(getrandom, EINTR),
    KYT_FAILURE(setsockopt, ENOMEM),
    KYT_FAILURE(getsockopt, ENOBUFS),
    KYT_FAILURE(setrlimit, EPERM),
    KYT_FAILURE(getrlimit, EPERM),
    KYT_FAILURE(mmap, ENOMEM),
    KYT_FAILURE(waitpid, EINTR),
    KYT_FAILURE(capget, EPERM),
    KYT_FAILURE(pidfd_open, EMFILE),
};

class FailedCallsFixture : public ::testing::Test {
 protected:
  FailedCallsFixture() {
    const auto bag = [this](const char* path) {
      const Dictionary entry{{"post_url", server_.url(path)}, {"event_threshold", 1000}};
      return signedBag(
          Dictionary{{"version", "1"},
                     {"vantu_internal", Dictionary{{"httppost", Dictionary{{"clients", Array{entry}}}}}}},
          propertyLists_);
    };
    server_.setHandler([this, before = bag("/before"),
                        afterwards = bag("/afterwards")](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      if (request.method == "GET")
        reply.body = request.target.find("/brisca") != std::string::npos ? afterwards : before;
      else if (request.target == "/afterwards")
        ++arrived_;
      return reply;
    });
  }
  void SetUp() override {
    if (kSanitized) GTEST_SKIP() << "a sanitizer's own library must be loaded first";
  }

  // A client whose every step may fail.
  static void tryToReport(const FailingDaemon& daemon) {
    TestClient client(daemon.socketPath(), kBefore);
    const auto configured = std::make_shared<std::promise<void>>();
    client->startConfiguration([configured](std::optional<std::vector<std::string>>, std::optional<Error>) {
      configured->set_value();
    });
    static_cast<void>(configured->get_future().wait_for(300ms));
    static_cast<void>(client.send(10, 1, Dictionary{{"n", 1}}));
    static_cast<void>(client.startFlush()->get_future().wait_for(300ms));
  }
  // A client whose every step must work.
  [[nodiscard]] bool reports(const FailingDaemon& daemon) {
    const int before = arrived_;
    TestClient client(daemon.socketPath(), kAfterwards);
    const std::string configured = client.configure();
    EXPECT_EQ(configured, "live: httppost");
    if (configured != "live: httppost") return false;
    static_cast<void>(client.send(10, 1, Dictionary{{"n", 1}}));
    EXPECT_EQ(client.flush(), "flushed");
    return eventually([&] { return arrived_ > before; });
  }
  static void endsInOrder(FailingDaemon& daemon) {
    const auto begin = std::chrono::steady_clock::now();
    daemon.terminate();
    EXPECT_EQ(daemon.exitStatus(), 0) << daemon.log();
    EXPECT_LT(std::chrono::steady_clock::now() - begin, kPatience) << daemon.log();
  }
  // Where the line about it may be lost, its socket tells that it has started.
  static bool startsOrEnds(FailingDaemon& daemon, bool mayLoseLines = false) {
    daemon.start({"--log-level", "default"});
    return eventually([&] {
      return daemon.hasEnded() || daemon.logged("start loop.") ||
             (mayLoseLines && std::filesystem::exists(daemon.socketPath()));
    });
  }

  PugixmlPropertyLists propertyLists_;
  std::atomic<int> arrived_{0};
  TestHTTPServer server_;
};

class FailedCalls : public FailedCallsFixture, public ::testing::WithParamInterface<Failure> {
 protected:
  // Until the call is not made so often.
  template <typename Case>
  void withEachOfTheFirst(Case&& run) {
    for (int first = 1; first <= kCalls; ++first) {
      SCOPED_TRACE(std::string(GetParam().name) + " " + std::to_string(first) + ": " + GetParam().errorName);
      FailingDaemon daemon(server_.url(""));
      run(daemon, first);
      if (daemon.failures() == 0 || HasFailure()) return;
    }
  }
};

TEST_P(FailedCalls, AtTheStartAreGotOverOrEndItWithALine) {
  withEachOfTheFirst([this](FailingDaemon& daemon, int first) {
    daemon.fail(GetParam().call, GetParam().error, first);
    ASSERT_TRUE(startsOrEnds(daemon, GetParam().call == kyt_failing_write)) << daemon.log();
    daemon.stopFailing();
    if (daemon.hasEnded()) {
      const int status = daemon.exitStatus();
      EXPECT_EQ(status, daemon.logged("<3>main: confine_init() fails: ") ? 255 : 1) << daemon.log();
      EXPECT_TRUE(daemon.logged("<3>")) << daemon.log();
      EXPECT_GT(daemon.failures(), 0) << daemon.log();
      return;
    }
    EXPECT_TRUE(reports(daemon)) << daemon.log();
    endsInOrder(daemon);
  });
}

TEST_P(FailedCalls, WhileItServesCostThatMomentAtMost) {
  withEachOfTheFirst([this](FailingDaemon& daemon, int first) {
    ASSERT_TRUE(startsOrEnds(daemon)) << daemon.log();
    daemon.fail(GetParam().call, GetParam().error, first);
    tryToReport(daemon);
    daemon.stopFailing();
    EXPECT_TRUE(reports(daemon)) << daemon.log();
    endsInOrder(daemon);
  });
}

TEST_P(FailedCalls, AtTheEndDoNotKeepItFromEnding) {
  withEachOfTheFirst([](FailingDaemon& daemon, int first) {
    ASSERT_TRUE(startsOrEnds(daemon)) << daemon.log();
    TestClient client(daemon.socketPath(), kBefore);
    ASSERT_EQ(client.configure(), "live: httppost") << daemon.log();
    static_cast<void>(client.send(10, 1, Dictionary{{"n", 1}}));
    daemon.fail(GetParam().call, GetParam().error, first);
    endsInOrder(daemon);
  });
}

// What watches a socket tries twice by itself.
TEST_F(FailedCallsFixture, ToWatchASocketCostThatMomentAlsoWhenSeveralFollowEachOther) {
  for (int first = 1; first <= kCalls; ++first) {
    SCOPED_TRACE(first);
    FailingDaemon daemon(server_.url(""));
    ASSERT_TRUE(startsOrEnds(daemon)) << daemon.log();
    daemon.fail(kyt_failing_epoll_ctl, ENOSPC, first, 4);
    tryToReport(daemon);
    daemon.stopFailing();
    const auto begin = std::chrono::steady_clock::now();
    EXPECT_TRUE(reports(daemon)) << daemon.log();
    EXPECT_LT(std::chrono::steady_clock::now() - begin, 8s)
        << "as long as a request waits for its connection";
    endsInOrder(daemon);
    if (HasFailure()) return;
  }
}

// How the daemon ends when the system is not what it was.
class EndOfTheDaemon : public FailedCallsFixture {
 protected:
  // A session that holds an event.
  std::unique_ptr<TestClient> sessionWithAnEvent(FailingDaemon& daemon) {
    EXPECT_TRUE(startsOrEnds(daemon)) << daemon.log();
    auto client = std::make_unique<TestClient>(daemon.socketPath(), kBefore);
    EXPECT_EQ(client->configure(), "live: httppost") << daemon.log();
    static_cast<void>(client->send(10, 1, Dictionary{{"n", 1}}));
    return client;
  }
};

TEST_F(EndOfTheDaemon, DoesNotWaitForThreadsThatTheSystemRefuses) {
  FailingDaemon daemon(server_.url(""));
  const auto client = sessionWithAnEvent(daemon);
  // The workers end when they have been idle for ten seconds; from then on there is none.
  ASSERT_TRUE(eventually([&] { return daemon.threads() == daemon.threadsNamed("kyt-reactor") + 2; }))
      << daemon.threads() << " threads";  // besides the main thread and that of the network
  daemon.fail(kyt_failing_pthread_create, EAGAIN, 1, FailingDaemon::kAlways);
  endsInOrder(daemon);
}

TEST_F(EndOfTheDaemon, DoesNotWaitForWhoeverReadsStandardError) {
  FailingDaemon daemon(server_.url(""));
  int ends[2];
  ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
  daemon.addBeforeExecution([out = ends[1]] { ::dup2(out, 2); });
  daemon.start({"--log-level", "debug"});
  // Nobody reads; what it says fills the pipe, and later what may wait for it.
  for (int client = 0; client < 40; ++client) EXPECT_TRUE(reports(daemon));
  int waiting = 0;
  ASSERT_EQ(::ioctl(ends[0], FIONREAD, &waiting), 0);
  EXPECT_GT(waiting, 60000) << "the pipe is full";
  endsInOrder(daemon);
  ::close(ends[0]);
  ::close(ends[1]);
}

TEST_F(EndOfTheDaemon, DoesNotComeBySignalsThatMeanNothingToIt) {
  FailingDaemon daemon(server_.url(""));
  const auto client = sessionWithAnEvent(daemon);
  for (const int signal :
       {SIGHUP, SIGUSR1, SIGUSR2, SIGALRM, SIGVTALRM, SIGPROF, SIGIO, SIGPWR, SIGRTMIN, SIGRTMAX})
    daemon.terminate(signal);
  EXPECT_TRUE(eventually([&] { return daemon.logged("<6>reload: no setting has changed"); })) << daemon.log();
  EXPECT_TRUE(reports(daemon)) << daemon.log();
  endsInOrder(daemon);
}

TEST_F(EndOfTheDaemon, DoesNotWaitForACertificateFileThatIsANamedPipe) {
  FailingDaemon daemon(server_.url(""));
  const std::string pipe = daemon.root() / "ca.pem";
  ASSERT_EQ(::mkfifo(pipe.c_str(), 0644), 0);
  daemon.writeSettings(
      "[storebag]\ninternal_host = \"https://127.0.0.1:9\"\npublic_host = \"https://127.0.0.1:9\"\n"
      "[log]\ntarget = \"stderr\"\n[tls]\nca_file = \"" +
      pipe + "\"\n");
  ASSERT_TRUE(startsOrEnds(daemon)) << daemon.log();
  TestHTTPServer silent{[] {
    TestHTTPServer::Options options;
    options.certificate = TestCertificateAuthority().issue();
    return options;
  }()};
  daemon.root().write("var/lib/kytreportingd/defaults/com.vantu.kytreporting.toml",
                      "kytreporting_storebag_url = \"" + silent.url("") + "\"\n");
  TestClient client(daemon.socketPath(), kBefore);
  EXPECT_EQ(client.configure(), "none");
  endsInOrder(daemon);
}

TEST_F(EndOfTheDaemon, ComesEvenWhenItsMainThreadHangs) {
  FailingDaemon daemon(server_.url(""));
  const auto client = sessionWithAnEvent(daemon);
  daemon.fail(kyt_failing_waitpid, kyt_failing_hangs);
  endsInOrder(daemon);
  EXPECT_EQ(daemon.failures(), 1);
  EXPECT_TRUE(daemon.logged("<3>shutDown: Not ended in time, ending without what still waits"))
      << daemon.log();
}

// The calls by which the daemon gives up what it could do.
class ConfinementFixture : public FailedCallsFixture {
 protected:
  // Of these calls each that the start makes, from the `first` one on in steps of `step`.
  void eachFailureEndsTheStart(const Failure& failure, int first = 1, int step = 1) {
    int failed = 0;
    for (;; first += step) {
      SCOPED_TRACE(std::string(failure.name) + " " + std::to_string(first));
      FailingDaemon daemon(server_.url(""));
      daemon.fail(failure.call, failure.error, first);
      ASSERT_TRUE(startsOrEnds(daemon)) << daemon.log();
      daemon.stopFailing();
      if (daemon.failures() == 0) {
        EXPECT_TRUE(reports(daemon)) << daemon.log();
        endsInOrder(daemon);
        break;
      }
      ++failed;
      EXPECT_EQ(daemon.exitStatus(), 255) << daemon.log();
      EXPECT_TRUE(daemon.logged("<3>main: confine_init() fails: ")) << daemon.log();
      EXPECT_FALSE(daemon.logged("Listener resumes")) << daemon.log();
      if (HasFailure()) return;
    }
    EXPECT_GT(failed, 0);
  }
};

class ConfinementStep : public ConfinementFixture, public ::testing::WithParamInterface<Failure> {};

TEST_P(ConfinementStep, ThatFailsEndsTheStartWith255AndALine) {
  eachFailureEndsTheStart(GetParam());
}

// Hundreds of rules make the filters: a part of them in each case, by the number of the first one.
class SystemCallRule : public ConfinementFixture, public ::testing::WithParamInterface<int> {};

TEST_P(SystemCallRule, ThatCannotBeAddedEndsTheStartWith255AndALine) {
  eachFailureEndsTheStart(KYT_FAILURE(seccomp_rule_add_array, ENOMEM), GetParam(), kRuleCases);
}

INSTANTIATE_TEST_SUITE_P(From, SystemCallRule, ::testing::Range(1, kRuleCases + 1));

// What the kernel lists of the process: the filters that it runs under.
std::string filtersOf(const FailingDaemon& daemon) {
  std::ifstream status("/proc/" + std::to_string(daemon.process()) + "/status");
  std::string filters;
  for (std::string line; std::getline(status, line);)
    if (line.starts_with("Seccomp") || line.starts_with("NoNewPrivs")) filters += line + "\n";
  return filters;
}

// Some of these calls only ask what the kernel knows, and there are other ways to enter a filter.
using FailedCallsForAFilter = FailedCallsFixture;

TEST_F(FailedCallsForAFilter, NeverLeaveTheDaemonWithLess) {
  std::string whole;
  {
    FailingDaemon daemon(server_.url(""));
    ASSERT_TRUE(startsOrEnds(daemon) && !daemon.hasEnded()) << daemon.log();
    whole = filtersOf(daemon);
    ASSERT_NE(whole.find("Seccomp_filters:\t"), std::string::npos) << whole;
    endsInOrder(daemon);
  }
  for (int first = 1, failures = 1; failures > 0; ++first) {
    SCOPED_TRACE(first);
    FailingDaemon daemon(server_.url(""));
    daemon.fail(kyt_failing_seccomp, EINVAL, first);
    ASSERT_TRUE(startsOrEnds(daemon)) << daemon.log();
    failures = daemon.failures();
    daemon.stopFailing();
    if (daemon.hasEnded()) {
      EXPECT_EQ(daemon.exitStatus(), 255) << daemon.log();
      EXPECT_TRUE(daemon.logged("<3>main: confine_init() fails: seccomp: ")) << daemon.log();
    } else {
      EXPECT_EQ(filtersOf(daemon), whole);
      endsInOrder(daemon);
    }
    if (HasFailure()) return;
  }
}

const Failure kSteps[] = {
    KYT_FAILURE(prctl, EPERM),
    KYT_FAILURE(capset, EPERM),
    KYT_FAILURE(landlock_create_ruleset, ENOMEM),
    KYT_FAILURE(landlock_add_rule, ENOMEM),
    KYT_FAILURE(landlock_restrict_self, E2BIG),
    KYT_FAILURE(setrlimit, EPERM),
    KYT_FAILURE(seccomp_init, ENOMEM),
    KYT_FAILURE(seccomp_attr_set, EINVAL),
    KYT_FAILURE(seccomp_load, ENOMEM),
};

INSTANTIATE_TEST_SUITE_P(Of, ConfinementStep, ::testing::ValuesIn(kSteps),
                         [](const auto& failure) { return std::string(failure.param.name); });

INSTANTIATE_TEST_SUITE_P(Of, FailedCalls, ::testing::ValuesIn(kFailures), [](const auto& failure) {
  return std::string(failure.param.name) + "_" + failure.param.errorName;
});

// It hangs where it opens its settings: of all files /dev/null comes before, for what is closed of the first three.
TEST(StartOfTheDaemon, IsNotCutOffByASignalToReadTheSettingsAgain) {
  FailingDaemon daemon("http://127.0.0.1:9");
  daemon.fail(kyt_failing_open, kyt_failing_hangs, 2);
  daemon.start();
  ASSERT_TRUE(eventually([&] { return daemon.failures() == 1; }));
  daemon.terminate(SIGHUP);
  daemon.goOn();
  EXPECT_TRUE(
      eventually([&] { return daemon.logged("reload: no setting has changed") || daemon.hasEnded(); }));
  ASSERT_FALSE(daemon.hasEnded()) << daemon.log();
  daemon.terminate();
  EXPECT_EQ(daemon.exitStatus(), 0) << daemon.log();
}

}  // namespace
}  // namespace kyt
