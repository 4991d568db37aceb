// The built daemon with an outbox whose disk does not end what it was asked for, until the test lets it.
#include <algorithm>
#include <chrono>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "tests/integration/FailingDaemon.h"
#include "tests/integration/OutboxDaemonFixture.h"
#include "tests/support/Programs.h"

namespace kyt {
namespace {

class OutboxOfTheDaemonOnASlowDisk : public OutboxOfTheDaemon {
 protected:
  void SetUp() override {
    if (kSanitized) GTEST_SKIP() << "a sanitizer's own library must be loaded first";
  }
  void begin() {
    putBag(Array{entry("plain", server_.url("/events")), entry("kept", failing_.url("/events"))});
    failing_.setReply({.status = 503});
    settings(kOn);
    start();
  }
  // One post of that program, which its server does not take.
  static std::shared_ptr<std::promise<std::string>> post(TestClient& client, int number) {
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", number}}));
    return client.startFlush();
  }

  FailingCalls calls_{daemon_};
  TestHTTPServer failing_;
};

TEST_F(OutboxOfTheDaemonOnASlowDisk, KeepsNobodyWaitingForIt) {
  begin();
  TestClient kept(daemon_.socketPath(), kTorvel, "kept"), plain(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(kept.configure(), "live: httppost") << daemon_.log();
  ASSERT_EQ(plain.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(kept.send(9, 1, Dictionary{{"number", 0}}));
  ASSERT_EQ(kept.flush(), "flushed") << daemon_.log();
  calls_.fail(kyt_failing_fdatasync, kyt_failing_hangs, 1, FailingCalls::kAlways);
  auto answer = post(kept, 1)->get_future();
  ASSERT_TRUE(eventually([this] { return calls_.failures() > 0; })) << "the disk was not asked";
  take(100);
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(plain.send(9, 1, Dictionary{{"number", i}}));
    EXPECT_EQ(plain.flush(), "flushed") << daemon_.log();
  }
  const ProgramRun status = runProgram(std::string(KYT_PROGRAMS) + "/kytctl",
                                       {"--root", daemon_.root().path(), "status", "--json"});
  EXPECT_EQ(status.status, 0) << status.text;
  ASSERT_EQ(answer.wait_for(kTestDeadline), std::future_status::ready) << daemon_.log();
  EXPECT_NE(answer.get(), "flushed") << "it is not on the disk";
  EXPECT_TRUE(daemon_.logged("Outbox: Its disk has taken longer than 5 s, 1 posts go the usual way"))
      << daemon_.log();
  calls_.goOn();
}

TEST_F(OutboxOfTheDaemonOnASlowDisk, IsNoReasonNotToEnd) {
  begin();
  TestClient kept(daemon_.socketPath(), kTorvel, "kept");
  ASSERT_EQ(kept.configure(), "live: httppost") << daemon_.log();
  calls_.fail(kyt_failing_fdatasync, kyt_failing_hangs, 1, FailingCalls::kAlways);
  auto answer = post(kept, 1);
  ASSERT_TRUE(eventually([this] { return calls_.failures() > 0; })) << "the disk was not asked";
  end();
}

// Each post that it does not take stands aside for the next one, so that the order shows that one is tried at a time.
TEST_F(OutboxOfTheDaemon, AsksAServerThatGoesOnAnswering500OneAtATimeInTurn) {
  TestHTTPServer failing;
  failing.setReply({.status = 500});
  putBag(Array{entry("plain", server_.url("/events")), entry("failing", failing.url("/events"))});
  settings(kOn);
  take(100);
  start();
  TestClient kept(daemon_.socketPath(), kTorvel, "failing"), plain(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(kept.configure(), "live: httppost") << daemon_.log();
  ASSERT_EQ(plain.configure(), "live: httppost") << daemon_.log();
  constexpr int kPosts = 6;
  for (int i = 0; i < kPosts; ++i) {
    EXPECT_TRUE(kept.send(9, 1, Dictionary{{"number", i}}));
    ASSERT_EQ(kept.flush(), "flushed") << daemon_.log();
  }
  std::vector<std::string> first, again;
  const auto look = [&] {
    first.clear();
    again.clear();
    for (const auto& request : failing.requests()) {
      const bool isNew = std::find(first.begin(), first.end(), request.body) == first.end();
      (isNew ? first : again).push_back(request.body);
    }
    return again.size() >= 2;
  };
  for (int i = 0; !look() && i < 600; ++i) {
    EXPECT_TRUE(plain.send(9, 1, Dictionary{{"number", i}}));
    EXPECT_EQ(plain.flush(), "flushed") << daemon_.log();
    static_cast<void>(failing.waitForRequests(failing.requestCount() + 1, std::chrono::milliseconds(200)));
  }
  ASSERT_GE(again.size(), 2U) << daemon_.log();
  for (size_t i = 0; i < again.size() && i < first.size(); ++i) EXPECT_EQ(again[i], first[i]) << i;
  EXPECT_TRUE(failed().empty()) << "the other server's posts";
  for (const auto& [body, times] : taken()) EXPECT_EQ(times, 1);
}

}  // namespace
}  // namespace kyt
