// A receiver and one server of the log, with its streams: for the tests of the whole program.
#pragma once

#include <gtest/gtest.h>

#include <optional>
#include <utility>

#include "tests/receiver/NatsServer.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/Eventually.h"

namespace kyt::receiver {

class ReceiverTest : public ::testing::Test {
 protected:
  explicit ReceiverTest(NatsServers::Options options = {}) : servers_(std::move(options)) {}
  void SetUp() override {
    if (!NatsServers::isInstalled()) GTEST_SKIP() << "nats-server is not installed";
    servers_.start();
    view_.emplace(servers_.url(0));
  }
  void makeStreams() const {
    ASSERT_TRUE(eventually([&] {
      tools::ChildProcess::Options how;
      how.outputFile = "/dev/null";
      auto made = tools::ChildProcess::start(KYT_RECEIVER,
                                             {"--config", receiver_->configFile(), "--make-streams"}, how);
      return made && made->wait(kTestDeadline) == 0;
    }));
  }
  // With its streams; ready for posts.
  void start(ReceiverProcess::Options options = {}) {
    options.servers = servers_.urlsAsToml();
    if (!receiver_) receiver_.emplace(options);
    ASSERT_TRUE(receiver_->isReady()) << receiver_->output();
    makeStreams();
    ASSERT_TRUE(receiver_->becomesReady()) << receiver_->output();
  }
  [[nodiscard]] bool spoolBecomesEmpty() const {
    return eventually([&] { return receiver_->metric("kyt_spool_posts") == 0; });
  }

  NatsServers servers_;
  std::optional<StreamView> view_;
  std::optional<ReceiverProcess> receiver_;
};

}  // namespace kyt::receiver
