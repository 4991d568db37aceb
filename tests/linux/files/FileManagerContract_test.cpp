// What every FileManager promises, on the one in memory that other tests use and on the system's files.
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>

#include "platform/fake/FakeFileManager.h"
#include "platform/fake/ManualClock.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/files/LinuxFileManager.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

struct InMemory {
  ManualClock clock;
  FakeFileManager files{clock};
  std::string root = "/logs";
  InMemory() { static_cast<void>(files.createDirectory(root)); }
};

struct InFiles {
  LinuxClock clock;
  LinuxFileManager files;
  TemporaryFolder folder;
  std::string root = folder.path();
};

template <typename Adapter>
class FileManagerContract : public testing::Test {
 protected:
  std::string path(const std::string& name) const { return adapter_.root + "/" + name; }
  std::vector<std::string> names(const std::string& folder) {
    auto listed = files_.contentsOfDirectory(folder);
    auto* found = std::get_if<std::vector<std::string>>(&listed);
    if (found == nullptr) return {"(error)"};
    std::sort(found->begin(), found->end());
    return *found;
  }
  Adapter adapter_;
  FileManager& files_ = adapter_.files;
};
using Adapters = testing::Types<InMemory, InFiles>;
TYPED_TEST_SUITE(FileManagerContract, Adapters);

TYPED_TEST(FileManagerContract, AMissingFolderIsAnErrorOfItsOwn) {
  const auto listed = this->files_.contentsOfDirectory(this->path("a/b"));
  ASSERT_TRUE(std::holds_alternative<Error>(listed));
  EXPECT_EQ(std::get<Error>(listed).code, kFileErrorNoSuchFile);
  EXPECT_EQ(std::get<Error>(listed).domain, kKYTFileErrorDomain);
}

TYPED_TEST(FileManagerContract, MakesAFolderWithThoseAboveItAndMayDoItTwice) {
  EXPECT_EQ(this->files_.createDirectory(this->path("a/b/c")), std::nullopt);
  EXPECT_EQ(this->files_.createDirectory(this->path("a/b/c")), std::nullopt);
  EXPECT_TRUE(this->names(this->path("a/b/c")).empty());
  const auto attributes = this->files_.attributesOfItem(this->path("a/b"));
  ASSERT_TRUE(attributes.has_value());
  EXPECT_FALSE(attributes->isRegularFile);
}

TYPED_TEST(FileManagerContract, AFileInAMissingFolderIsNotMade) {
  EXPECT_NE(this->files_.createFile(this->path("a/f")), std::nullopt);
  EXPECT_FALSE(this->files_.attributesOfItem(this->path("a/f")).has_value());
}

TYPED_TEST(FileManagerContract, AFileIsMadeEmptyNowAndKeptWhenItIsThere) {
  ASSERT_EQ(this->files_.createFile(this->path("f")), std::nullopt);
  EXPECT_EQ(this->names(this->adapter_.root), std::vector<std::string>{"f"});
  auto attributes = this->files_.attributesOfItem(this->path("f"));
  ASSERT_TRUE(attributes.has_value());
  EXPECT_TRUE(attributes->isRegularFile);
  EXPECT_EQ(attributes->size, 0U);
  ASSERT_TRUE(attributes->creationDate.has_value());
  EXPECT_LT(
      std::fabs(attributes->creationDate->secondsSince1970 - this->adapter_.clock.timeOfDay().asSeconds()),
      60);
  ASSERT_EQ(this->files_.append(this->path("f"), "one"), std::nullopt);
  ASSERT_EQ(this->files_.createFile(this->path("f")), std::nullopt);
  ASSERT_EQ(this->files_.append(this->path("f"), "two"), std::nullopt);
  EXPECT_EQ(this->files_.attributesOfItem(this->path("f"))->size, 6U);
}

TYPED_TEST(FileManagerContract, AMissingFileIsNotAppendedToNorRemoved) {
  const auto appended = this->files_.append(this->path("f"), "bytes");
  ASSERT_TRUE(appended.has_value());
  EXPECT_EQ(appended->code, kFileErrorNoSuchFile);
  const auto removed = this->files_.removeItem(this->path("f"));
  ASSERT_TRUE(removed.has_value());
  EXPECT_EQ(removed->code, kFileErrorNoSuchFile);
  EXPECT_TRUE(this->names(this->adapter_.root).empty());
}

TYPED_TEST(FileManagerContract, RemovesAFile) {
  ASSERT_EQ(this->files_.createFile(this->path("f")), std::nullopt);
  EXPECT_EQ(this->files_.removeItem(this->path("f")), std::nullopt);
  EXPECT_FALSE(this->files_.attributesOfItem(this->path("f")).has_value());
}

}  // namespace
}  // namespace kyt
