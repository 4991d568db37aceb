#include "tools/Publication.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <filesystem>
#include <string>
#include <thread>
#include <utility>

#include "tests/support/TemporaryFolder.h"

namespace kyt::tools {
namespace {

constexpr int64_t kNow = 1700000000;

class PublicationTest : public ::testing::Test {
 protected:
  Publication put(const std::string& document, int64_t now) {
    auto made = publish(document, folder_.path(), "dulvek", now);
    if (const auto* error = std::get_if<Error>(&made)) {
      ADD_FAILURE() << error->localizedDescription;
      return {};
    }
    return std::get<Publication>(made);
  }
  [[nodiscard]] int64_t modified() const {
    struct stat info {};
    return ::stat((folder_ / "dulvek").c_str(), &info) == 0 ? info.st_mtim.tv_sec : -1;
  }
  TemporaryFolder folder_;
};

TEST_F(PublicationTest, GivesEachANewerTimeThanTheOneBefore) {
  EXPECT_EQ(put("one", kNow).modified, kNow);
  EXPECT_EQ(modified(), kNow);
  EXPECT_EQ(put("two", kNow).modified, kNow + 1) << "within the same second";
  const Publication back = put("three", kNow - 3600);
  EXPECT_EQ(back.modified, kNow + 2) << "by a clock that was put back";
  EXPECT_EQ(modified(), kNow + 2);
  EXPECT_TRUE(back.isAhead);
  EXPECT_FALSE(put("four", kNow + 60).isAhead);
  EXPECT_EQ(modified(), kNow + 60);
}

TEST_F(PublicationTest, KeepsThoseBefore) {
  EXPECT_EQ(put("one", kNow).kept, "");
  EXPECT_EQ(put("two", kNow + 10).kept, folder_ / ".published/dulvek.20231114T221320Z");
  EXPECT_EQ(put("three", kNow + 20).kept, folder_ / ".published/dulvek.20231114T221330Z");
  EXPECT_EQ(folder_.read(".published/dulvek.20231114T221320Z"), "one");
  EXPECT_EQ(folder_.read(".published/dulvek.20231114T221330Z"), "two");
  EXPECT_EQ(folder_.read("dulvek"), "three");
}

TEST_F(PublicationTest, KeepsEachOfSeveralThatHadTheSameTime) {
  static_cast<void>(put("one", kNow));
  static_cast<void>(put("two", kNow + 10));
  // Somebody puts others in its place that have the time of the first, as "cp -p" does.
  for (const auto& [document, kept] :
       {std::pair("three", "dulvek.20231114T221320Z.2"), std::pair("four", "dulvek.20231114T221320Z.3")}) {
    std::filesystem::remove(folder_ / "dulvek");
    const std::string file = folder_.write("dulvek", document);
    const timespec times[2] = {{kNow, 0}, {kNow, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), times, 0), 0);
    EXPECT_EQ(put("next", kNow + 30).kept, folder_ / ".published/" + kept);
    EXPECT_EQ(folder_.read(std::string(".published/") + kept), document);
  }
  EXPECT_EQ(folder_.read(".published/dulvek.20231114T221320Z"), "one");
}

TEST_F(PublicationTest, GoesOnWhereAnAttemptHadKeptTheDocumentAndGotNoFurther) {
  static_cast<void>(put("one", kNow));
  const std::string kept = folder_ / ".published/dulvek.20231114T221320Z";
  std::filesystem::create_directory(folder_ / ".published");
  std::filesystem::create_hard_link(folder_ / "dulvek", kept);
  EXPECT_EQ(put("two", kNow + 10).kept, kept);
}

TEST_F(PublicationTest, LetsEverybodyReadAndLeavesNothingElseBehind) {
  static_cast<void>(put("one", kNow));
  static_cast<void>(put("two", kNow));
  struct stat info {};
  ASSERT_EQ(::stat((folder_ / "dulvek").c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777U, 0644U);
  int files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(folder_.path()))
    files += entry.exists() ? 1 : 0;
  EXPECT_EQ(files, 2) << "the document and the folder of the old ones";
}

TEST_F(PublicationTest, ShowsReadersNeverAPart) {
  const std::string one(300000, '1'), two(200000, '2');
  static_cast<void>(put(one, kNow));
  std::atomic<bool> done{false};
  int parts = 0, reads = 0;
  std::thread reader([&] {
    while (!done) {
      const std::string seen = folder_.read("dulvek");
      parts += seen == one || seen == two ? 0 : 1;
      ++reads;
    }
  });
  for (int i = 0; i < 50; ++i) static_cast<void>(put(i % 2 == 0 ? two : one, kNow + i));
  done = true;
  reader.join();
  EXPECT_GT(reads, 0);
  EXPECT_EQ(parts, 0);
}

TEST_F(PublicationTest, LeavesWhatIsThereWhereItCannotBeKept) {
  static_cast<void>(put("one", kNow));
  folder_.write(".published", "no folder");
  EXPECT_TRUE(std::holds_alternative<Error>(publish("two", folder_.path(), "dulvek", kNow)));
  EXPECT_EQ(folder_.read("dulvek"), "one");
  EXPECT_TRUE(std::holds_alternative<Error>(publish("x", folder_ / "nowhere", "dulvek", kNow)));
}

}  // namespace
}  // namespace kyt::tools
