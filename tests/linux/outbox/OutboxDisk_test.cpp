// The outbox on a real file whose disk fails: each call of the system that SQLite makes fails in turn, and a process is
// killed in the middle of whatever it does.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <set>

#include "outbox/Outbox.h"
#include "outbox/OutboxURLSession.h"
#include "platform/linux/outbox/SQLitePostStore.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/support/TestPlatform.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define KYT_UNDER_SANITIZER 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define KYT_UNDER_SANITIZER 1
#endif
#endif

namespace {

// Which call of which name fails, and how: from that one on, so many.
struct Fault {
  std::string call;
  int after = -1;  // negative: none fails
  int times = 1;
  int error = EIO;
  bool waitsForNoDisk = false;
  bool kills = false;  // it does not fail, its process is killed before it
  std::set<off_t>
      bad{};  // places of the file itself, of kPlace bytes, that cannot be read until they are written
  static constexpr off_t kPlace = 512;
  long seen = 0;
  [[nodiscard]] bool isBad(int descriptor, size_t size, off_t at) const {
    const auto first = bad.lower_bound(at / kPlace * kPlace);
    if (first == bad.end() || *first >= at + static_cast<off_t>(size) || !isFile(descriptor)) return false;
    errno = EIO;
    return true;
  }
  void written(int descriptor, size_t size, off_t at) {
    if (bad.empty() || !isFile(descriptor)) return;
    for (off_t place = at; place < at + static_cast<off_t>(size); place += kPlace) bad.erase(place);
  }
  static bool isFile(int descriptor) {
    std::error_code ignored;
    return std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(descriptor), ignored)
               .extension() == ".sqlite";
  }
  void makeBad(off_t from, off_t to) {
    bad.clear();
    for (off_t place = from; place < to; place += kPlace) bad.insert(place);
  }
  bool fails(const char* name) {
    if (call != name) return false;
    const long number = seen++;
    if (after < 0 || number < after || number >= after + times) return false;
    if (kills) ::kill(::getpid(), SIGKILL);
    errno = error;
    return true;
  }
} fault;

}  // namespace

// SQLite finds these before the C library's.
extern "C" {
int fdatasync(int descriptor) {
  static auto* const real = reinterpret_cast<int (*)(int)>(::dlsym(RTLD_NEXT, "fdatasync"));
  if (fault.waitsForNoDisk) return 0;
  return fault.fails("fdatasync") ? -1 : real(descriptor);
}
ssize_t pread(int descriptor, void* bytes, size_t size, off_t at) {
  static auto* const real =
      reinterpret_cast<ssize_t (*)(int, void*, size_t, off_t)>(::dlsym(RTLD_NEXT, "pread"));
  return fault.isBad(descriptor, size, at) ? -1 : real(descriptor, bytes, size, at);
}
int rename(const char* from, const char* to) {
  static auto* const real = reinterpret_cast<int (*)(const char*, const char*)>(::dlsym(RTLD_NEXT, "rename"));
  return fault.fails("rename") ? -1 : real(from, to);
}
int fsync(int descriptor) {
  static auto* const real = reinterpret_cast<int (*)(int)>(::dlsym(RTLD_NEXT, "fsync"));
  return fault.fails("fsync") ? -1 : real(descriptor);
}
}

namespace kyt {
namespace {

sqlite3_syscall_ptr real(const char* name) {
  static std::map<std::string, sqlite3_syscall_ptr> known;
  auto [entry, isNew] = known.try_emplace(name);
  if (isNew) entry->second = sqlite3_vfs_find(nullptr)->xGetSystemCall(sqlite3_vfs_find(nullptr), name);
  return entry->second;
}
int failingOpen(const char* path, int flags, int mode) {
  if (fault.fails("open")) return -1;
  return reinterpret_cast<int (*)(const char*, int, int)>(real("open"))(path, flags, mode);
}
ssize_t failingWrite(int descriptor, const void* bytes, size_t size, off_t at) {
  if (fault.fails("pwrite64")) return -1;
  fault.written(descriptor, size, at);
  return reinterpret_cast<ssize_t (*)(int, const void*, size_t, off_t)>(real("pwrite64"))(descriptor, bytes,
                                                                                          size, at);
}
ssize_t failingRead(int descriptor, void* bytes, size_t size, off_t at) {
  if (fault.fails("pread64")) return -1;
  if (fault.isBad(descriptor, size, at)) return -1;
  return reinterpret_cast<ssize_t (*)(int, void*, size_t, off_t)>(real("pread64"))(descriptor, bytes, size,
                                                                                   at);
}
int failingTruncate(int descriptor, off_t size) {
  if (fault.fails("ftruncate")) return -1;
  return reinterpret_cast<int (*)(int, off_t)>(real("ftruncate"))(descriptor, size);
}
int failingStat(int descriptor, struct stat* status) {
  if (fault.fails("fstat")) return -1;
  return reinterpret_cast<int (*)(int, struct stat*)>(real("fstat"))(descriptor, status);
}
int failingUnlink(const char* path) {
  if (fault.fails("unlink")) return -1;
  return reinterpret_cast<int (*)(const char*)>(real("unlink"))(path);
}

constexpr const char* kCalls[] = {"open",   "pwrite64",  "pread64", "ftruncate", "fstat",
                                  "unlink", "fdatasync", "fsync",   "rename"};

void makeCallsFail() {
  sqlite3_vfs* system = sqlite3_vfs_find(nullptr);
  const std::pair<const char*, sqlite3_syscall_ptr> table[] = {
      {"open", reinterpret_cast<sqlite3_syscall_ptr>(failingOpen)},
      {"pwrite64", reinterpret_cast<sqlite3_syscall_ptr>(failingWrite)},
      {"pread64", reinterpret_cast<sqlite3_syscall_ptr>(failingRead)},
      {"ftruncate", reinterpret_cast<sqlite3_syscall_ptr>(failingTruncate)},
      {"fstat", reinterpret_cast<sqlite3_syscall_ptr>(failingStat)},
      {"unlink", reinterpret_cast<sqlite3_syscall_ptr>(failingUnlink)}};
  for (const auto& [name, replacement] : table) {
    static_cast<void>(real(name));
    ASSERT_EQ(system->xSetSystemCall(system, name, replacement), SQLITE_OK) << name;
  }
}

class OutboxDiskTest : public testing::Test {
 protected:
  OutboxDiskTest() {
    test_.clock.setTimeOfDay({1767225600, 0});
    test_.random.setDraw(4999);  // ms: nobody tries again at once
  }
  ~OutboxDiskTest() override { fault = Fault(); }

  void start() {
    store_ = std::make_unique<SQLitePostStore>(folder_.path());
    outbox_ =
        Outbox::create({test_.clock, test_.timers, test_.random, test_.executor, test_.consent,
                        test_.counters, test_.log, *books_, test_.departures, test_.urlSessions, *store_},
                       OutboxSettings{.enabled = true});
    factory_ = std::make_unique<OutboxURLSessionFactory>(test_.urlSessions, outbox_, test_.executor);
    session_ = factory_->create({});
    outbox_->begin();
    test_.executor.runAll();
  }
  void stop() {
    outbox_->stopSending();
    test_.executor.runAll();
    session_.reset();
    factory_.reset();
    outbox_.reset();
    store_.reset();
  }
  // Fails unless the server is up; `taken` has what it took. Returns whether the session was told that it was taken.
  void post(int number) {
    const auto tally = books_->open({1000, 7, "a", "b"}, "httppost", false);
    tally->take();
    BookedEvents booked;
    booked.add(tally.get());
    auto posted = std::make_shared<PostedEvents>(std::move(booked), test_.counters);
    URLRequest request;
    request.method = "POST";
    request.url = "https://events.example.org/v1";
    request.body = Data(std::to_string(number) + " " + std::string(3000, 'x'));
    request.events = posted->events();
    session_->start(std::move(request), [this, number, posted](auto, auto response, auto error) {
      if (!error && !response) kept_.insert(number);
      if (error)
        posted->dropped(Reason::postFailed);
      else
        posted->delivered();
    });
    test_.executor.runAll();
  }
  void answerEverything(bool isUp) {
    test_.urlSessions.setResponder([this, isUp](const URLRequest& request) {
      FakeURLSessionFactory::Reply reply;
      if (isUp)
        ++taken_[std::atoi(std::string(request.body.view()).c_str())];
      else if (++failures_ % 2 == 0)
        reply = {.status = 503, .headers = {{"Retry-After", "60"}}};
      else
        reply.error = Error{kKYTURLErrorDomain, 28, "time-out"};
      return std::optional(std::move(reply));
    });
  }
  void pass(Duration time) {
    test_.timers.advance(time, [this] { test_.executor.runAll(); });
  }
  [[nodiscard]] BookRow row() const {
    for (BookRow& row : books_->snapshot()) return std::move(row);
    return {};
  }

  TestPlatform test_;
  TemporaryFolder folder_;
  std::unique_ptr<Books> books_ = std::make_unique<Books>();
  std::unique_ptr<SQLitePostStore> store_;
  std::shared_ptr<Outbox> outbox_;
  std::unique_ptr<OutboxURLSessionFactory> factory_;
  std::unique_ptr<URLSession> session_;
  std::set<int> kept_;
  std::map<int, int> taken_;
  int failures_ = 0;
};

// Whatever fails: nobody crashes, each event is in one place of the books, and what was said to be kept arrives.
TEST_F(OutboxDiskTest, ClosesItsBooksWhicheverCallOfTheSystemFails) {
  makeCallsFail();
  int runs = 0, failures = 0;
  for (const char* call : kCalls) {
    for (const int error : {EIO, ENOSPC}) {
      for (int after = 0; after < 40; after += after < 8 ? 1 : 8) {
        for (const int times : {1, 1000000}) {
          std::filesystem::remove_all(folder_.path());
          std::filesystem::create_directory(folder_.path());
          books_ = std::make_unique<Books>();
          kept_.clear();
          taken_.clear();
          failures_ = 0;
          fault = {.call = call, .after = after, .times = times, .error = error};
          answerEverything(false);
          start();
          for (int i = 0; i < 6; ++i) {
            post(i);
            if (i == 3) pass(std::chrono::seconds(31));
          }
          const long seen = fault.seen;
          fault = Fault();
          answerEverything(true);
          pass(std::chrono::hours(2));
          const BookRow books = row();
          ASSERT_EQ(books.taken, 6U);
          EXPECT_EQ(books.queued + books.batched + books.inFlight + books.waiting + books.outbox, 0U)
              << call << " " << after << " " << describeRow(books);
          if (books.droppedFor(Reason::outboxUnreadable) == 0) {
            for (const int number : kept_)
              EXPECT_GE(taken_[number], 1)
                  << call << " " << after << " " << number << " " << describeRow(books);
          }
          stop();
          ++runs;
          failures += seen > after ? 1 : 0;
        }
      }
    }
  }
  std::printf("%d runs, in %d of which the call failed\n", runs, failures);
  EXPECT_GT(failures, 100);
}

// Each place of the file in turn: what lies elsewhere is found, and more can be kept.
TEST_F(OutboxDiskTest, FindsAllThatLiesElsewhereWhereADiskHasABadPlace) {
  makeCallsFail();
  constexpr int64_t kPosts = 40;
  constexpr off_t kBlock = 4096;
  const auto postOf = [](int64_t number) {
    StoredPost post;
    post.number = number;
    post.url = "https://events.example.org";
    post.body = Data(std::string(static_cast<size_t>(number) * 97 % 3000, 'x'));
    return post;
  };
  {
    SQLitePostStore store(folder_.path());
    for (int64_t number = 1; number <= kPosts; ++number) {
      const StoredPost post = postOf(number), *added = &post;
      ASSERT_FALSE(store.change({&added, 1}, {}, false));
    }
  }
  const std::string file = folder_.path() + "/outbox.sqlite", copy = folder_.path() + "/copy";
  std::filesystem::copy_file(file, copy);
  const auto size = static_cast<off_t>(std::filesystem::file_size(file));
  int placesOfPosts = 0;
  for (off_t at = kBlock; at < size; at += kBlock) {
    std::filesystem::copy_file(copy, file, std::filesystem::copy_options::overwrite_existing);
    fault.makeBad(at, at + kBlock);
    std::set<int64_t> there, lost;
    {
      SQLitePostStore store(folder_.path());
      const auto problem = store.open([&](const StoredPostHead& head) {
        (head.isUnreadable || !std::holds_alternative<StoredPost>(store.read(head.post.number)) ? lost
                                                                                                : there)
            .insert(head.post.number);
      });
      if (problem) continue;  // the pages that lead to all others
      EXPECT_GE(there.size(), kPosts - 9U) << at;
      EXPECT_FALSE(lost.empty()) << at;
      ++placesOfPosts;
      const std::vector<int64_t> removed(lost.begin(), lost.end());
      const StoredPost more = postOf(kPosts + 1), *added = &more;
      const auto unable = store.change({&added, 1}, removed, false);
      if (unable) continue;  // the place is where more would go
    }
    SQLitePostStore store(folder_.path());
    std::set<int64_t> again;
    EXPECT_FALSE(store.open([&](const StoredPostHead& head) {
      if (!head.isUnreadable) again.insert(head.post.number);
    }));
    there.insert(kPosts + 1);
    EXPECT_EQ(again, there) << at;
  }
  std::printf("%d places of %lld\n", placesOfPosts, static_cast<long long>(size / kBlock));
  EXPECT_GE(placesOfPosts, static_cast<int>(size / kBlock) - 3);
}

TEST_F(OutboxDiskTest, LosesOnlyThePostThatLiesAtABadPlace) {
  makeCallsFail();
  answerEverything(false);
  start();
  for (int i = 0; i < 12; ++i) post(i);
  stop();
  books_ = std::make_unique<Books>();
  fault.makeBad(off_t{5} * 4096, off_t{6} * 4096);
  start();
  post(12);
  answerEverything(true);
  for (int i = 0; i < 40; ++i) {
    pass(std::chrono::minutes(10));
    if (i < 8) {
      answerEverything(false);
      post(100 + i);  // the disk does other work
      answerEverything(true);
    }
  }
  const BookRow books = row();
  EXPECT_EQ(books.outbox, 0U) << describeRow(books);
  EXPECT_GE(books.delivered, 13U + 8U - 3U);
  const uint64_t lost = test_.counters.value(Reason::outboxPostUnreadable);
  EXPECT_GE(lost, 1U);
  EXPECT_LE(lost, 3U);
  EXPECT_EQ(books.taken, books.delivered + books.droppedFor(Reason::outboxUnreadable));
  EXPECT_EQ(test_.counters.value(Reason::outboxFileDamaged), 0U);
  EXPECT_EQ(test_.counters.value(Reason::postNotKept), 0U);
  const auto before = taken_;
  stop();
  start();
  pass(std::chrono::hours(1));
  EXPECT_EQ(taken_, before) << "what could not be deleted does not come back";
}

TEST_F(OutboxDiskTest, BeginsAnewWhereADamagedFileCannotBeRenamed) {
  answerEverything(false);
  start();
  post(0);
  stop();
  std::ofstream(folder_.path() + "/outbox.sqlite", std::ios::trunc) << std::string(4096, 'x');
  fault = {"rename", 0, 1, EIO};
  start();
  EXPECT_EQ(fault.seen, 1);
  fault = Fault();
  EXPECT_EQ(test_.counters.value(Reason::outboxFileDamaged), 1U);
  EXPECT_FALSE(std::filesystem::exists(folder_.path() + "/outbox.sqlite.damaged"));
  post(1);
  EXPECT_TRUE(kept_.contains(1));
  answerEverything(true);
  pass(std::chrono::hours(1));
  EXPECT_EQ(taken_[1], 1);
}

// A week without the server, 100,000 posts, a restart each day, on a real file: in memory is the list of them alone.
TEST_F(OutboxDiskTest, NeedsLittleMemoryForEachPostOfAWeeksOutage) {
#if defined(KYT_UNDER_SANITIZER)
  GTEST_SKIP() << "a sanitizer's memory says nothing";
#endif
  constexpr size_t kPostsADay = 14300, kDays = 7, kMostOfAPost = 80;
  fault.waitsForNoDisk = true;
  test_.random.setDraw(1799999);
  answerEverything(false);
  const auto inUse = [] {
    const auto info = ::mallinfo2();
    return info.uordblks + info.hblkhd;
  };
  size_t afterOneDay = 0, after = 0;
  for (size_t day = 0; day < kDays; ++day) {
    start();
    for (size_t i = 0; i < kPostsADay; ++i) {
      FailedPost failed;
      failed.post.user = 1000;
      failed.post.url = "https://events.example.org/v1";
      failed.post.body = Data(std::string(200, 'x') + std::to_string(i));
      failed.isUnanswered = true;
      failed.mayHaveLeft = false;
      outbox_->keep(std::move(failed), [](bool isKept) { EXPECT_TRUE(isKept); });
      if (i % 8 == 0) test_.executor.runAll();
    }
    test_.executor.runAll();
    pass(std::chrono::hours(24));
    after = inUse();
    if (day == 0) afterOneDay = after;
    stop();
  }
  start();
  ASSERT_EQ(outbox_->list().at(0).posts, kPostsADay * kDays);
  const size_t each = (after - std::min(after, afterOneDay)) / (kPostsADay * (kDays - 1));
  std::printf("%zu bytes of memory for each post\n", each);
  EXPECT_LE(each, kMostOfAPost);
  answerEverything(true);
  pass(std::chrono::hours(1));
  EXPECT_TRUE(outbox_->isEmpty());
}

// A child process keeps posts and forgets them, telling each on a pipe when it is sure; it is killed at any moment.
void keepAndForget(const std::string& folder, int pipe) {
  SQLitePostStore store(folder);
  int64_t next = 1;
  std::vector<int64_t> there;
  if (store.open([&](const StoredPostHead& head) {
        there.push_back(head.post.number);
        next = head.post.number + 1;
      }))
    ::_exit(3);
  for (unsigned turn = 0;; ++turn) {
    StoredPost post;
    post.number = next++;
    post.url = "https://events.example.org";
    post.body = Data(std::string(500 + static_cast<size_t>(post.number) * 37 % 9000, 'x'));
    const StoredPost* added = &post;
    std::vector<int64_t> removed;
    if (there.size() > 20 || (turn % 3 == 0 && !there.empty())) {
      removed.push_back(there.front());
      there.erase(there.begin());
    }
    // What is about to be forgotten may be gone; what is kept is sure afterwards.
    for (const int64_t number : removed) {
      const int64_t told = -number;
      if (::write(pipe, &told, sizeof told) != sizeof told) ::_exit(4);
    }
    if (store.change({&added, 1}, removed, false)) ::_exit(5);
    there.push_back(post.number);
    if (::write(pipe, &post.number, sizeof post.number) != sizeof post.number) ::_exit(4);
  }
}

TEST_F(OutboxDiskTest, HasAllThatWasOnDiskWhenItsProcessIsKilled) {
  const char* wanted = std::getenv("KYT_OUTBOX_KILLS");
  const int kills = wanted != nullptr ? std::atoi(wanted) : 20;
  std::set<int64_t> sure;
  size_t seen = 0;
  for (int kill = 0; kill < kills; ++kill) {
    int ends[2];
    ASSERT_EQ(::pipe(ends), 0);
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      ::close(ends[0]);
      keepAndForget(folder_.path(), ends[1]);
    }
    ::close(ends[1]);
    const unsigned most = 1 + static_cast<unsigned>(std::rand()) % 60;
    int64_t told = 0;
    for (unsigned i = 0; i < most && ::read(ends[0], &told, sizeof told) == sizeof told; ++i)
      told > 0 ? static_cast<void>(sure.insert(told)) : static_cast<void>(sure.erase(-told));
    ::usleep(static_cast<unsigned>(std::rand()) % 3000);
    ::kill(child, SIGKILL);
    while (::read(ends[0], &told, sizeof told) == sizeof told)
      told > 0 ? static_cast<void>(sure.insert(told)) : static_cast<void>(sure.erase(-told));
    ::close(ends[0]);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFSIGNALED(status)) << "it ended by itself: " << WEXITSTATUS(status);
    SQLitePostStore store(folder_.path());
    std::set<int64_t> there;
    const auto problem = store.open([&](const StoredPostHead& head) { there.insert(head.post.number); });
    ASSERT_FALSE(problem) << problem->text;
    for (const int64_t number : sure) {
      ASSERT_TRUE(there.contains(number)) << number << " of kill " << kill;
      ASSERT_TRUE(std::holds_alternative<StoredPost>(store.read(number)));
      ++seen;
    }
    sure = there;
  }
  EXPECT_GT(seen, 0U);
}

// Before each of the calls by which it takes up a file of the version before; or the call fails, since the disk is full.
TEST_F(OutboxDiskTest, HasAllThatWasOnDiskWhenItsProcessIsKilledAsItTakesUpAnEarlierVersion) {
  {
    SQLitePostStore store(folder_.path());
    for (int64_t number = 1; number <= 3; ++number) {
      StoredPost post;
      post.number = number;
      post.url = "https://events.example.org/v1";
      post.body = Data(std::string(1000, static_cast<char>('a' + number)));
      const StoredPost* added = &post;
      ASSERT_FALSE(store.change({&added, 1}, {}, false));
    }
  }
  const std::string file = folder_ / "outbox.sqlite", before = folder_ / "before";
  sqlite3* database = nullptr;
  ASSERT_EQ(sqlite3_open(file.c_str(), &database), SQLITE_OK);
  ASSERT_EQ(
      sqlite3_exec(database, "DROP TABLE pauses; PRAGMA user_version=2; PRAGMA application_id=1264145410",
                   nullptr, nullptr, nullptr),
      SQLITE_OK);
  sqlite3_close(database);
  std::filesystem::rename(file, before);
  makeCallsFail();
  int kills = 0, failures = 0;
  for (const char* call : {"open", "pwrite64", "ftruncate", "unlink", "fdatasync", "fsync"}) {
    bool isKilled = true;
    for (int after = 0; isKilled || after % 2 != 0; ++after) {
      const bool isFull = after % 2 != 0;
      for (const char* end : {"", "-wal", "-journal"}) std::filesystem::remove(file + end);
      std::filesystem::copy_file(before, file);
      const pid_t child = ::fork();
      ASSERT_GE(child, 0);
      if (child == 0) {
        fault = {.call = call, .after = after / 2, .error = ENOSPC, .kills = !isFull};
        SQLitePostStore store(folder_.path());
        const auto problem = store.open([](const StoredPostHead&) {});
        store.close();
        ::_exit(!problem ? 0 : problem->kind == PostStoreProblem::Kind::unavailable ? 1 : 2);
      }
      int status = 0;
      ASSERT_EQ(::waitpid(child, &status, 0), child);
      if (!isFull) isKilled = WIFSIGNALED(status);
      ASSERT_LE(WEXITSTATUS(status), isFull ? 1 : 0) << call << " " << after;
      kills += !isFull && isKilled ? 1 : 0;
      failures += WEXITSTATUS(status);
      SQLitePostStore store(folder_.path());
      std::vector<int64_t> there;
      const auto problem = store.open([&](const StoredPostHead& head) {
        if (!head.isUnreadable) there.push_back(head.post.number);
      });
      ASSERT_FALSE(problem) << problem->text;
      EXPECT_EQ(there, std::vector<int64_t>({1, 2, 3})) << call << " " << after;
      const PostStore::ServerPause pause{1, 2, 3};
      EXPECT_FALSE(store.setPauses({&pause, 1}));
    }
  }
  std::printf("killed at %d calls, unavailable at %d\n", kills, failures);
  EXPECT_GT(kills, 5);
  EXPECT_GT(failures, 2);
}

}  // namespace
}  // namespace kyt
