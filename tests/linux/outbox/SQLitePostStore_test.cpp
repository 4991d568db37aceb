#include "platform/linux/outbox/SQLitePostStore.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/base/Limits.h"
#include "platform/linux/outbox/PostRecord.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

using Kind = PostStoreProblem::Kind;

StoredPost somePost(int64_t number, size_t bodyBytes = 2000) {
  StoredPost post;
  post.number = number;
  post.keptAt = 1767225600 + number;
  post.user = 1000;
  post.isByConsent = number % 2 == 0;
  post.allowsCellularAccess = number % 3 == 0;
  post.url = "https://events.example.org/v1/events?n=" + std::to_string(number);
  post.identity = "0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0";
  post.sourceApplication = "com.vantu.system.diagnostics";
  post.headers = {{"X-KYT-Client-Name", "videocall"},
                  {"User-Agent", "KYTReporting/8.0 (Model1,1; 12.0)"},
                  {"X-KYT-Client-Version", "80"},
                  {"X-KYT-Sender", "QPW"},
                  {"Accept", "application/json"},
                  {"Content-Type", "application/json"},
                  {"Content-Length", std::to_string(bodyBytes)},
                  {"Content-Encoding", "gzip"}};
  post.events = {{{{1000, 7, "videocall", "call"}, "httppost", false, false}, 50},
                 {{{1000, -7, "\n\"", ""}, "httppost2", true, true}, 1}};
  std::string body(bodyBytes, '\0');
  for (size_t i = 0; i < bodyBytes; ++i)
    body[i] = static_cast<char>((i * 2654435761U + static_cast<size_t>(number)) >> 7);
  post.body = Data(body);
  return post;
}

void expectSame(const StoredPost& a, const StoredPost& b) {
  EXPECT_EQ(a.number, b.number);
  EXPECT_EQ(a.keptAt, b.keptAt);
  EXPECT_EQ(a.user, b.user);
  EXPECT_EQ(a.isByConsent, b.isByConsent);
  EXPECT_EQ(a.allowsCellularAccess, b.allowsCellularAccess);
  EXPECT_EQ(a.url, b.url);
  EXPECT_EQ(a.identity, b.identity);
  EXPECT_EQ(a.sourceApplication, b.sourceApplication);
  EXPECT_EQ(a.headers, b.headers);
  ASSERT_EQ(a.events.size(), b.events.size());
  for (size_t i = 0; i < a.events.size(); ++i) {
    EXPECT_EQ(a.events[i].row, b.events[i].row);
    EXPECT_EQ(a.events[i].events, b.events[i].events);
  }
  EXPECT_EQ(a.body, b.body);
}

// Bytes that this process has handed to write and its kind.
uint64_t written() {
  std::ifstream figures("/proc/self/io");
  std::string name;
  uint64_t bytes = 0;
  while (figures >> name >> bytes)
    if (name == "wchar:") return bytes;
  return 0;
}

class SQLitePostStoreTest : public testing::Test {
 protected:
  static std::optional<PostStoreProblem> add(PostStore& store, const StoredPost& post) {
    const StoredPost* added = &post;
    return store.change({&added, 1}, {}, false);
  }
  static std::optional<PostStoreProblem> remove(PostStore& store, std::vector<int64_t> numbers,
                                                bool forGood = false) {
    return store.change({}, numbers, forGood);
  }
  static std::vector<int64_t> numbersIn(PostStore& store,
                                        std::optional<PostStoreProblem>* problem = nullptr) {
    std::vector<int64_t> numbers;
    const auto wrong =
        store.open([&numbers](const StoredPostHead& head) { numbers.push_back(head.post.number); });
    if (problem != nullptr)
      *problem = wrong;
    else
      EXPECT_FALSE(wrong) << wrong->text;
    return numbers;
  }
  void execute(const std::string& sql) const {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open(file().c_str(), &database), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
        << sqlite3_errmsg(database);
    sqlite3_close(database);
  }
  static std::string insertionOf(const StoredPost& post, uint64_t checksum) {
    return "INSERT INTO posts VALUES (" + std::to_string(post.number) + ", " +
           std::to_string(static_cast<int64_t>(checksum)) + ", x'" + hexadecimal(postRecord(post)) + "', x'" +
           hexadecimal(post.body.view()) + "');";
  }
  static std::string hexadecimal(std::string_view bytes) {
    std::string text;
    for (const char c : bytes) {
      char digits[3];
      std::snprintf(digits, sizeof digits, "%02x", static_cast<unsigned char>(c));
      text += digits;
    }
    return text;
  }
  [[nodiscard]] std::string file() const { return folder_ / "outbox.sqlite"; }
  [[nodiscard]] std::string bytesOnDisk() const {
    std::string all;
    for (const auto& entry : std::filesystem::directory_iterator(folder_.path())) {
      std::ostringstream text;
      text << std::ifstream(entry.path(), std::ios::binary).rdbuf();
      all += text.str();
    }
    return all;
  }

  TemporaryFolder folder_;
};

TEST_F(SQLitePostStoreTest, GivesBackByteForByteWhatItWasGiven) {
  {
    SQLitePostStore store(folder_.path());
    EXPECT_TRUE(numbersIn(store).empty());
    for (int64_t number = 1; number <= 5; ++number)
      ASSERT_FALSE(add(store, somePost(number, 700 * static_cast<size_t>(number - 1))));
  }
  SQLitePostStore store(folder_.path());
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({1, 2, 3, 4, 5}));
  for (int64_t number = 1; number <= 5; ++number) {
    auto read = store.read(number);
    ASSERT_TRUE(std::holds_alternative<StoredPost>(read)) << std::get<PostStoreProblem>(read).text;
    expectSame(std::get<StoredPost>(read), somePost(number, 700 * static_cast<size_t>(number - 1)));
  }
}

TEST_F(SQLitePostStoreTest, TellsOfEachPostHowLargeItIsAndWhoseItIs) {
  SQLitePostStore store(folder_.path());
  const StoredPost post = somePost(1);
  ASSERT_FALSE(add(store, post));
  EXPECT_FALSE(store.open([&](const StoredPostHead& head) {
    EXPECT_EQ(head.bytes, PostStore::bytesOf(post));
    EXPECT_EQ(head.post.events.size(), 2U);
    EXPECT_TRUE(head.post.headers.empty());
  }));
}

TEST_F(SQLitePostStoreTest, RemovesAndAddsAsAWhole) {
  SQLitePostStore store(folder_.path());
  for (int64_t number = 1; number <= 3; ++number) ASSERT_FALSE(add(store, somePost(number)));
  const StoredPost fourth = somePost(4), again = somePost(4);
  const std::array<const StoredPost*, 2> twice{&fourth, &again};
  const std::vector<int64_t> removed{1, 2};
  EXPECT_TRUE(store.change(twice, removed, false)) << "the same number twice";
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({1, 2, 3}));
  const std::array<const StoredPost*, 1> once{&fourth};
  EXPECT_FALSE(store.change(once, removed, false));
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({3, 4}));
  EXPECT_FALSE(remove(store, {1, 77})) << "what is not there is removed already";
}

TEST_F(SQLitePostStoreTest, MakesNoFileAndLoadsNothingBeforeThereIsAPostToKeep) {
  SQLitePostStore store(folder_.path(), "no-such-library.so");
  EXPECT_TRUE(numbersIn(store).empty());
  EXPECT_TRUE(std::filesystem::is_empty(folder_.path()));
}

TEST_F(SQLitePostStoreTest, IsUnavailableWithoutTheLibrary) {
  SQLitePostStore store(folder_.path(), "no-such-library.so");
  const auto problem = add(store, somePost(1));
  ASSERT_TRUE(problem);
  EXPECT_EQ(problem->kind, Kind::unavailable);
  EXPECT_NE(problem->text.find("no-such-library.so"), std::string::npos);
}

TEST_F(SQLitePostStoreTest, LetsNobodyElseReadItsFiles) {
  SQLitePostStore store(folder_.path());
  const mode_t before = ::umask(0);
  ASSERT_FALSE(add(store, somePost(1)));
  ::umask(before);
  size_t files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(folder_.path())) {
    struct stat status {};
    ASSERT_EQ(::stat(entry.path().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0600U) << entry.path();
    ++files;
  }
  EXPECT_EQ(files, 2U) << "the file and its log, and no shared memory";
}

TEST_F(SQLitePostStoreTest, FollowsNoLink) {
  folder_.write("elsewhere", "");
  std::filesystem::create_symlink("elsewhere", file());
  SQLitePostStore store(folder_.path());
  EXPECT_TRUE(add(store, somePost(1)));
}

TEST_F(SQLitePostStoreTest, SetsAsideAFileThatIsNone) {
  folder_.write("outbox.sqlite", std::string(8192, 'x'));
  SQLitePostStore store(folder_.path());
  std::optional<PostStoreProblem> problem;
  EXPECT_TRUE(numbersIn(store, &problem).empty());
  ASSERT_TRUE(problem);
  EXPECT_EQ(problem->kind, Kind::damaged);
  EXPECT_NE(store.setAside().find("outbox.sqlite.damaged"), std::string::npos);
  EXPECT_FALSE(add(store, somePost(1)));
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({1}));
  EXPECT_EQ(std::filesystem::file_size(folder_ / "outbox.sqlite.damaged"), 8192U);
}

class SQLitePostStoreThatKeepsEach : public SQLitePostStoreTest {
 protected:
  void copy(const char* from, const char* to) const {
    std::filesystem::copy_file(folder_ / from, folder_ / to,
                               std::filesystem::copy_options::overwrite_existing);
  }
  // A file of which that post is in the log alone, and whose beginning is damaged.
  void makeDamagedFile(int64_t number) const {
    {
      SQLitePostStore store(folder_.path());
      ASSERT_FALSE(add(store, somePost(number)));
      copy("outbox.sqlite", "copy");
      copy("outbox.sqlite-wal", "copy-wal");
    }
    copy("copy", "outbox.sqlite");
    copy("copy-wal", "outbox.sqlite-wal");
    std::fstream(file(), std::ios::in | std::ios::out | std::ios::binary) << "X";
  }
  void setAside(const std::string& name) const {
    SQLitePostStore store(folder_.path(), "libsqlite3.so.0", SQLitePostStore::Aside::each);
    std::optional<PostStoreProblem> problem;
    EXPECT_TRUE(numbersIn(store, &problem).empty());
    ASSERT_TRUE(problem);
    ASSERT_EQ(problem->kind, Kind::damaged);
    EXPECT_NE(store.setAside().find(name), std::string::npos);
    EXPECT_TRUE(numbersIn(store).empty()) << "nothing of it is in the new one";
  }
  // Once what is damaged of it is mended.
  void expectHasPost(const std::string& name, int64_t number) const {
    const TemporaryFolder other;
    std::filesystem::copy_file(folder_ / name, other / "outbox.sqlite");
    std::filesystem::copy_file(folder_ / (name + "-wal"), other / "outbox.sqlite-wal");
    std::fstream(other / "outbox.sqlite", std::ios::in | std::ios::out | std::ios::binary) << "S";
    SQLitePostStore store(other.path());
    EXPECT_EQ(numbersIn(store), std::vector<int64_t>({number}));
    auto read = store.read(number);
    ASSERT_TRUE(std::holds_alternative<StoredPost>(read));
    expectSame(std::get<StoredPost>(read), somePost(number));
  }
};

TEST_F(SQLitePostStoreThatKeepsEach, SetsAsideFileAndLogAndOverwritesNone) {
  makeDamagedFile(1);
  setAside("outbox.sqlite.damaged");
  makeDamagedFile(2);
  setAside("outbox.sqlite.damaged.2");
  makeDamagedFile(3);
  setAside("outbox.sqlite.damaged.3");
  EXPECT_EQ(SQLitePostStore(folder_.path()).filesAside(), 3U);
  expectHasPost("outbox.sqlite.damaged", 1);
  expectHasPost("outbox.sqlite.damaged.2", 2);
  expectHasPost("outbox.sqlite.damaged.3", 3);
}

// A process that is killed as it removes its file, or a person that removes the file alone, leaves the log.
TEST_F(SQLitePostStoreThatKeepsEach, TakesNothingFromTheLogOfAFileThatIsGone) {
  makeDamagedFile(1);
  std::filesystem::remove(file());
  ASSERT_TRUE(std::filesystem::exists(folder_ / "outbox.sqlite-wal"));
  std::filesystem::remove(folder_ / "copy");
  std::filesystem::remove(folder_ / "copy-wal");
  {
    SQLitePostStore store(folder_.path());
    EXPECT_TRUE(numbersIn(store).empty());
    EXPECT_FALSE(add(store, somePost(9)));
  }
  {
    SQLitePostStore store(folder_.path());
    EXPECT_EQ(numbersIn(store), std::vector<int64_t>({9}));
    EXPECT_EQ(bytesOnDisk().find(somePost(1).url), std::string::npos);
  }
  // Of a spool no byte is lost.
  makeDamagedFile(2);
  const auto size = std::filesystem::file_size(folder_ / "outbox.sqlite-wal");
  std::filesystem::remove(file());
  SQLitePostStore spool(folder_.path(), "libsqlite3.so.0", SQLitePostStore::Aside::each);
  EXPECT_FALSE(add(spool, somePost(9)));
  EXPECT_EQ(numbersIn(spool), std::vector<int64_t>({9}));
  EXPECT_EQ(std::filesystem::file_size(folder_ / "outbox.sqlite.damaged-wal"), size);
}

TEST_F(SQLitePostStoreTest, LeavesAFileAloneThatAnotherProcessHas) {
  int ends[2];
  ASSERT_EQ(::pipe(ends), 0);
  const pid_t other = ::fork();
  ASSERT_GE(other, 0);
  if (other == 0) {
    SQLitePostStore store(folder_.path());
    const char isThere = add(store, somePost(1)) ? 'n' : 'y';
    static_cast<void>(::write(ends[1], &isThere, 1));
    for (;;) ::pause();
  }
  char isThere = 0;
  ASSERT_EQ(::read(ends[0], &isThere, 1), 1);
  ASSERT_EQ(isThere, 'y');
  SQLitePostStore store(folder_.path());
  std::optional<PostStoreProblem> problem;
  EXPECT_TRUE(numbersIn(store, &problem).empty());
  ASSERT_TRUE(problem);
  EXPECT_EQ(problem->kind, Kind::unavailable) << problem->text;
  problem = add(store, somePost(2));
  ASSERT_TRUE(problem);
  EXPECT_EQ(problem->kind, Kind::unavailable) << problem->text;
  EXPECT_EQ(store.note(PostStore::Note::consentEpoch), 0);
  ::kill(other, SIGKILL);
  ASSERT_EQ(::waitpid(other, nullptr, 0), other);
  for (const int end : ends) ::close(end);
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({1})) << "once it has ended";
  EXPECT_FALSE(add(store, somePost(2)));
}

TEST_F(SQLitePostStoreTest, FindsEveryByteThatIsNotAsItWas) {
  {
    SQLitePostStore store(folder_.path());
    for (int64_t number = 1; number <= 3; ++number) ASSERT_FALSE(add(store, somePost(number, 300)));
  }
  std::ostringstream whole;
  whole << std::ifstream(file(), std::ios::binary).rdbuf();
  const std::string good = whole.str();
  size_t found = 0, harmless = 0;
  for (size_t at = 100; at < good.size(); at += 37) {
    std::string bad = good;
    bad[at] = static_cast<char>(bad[at] ^ 0x20);
    folder_.write("outbox.sqlite", bad, 0600);
    SQLitePostStore store(folder_.path());
    std::optional<PostStoreProblem> problem;
    bool isWrong = false;
    for (const int64_t number : numbersIn(store, &problem)) {
      auto read = store.read(number);
      if (const auto* post = std::get_if<StoredPost>(&read); post != nullptr && number >= 1 && number <= 3)
        expectSame(*post, somePost(number, 300));
      else
        isWrong = true;
    }
    ++(problem || isWrong ? found : harmless);
  }
  EXPECT_GT(found, 20U);
}

TEST_F(SQLitePostStoreTest, LeavesTheFileOfALaterVersionAlone) {
  {
    SQLitePostStore store(folder_.path());
    ASSERT_FALSE(add(store, somePost(1)));
  }
  execute("PRAGMA user_version=4; PRAGMA application_id=1264145412");
  SQLitePostStore store(folder_.path());
  std::optional<PostStoreProblem> problem;
  EXPECT_TRUE(numbersIn(store, &problem).empty());
  ASSERT_TRUE(problem);
  EXPECT_EQ(problem->kind, Kind::unavailable);
  EXPECT_NE(problem->text.find("later version"), std::string::npos);
}

TEST_F(SQLitePostStoreTest, TakesUpAFileOfTheFirstVersion) {
  const StoredPost first = somePost(1), second = somePost(2);
  execute(
      "PRAGMA page_size=512; PRAGMA journal_mode=WAL; CREATE TABLE posts (number INTEGER PRIMARY KEY, checksum"
      " INTEGER NOT NULL, record BLOB NOT NULL, body BLOB NOT NULL); PRAGMA user_version=1;" +
      insertionOf(first, postChecksum(postRecord(first), first.body.view())) + insertionOf(second, 77));
  SQLitePostStore store(folder_.path());
  std::vector<int64_t> good, bad;
  EXPECT_FALSE(store.open(
      [&](const StoredPostHead& head) { (head.isUnreadable ? bad : good).push_back(head.post.number); }));
  EXPECT_EQ(good, std::vector<int64_t>({1}));
  EXPECT_EQ(bad, std::vector<int64_t>({2})) << "nobody kept that";
  auto read = store.read(1);
  expectSame(std::get<StoredPost>(read), first);
  EXPECT_FALSE(add(store, somePost(3)));
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({1, 2, 3}));
}

class SQLitePostStoreOfTheSecondVersion : public SQLitePostStoreTest {
 protected:
  SQLitePostStoreOfTheSecondVersion() {
    {
      SQLitePostStore store(folder_.path());
      EXPECT_FALSE(add(store, somePost(1)));
      EXPECT_FALSE(add(store, somePost(2)));
      EXPECT_FALSE(store.setNote(PostStore::Note::consentEpoch, 77));
    }
    execute("DROP TABLE pauses; PRAGMA user_version=2; PRAGMA application_id=1264145410");
  }
  static void expectIsAsItWas(SQLitePostStore& store) {
    EXPECT_EQ(numbersIn(store), std::vector<int64_t>({1, 2}));
    auto read = store.read(2);
    ASSERT_TRUE(std::holds_alternative<StoredPost>(read));
    expectSame(std::get<StoredPost>(read), somePost(2));
    EXPECT_EQ(store.note(PostStore::Note::consentEpoch), 77);
  }
};

TEST_F(SQLitePostStoreOfTheSecondVersion, IsTakenUp) {
  for (int i = 0; i < 2; ++i) {
    SQLitePostStore store(folder_.path());
    expectIsAsItWas(store);
    EXPECT_EQ(store.pauses().size(), static_cast<size_t>(i));
    const PostStore::ServerPause pause{5, 6, 7};
    EXPECT_FALSE(store.setPauses({&pause, 1}));
  }
}

TEST_F(SQLitePostStoreTest, KnowsHowLongServersWantToBeLeftAlone) {
  const PostStore::ServerPause first{~uint64_t{0}, 1767225600, 1767229200}, second{2, 1767225600, 1767225700};
  const PostStore::ServerPause longer{2, 1767225601, 1767229999}, none{~uint64_t{0}, 0, 0};
  {
    SQLitePostStore store(folder_.path());
    EXPECT_FALSE(store.setPauses({&none, 1}));
    EXPECT_TRUE(store.pauses().empty());
    EXPECT_TRUE(std::filesystem::is_empty(folder_.path())) << "nothing is to be forgotten";
    ASSERT_FALSE(add(store, somePost(1)));
    const PostStore::ServerPause both[] = {first, second};
    EXPECT_FALSE(store.setPauses(both));
    EXPECT_FALSE(store.setPauses({&longer, 1}));
  }
  {
    SQLitePostStore store(folder_.path());
    auto found = store.pauses();
    ASSERT_EQ(found.size(), 2U);
    std::sort(found.begin(), found.end(), [](const auto& a, const auto& b) { return a.server < b.server; });
    EXPECT_EQ(found[0].server, 2U);
    EXPECT_EQ(found[0].since, longer.since);
    EXPECT_EQ(found[0].until, longer.until);
    EXPECT_EQ(found[1].server, first.server);
    EXPECT_EQ(found[1].until, first.until);
    EXPECT_FALSE(store.setPauses({&none, 1}));
    EXPECT_EQ(store.pauses().size(), 1U);
  }
  std::string rows;
  for (size_t i = 0; i < 2000; ++i) rows += (i == 0 ? "(" : ", (") + std::to_string(i + 10) + ", 'x', x'00')";
  execute("INSERT INTO pauses VALUES " + rows);
  EXPECT_EQ(SQLitePostStore(folder_.path()).pauses().size(), Limits::maxOutboxPauses);
  execute("DROP TABLE pauses");
  SQLitePostStore without(folder_.path());
  EXPECT_TRUE(without.pauses().empty());
  EXPECT_EQ(numbersIn(without), std::vector<int64_t>({1})) << "that is no matter of the posts";
}

TEST_F(SQLitePostStoreTest, TellsADamagedFileFromOneThatIsUnavailable) {
  {
    SQLitePostStore store(folder_.path());
    ASSERT_FALSE(add(store, somePost(1)));
  }
  const std::string good = bytesOnDisk();
  const auto problemOf = [&](const std::string& bytes, const std::string& sql) {
    folder_.write("outbox.sqlite", bytes, 0600);
    if (!sql.empty()) execute(sql);
    SQLitePostStore store(folder_.path());
    std::optional<PostStoreProblem> problem;
    static_cast<void>(numbersIn(store, &problem));
    return problem;
  };
  EXPECT_FALSE(problemOf(good, ""));
  const auto with = [&good](size_t at, char value) {
    std::string bytes = good;
    bytes[at] = value;
    return bytes;
  };
  const std::pair<std::string, std::string> cases[] = {
      {"", ""},
      {good.substr(0, 60), ""},
      {with(0, 's'), ""},
      {with(16, 4), ""},   // the size of its pages
      {with(18, 9), ""},   // who may write it
      {with(19, 9), ""},   // who may read it
      {with(63, 66), ""},  // its version
      {with(71, 9), ""},   // … where it stands again
      {good, "PRAGMA user_version=0"},
      // … whose tables are there already
      {good, "PRAGMA user_version=1; PRAGMA application_id=0"},
      {good, "DROP TABLE posts"},
      {good, "DROP TABLE gone"}};
  for (const auto& [bytes, sql] : cases) {
    const auto problem = problemOf(bytes, sql);
    ASSERT_TRUE(problem) << &bytes - &cases[0].first << " " << sql;
    EXPECT_EQ(problem->kind, Kind::damaged) << problem->text;
  }
}

TEST_F(SQLitePostStoreTest, BelievesNothingOfARowThatIsNotWhatWasKept) {
  {
    SQLitePostStore store(folder_.path());
    for (int64_t number = 1; number <= 4; ++number) ASSERT_FALSE(add(store, somePost(number)));
  }
  StoredPost other = somePost(2);
  other.isByConsent = false;
  execute("UPDATE posts SET record=x'" + hexadecimal(postRecord(other)) + "' WHERE number=2;" +
          "UPDATE posts SET number=9223372036854775807 WHERE number=3");
  SQLitePostStore store(folder_.path());
  std::vector<int64_t> good, bad;
  EXPECT_FALSE(store.open(
      [&](const StoredPostHead& head) { (head.isUnreadable ? bad : good).push_back(head.post.number); }));
  EXPECT_EQ(good, std::vector<int64_t>({1, 4}));
  EXPECT_EQ(bad, std::vector<int64_t>({2, INT64_MAX}));
}

// As after a process that was killed: the log holds what is not in the file yet.
TEST_F(SQLitePostStoreTest, SeesThatItsLogWasWholeOnce) {
  const TemporaryFolder live;
  SQLitePostStore writer(live.path());
  for (int64_t number = 1; number <= 5; ++number) ASSERT_FALSE(add(writer, somePost(number)));
  const auto bytesOf = [&live](const char* name) {
    std::ostringstream text;
    text << std::ifstream(live / name, std::ios::binary).rdbuf();
    return text.str();
  };
  const std::string database = bytesOf("outbox.sqlite"), log = bytesOf("outbox.sqlite-wal");
  constexpr size_t kFrame = 512 + 24;
  ASSERT_GE(log.size(), 20 * kFrame);
  // How many are found, and whether it is said that some are lost.
  const auto found = [&](const std::string& bytes) {
    folder_.write("outbox.sqlite", database, 0600);
    folder_.write("outbox.sqlite-wal", bytes, 0600);
    SQLitePostStore store(folder_.path());
    std::pair<size_t, bool> result;
    const auto problem = store.open([&](const StoredPostHead& head) {
      result.first += head.isUnreadable ? 0 : 1;
      result.second = result.second || head.isUnreadable;
    });
    EXPECT_FALSE(problem) << problem->text;
    return result;
  };
  EXPECT_EQ(found(log), (std::pair<size_t, bool>(5, false)));
  std::string bad = log;
  bad[32 + 9 * kFrame + 100] = static_cast<char>(bad[32 + 9 * kFrame + 100] ^ 1);
  const auto damaged = found(bad);
  EXPECT_LT(damaged.first, 5U);
  EXPECT_TRUE(damaged.second);
  const auto cut = found(log.substr(0, log.size() - kFrame - 10));
  EXPECT_EQ(cut.first, 4U);
  EXPECT_FALSE(cut.second) << "the last change was never finished";
}

TEST_F(SQLitePostStoreTest, LeavesNothingOnTheDiskOfWhatWasRemovedForGood) {
  SQLitePostStore store(folder_.path());
  StoredPost secret = somePost(1);
  secret.body = Data("what nobody may read any more" + std::string(5000, 's'));
  ASSERT_FALSE(add(store, secret));
  ASSERT_FALSE(add(store, somePost(2)));
  EXPECT_NE(bytesOnDisk().find("nobody may read"), std::string::npos);
  ASSERT_FALSE(remove(store, {1}, true));
  EXPECT_EQ(bytesOnDisk().find("nobody may read"), std::string::npos);
  EXPECT_EQ(bytesOnDisk().find("ssssssss"), std::string::npos);
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({2}));
}

TEST_F(SQLitePostStoreTest, LeavesNothingOnTheDiskOfWhatWasRemovedBefore) {
  SQLitePostStore store(folder_.path());
  std::vector<int64_t> sent;
  for (int64_t number = 1; number <= 60; ++number) {
    StoredPost post = somePost(number);
    if (number % 6 != 0) {
      post.body = Data("what nobody may read any more" + std::string(static_cast<size_t>(number) * 400, 's'));
      sent.push_back(number);
    }
    ASSERT_FALSE(add(store, post));
  }
  ASSERT_FALSE(remove(store, sent));
  store.close();
  ASSERT_EQ(numbersIn(store).size(), 10U);
  EXPECT_NE(bytesOnDisk().find("ssssssss"), std::string::npos) << "in pages that hold nothing";
  const auto size = std::filesystem::file_size(file());
  const uint64_t before = written();
  ASSERT_FALSE(remove(store, {}, true));
  const uint64_t cost = written() - before;
  std::printf("%.2f bytes written for each byte of the file\n",
              static_cast<double>(cost) / static_cast<double>(size));
  EXPECT_EQ(bytesOnDisk().find("ssssssss"), std::string::npos);
  EXPECT_EQ(bytesOnDisk().find("nobody may read"), std::string::npos);
  EXPECT_EQ(numbersIn(store).size(), 10U);
  EXPECT_LE(std::filesystem::file_size(file()), size + 65536);
  const uint64_t again = written();
  ASSERT_FALSE(remove(store, {}, true));
  EXPECT_LE(written() - again, 4096U) << "once is enough";
  std::vector<int64_t> rest = numbersIn(store);
  ASSERT_FALSE(remove(store, rest, true));
  EXPECT_TRUE(std::filesystem::is_empty(folder_.path())) << "no post is left";
}

TEST_F(SQLitePostStoreTest, KnowsTheLatestTimeAtWhichAPostWasKept) {
  {
    SQLitePostStore store(folder_.path());
    for (int64_t number = 1; number <= 6; ++number) {
      StoredPost post = somePost(number);
      post.keptAt = number == 2 ? 4102444800 : number % 2 == 0 ? 0 : 1000 * number;
      ASSERT_FALSE(add(store, post));
    }
    EXPECT_FALSE(store.setLatest(2, 7000));
    EXPECT_FALSE(store.setLatest(4, 9000));
    EXPECT_FALSE(store.setNote(PostStore::Note::consentEpoch, 77));
    EXPECT_EQ(store.note(PostStore::Note::tooOldSince), 0);
  }
  SQLitePostStore store(folder_.path());
  std::vector<int64_t> times;
  EXPECT_FALSE(store.open([&times](const StoredPostHead& head) { times.push_back(head.post.keptAt); }));
  EXPECT_EQ(times, std::vector<int64_t>({1000, 7000, 3000, 9000, 5000, 0}));
  EXPECT_EQ(store.note(PostStore::Note::consentEpoch), 77);
}

TEST_F(SQLitePostStoreTest, GivesItsRoomBackWhenItIsEmpty) {
  SQLitePostStore store(folder_.path());
  std::vector<int64_t> numbers;
  for (int64_t number = 1; number <= 30; ++number) {
    ASSERT_FALSE(add(store, somePost(number, 100000)));
    numbers.push_back(number);
  }
  ASSERT_FALSE(remove(store, numbers));
  store.becameEmpty();
  EXPECT_TRUE(std::filesystem::is_empty(folder_.path()));
  EXPECT_FALSE(add(store, somePost(31)));
  EXPECT_EQ(numbersIn(store), std::vector<int64_t>({31}));
}

// Each change writes whole pages to the log, and those again to the file, however small the post is.
TEST_F(SQLitePostStoreTest, WritesFewPagesForASmallPostThatIsKeptByItself) {
  SQLitePostStore store(folder_.path());
  constexpr int64_t kPosts = 200;
  constexpr size_t kBody = 300, kMostOfEach = 8192;
  uint64_t kept = 0;
  ASSERT_FALSE(add(store, somePost(1, kBody)));
  const uint64_t before = written();
  for (int64_t number = 2; number <= kPosts; ++number) {
    const StoredPost post = somePost(number, kBody);
    kept += PostStore::bytesOf(post);
    ASSERT_FALSE(add(store, post));
  }
  const uint64_t afterKeeping = written();
  for (int64_t number = 1; number <= kPosts; ++number) ASSERT_FALSE(remove(store, {number}));
  store.close();
  const uint64_t all = written() - before;
  std::printf(
      "body of %zu bytes, alone: %.2f bytes written for each that is kept (%llu a post), %llu a post to keep it\n",
      kBody, static_cast<double>(all) / static_cast<double>(kept),
      static_cast<unsigned long long>(all / kPosts),
      static_cast<unsigned long long>((afterKeeping - before) / kPosts));
  EXPECT_LE(all / kPosts, kMostOfEach);
}

// All of a post's life: kept, sent, forgotten, in changes as the outbox makes them.
TEST_F(SQLitePostStoreTest, WritesAtMostThreeBytesForEachThatItKeeps) {
  for (const size_t bodyBytes : {2100U, 20000U}) {
    SQLitePostStore store(folder_.path());
    uint64_t kept = 0;
    const uint64_t before = written();
    constexpr int64_t kPosts = 400, kTogether = 4;
    for (int64_t number = 1; number <= kPosts; number += kTogether) {
      std::vector<StoredPost> posts;
      std::vector<const StoredPost*> added;
      for (int64_t i = 0; i < kTogether; ++i) posts.push_back(somePost(number + i, bodyBytes));
      for (const StoredPost& post : posts) {
        added.push_back(&post);
        kept += PostStore::bytesOf(post);
      }
      ASSERT_FALSE(store.change(added, {}, false));
    }
    for (int64_t number = 1; number <= kPosts; number += kTogether) {
      std::vector<int64_t> numbers;
      for (int64_t i = 0; i < kTogether; ++i) numbers.push_back(number + i);
      ASSERT_FALSE(remove(store, numbers));
    }
    store.close();
    const double ratio = static_cast<double>(written() - before) / static_cast<double>(kept);
    RecordProperty("written-for-each-kept-" + std::to_string(bodyBytes), std::to_string(ratio));
    std::printf("body of %zu bytes: %.2f bytes written for each that is kept\n", bodyBytes, ratio);
    EXPECT_LE(ratio, 3.0) << bodyBytes;
    std::filesystem::remove(file());
  }
}

}  // namespace
}  // namespace kyt
