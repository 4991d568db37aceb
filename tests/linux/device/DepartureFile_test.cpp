// The file of what left, and the lock beside it.
#include "platform/linux/device/DepartureFile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>

#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/data/RapidJSON.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

class DepartureFileTest : public testing::Test {
 protected:
  std::unique_ptr<DepartureFile> make() {
    return std::make_unique<DepartureFile>(folder_.path(), json_, log_, clock_, timers_,
                                           SerialQueue::create("departures", executor_));
  }
  static Departure departure(const std::string& client) {
    Departure made;
    made.program.clientName = client;
    made.server = "https://posts.example.org";
    made.events = 1;
    return made;
  }
  void wait(Duration time) {
    timers_.advance(time);
    executor_.runAll();
  }
  size_t rows() { return DepartureFile::read(folder_.path(), json_).rows().size(); }
  bool isThere() const { return access(path_.c_str(), F_OK) == 0; }

  TemporaryFolder folder_;
  const std::string path_ = DepartureFile::pathIn(folder_.path());
  RapidJSON json_;
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  ManualClock clock_;
  ManualTimers timers_{clock_};
  ManualExecutor executor_;
};

TEST_F(DepartureFileTest, WritesOnceHalfAMinuteAfterSomethingLeft) {
  const auto file = make();
  wait(std::chrono::hours(1));
  EXPECT_FALSE(isThere()) << "nothing left";
  file->add(departure("a"));
  wait(DepartureFile::kWrittenAfter / 2);
  file->add(departure("b"));
  EXPECT_FALSE(isThere());
  wait(DepartureFile::kWrittenAfter / 2);
  ASSERT_TRUE(isThere());
  EXPECT_EQ(rows(), 2U);
  struct stat status = {};
  ASSERT_EQ(stat(path_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0640U);
  const FileIdentity before = identityOf(path_);
  wait(std::chrono::hours(1));
  EXPECT_EQ(identityOf(path_), before) << "no more was to write";
}

TEST_F(DepartureFileTest, GoesOnWithWhatADaemonBeforeWrote) {
  make()->add(departure("lost"));  // killed before it wrote
  {
    const auto file = make();
    file->add(departure("a"));
    file->flush();
  }
  const auto file = make();
  file->add(departure("b"));
  file->flush();
  EXPECT_EQ(rows(), 2U);
}

TEST_F(DepartureFileTest, NeverWritesBackWhatSomebodyRemoved) {
  const auto file = make();
  file->add(departure("a"));
  file->flush();
  file->add(departure("b"));
  ASSERT_EQ(unlink(path_.c_str()), 0);
  file->add(departure("c"));
  file->flush();
  const DepartureTable table = DepartureFile::read(folder_.path(), json_);
  ASSERT_EQ(table.rows().size(), 1U);
  EXPECT_EQ(table.rows().begin()->first.program.clientName, "c");
  ASSERT_EQ(unlink(path_.c_str()), 0);
  file->flush();
  EXPECT_FALSE(isThere());
}

TEST_F(DepartureFileTest, BeginsAnewWhereTheFileHasAnotherForm) {
  folder_.write("departures.json", "{\"format\":1,\"rows\":[");
  EXPECT_EQ(rows(), 0U);
  const auto file = make();
  file->add(departure("a"));
  file->flush();
  EXPECT_EQ(rows(), 1U);
}

TEST_F(DepartureFileTest, SaysWhatKeepsItFromWriting) {
  const auto file = make();
  file->add(departure("a"));
  folder_.write(".departures.json.new/in the way", "");
  file->flush();
  EXPECT_FALSE(isThere());
  EXPECT_EQ(sink_.count(LogLevel::error, "departures: "), 1U);
}

TEST_F(DepartureFileTest, TheLockOfADaemonKeepsOthersOutUntilItEnds) {
  int ready[2], over[2];
  ASSERT_EQ(pipe(ready), 0);
  ASSERT_EQ(pipe(over), 0);
  const pid_t child = fork();
  if (child == 0) {
    close(over[1]);
    std::string problem;
    const auto lock = DaemonLock::take(folder_.path(), Duration(0), problem);
    char byte = lock ? 'y' : 'n';
    if (write(ready[1], &byte, 1) != 1) _exit(1);
    _exit(read(over[0], &byte, 1) == 0 ? 0 : 1);
  }
  close(over[0]);
  char byte = 0;
  ASSERT_EQ(read(ready[0], &byte, 1), 1);
  EXPECT_EQ(byte, 'y');
  EXPECT_EQ(DaemonLock::holder(folder_.path()), child);
  std::string problem;
  EXPECT_FALSE(DaemonLock::take(folder_.path(), std::chrono::milliseconds(20), problem));
  EXPECT_EQ(problem, folder_ / "daemon.lock: Resource temporarily unavailable");
  close(over[1]);
  EXPECT_TRUE(DaemonLock::take(folder_.path(), std::chrono::seconds(30), problem)) << problem;
  int status = 0;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  EXPECT_EQ(DaemonLock::holder(folder_.path()), 0);
  close(ready[0]);
  close(ready[1]);
}

TEST_F(DepartureFileTest, NobodyHoldsALockThatIsNotThere) {
  EXPECT_EQ(DaemonLock::holder(folder_.path()), 0);
  std::string problem;
  EXPECT_FALSE(DaemonLock::take(folder_ / "missing", Duration(0), problem));
  EXPECT_EQ(problem, folder_ / "missing/daemon.lock: No such file or directory");
}

// A process that does something, says that it has, and goes on until it is told to end, or dies.
class OtherProcess {
 public:
  explicit OtherProcess(const std::function<void()>& begin) {
    int ready[2];
    EXPECT_EQ(pipe(ready), 0);
    process_ = fork();
    if (process_ == 0) {
      begin();
      const char byte = 'y';
      if (write(ready[1], &byte, 1) != 1) _exit(1);
      for (;;) pause();
    }
    close(ready[1]);
    ready_ = ready[0];
  }
  ~OtherProcess() {
    kill(process_, SIGKILL);
    static_cast<void>(end());
    close(ready_);
  }
  bool hasBegun() const {
    char byte = 0;
    return read(ready_, &byte, 1) == 1;
  }
  // The signal that ended it.
  int end() {
    if (ended_ == 0) {
      int status = 0;
      EXPECT_EQ(waitpid(process_, &status, 0), process_);
      ended_ = WTERMSIG(status);
    }
    return ended_;
  }
  [[nodiscard]] pid_t process() const { return process_; }

 private:
  pid_t process_ = 0;
  int ready_ = -1, ended_ = 0;
};

TEST_F(DepartureFileTest, WhoeverErasesEndsADaemonThatStartsMeanwhileToo) {
  const auto keep = [this] {
    std::string problem;
    static const auto lock = DaemonLock::take(folder_.path(), std::chrono::seconds(30), problem);
    if (!lock) _exit(1);
  };
  OtherProcess first(keep);
  ASSERT_TRUE(first.hasBegun());
  // Stands in line before the eraser, so that it has the lock next.
  OtherProcess second([this] {
    const int file = open((folder_ / "daemon.lock").c_str(), O_RDWR | O_CLOEXEC);
    struct flock lock = {};
    lock.l_type = F_WRLCK;
    lock.l_whence = SEEK_SET;
    if (fcntl(file, F_SETLKW, &lock) != 0) _exit(1);
  });
  const std::string waiting = "-> POSIX  ADVISORY  WRITE " + std::to_string(second.process()) + " ";
  ASSERT_TRUE(eventually([&] {
    std::ifstream locks("/proc/locks");
    const std::string all{std::istreambuf_iterator<char>(locks), {}};
    return all.find(waiting) != all.npos;
  }));
  std::string problem;
  int told = 0;
  EXPECT_TRUE(DaemonLock::takeFromDaemon(folder_.path(), std::chrono::seconds(20), problem, told)) << problem;
  EXPECT_EQ(first.end(), SIGTERM);
  if (told == 2) {
    EXPECT_EQ(second.end(), SIGTERM);
  }
  EXPECT_GE(told, 1);
}

TEST_F(DepartureFileTest, AnErasuresMarkIsKnownToBeHeldWhileItsProcessLives) {
  ErasureMark mark(folder_.path());
  EXPECT_FALSE(mark.isHeld());
  {
    OtherProcess eraser([this] {
      static ErasureMark own(folder_.path());
      if (!own.set()) _exit(1);
    });
    ASSERT_TRUE(eraser.hasBegun());
    EXPECT_TRUE(mark.isHeld());
    EXPECT_FALSE(mark.remove()) << "it is another's";
    EXPECT_TRUE(mark.stands());
  }
  EXPECT_TRUE(mark.stands()) << "it was left behind";
  EXPECT_FALSE(mark.isHeld());
  EXPECT_TRUE(mark.remove());
  EXPECT_FALSE(mark.stands());
}

TEST_F(DepartureFileTest, AnErasuresMarkStandsUntilItIsRemoved) {
  ErasureMark mark(folder_.path());
  EXPECT_FALSE(mark.stands());
  EXPECT_TRUE(mark.remove());
  EXPECT_TRUE(mark.set());
  EXPECT_TRUE(mark.stands());
  EXPECT_TRUE(mark.set()) << "one that was cut off";
  EXPECT_TRUE(mark.remove());
  EXPECT_FALSE(mark.stands());
}

}  // namespace
}  // namespace kyt
