#include "platform/linux/base/FileWatch.h"

#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>

#include "platform/base/Semaphore.h"
#include "platform/linux/base/EpollReactor.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

TEST(FileWatch, TellsOfEachWayInWhichTheFileChangesAndOfNoOther) {
  const TemporaryFolder folder;
  const auto reactor = EpollReactor::create();
  Semaphore changed;
  const FileWatch watch(*reactor, folder.path(), "watched.toml", [&changed] { changed.signal(); });
  ASSERT_TRUE(watch.isWatching());
  const auto isTold = [&changed] {
    const bool told = changed.waitFor(std::chrono::seconds(30));
    while (changed.waitFor(std::chrono::milliseconds(20))) {
    }
    return told;
  };
  folder.write("watched.toml", "consent = true\n");
  EXPECT_TRUE(isTold());
  folder.write("watched.toml", "consent = false\n");
  EXPECT_TRUE(isTold());
  folder.write("another.toml", "consent = true\n");
  EXPECT_FALSE(changed.waitFor(std::chrono::milliseconds(50)));
  std::filesystem::rename(folder / "another.toml", folder / "watched.toml");
  EXPECT_TRUE(isTold());
  std::filesystem::remove(folder / "watched.toml");
  EXPECT_TRUE(isTold());
  reactor->stop();
}

TEST(FileWatch, WatchesNothingWhereThereIsNoFolder) {
  const auto reactor = EpollReactor::create();
  const FileWatch watch(*reactor, "/nowhere/at/all", "watched.toml", [] {});
  EXPECT_FALSE(watch.isWatching());
  reactor->stop();
}

}  // namespace
}  // namespace kyt
