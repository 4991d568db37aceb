#include "config/DeviceIdentity.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstring>
#include <fstream>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/base/Semaphore.h"
#include "platform/base/UUIDText.h"
#include "tests/support/Eventually.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

TEST(DeviceIdentity, AsksForEachFactByItsKey) {
  TestPlatform test;
  for (const char* key :
       {"ProductVersion", "BuildVersion", "ProductType", "DeviceName", "HWModelStr", "SerialNumber"})
    test.deviceProperties.setProperty(key, std::string("the ") + key);
  EXPECT_EQ(test.deviceIdentity.productVersion(), String("the ProductVersion"));
  EXPECT_EQ(test.deviceIdentity.buildVersion(), String("the BuildVersion"));
  EXPECT_EQ(test.deviceIdentity.productType(), String("the ProductType"));
  EXPECT_EQ(test.deviceIdentity.deviceName(), String("the DeviceName"));
  EXPECT_EQ(test.deviceIdentity.hardwareModel(), String("the HWModelStr"));
  EXPECT_EQ(test.deviceIdentity.serialNumber(), String("the SerialNumber"));
}

TEST(DeviceIdentity, AnswersNothingForAFactThatIsMissing) {
  TestPlatform test;
  EXPECT_FALSE(test.deviceIdentity.productVersion());
  EXPECT_FALSE(test.deviceIdentity.serialNumber());
}

TEST(DeviceIdentity, FillsTheBufferWithFortyCharacters) {
  TestPlatform test;
  const std::string identifier(40, 'a');
  test.deviceProperties.setProperty("UniqueDeviceID", identifier);
  char buffer[kDeviceIDSize];
  std::memset(buffer, 'x', sizeof buffer);
  test.deviceIdentity.deviceUniqueIDCString(buffer, kDeviceIDSize);
  EXPECT_EQ(buffer[40], '\0');
  EXPECT_EQ(identifier, buffer);
}

TEST(DeviceIdentity, ForcesTheLastByteToZeroForAShorterIdentifier) {
  TestPlatform test;
  test.deviceProperties.setProperty("UniqueDeviceID", "abc");
  char buffer[8];
  std::memset(buffer, 'x', sizeof buffer);
  test.deviceIdentity.deviceUniqueIDCString(buffer, sizeof buffer);
  EXPECT_STREQ(buffer, "abc");
  EXPECT_EQ(buffer[7], '\0');
}

TEST(DeviceIdentity, LeavesTheBufferForAnIdentifierThatIsTooLongOrMissing) {
  TestPlatform test;
  char buffer[kDeviceIDSize] = "as it was";
  test.deviceIdentity.deviceUniqueIDCString(buffer, kDeviceIDSize);
  EXPECT_STREQ(buffer, "as it was");
  test.deviceProperties.setProperty("UniqueDeviceID", std::string(41, 'a'));
  test.deviceIdentity.deviceUniqueIDCString(buffer, kDeviceIDSize);
  EXPECT_STREQ(buffer, "as it was");
}

TEST(DeviceIdentity, IsInternalOnlyForTheInternalReleaseType) {
  for (const char* type : {"Beta", "internal", ""}) {
    TestPlatform test;
    test.deviceProperties.setProperty("ReleaseType", type);
    EXPECT_FALSE(test.deviceIdentity.isInternalBuild()) << type;
  }
  TestPlatform without;
  EXPECT_FALSE(without.deviceIdentity.isInternalBuild());
  TestPlatform internal;
  internal.deviceProperties.setProperty("ReleaseType", "Internal");
  EXPECT_TRUE(internal.deviceIdentity.isInternalBuild());
}

TEST(DeviceIdentity, AsksForTheReleaseTypeOnce) {
  TestPlatform test;
  EXPECT_FALSE(test.deviceIdentity.isInternalBuild());
  test.deviceProperties.setProperty("ReleaseType", "Internal");
  EXPECT_FALSE(test.deviceIdentity.isInternalBuild());
  EXPECT_EQ(test.deviceProperties.queries("ReleaseType"), 1);
}

// Whether a thread of this process waits for something.
bool waits(pid_t thread) {
  std::ifstream status("/proc/self/task/" + std::to_string(thread) + "/status");
  for (std::string line; std::getline(status, line);)
    if (line.starts_with("State:")) return line.find('S') != std::string::npos;
  return false;
}

// Each caller gets the answer of the device, also one that comes while the first is still asking.
TEST(DeviceIdentity, AsksForTheReleaseTypeOnceUnderConcurrentFirstCalls) {
  constexpr int kCallers = 4;
  TestPlatform test;
  test.deviceProperties.setProperty("ReleaseType", "Internal");
  Semaphore released(0);
  std::atomic<int> asked = 0;
  test.deviceProperties.setOnQuery([&](std::string_view) {
    ++asked;
    released.wait();
  });
  struct Caller {
    std::atomic<pid_t> thread = 0;
    std::atomic<bool> answered = false;
    bool answer = false;
    [[nodiscard]] bool hasComeToRest() const { return answered || (thread != 0 && waits(thread)); }
  };
  std::array<Caller, kCallers> callers;
  {
    std::vector<std::jthread> threads;
    for (Caller& caller : callers)
      threads.emplace_back([&] {
        caller.thread = ::gettid();
        caller.answer = test.deviceIdentity.isInternalBuild();
        caller.answered = true;
      });
    // The one that asks, and the others, which wait for it.
    EXPECT_TRUE(eventually([&] {
      return asked >= 1 && std::all_of(callers.begin(), callers.end(),
                                       [](const Caller& caller) { return caller.hasComeToRest(); });
    }));
    for (const Caller& caller : callers) EXPECT_FALSE(caller.answered) << "before the device has answered";
    for (int i = 0; i < kCallers; ++i) released.signal();
  }
  for (const Caller& caller : callers) EXPECT_TRUE(caller.answer);
  EXPECT_EQ(asked, 1);
}

TEST(DeviceIdentity, KeepsOneInstanceUUIDUnderConcurrentFirstCalls) {
  TestPlatform test;
  std::vector<std::string> answers(4);
  {
    std::vector<std::jthread> threads;
    for (std::string& answer : answers)
      threads.emplace_back([&] { answer = test.deviceIdentity.processInstanceUUID(); });
  }
  for (const std::string& answer : answers) EXPECT_EQ(answer, answers[0]);
  EXPECT_EQ(answers[0], uuidText(FixedRandom::uuidNumber(1)));
  EXPECT_EQ(test.deviceIdentity.processInstanceUUID(), answers[0]);
}

}  // namespace
}  // namespace kyt
