#include "platform/base/Paths.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

TEST(Paths, StandBehindTheRoot) {
  const Paths paths = Paths::of("/tmp/demo/", "/opt/kyt/bin");
  EXPECT_EQ(paths.settings(), "/tmp/demo/etc/kytreportingd/kytreportingd.toml");
  EXPECT_EQ(paths.entitlements(), "/tmp/demo/etc/kytreportingd/entitlements.d");
  EXPECT_EQ(paths.device(), "/tmp/demo/etc/kytreportingd/device.toml");
  EXPECT_EQ(paths.userDefaults(), "/tmp/demo/var/lib/kytreportingd/defaults");
  EXPECT_EQ(paths.socket(), "/tmp/demo/run/kytreportingd/com.vantu.kytreportingd");
  EXPECT_EQ(paths.systemLogs(), "/tmp/demo/var/mobile/Library/Logs/Faultbin");
  EXPECT_EQ(paths.messageLogs(), "/tmp/demo/var/mobile/Library/Logs/Faultbin/Retired");
  EXPECT_EQ(paths.plugIns(), "/tmp/demo/System/Library/PrivateFrameworks");
  EXPECT_EQ(paths.clientBundle(), "/tmp/demo/usr/share/kytreporting/KYTReporting.bundle");
  EXPECT_EQ(paths.daemonBundle(), "/tmp/demo/usr/share/kytreporting/kytreportingd.bundle");
}

TEST(Paths, WithoutARootTheSharedFilesAreBesideTheProgram) {
  const Paths paths = Paths::of("", "/opt/kyt/bin");
  EXPECT_EQ(paths.settings(), "/etc/kytreportingd/kytreportingd.toml");
  EXPECT_EQ(paths.kytShare(), "/opt/kyt/share/kytreporting");
  EXPECT_EQ(Paths::of("", "/bin").kytShare(), "/share/kytreporting");
}

TEST(Paths, TheRootFolderItselfIsARootToo) {
  const Paths paths = Paths::of("/", "/opt/kyt/bin");
  EXPECT_EQ(paths.settings(), "/etc/kytreportingd/kytreportingd.toml");
  EXPECT_EQ(paths.kytShare(), "/usr/share/kytreporting");
}

}  // namespace
}  // namespace kyt
