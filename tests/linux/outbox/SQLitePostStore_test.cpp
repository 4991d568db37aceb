#include "platform/linux/outbox/SQLitePostStore.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <sstream>

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
  sqlite3* database = nullptr;
  ASSERT_EQ(sqlite3_open(file().c_str(), &database), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(database, "PRAGMA user_version=2", nullptr, nullptr, nullptr), SQLITE_OK);
  sqlite3_close(database);
  SQLitePostStore store(folder_.path());
  std::optional<PostStoreProblem> problem;
  EXPECT_TRUE(numbersIn(store, &problem).empty());
  ASSERT_TRUE(problem);
  EXPECT_EQ(problem->kind, Kind::unavailable);
  EXPECT_NE(problem->text.find("later version"), std::string::npos);
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

// Bytes that this process has handed to write and its kind.
uint64_t written() {
  std::ifstream figures("/proc/self/io");
  std::string name;
  uint64_t bytes = 0;
  while (figures >> name >> bytes)
    if (name == "wchar:") return bytes;
  return 0;
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
