// Which capabilities are left, and that none comes back.
#include "platform/linux/confinement/Capabilities.h"

#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include "tests/support/ChildProcess.h"
#include "tests/support/OrdinaryUser.h"

namespace kyt {
namespace {

constexpr uint32_t kOther = 54321;

std::string hexadecimal(CapabilitySet set) {
  char number[24];
  std::snprintf(number, sizeof number, "%llx", static_cast<unsigned long long>(set));
  return number;
}

std::string sets() {
  return capabilitiesOf("/proc/thread-self");
}

class Capabilities : public testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0 || (effectiveCapabilities() & kService) != kService)
      GTEST_SKIP() << "needs root to have something to give up";
  }
  static constexpr CapabilitySet kService =
      capabilitySet(CAP_SETUID) | capabilitySet(CAP_SETGID) | capabilitySet(CAP_SETPCAP);
};

TEST_F(Capabilities, OfAnOrdinaryUsersDaemonAreAllGivenUp) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              if (!becomeOrdinaryUser(kOther, kService)) return "cannot begin as a service does";
              const std::string all = hexadecimal(kService);
              if (sets() != all + " " + all + " " + all + " " + all + " " + all)
                return "began with " + sets();
              if (const int error = giveUpCapabilities()) return "error " + std::to_string(error);
              return sets();
            }),
            "0 0 0 0 0");
}

TEST_F(Capabilities, WithoutTheRightToEmptyItTheBoundingSetStaysAndTheRestGoes) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              const CapabilitySet set = capabilitySet(CAP_SETUID) | capabilitySet(CAP_SETGID);
              if (!becomeOrdinaryUser(kOther, set)) return "cannot begin as a service does";
              if (const int error = giveUpCapabilities()) return "error " + std::to_string(error);
              return sets();
            }),
            "0 0 0 c0 0");
}

TEST_F(Capabilities, OfRootThatReachFilesOfOthersStay) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              const CapabilitySet wanted =
                  capabilitySet(CAP_CHOWN) | capabilitySet(CAP_DAC_OVERRIDE) | capabilitySet(CAP_FOWNER);
              const std::string left = hexadecimal(effectiveCapabilities() & wanted);
              if (const int error = giveUpCapabilities()) return "error " + std::to_string(error);
              return sets() == "0 " + left + " " + left + " 0 0" ? "" : sets();
            }),
            "");
}

TEST_F(Capabilities, ThatWereGivenUpAreGoneForGood) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              if (giveUpCapabilities() != 0) return "error";
              if (::syscall(SYS_setresuid, kOther, kOther, kOther) == 0) return "became another user";
              if (::syscall(SYS_setresgid, kOther, kOther, kOther) == 0) return "took another group";
              if (keepCapabilities(kService) != 0) return "keeping more than it has is an error";
              return (effectiveCapabilities() & kService) == 0 ? "" : "they came back";
            }),
            "");
}

TEST_F(Capabilities, ThatAreKeptStayInUse) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              if (keepCapabilities(capabilitySet(CAP_SETUID)) != 0) return "error";
              if (::syscall(SYS_setresgid, kOther, kOther, kOther) == 0) return "took another group";
              return ::syscall(SYS_setresuid, kOther, kOther, kOther) == 0 ? ""
                                                                           : "could not become another user";
            }),
            "");
}

}  // namespace
}  // namespace kyt
