// The real daemon in surroundings that nobody meant for it: closed standard descriptors, sockets that are none, absurd
// variables, limits too low, helper processes that stand still.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/support/PlainClient.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

using test::PlainClient;

class Surroundings : public ::testing::Test {
 protected:
  [[nodiscard]] bool serves() {
    PlainClient client(daemon_.socketPath());
    if (!client.shakeHands()) return false;
    client.call("FetchDisplayURL");
    return client.receiveText() == "URL not available";
  }
  void expectOrderlyEnd() {
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  // It takes its name after it was started.
  [[nodiscard]] pid_t helper(const std::string& name) const {
    pid_t found = 0;
    (void)eventually([&] { return (found = helperNow(name)) != 0; });
    return found;
  }
  [[nodiscard]] pid_t helperNow(const std::string& name) const {
    const std::string process = std::to_string(daemon_.process());
    std::ifstream children("/proc/" + process + "/task/" + process + "/children");
    for (pid_t child = 0; children >> child;) {
      std::string text;
      std::ifstream("/proc/" + std::to_string(child) + "/comm") >> text;
      if (text == name) return child;
    }
    return 0;
  }

  DaemonProcess daemon_{"http://127.0.0.1:9"};
};

TEST_F(Surroundings, StandardDescriptorsThatAreClosedBecomeTheNullDevice) {
  for (const std::vector<int>& closed : {std::vector<int>{0}, {2}, {0, 1, 2}}) {
    daemon_.setBeforeExecution([&closed] {
      for (const int descriptor : closed) ::close(descriptor);
    });
    daemon_.start();
    ASSERT_TRUE(eventually([&] { return PlainClient(daemon_.socketPath()).connected(); })) << closed.size();
    EXPECT_TRUE(serves());
    for (const int descriptor : closed) {
      std::error_code error;
      const auto target = std::filesystem::read_symlink(
          "/proc/" + std::to_string(daemon_.process()) + "/fd/" + std::to_string(descriptor), error);
      if (error == std::errc::permission_denied) GTEST_SKIP() << "the system does not show them to this user";
      EXPECT_EQ(target, "/dev/null") << descriptor;
    }
    expectOrderlyEnd();
  }
}

TEST_F(Surroundings, WhatIsHandedOverInsteadOfAListeningSocketIsAStartUpError) {
  const auto socketOf = [](int family, int type) { return ::socket(family, type, 0); };
  const std::pair<const char*, std::function<int()>> kinds[] = {
      {"a TCP socket", [&] { return socketOf(AF_INET, SOCK_STREAM); }},
      {"a TCP socket that listens",
       [&] {
         const int made = socketOf(AF_INET, SOCK_STREAM);
         ::listen(made, 1);
         return made;
       }},
      {"a Unix socket that does not listen", [&] { return socketOf(AF_UNIX, SOCK_STREAM); }},
      {"a datagram socket", [&] { return socketOf(AF_UNIX, SOCK_DGRAM); }},
      {"a file", [] { return ::open("/dev/null", O_RDWR); }},
      {"nothing", [] { return -1; }},
  };
  for (const auto& [name, make] : kinds) {
    SCOPED_TRACE(name);
    daemon_.setBeforeExecution([&make = make] {
      const int made = make();
      if (made >= 0 && made != 3) ::dup2(made, 3);
      if (made < 0) ::close(3);
      ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
      ::setenv("LISTEN_FDS", "1", 1);
    });
    daemon_.start();
    EXPECT_EQ(daemon_.exitStatus(), 1) << daemon_.log();
    EXPECT_TRUE(daemon_.logged("main: The descriptor that was passed is no listening Unix stream socket"))
        << daemon_.log();
  }
  for (const char* count : {"0", "2", "-1", "99999999999999999999", "1x", ""}) {
    SCOPED_TRACE(count);
    daemon_.setBeforeExecution([count] {
      ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
      ::setenv("LISTEN_FDS", count, 1);
    });
    daemon_.start();
    EXPECT_EQ(daemon_.exitStatus(), 1) << daemon_.log();
    EXPECT_TRUE(daemon_.logged(std::string("main: The service manager passed ") + count + " sockets"))
        << daemon_.log();
  }
}

TEST_F(Surroundings, AbsurdVariablesChangeNothing) {
  daemon_.setBeforeExecution([] {
    const std::string endless(100000, 'x');
    const std::pair<const char*, std::string> variables[] = {
        {"LISTEN_FDS", "-1"},          {"LISTEN_PID", "0"},
        {"NOTIFY_SOCKET", endless},    {"WATCHDOG_USEC", "1"},
        {"WATCHDOG_PID", "x"},         {"TZ", endless},
        {"LANG", "../../etc/passwd"},  {"LC_ALL", endless},
        {"http_proxy", "http://[::"},  {"JOURNAL_STREAM", "8:99999999999999999999"},
        {"INVOCATION_ID", "%s%s%s%n"}, {"SSL_CERT_FILE", "/dev/zero"}};
    for (const auto& [name, value] : variables) ::setenv(name, value.c_str(), 1);
  });
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  EXPECT_TRUE(serves());
  expectOrderlyEnd();
}

TEST_F(Surroundings, WithTooFewDescriptorsItSaysSoAndEnds) {
  if (kSanitized) GTEST_SKIP() << "the sanitizer itself needs more";
  for (const rlim_t most : {5, 7, 9}) {
    daemon_.setBeforeExecution([most] {
      for (int descriptor = 3; descriptor < 256; ++descriptor) ::close(descriptor);
      const rlimit limit = {most, most};
      ::setrlimit(RLIMIT_NOFILE, &limit);
    });
    daemon_.start();
    const int status = daemon_.exitStatus();
    EXPECT_TRUE(status == 1 || status == 255 || status == 127) << most << ": " << status;
    EXPECT_NE(daemon_.log(), "") << most;
  }
}

TEST_F(Surroundings, SignalsThatWereIgnoredOrHeldBackStillEndIt) {
  daemon_.setBeforeExecution([] {
    sigset_t all;
    ::sigfillset(&all);
    ::sigprocmask(SIG_SETMASK, &all, nullptr);
    for (const int signal : {SIGTERM, SIGINT, SIGCHLD, SIGALRM}) ::signal(signal, SIG_IGN);
  });
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  EXPECT_TRUE(serves());
  expectOrderlyEnd();
}

// Its question is asked for a grant that stands before the one that lets this client in.
TEST_F(Surroundings, AnInspectorThatStandsStillIsWaitedForOnce) {
  daemon_.root().write("etc/kytreportingd/entitlements.d/first.toml",
                       "[[grant]]\nexecutable = \"/bin/true\"\n\"com.vantu.private.kytreportingd\" = true\n");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  EXPECT_TRUE(serves());
  const pid_t inspector = helper("kyt-inspector");
  ASSERT_GT(inspector, 0);
  ASSERT_EQ(::kill(inspector, SIGSTOP), 0);
  const auto begin = std::chrono::steady_clock::now();
  for (int i = 0; i < 30; ++i) EXPECT_TRUE(serves()) << i;
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(30)) << "each client waited";
  ASSERT_EQ(::kill(inspector, SIGCONT), 0);
  EXPECT_TRUE(serves());
  expectOrderlyEnd();
}

TEST_F(Surroundings, HelpersThatStandStillDoNotKeepItFromEnding) {
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  const pid_t helpers[] = {helper("kyt-inspector"), helper("kyt-broker")};
  for (const pid_t each : helpers) {
    ASSERT_GT(each, 0);
    ASSERT_EQ(::kill(each, SIGSTOP), 0);
  }
  daemon_.terminate();
  EXPECT_TRUE(eventually([this] { return daemon_.hasEnded(); })) << daemon_.log();
  for (const pid_t each : helpers) ::kill(each, SIGKILL);
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

}  // namespace
}  // namespace kyt
