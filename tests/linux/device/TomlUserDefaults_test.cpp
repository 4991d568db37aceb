#include "platform/linux/device/TomlUserDefaults.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <set>
#include <thread>

#include "platform/base/Limits.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/NoDescriptors.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr char kDomain[] = "com.vantu.kytreporting";
constexpr char kFile[] = "com.vantu.kytreporting.toml";

// A step at which this process is to die, for the crash tests.
const char* dieAt = nullptr;
void dieAtStep(const char* step) {
  if (dieAt != nullptr && std::string_view(step) == dieAt) ::raise(SIGKILL);
}

class TomlUserDefaultsTest : public testing::Test {
 protected:
  TomlUserDefaults make(Duration lockWait = std::chrono::seconds(5), void (*step)(const char*) = nullptr) {
    return TomlUserDefaults({folder_.path(), lockWait, step}, log_, counters_, clock_);
  }
  std::string text() const { return folder_.read(kFile); }

  TemporaryFolder folder_;
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  Counters counters_;
  ManualClock clock_;
};

// Runs `work` in a process of its own and answers how it ended (as waitpid says).
int inChild(const std::function<int()>& work) {
  const pid_t child = ::fork();
  if (child == 0) ::_exit(work());
  int status = 0;
  while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
  }
  return status;
}

TEST_F(TomlUserDefaultsTest, AnswersWhatAnAdministratorWrote) {
  folder_.write(kFile, "environmentType = 2\nforceEventLogging = true\nratio = 0.5\n\"uuid:a:b\" = \"X\"\n");
  auto defaults = make();
  EXPECT_EQ(defaults.value(kDomain, "environmentType"), Value(2));
  EXPECT_EQ(defaults.value(kDomain, "forceEventLogging").boolean(), true);
  EXPECT_EQ(defaults.value(kDomain, "ratio").real(), 0.5);
  EXPECT_EQ(defaults.value(kDomain, "uuid:a:b"), Value("X"));
  EXPECT_TRUE(defaults.value(kDomain, "none").isNull());
  EXPECT_TRUE(defaults.value("com.vantu.timed", "environmentType").isNull());
  EXPECT_TRUE(sink_.lines().empty());
}

TEST_F(TomlUserDefaultsTest, AChangeCountsAtOnceAlsoWithinOneTick) {
  auto defaults = make();
  for (int i = 0; i < 200; ++i) {  // written in place, same size: only the times can tell
    folder_.write(kFile, "n = " + std::to_string(100 + i) + "\n");
    ASSERT_EQ(defaults.value(kDomain, "n"), Value(100 + i));
  }
  ::unlink((folder_ / kFile).c_str());
  EXPECT_TRUE(defaults.value(kDomain, "n").isNull());
}

// Where the kernel stamps files by its slow clock, changes within one tick leave the same times.
TEST_F(TomlUserDefaultsTest, AChangeCountsAtOnceOnAFileSystemWithCoarseTimes) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount a file system";
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              if (!unshareMounts() || ::mount("ramfs", folder_.path().c_str(), "ramfs", 0, nullptr) != 0)
                return "no mount";
              auto defaults = make();
              folder_.write(kFile, "n = 100\n");
              const int file = ::open((folder_ / kFile).c_str(), O_WRONLY);
              for (int i = 101; i < 900; ++i) {
                if (defaults.value(kDomain, "n") != Value(i - 1)) return "old value at " + std::to_string(i);
                const std::string number = std::to_string(i);
                if (::pwrite(file, number.data(), number.size(), 4) != 3) return "pwrite";
              }
              return "";
            }),
            "");
}

TEST_F(TomlUserDefaultsTest, StoresEveryKindAndReadsItBack) {
  auto defaults = make();
  const std::pair<const char*, Value> values[] = {
      {"text", Value("a \"quoted\" \\ line\nbreak \x01\x7f \u00fc")},
      {"yes", Value(true)},
      {"whole", Value(-7)},
      {"large", Value(static_cast<unsigned long>(INT64_MAX))},
      {"real", Value(2.0)},
      {"tiny", Value(1e-300)},
      {"key with \"quotes\" and .", Value("v")},
  };
  for (const auto& [key, value] : values) EXPECT_EQ(defaults.set(kDomain, key, value), std::nullopt) << key;
  auto other = make();
  for (const auto& [key, value] : values) EXPECT_EQ(other.value(kDomain, key), value) << key;
  EXPECT_EQ(other.value(kDomain, "real").kind(), Value::Kind::real);
  EXPECT_EQ(other.values(kDomain).size(), std::size(values));
}

TEST_F(TomlUserDefaultsTest, RefusesWhatAFileCannotHold) {
  auto defaults = make();
  ASSERT_EQ(defaults.set(kDomain, "kept", Value(1)), std::nullopt);
  const std::string before = text();
  EXPECT_NE(defaults.set(kDomain, "a", Value(Array{Value(1)})), std::nullopt);
  EXPECT_NE(defaults.set(kDomain, "a", Value(Dictionary())), std::nullopt);
  EXPECT_NE(defaults.set(kDomain, "a", Value(UINT64_MAX)), std::nullopt);
  EXPECT_NE(defaults.set(kDomain, "a", Value("\xff")), std::nullopt);
  EXPECT_NE(defaults.set(kDomain, "\xff", Value(1)), std::nullopt);
  EXPECT_NE(defaults.set(kDomain, "", Value(1)), std::nullopt);
  EXPECT_NE(defaults.set(kDomain, "a", Value(std::string(kMaxTomlBytes, 'x'))), std::nullopt);
  EXPECT_EQ(text(), before);
}

TEST_F(TomlUserDefaultsTest, KeepsRemarksOrderAndOtherLines) {
  folder_.write(kFile, "# ours\nb = 1 # why\n\nlong = \"\"\"\nx\ny\"\"\"\na = 2");
  auto defaults = make();
  EXPECT_EQ(defaults.set(kDomain, "long", Value("short")), std::nullopt);
  EXPECT_EQ(defaults.set(kDomain, "new", Value(true)), std::nullopt);
  EXPECT_EQ(text(), "# ours\nb = 1 # why\n\nlong = \"short\"\na = 2\nnew = true\n");
  EXPECT_EQ(defaults.set(kDomain, "b", Value()), std::nullopt);
  EXPECT_EQ(defaults.set(kDomain, "none", Value()), std::nullopt);
  EXPECT_EQ(text(), "# ours\n\nlong = \"short\"\na = 2\nnew = true\n");
}

TEST_F(TomlUserDefaultsTest, KeepsOwnerAndMode) {
  const std::string file = folder_.write(kFile, "a = 1\n", 0604);
  const bool isRoot = ::geteuid() == 0;
  if (isRoot) {
    ASSERT_EQ(::chown(file.c_str(), 1234, 4321), 0);
  }
  auto defaults = make();
  ASSERT_EQ(defaults.set(kDomain, "a", Value(2)), std::nullopt);
  struct stat status = {};
  ASSERT_EQ(::stat(file.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0604u);
  if (isRoot) {
    EXPECT_EQ(status.st_uid, 1234u);
    EXPECT_EQ(status.st_gid, 4321u);
  }
}

TEST_F(TomlUserDefaultsTest, ANewFileBelongsToTheFoldersOwner) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  ASSERT_EQ(::chown(folder_.path().c_str(), 1234, 4321), 0);
  auto defaults = make();
  ASSERT_EQ(defaults.set(kDomain, "a", Value(2)), std::nullopt);
  for (const char* name : {kFile, "com.vantu.kytreporting.lock"}) {
    struct stat status = {};
    ASSERT_EQ(::stat((folder_ / name).c_str(), &status), 0);
    EXPECT_EQ(status.st_uid, 1234u) << name;
    EXPECT_EQ(status.st_gid, 4321u) << name;
    EXPECT_EQ(status.st_mode & 0007, 0u) << name;
  }
}

TEST_F(TomlUserDefaultsTest, ABadFileAnswersNothingIsToldOnceAndNeverOverwritten) {
  for (const char* bad :
       {"a = \n", "[section]\na = 1\n", "a = [1]\n", "a.b = 1\n", "d = 2026-01-31\n", "a = \"\xff\"\n"}) {
    sink_.clear();
    const uint64_t before = counters_.value(Reason::badUserDefaultsFile);
    auto defaults = make();
    const std::string file = folder_.write(kFile, bad);
    for (int i = 0; i < 3; ++i) EXPECT_TRUE(defaults.value(kDomain, "a").isNull()) << bad;
    EXPECT_EQ(sink_.count(LogLevel::error, "userDefaults: " + file + ":"), 1u) << bad;
    EXPECT_EQ(sink_.lines().size(), 1u) << bad;
    EXPECT_EQ(counters_.value(Reason::badUserDefaultsFile), before + 1) << bad;
    EXPECT_NE(defaults.set(kDomain, "a", Value(1)), std::nullopt) << bad;
    EXPECT_EQ(text(), bad);
  }
  auto defaults = make();
  EXPECT_TRUE(defaults.value(kDomain, "a").isNull());
  folder_.write(kFile, "a = 1\n");
  EXPECT_EQ(defaults.value(kDomain, "a"), Value(1));
}

TEST_F(TomlUserDefaultsTest, AFolderOrALinkInTheFilesPlaceIsNoFile) {
  std::filesystem::create_directory(folder_ / kFile);
  auto defaults = make();
  EXPECT_TRUE(defaults.value(kDomain, "a").isNull());
  EXPECT_EQ(sink_.count("is no regular file"), 1u);
  EXPECT_NE(defaults.set(kDomain, "a", Value(1)), std::nullopt);
  std::filesystem::remove(folder_ / kFile);
  folder_.write("elsewhere", "a = 1\n");
  std::filesystem::create_symlink(folder_ / "elsewhere", folder_ / kFile);
  EXPECT_NE(defaults.set(kDomain, "a", Value(2)), std::nullopt);
  EXPECT_EQ(folder_.read("elsewhere"), "a = 1\n");
}

TEST_F(TomlUserDefaultsTest, DomainNamesCannotLeaveTheFolder) {
  auto defaults = make();
  for (const char* domain : {"", ".", "..", "a/b", "../x", ".hidden", "a..b", "a b", "a\n"}) {
    EXPECT_FALSE(TomlUserDefaults::isDomainName(domain)) << domain;
    EXPECT_TRUE(defaults.value(domain, "a").isNull());
    EXPECT_NE(defaults.set(domain, "a", Value(1)), std::nullopt);
  }
  EXPECT_FALSE(TomlUserDefaults::isDomainName(std::string(129, 'a')));
  EXPECT_TRUE(TomlUserDefaults::isDomainName("com.vantu.kyt-reporting_2"));
  EXPECT_TRUE(std::filesystem::is_empty(folder_.path()));
}

TEST_F(TomlUserDefaultsTest, MakesItsFolderWhenSomethingIsStored) {
  TomlUserDefaults defaults({folder_ / "a/b/defaults"}, log_, counters_, clock_);
  EXPECT_TRUE(defaults.value(kDomain, "a").isNull());
  EXPECT_EQ(defaults.set(kDomain, "a", Value(1)), std::nullopt);
  EXPECT_EQ(defaults.value(kDomain, "a"), Value(1));
}

TEST_F(TomlUserDefaultsTest, StoresAnIdentifierOnce) {
  auto defaults = make();
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:b", String("one")), "one");
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:b", String("two")), "one");
  EXPECT_EQ(make().stringOrStore(kDomain, "uuid:a:b", String("three")), "one");
  EXPECT_EQ(defaults.set(kDomain, "uuid:a:b", Value(5)), std::nullopt);
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:b", String("four")), "four");
}

TEST_F(TomlUserDefaultsTest, RefusesIdentifiersPastTheLimitAndCountsThem) {
  std::string full;
  for (size_t i = 0; i < Limits::maxCustomIdentifiers; ++i)
    full += "\"uuid:" + std::to_string(i) + ":\" = \"x\"\n";
  folder_.write(kFile, full);
  auto defaults = make();
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:new:", String("fresh")), "fresh");
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:new:", String("fresher")), "fresher");
  EXPECT_EQ(counters_.value(Reason::customIdentifierRefused), 2u);
  EXPECT_EQ(sink_.count(LogLevel::error, "userDefaults: An identifier was not stored: there are 1000 custom"),
            1u);
  EXPECT_EQ(text(), full);
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:7:", String("y")), "x");
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuidRespectDnu", String("own")), "own");
  EXPECT_EQ(defaults.value(kDomain, "uuidRespectDnu"), Value("own"));
}

TEST_F(TomlUserDefaultsTest, OneUserHasAShareOfTheIdentifiersForGood) {
  TomlUserDefaultsOptions options{folder_.path()};
  options.mostIdentifiersOfAUser = 3;
  const auto store = [&](TomlUserDefaults& defaults, const std::string& key, std::optional<uint32_t> owner) {
    static_cast<void>(defaults.stringOrStore(kDomain, key, String("x"), owner));
    return !defaults.value(kDomain, key).isNull();
  };
  {
    TomlUserDefaults defaults(options, log_, counters_, clock_);
    for (int i = 0; i < 3; ++i) EXPECT_TRUE(store(defaults, "uuid:a" + std::to_string(i) + ":", 1000));
  }
  TomlUserDefaults defaults(options, log_, counters_, clock_);  // as after a restart
  EXPECT_FALSE(store(defaults, "uuid:new:", 1000));
  EXPECT_EQ(counters_.value(Reason::customIdentifierRefused), 1u);
  EXPECT_EQ(sink_.count(LogLevel::error, "there are 3 custom identifiers of user 1000 already"), 1u);
  EXPECT_TRUE(store(defaults, "uuid:new:", 1001)) << "another user's";
  EXPECT_TRUE(store(defaults, "uuid:own:", std::nullopt)) << "nobody's";
  EXPECT_EQ(defaults.value(kDomain, "uuidOwner:a0:"), Value(1000));
  EXPECT_EQ(defaults.value(kDomain, "uuidOwner:new:"), Value(1001));
  EXPECT_TRUE(defaults.value(kDomain, "uuidOwner:own:").isNull());
  // What an administrator deletes is free again.
  EXPECT_EQ(defaults.set(kDomain, "uuid:a1:", Value()), std::nullopt);
  EXPECT_TRUE(store(defaults, "uuid:newer:", 1000));
  EXPECT_FALSE(store(defaults, "uuid:newest:", 1000));
}

TEST_F(TomlUserDefaultsTest, RefusesAnIdentifierWithAVeryLongName) {
  auto defaults = make();
  const std::string key = "uuid:" + std::string(TomlUserDefaults::kMaxIdentifierKey, 'n');
  EXPECT_EQ(defaults.stringOrStore(kDomain, key, String("fresh")), "fresh");
  EXPECT_EQ(counters_.value(Reason::customIdentifierRefused), 1u);
  EXPECT_TRUE(defaults.value(kDomain, key).isNull());
}

TEST_F(TomlUserDefaultsTest, GivesUpWhenTheLockIsHeldForTooLong) {
  folder_.write("com.vantu.kytreporting.lock", "");
  const Descriptor held =
      ownDescriptor(::open((folder_ / "com.vantu.kytreporting.lock").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_EQ(::flock(held.get(), LOCK_EX), 0);
  auto defaults = make(std::chrono::milliseconds(20));
  EXPECT_NE(defaults.set(kDomain, "a", Value(1)), std::nullopt);
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:b", String("x")), "x");
  EXPECT_EQ(counters_.value(Reason::customIdentifierRefused), 1u);
  EXPECT_TRUE(defaults.value(kDomain, "uuid:a:b").isNull());
  ASSERT_EQ(::flock(held.get(), LOCK_UN), 0);
  EXPECT_EQ(defaults.set(kDomain, "a", Value(1)), std::nullopt);
}

// One after the other they waited five seconds each, on workers that counted as running, and other users' sessions with
// them.
TEST_F(TomlUserDefaultsTest, ALockThatSomebodyKeepsIsWaitedForOnceByAllAndHoldsUpNobodyElse) {
  constexpr int kWriters = 12;
  folder_.write("com.vantu.kytreporting.lock", "");
  const Descriptor held =
      ownDescriptor(::open((folder_ / "com.vantu.kytreporting.lock").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_EQ(::flock(held.get(), LOCK_EX), 0);
  auto defaults = make(std::chrono::seconds(2));
  WorkerPoolOptions options;
  options.runnable = 2;
  WorkerPool pool(options);
  std::atomic<int> finished{0}, finishedBefore{-1};
  std::vector<std::shared_ptr<SerialQueue>> queues;
  const auto begin = std::chrono::steady_clock::now();
  for (int i = 0; i < kWriters; ++i) {
    queues.push_back(SerialQueue::create("test.writer", pool));
    queues.back()->async([&, i] {
      EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:" + std::to_string(i), String("x")), "x");
      ++finished;
    });
  }
  queues.push_back(SerialQueue::create("test.bystander", pool));
  queues.back()->async([&] { finishedBefore = finished.load(); });
  ASSERT_TRUE(eventually([&] { return finished == kWriters && finishedBefore >= 0; }));
  EXPECT_EQ(finishedBefore, 0) << "it ran while they waited";
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(12)) << "two seconds for each";
  EXPECT_EQ(counters_.value(Reason::customIdentifierRefused), uint64_t{kWriters});
  ASSERT_EQ(::flock(held.get(), LOCK_UN), 0);
  EXPECT_EQ(defaults.set(kDomain, "a", Value(1)), std::nullopt) << "free again";
  ASSERT_EQ(::flock(held.get(), LOCK_EX), 0);
  std::thread releases([&] {
    while (::access((folder_ / "waits").c_str(), F_OK) != 0) std::this_thread::yield();
    ::flock(held.get(), LOCK_UN);
  });
  folder_.write("waits", "");
  EXPECT_EQ(defaults.set(kDomain, "a", Value(2)), std::nullopt) << "waited for anew";
  releases.join();
  pool.shutDown();
}

// They counted as blocked only, of which one user may have half of all.
TEST_F(TomlUserDefaultsTest, WritersInLineOfOneUserTakeAFifthOfTheWorkersAtMost) {
  constexpr size_t kWorkers = 40, kWriters = 60;
  folder_.write("com.vantu.kytreporting.lock", "");
  const Descriptor held =
      ownDescriptor(::open((folder_ / "com.vantu.kytreporting.lock").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_EQ(::flock(held.get(), LOCK_EX), 0);
  auto defaults = make(std::chrono::seconds(60));
  WorkerPool pool({.runnable = 2, .maxWorkers = kWorkers});
  std::atomic<size_t> finished{0};
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (size_t i = 0; i < kWriters; ++i) {
    queues.push_back(SerialQueue::create("test.writer", pool, 1001));
    queues.back()->async([&, i] {
      if (i % 2 == 0) {
        EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:b", String("x")), "x");
      } else {
        EXPECT_EQ(defaults.set(kDomain, "none", Value()), std::nullopt);
      }
      ++finished;
    });
  }
  WorkerPoolFigures figures;
  ASSERT_TRUE(eventually([&] {
    figures = pool.figures();
    return figures.blocked > 2 && figures.blocked + figures.idle == figures.workers &&
           figures.blocked + figures.waitingQueues == kWriters;
  })) << "all that may wait do";
  EXPECT_LE(figures.blocked, kWorkers / 5 + 3) << "the one that writes, and two that were about to wait";
  ASSERT_EQ(::flock(held.get(), LOCK_UN), 0);
  ASSERT_TRUE(eventually([&] { return finished == kWriters; }));
  pool.shutDown();
}

TEST_F(TomlUserDefaultsTest, ACrashAtAnyStepLeavesTheOldOrTheNewContent) {
  for (const char* step : {"locked", "created", "written", "synced", "renamed", "done"}) {
    folder_.write(kFile, "a = \"old\"\n");
    const int status = inChild([&] {
      dieAt = step;
      auto defaults = make(std::chrono::seconds(5), dieAtStep);
      (void)defaults.set(kDomain, "a", Value("new"));
      return 0;
    });
    ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << step;
    const bool isNew = std::string_view(step) == "renamed" || std::string_view(step) == "done";
    EXPECT_EQ(text(), isNew ? "a = \"new\"\n" : "a = \"old\"\n") << step;
    auto defaults = make(std::chrono::milliseconds(50));
    EXPECT_EQ(defaults.set(kDomain, "b", Value(1)), std::nullopt)
        << step;  // neither lock nor left-over is in the way
    EXPECT_EQ(defaults.value(kDomain, "b"), Value(1)) << step;
    EXPECT_FALSE(std::filesystem::exists(folder_ / ".com.vantu.kytreporting.toml.new")) << step;
  }
}

TEST_F(TomlUserDefaultsTest, WritersOfSeveralProcessesLoseNothing) {
  constexpr int kProcesses = 4, kWrites = 25;
  std::vector<pid_t> children;
  for (int process = 0; process < kProcesses; ++process) {
    const pid_t child = ::fork();
    if (child == 0) {
      auto defaults = make(std::chrono::seconds(60));
      int failures = 0;
      for (int i = 0; i < kWrites; ++i) {
        const std::string key = "p" + std::to_string(process) + "-" + std::to_string(i);
        if (defaults.set(kDomain, key, Value(i))) ++failures;
        if (defaults.value(kDomain, key) != Value(i)) ++failures;
      }
      ::_exit(failures == 0 ? 0 : 1);
    }
    children.push_back(child);
  }
  for (pid_t child : children) {
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
  EXPECT_EQ(make().values(kDomain).size(), static_cast<size_t>(kProcesses * kWrites));
}

TEST_F(TomlUserDefaultsTest, ProcessesThatRaceForAnIdentifierAgree) {
  constexpr int kProcesses = 6;
  int ends[2];
  ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
  std::vector<pid_t> children;
  for (int process = 0; process < kProcesses; ++process) {
    const pid_t child = ::fork();
    if (child == 0) {
      auto defaults = make(std::chrono::seconds(60));
      std::string answers;
      for (int i = 0; i < 10; ++i) {
        const std::string own(1, static_cast<char>('a' + process));
        answers += defaults.stringOrStore(kDomain, "uuid:" + std::to_string(i), String(std::string_view(own)))
                       .view();
      }
      ::_exit(writeAll(ends[1], answers) ? 0 : 1);
    }
    children.push_back(child);
  }
  for (pid_t child : children) {
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
  std::set<std::string> answers;
  char buffer[10];
  for (int process = 0; process < kProcesses; ++process) {
    ASSERT_EQ(::read(ends[0], buffer, sizeof buffer), 10);
    answers.emplace(buffer, sizeof buffer);
  }
  EXPECT_EQ(answers.size(), 1u) << "every process was answered the same identifiers";
  ::close(ends[0]);
  ::close(ends[1]);
}

TEST_F(TomlUserDefaultsTest, WhatCannotBeOpenedForAMomentKeepsItsValues) {
  folder_.write("com.vantu.diagnostics.toml", "consent = true\n");
  auto defaults = make();
  const auto consent = [&] { return defaults.value("com.vantu.diagnostics", "consent"); };
  ASSERT_EQ(consent(), Value(true));
  folder_.write("com.vantu.diagnostics.toml", "consent = true #\n");
  for (int i = 0; i < 3; ++i) {
    const NoDescriptors none;
    EXPECT_EQ(consent(), Value(true));
  }
  EXPECT_EQ(
      sink_.count(LogLevel::error,
                  "com.vantu.diagnostics.toml: Too many open files. What was read before counts until it can "
                  "be read"),
      1u)
      << "a line a minute";
  clock_.advance(std::chrono::seconds(61));
  {
    const NoDescriptors none;
    EXPECT_EQ(consent(), Value(true));
  }
  EXPECT_EQ(sink_.count("Too many open files"), 2u);
  folder_.write("com.vantu.diagnostics.toml", "consent = false\n");
  EXPECT_EQ(consent(), Value(false)) << "a change counts as soon as the file can be read";
}

TEST_F(TomlUserDefaultsTest, WhatCouldNotBeOpenedAtFirstIsReadWithoutAChange) {
  const std::string file = folder_.write(kFile, "n = 1\n");
  ASSERT_TRUE(eventually([&] { return !changedJustNow(identityOf(file)); }));
  auto defaults = make();
  {
    const NoDescriptors none;
    EXPECT_TRUE(defaults.value(kDomain, "n").isNull());
  }
  EXPECT_EQ(defaults.value(kDomain, "n"), Value(1));
}

TEST_F(TomlUserDefaultsTest, NotesWhenAnIdentifierWasMade) {
  auto defaults = make();
  clock_.setTimeOfDay({1769860800, 0});
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuidRespectDnu", String("one")), "one");
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:b", String("two"), 1000), "two");
  EXPECT_EQ(defaults.stringOrStore(kDomain, "other", String("three")), "three");
  clock_.setTimeOfDay({1769860900, 0});
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuidRespectDnu", String("later")), "one");
  EXPECT_EQ(defaults.value(kDomain, "uuidMade:uuidRespectDnu"), Value(1769860800));
  EXPECT_EQ(defaults.value(kDomain, "uuidMade:uuid:a:b"), Value(1769860800));
  EXPECT_TRUE(defaults.value(kDomain, "uuidMade:other").isNull());
  EXPECT_EQ(defaults.set(kDomain, "uuidRespectDnu", Value()), std::nullopt);
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuidRespectDnu", String("anew")), "anew");
  EXPECT_EQ(defaults.value(kDomain, "uuidMade:uuidRespectDnu"), Value(1769860900));
}

TEST_F(TomlUserDefaultsTest, RemovesAllIdentifiersAtOnceAndNothingElse) {
  const std::string rest = "# a remark\nenvironmentType = 2\n\n\"uui\" = \"x\"\n";
  folder_.write(kFile, rest);
  auto defaults = make();
  EXPECT_EQ(defaults.stringOrStore(kDomain, "uuidRespectDnu", String("one")), "one");
  for (int i = 0; i < 50; ++i)
    EXPECT_EQ(defaults.stringOrStore(kDomain, "uuid:a:" + std::to_string(i), String("x"), 1000), "x");
  EXPECT_EQ(defaults.removeIdentifiers(kDomain), std::nullopt);
  EXPECT_EQ(text(), rest);
  EXPECT_TRUE(defaults.value(kDomain, "uuidRespectDnu").isNull());
  const auto before = identityOf(folder_ / kFile);
  EXPECT_EQ(defaults.removeIdentifiers(kDomain), std::nullopt);
  EXPECT_EQ(identityOf(folder_ / kFile), before) << "there was nothing to remove";
  EXPECT_TRUE(defaults.removeIdentifiers("../etc"));
}

TEST_F(TomlUserDefaultsTest, RemovesIdentifiersOfAFileWithoutALastLineEnd) {
  folder_.write(kFile, "\"uuid:a:b\" = \"one\"\nlast = 1\nuuidRespectDnu = \"two\"");
  EXPECT_EQ(make().removeIdentifiers(kDomain), std::nullopt);
  EXPECT_EQ(text(), "last = 1\n");
}

TEST_F(TomlUserDefaultsTest, RemovesNoIdentifiersOfAFileThatIsWrong) {
  folder_.write(kFile, "uuidRespectDnu = ");
  EXPECT_TRUE(make().removeIdentifiers(kDomain));
  EXPECT_EQ(text(), "uuidRespectDnu = ");
}

TEST(Identifiers, AreToldFromWhatIsNotedBesideThem) {
  for (const char* key : {"uuidRespectDnu", "uuidOverrideDnu", "uuid:a:b"})
    EXPECT_TRUE(TomlUserDefaults::isIdentifier(key)) << key;
  for (const char* key : {"uuidOwner:a:b", "uuidMade:uuid:a:b", "environmentType"})
    EXPECT_FALSE(TomlUserDefaults::isIdentifier(key)) << key;
}

}  // namespace
}  // namespace kyt
