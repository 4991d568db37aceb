// What the fleet's guide says that a receiving end is set up with, in the eyes of the programs themselves.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#include "tests/receiver/NatsServer.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

std::string theGuide() {
  std::ifstream file(KYT_SOURCE_DIR "/docs/FLEET.md");
  return {std::istreambuf_iterator<char>(file), {}};
}

// The block of that kind.
std::string blockOf(const std::string& kind) {
  const std::string guide = theGuide();
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

TEST(FleetsGuide, SaysHowLongTheLogKnowsRepeats) {
  using namespace receiver;
  if (!NatsServers::isInstalled()) GTEST_SKIP() << "nats-server is not installed";
  NatsServers servers;
  servers.start();
  ReceiverProcess::Options options;
  options.servers = servers.urlsAsToml();
  const ReceiverProcess made(options);
  ASSERT_TRUE(eventually([&] {
    return runProgram(KYT_RECEIVER, {"--config", made.configFile(), "--make-streams"}).status == 0;
  }));
  natsConnection* connection = nullptr;
  jsCtx* context = nullptr;
  jsStreamInfo* info = nullptr;
  ASSERT_EQ(natsConnection_ConnectTo(&connection, servers.url(0).c_str()), NATS_OK);
  ASSERT_EQ(natsConnection_JetStream(&context, connection, nullptr), NATS_OK);
  ASSERT_EQ(js_GetStreamInfo(&info, context, "kyt-events", nullptr, nullptr), NATS_OK);
  EXPECT_EQ(std::chrono::nanoseconds(info->Config->Duplicates), std::chrono::minutes(10));
  jsStreamInfo_Destroy(info);
  jsCtx_Destroy(context);
  natsConnection_Destroy(connection);
  EXPECT_NE(theGuide().find("knows repeats for ten minutes"), std::string::npos);
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
