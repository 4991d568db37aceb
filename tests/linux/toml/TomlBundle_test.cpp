#include "platform/linux/toml/TomlBundle.h"

#include <gtest/gtest.h>

#include "platform/fake/MemoryLogSink.h"
#include "tests/support/NoDescriptors.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

TEST(TomlBundle, HoldsItsVersionAndResources) {
  const TemporaryFolder folder;
  MemoryLogSink sink;
  Log log(sink);
  folder.write("info.toml", "version = \"8.0\"\n");
  folder.write("publicKey.der", std::string("\x30\x00\xff", 3));
  TomlBundle bundle(folder.path(), log);
  std::filesystem::remove(folder / "info.toml");
  EXPECT_EQ(bundle.version(), String("8.0"));
  ASSERT_TRUE(bundle.resource("publicKey", "der"));
  EXPECT_EQ(bundle.resource("publicKey", "der")->view(), std::string_view("\x30\x00\xff", 3));
  EXPECT_EQ(bundle.resource("publicKey", "pem"), std::nullopt);
  EXPECT_EQ(bundle.resource("../publicKey", "der"), std::nullopt);
  EXPECT_TRUE(sink.lines().empty());
}

TEST(TomlBundle, WithoutItsInformationHasNoVersion) {
  const TemporaryFolder folder;
  MemoryLogSink sink;
  Log log(sink);
  EXPECT_EQ(TomlBundle(folder / "none", log).version(), std::nullopt);
  EXPECT_EQ(sink.count(LogLevel::error, "bundle: " + (folder / "none/info.toml") + ": No such file"), 1u);
  folder.write("info.toml", "version = 8\n");
  EXPECT_EQ(TomlBundle(folder.path(), log).version(), std::nullopt);
  EXPECT_EQ(sink.count("\"version\" must be text"), 1u);
  folder.write("info.toml", "version = \n");
  folder.write("large.bin", std::string(TomlBundle::kMaxResourceBytes + 1, 'x'));
  TomlBundle bundle(folder.path(), log);
  EXPECT_EQ(bundle.version(), std::nullopt);
  EXPECT_EQ(bundle.resource("large", "bin"), std::nullopt);
  EXPECT_EQ(sink.count("is too large"), 1u);
}

TEST(TomlBundle, TheShippedOnesAreOfThisVersion) {
  MemoryLogSink sink;
  Log log(sink);
  EXPECT_EQ(TomlBundle(KYT_PACKAGING_SHARE "/KYTReporting.bundle", log).version(), String("8.0"));
  EXPECT_EQ(TomlBundle(KYT_PACKAGING_SHARE "/kytreportingd.bundle", log).version(), String("8.0"));
  EXPECT_TRUE(sink.lines().empty());
}

TEST(TomlBundle, ReadsWhatCouldNotBeOpenedAtTheStartWhenItIsAskedFor) {
  const TemporaryFolder folder;
  MemoryLogSink sink;
  Log log(sink);
  folder.write("info.toml", "version = \"8.0\"\n");
  folder.write("publicKey.der", "key");
  std::optional<TomlBundle> bundle;
  {
    const NoDescriptors none;
    bundle.emplace(folder.path(), log);
    EXPECT_EQ(bundle->resource("publicKey", "der"), std::nullopt);
  }
  EXPECT_TRUE(
      sink.contains(LogLevel::error, "bundle: " + (folder / "publicKey.der") + ": Too many open files"));
  EXPECT_EQ(bundle->version(), String("8.0"));
  ASSERT_TRUE(bundle->resource("publicKey", "der"));
  EXPECT_EQ(bundle->resource("publicKey", "der")->view(), "key");
}

TEST(TomlBundle, ReadsAResourceEachTime) {
  const TemporaryFolder folder;
  MemoryLogSink sink;
  Log log(sink);
  folder.write("info.toml", "version = \"8.0\"\n");
  TomlBundle bundle(folder.path(), log);
  EXPECT_EQ(bundle.resource("publicKey", "der"), std::nullopt);
  folder.write("publicKey.der", "installed later");
  ASSERT_TRUE(bundle.resource("publicKey", "der"));
  EXPECT_EQ(bundle.resource("publicKey", "der")->view(), "installed later");
  folder.write("next", "another");
  std::filesystem::rename(folder / "next", folder / "publicKey.der");
  ASSERT_TRUE(bundle.resource("publicKey", "der"));
  EXPECT_EQ(bundle.resource("publicKey", "der")->view(), "another");
  std::filesystem::remove(folder / "publicKey.der");
  EXPECT_EQ(bundle.resource("publicKey", "der"), std::nullopt);
  EXPECT_TRUE(sink.lines().empty()) << "a missing one is its user's to tell of";
}

}  // namespace
}  // namespace kyt
