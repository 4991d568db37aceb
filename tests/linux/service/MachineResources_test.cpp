#include "platform/linux/service/MachineResources.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr uint64_t kMiB = 1u << 20;

class MemoryForTheDaemon : public ::testing::Test {
 protected:
  MachineSources sources() const { return {folder_ / "self", folder_ / "groups", 512 * kMiB, ~uint64_t{0}}; }
  TemporaryFolder folder_;
};

TEST_F(MemoryForTheDaemon, IsAQuarterOfTheMachinesWithoutALimit) {
  EXPECT_EQ(memoryForTheDaemon(sources()), 128 * kMiB);
  folder_.write("self/cgroup", "1:name=systemd:/a\n0::/system.slice/k.service\n");
  folder_.write("groups/system.slice/k.service/memory.max", "max\n");
  EXPECT_EQ(memoryForTheDaemon(sources()), 128 * kMiB);
}

TEST_F(MemoryForTheDaemon, IsTheLeastLimitOfItsControlGroups) {
  folder_.write("self/cgroup", "1:name=systemd:/a\n0::/system.slice/k.service\n");
  folder_.write("groups/system.slice/k.service/memory.max", "104857600\n");
  EXPECT_EQ(memoryForTheDaemon(sources()), 100 * kMiB);
  folder_.write("groups/system.slice/memory.max", "52428800\n");
  EXPECT_EQ(memoryForTheDaemon(sources()), 50 * kMiB);
  folder_.write("groups/memory.max", "26214400\n");
  EXPECT_EQ(memoryForTheDaemon(sources()), 25 * kMiB);
}

TEST_F(MemoryForTheDaemon, IsAQuarterOfTheAddressSpaceWhereThatIsLess) {
  MachineSources limited = sources();
  limited.addressSpace = 100 * kMiB;
  EXPECT_EQ(memoryForTheDaemon(limited), 25 * kMiB);
}

TEST_F(MemoryForTheDaemon, IgnoresGroupsThatLeadOutsideOrAreOfTheFirstVersion) {
  for (const char* text : {"0::/../../x\n", "5:memory:/x\n", "10::/x\n", ""}) {
    folder_.write("self/cgroup", text);
    folder_.write("groups/x/memory.max", "1048576\n");
    EXPECT_EQ(memoryForTheDaemon(sources()), 128 * kMiB) << text;
  }
}

TEST(MachineResources, OfThisMachineAreSomeOfItsMemory) {
  const uint64_t memory = memoryForTheDaemon();
  EXPECT_GT(memory, kMiB);
  const auto whole =
      static_cast<uint64_t>(::sysconf(_SC_PHYS_PAGES)) * static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
  EXPECT_LE(memory, whole / 4);
}

}  // namespace
}  // namespace kyt
