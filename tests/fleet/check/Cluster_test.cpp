// Two receivers and three servers of the log, of which some die under load, and nothing between them and this program, so
// that the stream itself shows that it has each post once. For `./kyt fleet --check`.
#include <gtest/gtest.h>

#include <cstdio>
#include <memory>
#include <optional>

#include "tests/receiver/Load.h"
#include "tests/receiver/NatsServer.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/Eventually.h"

namespace kyt::receiver {
namespace {

class ReceiversAndACluster : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!NatsServers::isInstalled()) GTEST_SKIP() << "nats-server is not installed";
    servers_.start();
    ReceiverProcess::Options options;
    options.servers = servers_.urlsAsToml();
    options.log = "replicas = 3\n";
    for (auto& receiver : receivers_) {
      receiver = std::make_unique<ReceiverProcess>(options);
      ASSERT_TRUE(receiver->isReady()) << receiver->output();
    }
    ASSERT_TRUE(eventually([&] {
      tools::ChildProcess::Options how;
      how.outputFile = "/dev/null";
      auto made = tools::ChildProcess::start(
          KYT_RECEIVER, {"--config", receivers_[0]->configFile(), "--make-streams"}, how);
      return made && made->wait(kTestDeadline) == 0;
    }));
    for (auto& receiver : receivers_) ASSERT_TRUE(receiver->becomesReady()) << receiver->output();
  }

  [[nodiscard]] size_t leader() {
    std::string name;
    StreamView view(servers_.url(0));
    EXPECT_TRUE(eventually([&] { return !(name = view.leader()).empty(); }));
    return static_cast<size_t>(name.back() - '1');
  }
  [[nodiscard]] std::vector<uint16_t> ports() const { return {receivers_[0]->port(), receivers_[1]->port()}; }
  [[nodiscard]] double spooled() const {
    double sum = 0;
    for (const auto& receiver : receivers_) sum += receiver->metric("kyt_spool_posts").value_or(0);
    return sum;
  }
  // Every post that was answered is there, each once.
  void expectEachOnce(const Load& load) {
    // Servers that come back together sometimes need more than half a minute until they have a leader.
    bool isEmpty = false;
    for (int tries = 0; tries < 4 && !isEmpty; ++tries) isEmpty = eventually([&] { return spooled() == 0; });
    EXPECT_TRUE(isEmpty) << receivers_[0]->output() << receivers_[1]->output();
    StreamView view(servers_.url(0));
    EXPECT_TRUE(eventually([&] { return view.messages().has_value(); }));
    const auto stored = view.ids();
    EXPECT_EQ(load.missingIn(stored), 0U) << "of " << load.taken().size();
    for (const auto& [id, times] : stored) EXPECT_EQ(times, 1) << id;
    EXPECT_TRUE(load.others().empty());
    std::printf("%zu posts answered with 200, each in the stream once; longest %.2f s\n", load.taken().size(),
                static_cast<double>(load.longest().count()) / 1000);
  }

  NatsServers servers_{NatsServers::Options{3, ""}};
  std::unique_ptr<ReceiverProcess> receivers_[2];
};

TEST_F(ReceiversAndACluster, AnswerWithinTwoAndAHalfSecondsWhenTheLeaderDiesAndLoseNothing) {
  Load load({.ports = ports(), .pause = std::chrono::milliseconds(5)});
  ASSERT_TRUE(eventually([&] { return load.answered() > 500; }));
  const size_t dead = leader();
  servers_.kill(dead);
  const uint64_t before = load.answered();
  ASSERT_TRUE(eventually([&] { return load.answered() > before + 2000; }));
  load.stop();
  servers_.start(dead);
  EXPECT_LE(load.longest(), std::chrono::milliseconds(2500));
  expectEachOnce(load);
}

TEST_F(ReceiversAndACluster, SpoolWhileTwoOfThreeServersAreAwayForHalfAMinuteAndDrainAfterwards) {
  Load load({.ports = ports(), .pause = std::chrono::milliseconds(20)});
  ASSERT_TRUE(eventually([&] { return load.answered() > 200; }));
  servers_.kill(1);
  servers_.kill(2);
  bool isLong = false;
  for (int tries = 0; tries < 3 && !isLong; ++tries)
    isLong = eventually([&] { return receivers_[0]->metric("kyt_spool_oldest_seconds").value_or(0) >= 30; });
  EXPECT_TRUE(isLong);
  EXPECT_GT(spooled(), 100);
  EXPECT_EQ(receivers_[0]->get("/readyz").status, 200);
  servers_.start(1);
  servers_.start(2);
  const uint64_t before = load.answered();
  EXPECT_TRUE(eventually([&] { return load.answered() > before + 200; }));
  load.stop();
  EXPECT_LE(load.longest(), std::chrono::milliseconds(2500));
  expectEachOnce(load);
}

}  // namespace
}  // namespace kyt::receiver
