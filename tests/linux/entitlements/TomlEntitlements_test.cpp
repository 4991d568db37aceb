#include "platform/linux/entitlements/TomlEntitlements.h"

#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <future>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/objects/Keys.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/NoDescriptors.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr char kGranted[] = "\"com.vantu.private.kytreportingd\" = true\n";

Descriptor pidfdOf(pid_t pid) {
  return Descriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)), [](int fd) { ::close(fd); });
}

class TomlEntitlementsTest : public testing::Test {
 protected:
  TomlEntitlementsTest() { ::chmod(folder_.path().c_str(), 0755); }
  static PeerCredentials peer(uint32_t uid, uint32_t gid = 77) {
    PeerCredentials result;
    result.pid = ::getpid();
    result.uid = uid;
    result.gid = gid;
    return result;
  }
  void grant(const std::string& criteria, const std::string& name = "a.toml") {
    folder_.write(name, "[[grant]]\n" + criteria + kGranted);
  }
  Value value(const PeerCredentials& credentials) {
    return entitlements_.valueFor(credentials, kEntitlement);
  }
  bool isGranted(const PeerCredentials& credentials) { return value(credentials).boolValue(); }

  TemporaryFolder folder_;
  MemoryLogSink sink_;
  Log log_{sink_};
  Counters counters_;
  ManualClock clock_;
  DirectProgramInspector inspector_;
  TomlEntitlements entitlements_{{folder_.path(), ::geteuid()}, inspector_, log_, counters_, clock_};
};

TEST_F(TomlEntitlementsTest, NobodyIsGrantedAnythingWithoutFiles) {
  EXPECT_TRUE(value(peer(0)).isNull());
  EXPECT_TRUE(sink_.lines().empty());
  TomlEntitlements elsewhere({folder_ / "none", ::geteuid()}, inspector_, log_, counters_, clock_);
  EXPECT_TRUE(elsewhere.valueFor(peer(0), kEntitlement).isNull());
}

TEST_F(TomlEntitlementsTest, MatchesByUser) {
  grant("user = 1234\n");
  EXPECT_EQ(value(peer(1234)).boolean(), true);
  EXPECT_FALSE(isGranted(peer(1235)));
  EXPECT_TRUE(entitlements_.valueFor(peer(1234), "com.vantu.other").isNull());
  grant("user = \"root\"\n");
  EXPECT_TRUE(isGranted(peer(0)));
  EXPECT_FALSE(isGranted(peer(1234)));
  grant("user = \"nobody-of-that-name\"\n");
  EXPECT_FALSE(isGranted(peer(0)));
  grant("user = 4294967296\n");
  EXPECT_FALSE(isGranted(peer(0))) << "a number that does not fit is nobody";
}

TEST_F(TomlEntitlementsTest, MatchesByGroupAndSupplementaryGroup) {
  grant("group = 55\n");
  EXPECT_TRUE(isGranted(peer(1, 55)));
  PeerCredentials member = peer(1, 2);
  EXPECT_FALSE(isGranted(member));
  member.groups = {54, 55};
  EXPECT_TRUE(isGranted(member));
  grant("group = \"root\"\n");
  EXPECT_TRUE(isGranted(peer(1, 0)));
}

TEST_F(TomlEntitlementsTest, MatchesBySecurityLabel) {
  grant("security_label = \"app (enforce)\"\n");
  PeerCredentials labelled = peer(1);
  EXPECT_FALSE(isGranted(labelled));
  labelled.securityLabel = "app (enforce)";
  EXPECT_TRUE(isGranted(labelled));
}

TEST_F(TomlEntitlementsTest, AllCriteriaOfAGrantMustMatch) {
  grant("user = 5\ngroup = 6\n");
  EXPECT_TRUE(isGranted(peer(5, 6)));
  EXPECT_FALSE(isGranted(peer(5, 7)));
  EXPECT_FALSE(isGranted(peer(4, 6)));
}

TEST_F(TomlEntitlementsTest, AnyMatchingGrantSuffices) {
  folder_.write("a.toml", "[[grant]]\nuser = 5\n\"com.vantu.private.kytreportingd\" = false\n");
  EXPECT_EQ(value(peer(5)).boolean(), false);
  grant("group = 6\n", "b.toml");
  EXPECT_TRUE(isGranted(peer(5, 6)));
  EXPECT_FALSE(isGranted(peer(5, 7)));
}

TEST_F(TomlEntitlementsTest, ChangedAddedAndRemovedFilesCountForTheNextConnection) {
  for (uint32_t i = 100; i < 150; ++i) {  // in place, same size, often within one tick of the kernel's clock
    grant("user = " + std::to_string(i) + "\n");
    ASSERT_TRUE(isGranted(peer(i)));
    ASSERT_FALSE(isGranted(peer(i - 1)));
  }
  grant("user = 7\n", "b.toml");
  EXPECT_TRUE(isGranted(peer(7)));
  ::unlink((folder_ / "b.toml").c_str());
  EXPECT_FALSE(isGranted(peer(7)));
  grant("user = 7\n", "c.toml.bak");
  grant("user = 7\n", ".c.toml");
  EXPECT_FALSE(isGranted(peer(7)));
}

TEST_F(TomlEntitlementsTest, AFileThatOthersCanWriteIsIgnoredWithALine) {
  for (mode_t mode : {0664, 0646, 0666}) {
    sink_.clear();
    folder_.write("a.toml", std::string("[[grant]]\nuser = 5\n") + kGranted, mode);
    EXPECT_FALSE(isGranted(peer(5)));
    EXPECT_FALSE(isGranted(peer(5)));
    EXPECT_EQ(sink_.count(LogLevel::error,
                          "entitlements: " + (folder_ / "a.toml") + ": others than root can write the file"),
              1u);
  }
  EXPECT_EQ(counters_.value(Reason::badEntitlementsFile), 3u);
  ::chmod((folder_ / "a.toml").c_str(), 0644);
  EXPECT_TRUE(isGranted(peer(5)));
}

TEST_F(TomlEntitlementsTest, AFileOfAnotherOwnerIsIgnored) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  grant("user = 5\n");
  ASSERT_EQ(::chown((folder_ / "a.toml").c_str(), 1234, 0), 0);
  EXPECT_FALSE(isGranted(peer(5)));
  EXPECT_EQ(sink_.count("others than root can write the file"), 1u);
  TomlEntitlements trusting({folder_.path(), 1234}, inspector_, log_, counters_, clock_);
  EXPECT_TRUE(trusting.valueFor(peer(5), kEntitlement).boolValue())
      << "the user of a private root may own its files";
}

TEST_F(TomlEntitlementsTest, ALinkThatOthersMadeIsIgnoredWithALine) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give links away";
  grant("user = 5\n", "meant.disabled");
  std::filesystem::create_symlink("meant.disabled", folder_ / "a.toml");
  EXPECT_TRUE(isGranted(peer(5))) << "root's own link counts";
  std::filesystem::remove(folder_ / "a.toml");
  const std::string link = folder_ / "b.toml";
  std::filesystem::create_symlink("meant.disabled", link);
  ASSERT_EQ(::lchown(link.c_str(), 54321, 54321), 0);
  EXPECT_FALSE(isGranted(peer(5)));
  EXPECT_EQ(sink_.count(LogLevel::error, "entitlements: " + link + ": others than root can write the file"),
            1u);
}

TEST_F(TomlEntitlementsTest, WhatIsWrongCountsForNothingAndIsToldOnce) {
  const std::pair<std::string, std::string> bad[] = {
      {kGranted, ":1: a grant without user, group, executable and security_label is ignored"},
      {"usre = 5\nuser = 5\n",
       ":2: \"usre\" is unknown; the nearest known one is \"user\". The grant is ignored"},
      {"user = true\n", ":2: \"user\" must be a name or a number. The grant is ignored"},
      {"user = -1\n", ":2: \"user\" must be a name or a number. The grant is ignored"},
      {"user = 5\nexecutable = \"bin/x\"\n",
       ":3: \"executable\" must be an absolute path. The grant is ignored"},
      {"user = 5\nsecurity_label = \"\"\n", ":3: \"security_label\" must be text. The grant is ignored"},
      {"user = 5\ncom.vantu.x = true\n",
       ":3: \"com\" must be a value (the name of an entitlement stands in quotes). The "
       "grant is ignored"},
      {"user = 5\n\"com.vantu.x\" = [1]\n",
       ":3: \"com.vantu.x\" must be text, a boolean or a number. The grant is ignored"},
  };
  for (const auto& [lines, message] : bad) {
    sink_.clear();
    folder_.write("a.toml", "[[grant]]\n" + lines + (lines == kGranted ? "" : kGranted) +
                                "[[grant]]\nuser = 6\n" + kGranted);
    EXPECT_FALSE(isGranted(peer(5))) << lines;
    EXPECT_TRUE(isGranted(peer(6))) << "the other grant of the file counts: " << lines;
    EXPECT_EQ(sink_.lines().size(), 1u) << lines;
    EXPECT_TRUE(sink_.contains(LogLevel::error, "entitlements: " + (folder_ / "a.toml") + message)) << lines;
  }
  for (const char* text : {"[[grant]\n", "grants = 1\n", "[grant]\nuser = 5\n", "grant = [5]\n"}) {
    sink_.clear();
    folder_.write("a.toml", text);
    EXPECT_FALSE(isGranted(peer(5))) << text;
    EXPECT_EQ(sink_.lines().size(), 1u) << text;
  }
}

TEST_F(TomlEntitlementsTest, MatchesByTheRunningProgram) {
  std::string own = std::filesystem::read_symlink("/proc/self/exe");
  grant("executable = \"" + own + "\"\n");
  PeerCredentials self = peer(1);
  EXPECT_FALSE(isGranted(self)) << "without a pidfd nothing is known";
  EXPECT_FALSE(isGranted(self));
  EXPECT_EQ(sink_.count(LogLevel::error, "entitlements: Grants by executable cannot match: the kernel"), 1u);
  self.pidfd = pidfdOf(::getpid());
  EXPECT_TRUE(isGranted(self));
  std::filesystem::create_symlink(own, folder_ / "link");
  grant("executable = \"" + (folder_ / "link") + "\"\n");
  EXPECT_TRUE(isGranted(self)) << "the file counts, not its name";
  std::filesystem::copy_file("/bin/true", folder_ / "other");
  grant("executable = \"" + (folder_ / "other") + "\"\n");
  EXPECT_FALSE(isGranted(self));
  grant("executable = \"" + (folder_ / "missing") + "\"\n");
  EXPECT_FALSE(isGranted(self));
}

TEST_F(TomlEntitlementsTest, AProcessThatHasEndedIsNobody) {
  grant("executable = \"" + std::filesystem::read_symlink("/proc/self/exe").string() + "\"\n");
  const pid_t child = ::fork();
  if (child == 0) {
    while (true) ::pause();
  }
  PeerCredentials ended = peer(1);
  ended.pid = child;
  ended.pidfd = pidfdOf(child);
  EXPECT_TRUE(isGranted(ended));
  ::kill(child, SIGKILL);
  siginfo_t info = {};
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOWAIT), 0);
  EXPECT_FALSE(isGranted(ended));  // its number still stands for it, but it runs nothing
  ASSERT_EQ(::waitpid(child, nullptr, 0), child);
  EXPECT_FALSE(isGranted(ended));
  ended.pid = ::getpid();  // as if another process had its number now
  EXPECT_FALSE(isGranted(ended));
  EXPECT_TRUE(sink_.lines().empty()) << "an ended process is no lack of privilege";
}

class RefusingInspector final : public ProgramInspector {
 public:
  explicit RefusingInspector(int error) : error_(error) {}
  std::variant<ProgramIdentity, int> runningProgram(int32_t) override {
    ++asked;
    return error_;
  }
  std::string programPath(int32_t) override { return {}; }
  int asked = 0;

 private:
  const int error_;
};

TEST_F(TomlEntitlementsTest, WithoutThePrivilegeAnExecutableNeverMatchesAndThatIsToldOnce) {
  RefusingInspector refusing(EACCES);
  TomlEntitlements entitlements({folder_.path(), ::geteuid()}, refusing, log_, counters_, clock_);
  grant("executable = \"/proc/self/exe\"\n");
  PeerCredentials self = peer(1);
  self.pidfd = pidfdOf(::getpid());
  for (int i = 0; i < 3; ++i) EXPECT_FALSE(entitlements.valueFor(self, kEntitlement).boolValue());
  EXPECT_EQ(
      sink_.count(LogLevel::error, "entitlements: Grants by executable cannot match: Permission denied"), 1u);
}

// A mount of /proc that hides other users' processes.
TEST_F(TomlEntitlementsTest, AProcessThatIsHiddenIsALackOfPrivilegeToo) {
  RefusingInspector hidden(ESRCH);
  TomlEntitlements entitlements({folder_.path(), ::geteuid()}, hidden, log_, counters_, clock_);
  grant("executable = \"/proc/self/exe\"\n");
  PeerCredentials self = peer(1);
  self.pidfd = pidfdOf(::getpid());
  EXPECT_FALSE(entitlements.valueFor(self, kEntitlement).boolValue());
  EXPECT_EQ(sink_.count(LogLevel::error, "entitlements: Grants by executable cannot match: No such process"),
            1u);
}

TEST_F(TomlEntitlementsTest, AProcessThatIsEndingIsNoLackOfPrivilege) {
  RefusingInspector ending(ENOENT);
  TomlEntitlements entitlements({folder_.path(), ::geteuid()}, ending, log_, counters_, clock_);
  grant("executable = \"/proc/self/exe\"\n");
  PeerCredentials self = peer(1);
  self.pidfd = pidfdOf(::getpid());
  EXPECT_FALSE(entitlements.valueFor(self, kEntitlement).boolValue());
  EXPECT_TRUE(sink_.lines().empty());
}

TEST_F(TomlEntitlementsTest, AsksOnceForAConnectionWhatItRuns) {
  RefusingInspector refusing(EACCES);
  TomlEntitlements entitlements({folder_.path(), ::geteuid()}, refusing, log_, counters_, clock_);
  for (const char* name : {"a.toml", "b.toml", "c.toml"}) grant("executable = \"/proc/self/exe\"\n", name);
  PeerCredentials self = peer(1);
  self.pidfd = pidfdOf(::getpid());
  EXPECT_FALSE(entitlements.valueFor(self, kEntitlement).boolValue());
  EXPECT_EQ(refusing.asked, 1);
}

// As one that stands still and is waited for.
class SlowInspector final : public ProgramInspector {
 public:
  std::variant<ProgramIdentity, int> runningProgram(int32_t) override {
    asked.set_value();
    EXPECT_EQ(answer.get_future().wait_for(std::chrono::seconds(60)), std::future_status::ready);
    return ETIMEDOUT;
  }
  std::string programPath(int32_t) override { return {}; }
  std::promise<void> asked, answer;
};

TEST_F(TomlEntitlementsTest, AQuestionAboutAProgramHoldsUpNobodyElse) {
  grant("executable = \"" + std::filesystem::read_symlink("/proc/self/exe").string() + "\"\n", "a.toml");
  grant("user = 1234\n", "b.toml");
  SlowInspector slow;
  TomlEntitlements entitlements({folder_.path(), ::geteuid()}, slow, log_, counters_, clock_);
  std::thread asks([&] {
    PeerCredentials self = peer(1);
    self.pidfd = pidfdOf(::getpid());
    EXPECT_TRUE(entitlements.valueFor(self, kEntitlement).isNull());
  });
  slow.asked.get_future().wait();
  std::promise<bool> granted;
  std::future<bool> isGranted = granted.get_future();
  std::thread other([&] { granted.set_value(entitlements.valueFor(peer(1234), kEntitlement).boolValue()); });
  EXPECT_EQ(isGranted.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  slow.answer.set_value();
  asks.join();
  other.join();
  EXPECT_TRUE(isGranted.get());
}

TEST_F(TomlEntitlementsTest, ATrueValueCountsMoreThanAFalseOne) {
  grant("user = 5\n\"com.vantu.other\" = false\n", "a.toml");
  folder_.write("b.toml", "[[grant]]\nuser = 5\n\"com.vantu.other\" = true\n");
  EXPECT_TRUE(entitlements_.valueFor(peer(5), "com.vantu.other").boolValue());
  folder_.write("b.toml", "[[grant]]\nuser = 6\n\"com.vantu.other\" = true\n");
  const Value no = entitlements_.valueFor(peer(5), "com.vantu.other");
  EXPECT_FALSE(no.isNull());
  EXPECT_FALSE(no.boolValue());
}

// The number that stands for nobody, and for a peer that the kernel does not name.
TEST_F(TomlEntitlementsTest, NobodysNumberMatchesNobody) {
  grant("user = 4294967295\n");
  EXPECT_FALSE(isGranted(peer(UINT32_MAX)));
  grant("group = 4294967295\n");
  EXPECT_FALSE(isGranted(peer(UINT32_MAX, UINT32_MAX)));
  grant("user = 4294967294\n");
  EXPECT_TRUE(isGranted(peer(UINT32_MAX - 1)));
}

TEST_F(TomlEntitlementsTest, TellsTheProgramOfALivingPeerOnly) {
  PeerCredentials self = peer(1);
  EXPECT_EQ(entitlements_.executableOf(self), "") << "the number alone may be another's";
  self.pidfd = pidfdOf(::getpid());
  EXPECT_EQ(entitlements_.executableOf(self), std::filesystem::read_symlink("/proc/self/exe").string());
}

TEST_F(TomlEntitlementsTest, AnswersSeveralThreadsWhileFilesChange) {
  grant("user = 5\n");
  std::atomic<int> wrong = 0;
  std::atomic<bool> done = false;
  std::vector<std::thread> threads;
  for (int i = 0; i < 3; ++i) {
    threads.emplace_back([&] {
      do {
        if (!isGranted(peer(5)) || isGranted(peer(6))) ++wrong;
      } while (!done);
    });
  }
  for (int i = 0; i < 20; ++i) grant("user = 1000\n", "b" + std::to_string(i) + ".toml");
  done = true;
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
}

TEST(ProgramInspectorProcess, EndsWithTheDaemonHoweverThatEnds) {
  EXPECT_EQ(
      inChildProcess([]() -> std::string {
        ::prctl(PR_SET_CHILD_SUBREAPER, 1);  // whoever loses its parent becomes this process's child
        const pid_t daemon = ::fork();
        if (daemon == 0) {
          auto started = ProgramInspectorProcess::start();
          if (started.index() != 0 || std::get<0>(started)->runningProgram(1).index() > 1) ::_exit(1);
          ::raise(SIGKILL);
        }
        int status = 0;
        if (::waitpid(daemon, &status, 0) != daemon || !WIFSIGNALED(status))
          return "the daemon was not killed";
        const pid_t inspector = ::waitpid(-1, &status, 0);
        if (inspector <= 0) return "there was no inspector";
        return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? "" : "it ended with " + std::to_string(status);
      }),
      "");
}

TEST(ProgramInspectorProcess, CanOpenNothing) {
  auto started = ProgramInspectorProcess::start();
  ASSERT_EQ(started.index(), 0u);
  EXPECT_EQ(std::get<0>(started)->runningProgram(::getpid()).index(), 0u);  // it has finished starting
  pid_t inspector = 0;
  std::ifstream("/proc/thread-self/children") >> inspector;
  ASSERT_GT(inspector, 0);
  std::ifstream limits("/proc/" + std::to_string(inspector) + "/limits");
  std::string found;
  for (std::string line; std::getline(limits, line);)
    if (line.starts_with("Max open files")) found = line;
  EXPECT_TRUE(std::regex_search(found, std::regex("Max open files +0 +0 "))) << found;
}

TEST(ProgramInspectorProcess, AnswersLikeAskingDirectly) {
  auto started = ProgramInspectorProcess::start();
  ASSERT_EQ(started.index(), 0u);
  ProgramInspector& inspector = *std::get<0>(started);
  DirectProgramInspector direct;
  EXPECT_EQ(inspector.runningProgram(::getpid()), direct.runningProgram(::getpid()));
  EXPECT_EQ(inspector.programPath(::getpid()), direct.programPath(::getpid()));
  EXPECT_EQ(inspector.programPath(INT32_MAX), "");
  EXPECT_EQ(std::get<int>(inspector.runningProgram(0)), ESRCH);
  EXPECT_EQ(std::get<int>(inspector.runningProgram(-5)), ESRCH);
  EXPECT_EQ(std::get<int>(inspector.runningProgram(INT32_MAX)), ESRCH);
}

TEST(ProgramInspectorProcess, ThatStandsStillIsWaitedForOnceAndAnswersWhenItGoesOn) {
  using Clock = std::chrono::steady_clock;
  auto started = ProgramInspectorProcess::start();
  ASSERT_EQ(started.index(), 0u);
  ProgramInspector& inspector = *std::get<0>(started);
  EXPECT_EQ(inspector.runningProgram(::getpid()).index(), 0u);
  pid_t process = 0;
  std::ifstream("/proc/thread-self/children") >> process;
  ASSERT_GT(process, 0);
  for (int round = 0; round < 2; ++round) {
    ASSERT_EQ(::kill(process, SIGSTOP), 0);
    EXPECT_EQ(std::get<int>(inspector.runningProgram(::getpid())), ETIMEDOUT);
    const auto begin = Clock::now();
    for (int i = 0; i < 100; ++i) EXPECT_EQ(std::get<int>(inspector.runningProgram(::getpid())), ETIMEDOUT);
    EXPECT_LT(Clock::now() - begin, std::chrono::seconds(20)) << "each waited";
    ASSERT_EQ(::kill(process, SIGCONT), 0);
    EXPECT_TRUE(eventually([&] { return inspector.runningProgram(::getpid()).index() == 0; }));
    EXPECT_EQ(std::get<int>(inspector.runningProgram(INT32_MAX)), ESRCH) << "the answer of another question";
  }
}

// They counted as blocked only, of which one user may have half of all.
TEST(ProgramInspectorProcess, ThoseInLineForItOfOneUserTakeAFifthOfTheWorkersAtMost) {
  constexpr size_t kWorkers = 40, kQuestions = 60;
  auto started = ProgramInspectorProcess::start();
  ASSERT_EQ(started.index(), 0u);
  ProgramInspector& inspector = *std::get<0>(started);
  EXPECT_EQ(inspector.runningProgram(::getpid()).index(), 0u);
  pid_t process = 0;
  std::ifstream("/proc/thread-self/children") >> process;
  ASSERT_GT(process, 0);
  size_t blocked = 0;
  // It is waited for two seconds only, in which a busy machine may not bring all of them to where they wait.
  for (int round = 0; round < 30 && blocked == 0; ++round) {
    ASSERT_EQ(::kill(process, SIGSTOP), 0);
    WorkerPool pool({.runnable = 2, .maxWorkers = kWorkers});
    std::atomic<size_t> finished{0};
    std::vector<std::shared_ptr<SerialQueue>> queues;
    for (size_t i = 0; i < kQuestions; ++i) {
      queues.push_back(SerialQueue::create("test.question", pool, 1001));
      queues.back()->async([&] {
        static_cast<void>(inspector.runningProgram(::getpid()));
        ++finished;
      });
    }
    ASSERT_TRUE(eventually([&] {
      const WorkerPoolFigures figures = pool.figures();
      const bool allWait = figures.blocked > 2 && figures.blocked + figures.idle == figures.workers;
      if (allWait && figures.blocked + figures.waitingQueues == kQuestions) blocked = figures.blocked;
      return blocked != 0 || finished == kQuestions;
    }));
    ASSERT_EQ(::kill(process, SIGCONT), 0);
    ASSERT_TRUE(eventually([&] { return finished == kQuestions; }));
    pool.shutDown();
    ASSERT_TRUE(eventually([&] { return inspector.runningProgram(::getpid()).index() == 0; }));
  }
  EXPECT_GT(blocked, 0u) << "all that may wait do";
  EXPECT_LE(blocked, kWorkers / 5 + 3) << "the one that asks, and two that were about to wait";
}

TEST_F(TomlEntitlementsTest, WhatCannotBeOpenedForAMomentKeepsItsGrants) {
  grant("user = 1234\n");
  grant("user = 5678\n", "b.toml");
  ASSERT_TRUE(isGranted(peer(1234)));
  ::chmod((folder_ / "a.toml").c_str(), 0640);  // a change, so that the file is looked at again
  for (int i = 0; i < 3; ++i) {
    const NoDescriptors none;
    EXPECT_TRUE(isGranted(peer(1234)));
    EXPECT_TRUE(isGranted(peer(5678)));
    EXPECT_FALSE(isGranted(peer(1)));
  }
  EXPECT_EQ(
      sink_.count(LogLevel::error, "Too many open files. What it granted before counts until it can be read"),
      1u)
      << "a line a minute";
  clock_.advance(std::chrono::seconds(61));
  {
    const NoDescriptors none;
    EXPECT_TRUE(isGranted(peer(1234)));
  }
  EXPECT_EQ(sink_.count("Too many open files"), 2u);
  grant("user = 4321\n");
  EXPECT_TRUE(isGranted(peer(4321))) << "a change counts as soon as the file can be read";
  EXPECT_FALSE(isGranted(peer(1234)));
  ::unlink((folder_ / "b.toml").c_str());
  {
    const NoDescriptors none;
    EXPECT_FALSE(isGranted(peer(5678)))
        << "a file that is gone grants nothing, whether or not the folder can be listed";
  }
}

TEST_F(TomlEntitlementsTest, ANameThatCannotBeLookedUpForAMomentStandsForItsLastNumber) {
  const passwd* user = ::getpwnam("daemon");
  const struct group* group = ::getgrnam("daemon");
  if (user == nullptr || group == nullptr) GTEST_SKIP() << "a system without the user daemon";
  const uint32_t uid = user->pw_uid, gid = group->gr_gid;
  grant("user = \"daemon\"\n");
  grant("group = \"daemon\"\n", "b.toml");
  EXPECT_TRUE(entitlements_.valueFor(peer(uid), "com.vantu.other").isNull()) << "reads the files";
  {
    const NoDescriptors none;
    EXPECT_FALSE(isGranted(peer(uid))) << "nobody has looked up the name yet";
  }
  ASSERT_TRUE(isGranted(peer(uid)));
  ASSERT_TRUE(isGranted(peer(77, gid)));
  // Whatever asks all sources for names loads those that need no descriptor, and know of nobody.
  for (const bool allLoaded : {false, true}) {
    if (allLoaded) {
      EXPECT_EQ(::getpwnam("nobody-of-that-name"), nullptr);
      EXPECT_EQ(::getgrnam("nobody-of-that-name"), nullptr);
    }
    const NoDescriptors none;
    for (int i = 0; i < 3; ++i) {
      EXPECT_TRUE(isGranted(peer(uid))) << allLoaded;
      EXPECT_TRUE(isGranted(peer(77, gid))) << allLoaded;
      EXPECT_FALSE(isGranted(peer(77))) << allLoaded;
    }
  }
}

TEST_F(TomlEntitlementsTest, WhatCouldNotBeOpenedAtFirstIsReadWithoutAChange) {
  grant("user = 1234\n");
  // Old enough for its times to tell every change.
  const auto ago = [&](const std::string& path) { return changedJustNow(identityOf(path)); };
  ASSERT_TRUE(eventually([&] { return !ago(folder_ / "a.toml") && !ago(folder_.path()); }));
  {
    const NoDescriptors none;
    EXPECT_FALSE(isGranted(peer(1234)));
  }
  EXPECT_TRUE(isGranted(peer(1234)));
}

TEST_F(TomlEntitlementsTest, AFolderThatMayNotBeListedIsSaidOnce) {
  if (::geteuid() == 0) GTEST_SKIP() << "root may list everything";
  grant("user = 1234\n");
  ::chmod(folder_.path().c_str(), 0311);
  EXPECT_FALSE(isGranted(peer(1234)));
  EXPECT_FALSE(isGranted(peer(1234)));
  EXPECT_EQ(sink_.count(LogLevel::error, folder_.path() + ": Permission denied. Nobody is granted anything"),
            1u);
  ::chmod(folder_.path().c_str(), 0755);
  EXPECT_TRUE(isGranted(peer(1234)));
}

}  // namespace
}  // namespace kyt
