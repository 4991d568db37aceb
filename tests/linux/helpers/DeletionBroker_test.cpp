// Whose files the broker removes, which it leaves alone, and what it may do itself.
#include "platform/linux/helpers/DeletionBroker.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstddef>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "tests/support/ChildProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/SendDescriptors.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr uint32_t kOther = 54321, kTheirGroup = 54322, kFurtherGroup = 54323;

std::unique_ptr<DeletionBroker> startBroker(const std::vector<std::string>& daemonsOwn = {}) {
  auto started = DeletionBroker::start(daemonsOwn);
  if (const auto* error = std::get_if<std::string>(&started)) ADD_FAILURE() << *error;
  return std::move(std::get<std::unique_ptr<DeletionBroker>>(started));
}

PeerIdentity myself() {
  return {::geteuid(), ::getegid(), {}};
}

// The process that start() made: this process has no other child.
pid_t brokerProcess() {
  std::ifstream children("/proc/thread-self/children");
  pid_t child = 0;
  children >> child;
  return child;
}

std::string statusOf(pid_t process, const std::string& key) {
  std::ifstream status("/proc/" + std::to_string(process) + "/status");
  for (std::string line; std::getline(status, line);)
    if (line.starts_with(key + ":")) return line.substr(line.find_first_not_of(" \t", key.size() + 1));
  return {};
}

class Broker : public testing::Test {
 protected:
  struct Opened {
    Descriptor file, folder;
  };
  Descriptor folder() const {
    return ownDescriptor(::open(folder_.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  }
  Opened open(const std::string& name) const {
    return {ownDescriptor(::open((folder_ / name).c_str(), O_RDONLY | O_CLOEXEC)), folder()};
  }
  int remove(const Opened& opened, std::string_view name, const PeerIdentity& peer = myself()) const {
    return broker_->remove(opened.file.get(), opened.folder.get(), name, peer);
  }
  [[nodiscard]] bool exists(const std::string& name) const {
    return std::filesystem::exists(std::filesystem::symlink_status(folder_ / name));
  }

  const TemporaryFolder folder_;
  const std::unique_ptr<DeletionBroker> broker_ = startBroker();
};

TEST_F(Broker, RemovesTheNameThatIsStillTheFile) {
  folder_.write("a", "1");
  folder_.write("b", "2");
  EXPECT_EQ(remove(open("a"), "a"), 0);
  EXPECT_FALSE(exists("a"));
  EXPECT_TRUE(exists("b"));
}

TEST_F(Broker, LeavesAFileThatTookItsPlace) {
  folder_.write("a", "1");
  const Opened opened = open("a");
  std::filesystem::rename(folder_ / "a", folder_ / "old");
  folder_.write("a", "another");
  EXPECT_EQ(remove(opened, "a"), ESTALE);
  EXPECT_EQ(folder_.read("a"), "another");
  EXPECT_EQ(remove(opened, "old"), 0);
}

TEST_F(Broker, FollowsNoSymbolicLink) {
  folder_.write("a", "1");
  const Opened opened = open("a");
  std::filesystem::rename(folder_ / "a", folder_ / "target");
  std::filesystem::create_symlink("target", folder_ / "a");
  EXPECT_EQ(remove(opened, "a"), ESTALE);
  EXPECT_TRUE(exists("a"));
  EXPECT_TRUE(exists("target"));
}

TEST_F(Broker, TakesOnlyPlainNames) {
  folder_.write("a", "1");
  folder_.write("sub/b", "2");
  const Opened opened = open("a");
  const Opened below = {ownDescriptor(::open((folder_ / "sub/b").c_str(), O_RDONLY | O_CLOEXEC)), folder()};
  EXPECT_EQ(remove(below, "sub/b"), EINVAL);
  EXPECT_EQ(remove(opened, "./a"), EINVAL);
  EXPECT_EQ(remove(opened, (folder_ / "a")), EINVAL);
  for (const std::string& name :
       {std::string(), std::string("."), std::string(".."), std::string("a\0", 2), std::string(256, 'n')})
    EXPECT_EQ(remove(opened, name), EINVAL) << name;
  EXPECT_EQ(remove(opened, std::string(255, 'n')), ENOENT);
  EXPECT_TRUE(exists("a"));
  EXPECT_TRUE(exists("sub/b"));
}

TEST_F(Broker, RemovesNothingButRegularFiles) {
  std::filesystem::create_directory(folder_ / "folder");
  EXPECT_EQ(remove(open("folder"), "folder"), EINVAL);
  ASSERT_EQ(::mkfifo((folder_ / "fifo").c_str(), 0600), 0);
  const Opened fifo = {ownDescriptor(::open((folder_ / "fifo").c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC)),
                       folder()};
  EXPECT_EQ(remove(fifo, "fifo"), EINVAL);
  EXPECT_TRUE(exists("fifo"));
}

TEST_F(Broker, NeedsBothDescriptors) {
  folder_.write("a", "1");
  const Opened opened = open("a");
  EXPECT_EQ(broker_->remove(-1, opened.folder.get(), "a", myself()), EBADF);
  EXPECT_EQ(broker_->remove(opened.file.get(), -1, "a", myself()), EBADF);
  EXPECT_EQ(broker_->remove(opened.file.get(), opened.file.get(), "a", myself()), ENOTDIR);
  EXPECT_TRUE(exists("a"));
}

TEST_F(Broker, ServesNobodyUnknown) {
  folder_.write("a", "1");
  const Opened opened = open("a");
  EXPECT_EQ(remove(opened, "a", PeerIdentity{}), EPERM);
  EXPECT_EQ(remove(opened, "a", {::geteuid(), ~0U, {}}), EPERM);
  EXPECT_EQ(remove(opened, "a", {~0U, ::getegid(), {}}), EPERM);
  EXPECT_EQ(remove(opened, "a",
                   {::geteuid(), ::getegid(), std::vector<uint32_t>(DeletionBroker::kMaxGroups + 1, 7)}),
            EINVAL);
  EXPECT_TRUE(exists("a"));
}

TEST_F(Broker, TakesTheClientsUserAndGroupsAndNothingElse) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to take another user";
  const PeerIdentity other{kOther, kTheirGroup, {kFurtherGroup}};
  const auto tryAs = [&](const PeerIdentity& peer, uid_t owner, gid_t group, mode_t mode) {
    folder_.write("a", "1");
    EXPECT_EQ(::chown(folder_.path().c_str(), owner, group), 0);
    EXPECT_EQ(::chmod(folder_.path().c_str(), mode), 0);
    const int result = remove(open("a"), "a", peer);
    EXPECT_EQ(exists("a"), result != 0);
    return result;
  };
  EXPECT_EQ(tryAs(other, 0, 0, 0755), EACCES);
  EXPECT_EQ(tryAs(other, kOther, 0, 0700), 0);
  EXPECT_EQ(tryAs(other, 0, kTheirGroup, 0770), 0);
  EXPECT_EQ(tryAs(other, 0, kFurtherGroup, 0770), 0);
  EXPECT_EQ(tryAs({kOther, kTheirGroup, {}}, 0, kFurtherGroup, 0770), EACCES);
  // Not even root's clients have root's power over the folders of others.
  EXPECT_EQ(tryAs({0, 0, {}}, kOther, kTheirGroup, 0700), EACCES);
  EXPECT_EQ(tryAs({0, 0, {}}, 0, 0, 0700), 0);
  // A folder where each user may remove only what is its own.
  EXPECT_EQ(tryAs(other, 0, 0, 01777), EPERM);
}

TEST_F(Broker, StartedByAnOrdinaryUserItServesThatUserAlone) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to become an ordinary user";
  folder_.write("a", "1");
  folder_.write("b", "1");
  ASSERT_EQ(::chown(folder_.path().c_str(), kOther, kOther), 0);
  const Opened a = open("a"), b = open("b");
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              if (::setresgid(kOther, kOther, kOther) != 0 || ::setresuid(kOther, kOther, kOther) != 0)
                return "cannot become an ordinary user";
              const auto broker = startBroker();
              const auto asUser = [&](const Opened& opened, const char* name, uint32_t user) {
                return std::to_string(
                           broker->remove(opened.file.get(), opened.folder.get(), name, {user, user, {}})) +
                       " ";
              };
              return asUser(a, "a", kOther) + asUser(b, "b", 0) + asUser(b, "b", kOther + 1);
            }),
            "0 " + std::to_string(EPERM) + " " + std::to_string(EPERM) + " ");
  EXPECT_FALSE(exists("a"));
  EXPECT_TRUE(exists("b"));
}

TEST_F(Broker, HoldsNothingButThePowerToTakeUsers) {
  const pid_t process = brokerProcess();
  ASSERT_GT(process, 0);
  ASSERT_TRUE(eventually([&] { return statusOf(process, "Name") == "kyt-broker"; }));
  folder_.write("a", "1");
  EXPECT_EQ(remove(open("a"), "a"), 0);  // it has finished starting
  const std::string expected = ::geteuid() == 0 ? "00000000000000c0" : "0000000000000000";
  EXPECT_EQ(statusOf(process, "CapEff"), expected);
  EXPECT_EQ(statusOf(process, "CapPrm"), expected);
  for (const char* set : {"CapInh", "CapAmb"}) EXPECT_EQ(statusOf(process, set), "0000000000000000") << set;
  EXPECT_EQ(statusOf(process, "NoNewPrivs"), "1");
}

TEST_F(Broker, ThatIsGoneRemovesNothingAndHoldsNobody) {
  const pid_t process = brokerProcess();
  ASSERT_GT(process, 0);
  ASSERT_EQ(::kill(process, SIGKILL), 0);
  folder_.write("a", "1");
  EXPECT_TRUE(eventually([&] { return remove(open("a"), "a") == EPIPE; }));
  EXPECT_TRUE(exists("a"));
}

TEST_F(Broker, SurvivesASignalOfItsTerminal) {
  const pid_t process = brokerProcess();
  folder_.write("a", "1");
  EXPECT_EQ(remove(open("a"), "a"), 0);
  for (const int signal : {SIGINT, SIGTERM, SIGHUP}) ASSERT_EQ(::kill(process, signal), 0);
  folder_.write("b", "1");
  EXPECT_EQ(remove(open("b"), "b"), 0);
}

// A file system that never answers: whoever removes a name stands still, as long as this object's process does not
// end it. Only for a process of its own, and for those it starts from here on.
class SilentFileSystem {
 public:
  // Empty, or why this system cannot do that.
  std::string begin() {
    sock_filter code[] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_unlinkat, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_USER_NOTIF),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
    };
    sock_fprog program = {std::size(code), code};
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return "no_new_privs: " + errorText(errno);
    const long listener =
        ::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_NEW_LISTENER, &program);
    if (listener < 0) return "seccomp: " + errorText(errno);
    listener_ = ownDescriptor(static_cast<int>(listener));
    return {};
  }
  // The next process that stands still, and does so until it ends.
  [[nodiscard]] pid_t next() const {
    seccomp_notif call = {};
    return ::ioctl(listener_.get(), SECCOMP_IOCTL_NOTIF_RECV, &call) == 0 ? static_cast<pid_t>(call.pid) : -1;
  }

 private:
  Descriptor listener_;
};

// Runs where removing hangs, and prints what went wrong. Three removals at once: one that hangs, one that hangs in
// a child that its client has stopped, and one that fails before it comes to that.
std::string removeWhereItHangs(const TemporaryFolder& folder) {
  using Clock = std::chrono::steady_clock;
  SilentFileSystem silent;
  if (const std::string problem = silent.begin(); !problem.empty()) return "cannot: " + problem;
  const auto broker = startBroker();
  struct Removal {
    int result = -1;
    double seconds = 0;
  };
  const auto remove = [&](const char* name, const char* opened, Removal& removal) {
    const Descriptor file = ownDescriptor(::open((folder / opened).c_str(), O_RDONLY | O_CLOEXEC));
    const Descriptor directory =
        ownDescriptor(::open(folder.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    const auto begin = Clock::now();
    removal.result = broker->remove(file.get(), directory.get(), name, myself());
    removal.seconds = std::chrono::duration<double>(Clock::now() - begin).count();
  };
  Removal hanging, stopped, other;
  std::thread first([&] { remove("a", "a", hanging); });
  const pid_t hangs = silent.next();
  std::thread second([&] { remove("b", "b", stopped); });
  const pid_t stops = silent.next();
  if (hangs <= 0 || stops <= 0) return "nobody hangs";
  ::kill(stops, SIGSTOP);
  remove("a", "b", other);
  first.join();
  second.join();
  std::string wrong;
  const auto expect = [&](bool holds, const std::string& what) {
    if (!holds) wrong += what + "; ";
  };
  expect(other.result == ESTALE && other.seconds < 4,
         "another was held up: " + std::to_string(other.seconds));
  expect(hanging.result == EIO, "the hanging one: " + errorText(hanging.result));
  expect(hanging.seconds > 4.5, "the deadline came after " + std::to_string(hanging.seconds));
  expect(stopped.result == EIO, "the stopped one: " + errorText(stopped.result));
  expect(stopped.seconds > 4.5, "its deadline came after " + std::to_string(stopped.seconds));
  for (const pid_t child : {hangs, stops})
    expect(eventually([&] { return ::kill(child, 0) != 0 && errno == ESRCH; }), "a child is still there");
  remove("a", "b", other);
  expect(other.result == ESTALE, "afterwards: " + errorText(other.result));
  return wrong;
}

TEST_F(Broker, EndsAChildWhoseFileSystemNeverAnswersAndServesOthersMeanwhile) {
  folder_.write("a", "1");
  folder_.write("b", "2");
  const std::string outcome = inChildProcess([this] { return removeWhereItHangs(folder_); });
  if (outcome.starts_with("cannot: ")) GTEST_SKIP() << outcome;
  EXPECT_EQ(outcome, "");
  EXPECT_TRUE(exists("a"));
  EXPECT_TRUE(exists("b"));
}

// As many removals as a user may have at once hang; prints what went wrong with further ones.
std::string removeAtOnce(const TemporaryFolder& folder) {
  SilentFileSystem silent;
  if (const std::string problem = silent.begin(); !problem.empty()) return "cannot: " + problem;
  const auto broker = startBroker();
  const Descriptor file = ownDescriptor(::open((folder / "a").c_str(), O_RDONLY | O_CLOEXEC));
  const Descriptor directory = ownDescriptor(::open(folder.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  const auto remove = [&](const char* name, const PeerIdentity& peer) {
    return broker->remove(file.get(), directory.get(), name, peer);
  };
  std::vector<std::thread> hanging;
  for (size_t i = 0; i < DeletionBroker::kMostOfOneUser; ++i) {
    hanging.emplace_back([&] { (void)remove("a", myself()); });
    if (silent.next() <= 0) return "nobody hangs";
  }
  std::string wrong;
  if (const int result = remove("b", myself()); result != EIO)
    wrong += "one more: " + errorText(result) + "; ";
  if (::geteuid() == 0)
    if (const int result = remove("b", {kOther, kOther, {}}); result != ESTALE)
      wrong += "another user's: " + errorText(result) + "; ";
  for (std::thread& each : hanging) each.join();
  if (!eventually([&] { return remove("b", myself()) == ESTALE; })) wrong += "not served afterwards";
  return wrong;
}

TEST_F(Broker, WorksForOneUserOnlySoOftenAtOnceAndForOthersMeanwhile) {
  folder_.write("a", "1");
  folder_.write("b", "2");
  ASSERT_EQ(::chmod(folder_.path().c_str(), 0755), 0);
  const std::string outcome = inChildProcess([this] { return removeAtOnce(folder_); });
  if (outcome.starts_with("cannot: ")) GTEST_SKIP() << outcome;
  EXPECT_EQ(outcome, "");
}

TEST_F(Broker, LeavesAFileThatNobodyOpenedForReading) {
  folder_.write("a", "1");
  for (const int flags : {O_PATH, O_WRONLY, O_WRONLY | O_APPEND}) {
    const Opened opened = {ownDescriptor(::open((folder_ / "a").c_str(), flags | O_CLOEXEC)), folder()};
    EXPECT_EQ(remove(opened, "a"), EBADF) << flags;
  }
  EXPECT_TRUE(exists("a"));
  const Opened both = {ownDescriptor(::open((folder_ / "a").c_str(), O_RDWR | O_CLOEXEC)), folder()};
  EXPECT_EQ(remove(both, "a"), 0);
}

// What the confined daemon can open itself is no proof that a client passed it.
TEST_F(Broker, LeavesWhatLiesBeneathTheDaemonsOwnFoldersUnderWhateverName) {
  for (const char* name : {"own/a", "own/sub/b", "other/c", "owner/d"}) folder_.write(name, "1");
  std::filesystem::create_directory_symlink(folder_ / "own", folder_ / "link");
  const auto broker = startBroker({folder_ / "missing", folder_ / "link", folder_ / "other/c"});
  const auto removeFrom = [&](const std::string& where, const std::string& name) {
    const Descriptor directory =
        ownDescriptor(::open((folder_ / where).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    const Descriptor file =
        ownDescriptor(::open((folder_ / (where + "/" + name)).c_str(), O_RDONLY | O_CLOEXEC));
    return broker->remove(file.get(), directory.get(), name, myself());
  };
  EXPECT_EQ(removeFrom("own", "a"), EPERM);
  EXPECT_EQ(removeFrom("own/sub", "b"), EPERM);
  EXPECT_EQ(removeFrom("link/sub", "b"), EPERM);
  EXPECT_EQ(removeFrom("other/../own/sub/..", "a"), EPERM);
  std::filesystem::rename(folder_ / "own", folder_ / "other/moved");
  EXPECT_EQ(removeFrom("other/moved/sub", "b"), EPERM);
  EXPECT_EQ(removeFrom("other", "c"), 0);
  EXPECT_EQ(removeFrom("owner", "d"), 0);
}

// The requests of code that took over the daemon, in the socket's own words.
class ForgedRequest : public Broker {
 protected:
  // A whole request without a name, but for what a test changes in it.
  struct Words {
    uint32_t user = ::geteuid(), group = ::getegid(), groupCount = 0, nameLength = 1;
    uint32_t groups[DeletionBroker::kMaxGroups] = {};
    char name[256] = "a";
  };
  static int socketOfTheBroker() {
    for (int fd = 0; fd < 1024; ++fd) {
      int type = 0;
      socklen_t size = sizeof type;
      if (::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &size) == 0 && type == SOCK_SEQPACKET) return fd;
    }
    return -1;
  }
  static void send(const Words& words, size_t bytes, const std::vector<int>& descriptors) {
    const std::string_view request(reinterpret_cast<const char*>(&words), bytes);
    ASSERT_EQ(test::sendDescriptors(socketOfTheBroker(), request, descriptors), static_cast<ssize_t>(bytes));
  }
  // Sends it with a place for the answer behind file and folder, and `more` descriptors behind that. The answer, or
  // -1 when there is none.
  int ask(const Words& words, size_t more = 0, size_t bytes = sizeof(Words)) {
    folder_.write("a", "1");
    const Opened opened = open("a");
    int ends[2] = {-1, -1};
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends), 0);
    const Descriptor mine = ownDescriptor(ends[0]);
    {
      const Descriptor theirs = ownDescriptor(ends[1]);
      std::vector<int> descriptors = {opened.file.get(), opened.folder.get(), theirs.get()};
      descriptors.resize(descriptors.size() + more, opened.file.get());
      send(words, bytes, descriptors);
    }
    int32_t answer = -1;
    return ::recv(mine.get(), &answer, sizeof answer, 0) == sizeof answer ? answer : -1;
  }
};

TEST_F(ForgedRequest, ThatIsWholeIsServed) {
  EXPECT_EQ(ask({}), 0);
  EXPECT_FALSE(exists("a"));
}

TEST_F(ForgedRequest, WithTheWrongDescriptorsIsDroppedAndLeavesNoneOpen) {
  EXPECT_EQ(ask({}), 0);  // it has finished starting
  const auto descriptors = [] {
    return std::distance(
        std::filesystem::directory_iterator("/proc/" + std::to_string(brokerProcess()) + "/fd"), {});
  };
  const auto before = descriptors();
  for (int round = 0; round < 20; ++round)
    for (const size_t more : {1, 2, 100}) EXPECT_EQ(ask({}, more), -1) << more;
  EXPECT_TRUE(exists("a"));
  folder_.write("b", "1");
  const Opened opened = open("b");
  send({}, sizeof(Words), {});
  send({}, sizeof(Words), {opened.file.get()});
  send({}, sizeof(Words), {opened.file.get(), opened.folder.get()});
  EXPECT_EQ(ask({}), 0);
  // Less when the first count found it at work.
  EXPECT_TRUE(eventually([&] { return descriptors() <= before; })) << before << ", then " << descriptors();
}

TEST_F(ForgedRequest, OfAnotherSizeOrWithAbsurdNumbersIsDroppedAndTheNextIsServed) {
  for (const size_t bytes : {size_t{1}, size_t{3}, size_t{4}, size_t{16}, sizeof(Words) - 1})
    EXPECT_EQ(ask({}, 0, bytes), -1) << bytes;
  Words words;
  words.groupCount = DeletionBroker::kMaxGroups + 1;
  EXPECT_EQ(ask(words), -1);
  words.groupCount = UINT32_MAX;
  EXPECT_EQ(ask(words), -1);
  words = {};
  words.nameLength = 256;
  EXPECT_EQ(ask(words), -1);
  words.nameLength = UINT32_MAX;
  EXPECT_EQ(ask(words), -1);
  words.nameLength = 0;
  EXPECT_EQ(ask(words), EINVAL);
  words = {};
  std::memset(words.name, 'a', sizeof words.name);  // without an end
  words.nameLength = 255;
  EXPECT_EQ(ask(words), ENOENT);
  EXPECT_TRUE(exists("a"));
  EXPECT_EQ(ask({}), 0);
}

TEST_F(ForgedRequest, ThatComesInMassesIsServedInTurn) {
  folder_.write("b", "1");
  const Opened opened = open("b");
  const Descriptor nowhere = ownDescriptor(::open("/dev/null", O_WRONLY | O_CLOEXEC));
  for (int i = 0; i < 500; ++i)
    send({}, sizeof(Words), {opened.file.get(), opened.folder.get(), nowhere.get()});
  EXPECT_TRUE(eventually([&] { return ask({}) == 0; }));
}

TEST(BrokerThatIsStopped, HoldsUpTheEndForSomeSecondsOnly) {
  auto broker = startBroker();
  const pid_t process = brokerProcess();
  ASSERT_GT(process, 0);
  ASSERT_EQ(::kill(process, SIGSTOP), 0);
  const auto begin = std::chrono::steady_clock::now();
  broker.reset();
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(20));
  ASSERT_EQ(::kill(process, SIGKILL), 0);
  EXPECT_EQ(::waitpid(process, nullptr, 0), process);
}

}  // namespace
}  // namespace kyt
