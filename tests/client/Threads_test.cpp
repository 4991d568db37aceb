// Where the system gives the library no thread.
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <functional>
#include <iterator>
#include <string>
#include <thread>

#include "kytreporting/KYTReporting.h"
#include "tests/support/Eventually.h"

#ifndef __has_feature
#define __has_feature(feature) 0
#endif
// A forked child of a process with threads is nothing that the thread sanitizer follows.
#if !__has_feature(thread_sanitizer)

namespace kyt {
namespace {

constexpr char kNoThread[] = "the system gives the library no thread";

KYTReporting::Options options() {
  KYTReporting::Options made;
  made.socketPath = "/nonexistent/socket";
  made.sessionInfo = SessionInfo{.sessionID = 42, .clientType = 7};
  return made;
}

// From here on no thread of this process begins another. clone3 is denied as old kernels deny it, since its flags
// cannot be seen.
bool forbidThreads() {
  sock_filter code[] = {BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
                        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_clone3, 2, 0),
                        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_clone, 2, 0),
                        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
                        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | ENOSYS),
                        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | EAGAIN)};
  const sock_fprog program{std::size(code), code};
  return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_TSYNC, &program) == 0;
}

// Opens a session, asks, and closes it; whether it said all along why nothing is done.
bool saysSo() {
  const auto session = KYTReporting::open(options());
  int32_t code = 0;
  session->flush(
      [&code](const Value&, const std::optional<Error>& error) { code = error ? error->code : 0; });
  return code == static_cast<int32_t>(ClientError::notConnected) && !session->sendMessage(1, 1, {}) &&
         !session->finish() && session->state() == KYTReporting::State::noDaemon &&
         session->stateReason() == kNoThread;
}

bool singleMessageSaysSo() {
  std::string told;
  KYTReporting::sendSingleMessage(options(), 1, 1, std::nullopt,
                                  [&told](const std::string&, const std::optional<Error>& error) {
                                    told = error ? error->localizedDescription : "sent";
                                  });
  return told == kNoThread;
}

bool wrongInformationStaysTheReason() {
  KYTReporting::Options wrong = options();
  wrong.sessionInfo.set("RequireUserinfo", true);
  const auto session = KYTReporting::open(std::move(wrong));
  return session->state() == KYTReporting::State::refused &&
         session->stateReason().find("RequireUserinfo") != std::string::npos;
}

int statusOf(const std::function<bool()>& what) {
  const pid_t child = fork();
  if (child == 0) {
    alarm(static_cast<unsigned>(kTestDeadline.count()));
    _exit(what() ? 0 : 1);
  }
  int status = -1;
  return waitpid(child, &status, 0) == child ? status : -1;
}

TEST(ClientThreads, ASessionWithoutAThreadSaysSoAndEnds) {
  EXPECT_EQ(statusOf([] {
              return forbidThreads() && saysSo() && singleMessageSaysSo() && wrongInformationStaysTheReason();
            }),
            0);
}

// Two at once, again and again: one finds the other's thread about to begin, which never does.
TEST(ClientThreads, SessionsOpenedTogetherBothEndWithoutAThread) {
  EXPECT_EQ(statusOf([] {
              constexpr int kRounds = 2000;
              std::atomic<int> round{0}, done{0};
              std::atomic<bool> right{true};
              std::thread other([&] {
                for (int i = 1; i <= kRounds; ++i) {
                  while (round < i) std::this_thread::yield();
                  if (!saysSo()) right = false;
                  done = i;
                }
              });
              const bool forbidden = forbidThreads();
              for (int i = 1; i <= kRounds; ++i) {
                round = i;
                if (!saysSo()) right = false;
                while (done < i) std::this_thread::yield();
              }
              other.join();
              return forbidden && right;
            }),
            0);
}

}  // namespace
}  // namespace kyt
#endif
