// Figures of a machine: of folders that stand for /proc and /sys.
#include "sources/resources/ResourcePeriod.h"

#include <gtest/gtest.h>
#include <sys/statvfs.h>

#include "tests/support/TemporaryFolder.h"

namespace kyt::sources {
namespace {

class ResourcePeriodOf : public ::testing::Test {
 protected:
  void processor(int busy, int idle) const {
    root_.write("proc/stat",
                "cpu  " + std::to_string(busy) + " 0 0 " + std::to_string(idle) + " 0 0 0 0 0 0\ncpu0 1\n");
  }
  void memory(int total, int available) const {
    root_.write("proc/meminfo", "MemTotal:       " + std::to_string(total) +
                                    " kB\nMemFree:  1 kB\nMemAvailable:   " + std::to_string(available) +
                                    " kB\n");
  }
  void stalled(const char* what, int total) const {
    root_.write(std::string("proc/pressure/") + what, "some avg10=1.00 avg60=2.00 avg300=3.00 total=" +
                                                          std::to_string(total) + "\nfull avg10=0 total=1\n");
  }
  void look(uint64_t second) { period_.sample(second * 1'000'000); }
  [[nodiscard]] double value(const char* name) const {
    const Value* found = fields_.find(name);
    return found != nullptr ? found->doubleValue() : -1;
  }
  TemporaryFolder root_;
  ResourcePeriod period_{root_.path()};
  Dictionary fields_;
};

TEST_F(ResourcePeriodOf, HasLowestMeanAndHighestShareOfTheProcessors) {
  processor(100, 900);
  look(1);
  processor(110, 990);
  look(2);
  processor(160, 1040);
  look(3);
  fields_ = period_.summary();
  EXPECT_DOUBLE_EQ(value("processorMin"), 0.1);
  EXPECT_DOUBLE_EQ(value("processorMean"), 0.3);
  EXPECT_DOUBLE_EQ(value("processorMax"), 0.5);
  EXPECT_EQ(value("seconds"), 2);
  EXPECT_EQ(value("looks"), 3);
}

TEST_F(ResourcePeriodOf, HasTheMemoryThatIsNotAvailable) {
  memory(1000, 750);
  look(1);
  memory(1000, 250);
  look(2);
  fields_ = period_.summary();
  EXPECT_DOUBLE_EQ(value("memoryMin"), 0.25);
  EXPECT_DOUBLE_EQ(value("memoryMean"), 0.5);
  EXPECT_DOUBLE_EQ(value("memoryMax"), 0.75);
}

TEST_F(ResourcePeriodOf, HasTheShareOfTimeThatSomethingWasStalled) {
  stalled("io", 1'000'000);
  look(10);
  stalled("io", 3'000'000);
  look(20);
  stalled("io", 3'000'000);
  look(30);
  fields_ = period_.summary();
  EXPECT_DOUBLE_EQ(value("diskPressureMin"), 0);
  EXPECT_DOUBLE_EQ(value("diskPressureMean"), 0.1);
  EXPECT_DOUBLE_EQ(value("diskPressureMax"), 0.2);
}

TEST_F(ResourcePeriodOf, HasTheTemperatureOfTheHottestZone) {
  root_.write("sys/class/thermal/thermal_zone0/temp", "41000\n");
  root_.write("sys/class/thermal/thermal_zone1/temp", "52500\n");
  root_.write("sys/class/thermal/thermal_zone2/temp", "-274000\n");
  root_.write("sys/class/thermal/cooling_device0/temp", "99000\n");
  look(1);
  fields_ = period_.summary();
  EXPECT_DOUBLE_EQ(value("temperatureMax"), 52.5);
}

TEST_F(ResourcePeriodOf, HasTheShareOfTheDiskThatIsNotFreeForPrograms) {
  root_.write("var/file", "");
  look(1);
  fields_ = period_.summary();
  struct statvfs disk = {};
  ASSERT_EQ(::statvfs((root_ / "var").c_str(), &disk), 0);
  constexpr double kMeanwhile = 0.02;  // what others write
  EXPECT_NEAR(value("diskMean"), 1 - static_cast<double>(disk.f_bavail) / static_cast<double>(disk.f_blocks),
              kMeanwhile);
  EXPECT_GE(value("diskMin"), 0);
  EXPECT_LE(value("diskMax"), 1);
}

TEST_F(ResourcePeriodOf, LeavesOutWhatTheMachineDoesNotHave) {
  root_.write("proc/stat", "nothing\n");
  root_.write("proc/meminfo", "MemTotal: 0 kB\n");
  root_.write("proc/pressure/cpu", "full avg10=0\n");
  look(1);
  look(2);
  EXPECT_TRUE(period_.empty());
  EXPECT_EQ(period_.summary().size(), 2U);
}

TEST_F(ResourcePeriodOf, BeginsANewPeriodWithTheLastLook) {
  processor(0, 1000);
  memory(1000, 0);
  look(1);
  look(5);
  period_.restart();
  memory(1000, 900);
  processor(50, 1050);
  look(8);
  fields_ = period_.summary();
  EXPECT_EQ(value("seconds"), 3);
  EXPECT_EQ(value("looks"), 1);
  EXPECT_DOUBLE_EQ(value("memoryMax"), 0.1);
  EXPECT_DOUBLE_EQ(value("processorMax"), 0.5);
}

}  // namespace
}  // namespace kyt::sources
