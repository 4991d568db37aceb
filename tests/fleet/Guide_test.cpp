// What the fleet's guide says that a receiving end is set up with, in the eyes of the programs themselves.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

// The block of that kind.
std::string blockOf(const std::string& kind) {
  std::ifstream file(KYT_SOURCE_DIR "/docs/FLEET.md");
  const std::string guide(std::istreambuf_iterator<char>(file), {});
  const std::string fence = "\n```" + kind + "\n";
  const size_t at = guide.find(fence);
  if (at == std::string::npos) return {};
  return guide.substr(at + fence.size(), guide.find("\n```", at + fence.size()) + 1 - at - fence.size());
}

TEST(FleetsGuide, HasSettingsThatTheReceiverTakes) {
  const TemporaryFolder folder;
  const std::string settings = blockOf("receiver");
  ASSERT_NE(settings, "");
  const ProgramRun run =
      runProgram(KYT_RECEIVER, {"--config", folder.write("kytreceiver.toml", settings), "--check-config"});
  EXPECT_EQ(run.status, 0) << run.text;
}

// Neither the log nor a receiver asks whoever reaches its ports who he is.
TEST(FleetsGuide, OpensNoPortOnEveryAddress) {
  for (const char* kind : {"receiver", "nats"}) {
    const std::string settings = blockOf(kind);
    EXPECT_NE(settings.find("listen"), std::string::npos) << kind;
    EXPECT_EQ(settings.find("0.0.0.0"), std::string::npos) << settings;
    EXPECT_EQ(settings.find("[::]"), std::string::npos) << settings;
  }
}

TEST(FleetsGuide, HasSettingsThatTheLogTakes) {
  if (!isInstalled("nats-server")) GTEST_SKIP() << "nats-server is not installed";
  const TemporaryFolder folder;
  const std::string settings = blockOf("nats");
  ASSERT_NE(settings, "");
  const ProgramRun run =
      runProgram("/usr/sbin/nats-server", {"-c", folder.write("nats-server.conf", settings), "-t"});
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find("is valid"), std::string::npos) << run.text;
}

}  // namespace
}  // namespace kyt
