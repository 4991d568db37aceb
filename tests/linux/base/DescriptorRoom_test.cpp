#include "platform/linux/base/DescriptorRoom.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <algorithm>
#include <fstream>
#include <string>

#include "platform/base/Blocking.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/NoDescriptors.h"

namespace kyt {
namespace {

// How many descriptors the kernel's table of this process has room for.
int tableSize() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);)
    if (line.starts_with("FDSize:")) return std::stoi(line.substr(7));
  return 0;
}

// As many descriptors as the system lets this process have; at most so many are asked for here.
int raiseLimit(int wanted) {
  rlimit limit = {};
  ::getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = std::min<rlim_t>(limit.rlim_max, static_cast<rlim_t>(wanted));
  ::setrlimit(RLIMIT_NOFILE, &limit);
  return static_cast<int>(limit.rlim_cur);
}

class Observer final : public BlockingObserver {
 public:
  void willBlock(BlockingKind) override { ++waits; }
  void hasBlocked() override {}
  int waits = 0;
};

std::string sizes(int before, int after, int waits = 0) {
  return std::to_string(before) + " " + std::to_string(after) + " " + std::to_string(waits);
}

TEST(DescriptorRoom, IsThereFromTheStart) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              const int least = std::min(raiseLimit(100000), DescriptorRoom::kAtFirst);
              const int before = tableSize();
              const DescriptorRoom room;
              return before < least && tableSize() >= least ? "" : sizes(before, tableSize());
            }),
            "");
}

TEST(DescriptorRoom, IsDoubledWhenHalfOfItIsInUseByAThreadThatAnnouncesIt) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              if (raiseLimit(100000) < 4 * DescriptorRoom::kAtFirst) return "";  // the machine allows too few
              DescriptorRoom room;
              Observer observer;
              BlockingObserver::exchange(&observer);
              room.noteUsed(DescriptorRoom::kAtFirst / 2 - 1);
              if (tableSize() != DescriptorRoom::kAtFirst || observer.waits != 0) return "too early";
              room.noteUsed(DescriptorRoom::kAtFirst / 2);
              room.noteUsed(DescriptorRoom::kAtFirst / 2 + 1);
              const int size = tableSize();
              BlockingObserver::exchange(nullptr);
              return size == 2 * DescriptorRoom::kAtFirst && observer.waits == 1
                         ? ""
                         : sizes(DescriptorRoom::kAtFirst, size, observer.waits);
            }),
            "");
}

TEST(DescriptorRoom, IsAsLargeAsTheLimitAllows) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              raiseLimit(1024);
              DescriptorRoom room;
              room.noteUsed(DescriptorRoom::kAtFirst);
              return tableSize() == 1024 ? "" : sizes(0, tableSize());
            }),
            "");
}

TEST(DescriptorRoom, DoesWithoutWhereTheSystemRefuses) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              const int before = tableSize();
              {
                const NoDescriptors none;
                DescriptorRoom room;
                room.noteUsed(DescriptorRoom::kAtFirst);
              }
              return tableSize() == before ? "" : sizes(before, tableSize());
            }),
            "");
}

}  // namespace
}  // namespace kyt
