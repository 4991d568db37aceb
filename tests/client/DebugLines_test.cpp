// KYTREPORTING_DEBUG: what the library writes to standard error, seen from a process of its own.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <functional>
#include <future>
#include <set>
#include <sstream>
#include <string>

#include "kytreporting/KYTReporting.h"
#include "tests/client/TestDaemon.h"
#include "tests/support/Eventually.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/TemporaryFolder.h"

#ifndef KYT_NO_FORK_TEST

namespace kyt {
namespace {

class ClientDebugLines : public testing::Test {
 protected:
  KYTReporting::Options options(int clientType = 7) const {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = {{kKYTReportingSessionInfoSessionID, 42},
                        {kKYTReportingSessionInfoClientType, clientType}};
    return made;
  }
  // What a child that does this writes to standard error.
  static std::string linesOf(const char* debug, const std::function<void()>& what) {
    std::array<int, 2> pipe{};
    if (::pipe2(pipe.data(), O_CLOEXEC) != 0) return "no pipe";
    const pid_t child = fork();
    if (child == 0) {
      alarm(static_cast<unsigned>(kTestDeadline.count()));
      dup2(pipe[1], STDERR_FILENO);
      if (debug != nullptr)
        setenv("KYTREPORTING_DEBUG", debug, 1);
      else
        unsetenv("KYTREPORTING_DEBUG");
      what();
      _exit(0);
    }
    close(pipe[1]);
    std::string text;
    std::array<char, 4096> buffer;
    for (ssize_t got = 0; (got = read(pipe[0], buffer.data(), buffer.size())) > 0;)
      text.append(buffer.data(), static_cast<size_t>(got));
    close(pipe[0]);
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? text : text + "(ended badly)";
  }

  TemporaryFolder folder_;
  const std::string socket_ = folder_ / "socket";
};

TEST_F(ClientDebugLines, ShowStateChangesAndDropsWhenAskedFor) {
  const auto session = [this] {
    auto made = KYTReporting::open(options());
    (void)made->sendMessage(70000, 1, {});
    (void)made->sendMessage(1, 1, {});
    (void)made->finish();
    (void)made->sendMessage(1, 1, {});
    made.reset();
  };
  const std::string begin = "libkytreporting: session 42: ";
  // By two threads, so in no order.
  std::istringstream text(linesOf("1", session));
  std::set<std::string> lines;
  for (std::string line; std::getline(text, line);) lines.insert(line);
  EXPECT_EQ(lines, (std::set<std::string>{
                       begin + "message of category 70000, type 1: both are whole numbers from 0 to 65535",
                       begin + "no-daemon: " + socket_ + ": No such file or directory",
                       begin + "dropped 1: session-ended (1 in all)", begin + "dropped 1: invalid (1 in all)",
                       begin + "dropped 1: session-closed (1 in all)"}));
  EXPECT_EQ(linesOf("0", session), "");
  EXPECT_EQ(linesOf(nullptr, session), "");
}

TEST_F(ClientDebugLines, ShowAFullQueueAndACallThatWaitedTooLong) {
  const std::string text = linesOf("1", [this] {
    KYTReporting::Options small = options();
    small.maxQueuedMessages = 64;
    small.callDeadline = std::chrono::milliseconds(20);
    const auto made = KYTReporting::open(std::move(small));
    std::promise<void> flushed;
    made->flush([&](const Value&, const auto&) { flushed.set_value(); });
    while (made->sendMessage(1, 1, {})) {
    }
    flushed.get_future().wait();
  });
  EXPECT_NE(text.find("dropped 1: queue-full (1 in all)\n"), std::string::npos) << text;
  EXPECT_NE(text.find("dropped 1: waited-too-long (1 in all)\n"), std::string::npos) << text;
}

TEST_F(ClientDebugLines, ShowWhatCannotBeSaidAgain) {
  TestDaemon daemon(socket_);
  ASSERT_TRUE(daemon.start());
  const std::string text = linesOf("1", [this] {
    KYTReporting::Options huge = options();
    huge.userInfo = Dictionary{{"ClientName", std::string(2000000, 'x')}};
    (void)KYTReporting::open(std::move(huge))->finish(kTestDeadline);
  });
  EXPECT_NE(text.find("dropped 1: replay-failed (1 in all)\n"), std::string::npos) << text;
}

TEST_F(ClientDebugLines, ShowAForgottenConfiguration) {
  TestDaemon daemon(socket_);
  ASSERT_TRUE(daemon.start());
  const std::string text = linesOf("1", [this] {
    const auto made = KYTReporting::open(options());
    (void)made->sendMessage(1, 1, {});
    (void)made->finish(kTestDeadline);
  });
  EXPECT_NE(text.find("session 42: connected: messages are sent, and startConfiguration was not called: the "
                      "daemon drops them\n"),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("dropped 1: not-configured (1 in all)\n"), std::string::npos) << text;
}

TEST_F(ClientDebugLines, ShowAMessageThatIsTooLarge) {
  TestDaemon daemon(socket_);
  ASSERT_TRUE(daemon.start());
  const std::string text = linesOf("1", [this] {
    const auto made = KYTReporting::open(options());
    made->startConfiguration();
    (void)made->sendMessage(5, 6, {{"huge", std::string(2000000, 'x')}});
    (void)made->finish(kTestDeadline);
  });
  EXPECT_NE(text.find("session 42: live: httppost qrs\n"), std::string::npos) << text;
  EXPECT_NE(text.find("message of category 5, type 6: larger than a megabyte, or nested too deeply\n"),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("dropped 1: unsendable (1 in all)\n"), std::string::npos) << text;
}

}  // namespace
}  // namespace kyt
#endif
