// The built daemon with an outbox and two servers, of which one lies: whose posts go to the other waits for nothing.
#include <chrono>
#include <memory>
#include <ostream>

#include "tests/integration/OutboxDaemonFixture.h"

namespace kyt {
namespace {

using Behaviour = TestHTTPServer::Behaviour;

struct Lie {
  const char* name;
  TestHTTPServer::Reply reply;
  friend std::ostream& operator<<(std::ostream& out, const Lie& lie) { return out << lie.name; }
};

class OutboxBesideALiar : public OutboxOfTheDaemon, public testing::WithParamInterface<Lie> {
 protected:
  TestHTTPServer liar_;
};

TEST_P(OutboxBesideALiar, LetsNobodyElseWait) {
  liar_.setReply(GetParam().reply);
  putBag(Array{entry("plain", server_.url("/events")), entry("liar", liar_.url("/events"))});
  settings(std::string(kOn) + "[service]\nshutdown_grace_seconds = 0.5\n");
  start();
  TestClient liar(daemon_.socketPath(), kTorvel, "liar"), plain(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(liar.configure(), "live: httppost") << daemon_.log();
  ASSERT_EQ(plain.configure(), "live: httppost") << daemon_.log();
  std::vector<std::shared_ptr<std::promise<std::string>>> unanswered;
  for (int i = 0; i < 8; ++i) {
    EXPECT_TRUE(liar.send(9, 1, Dictionary{{"lie", i}}));
    unanswered.push_back(liar.startFlush());
  }
  ASSERT_TRUE(liar_.waitForRequests(1)) << daemon_.log();
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(plain.send(9, 1, Dictionary{{"kept", i}}));
    ASSERT_EQ(plain.flush(), "flushed") << daemon_.log();
  }
  const auto kept = failed();
  EXPECT_GE(kept.size(), 3U);
  take(100);
  const auto arrived = [&] {
    const auto now = taken();
    return std::all_of(kept.begin(), kept.end(), [&now](const auto& one) { return now.contains(one.first); });
  };
  EXPECT_TRUE(eventually(arrived)) << daemon_.log();
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(plain.send(9, 1, Dictionary{{"new", i}}));
    EXPECT_EQ(plain.flush(), "flushed") << daemon_.log();
  }
  EXPECT_GE(taken().size(), kept.size() + 3);
  liar_.release();
  liar_.stop();
}

INSTANTIATE_TEST_SUITE_P(
    Each, OutboxBesideALiar,
    testing::Values(
        Lie{"AnswersWith500", {.status = 500}},
        Lie{"WantsToBeLeftAloneForAYear", {.status = 429, .headers = {{"Retry-After", "31536000"}}}},
        Lie{"ClosesAfterTheBody", {.behaviour = Behaviour::close}},
        Lie{"ResetsAfterTheBody", {.behaviour = Behaviour::reset}},
        Lie{"BreaksItsAnswerOff", {.status = 503, .body = "half of it", .behaviour = Behaviour::stopMidBody}},
        Lie{"DripsItsAnswer", {.status = 503, .body = std::string(4000, 'x'), .behaviour = Behaviour::drip}},
        Lie{"TakesAndDripsItsAnswer", {.body = std::string(4000, 'x'), .behaviour = Behaviour::drip}},
        Lie{"NeverAnswers", {.behaviour = Behaviour::hold}}),
    [](const auto& test) { return test.param.name; });

// The status says what became of a post, whatever becomes of the rest of the answer.
TEST_F(OutboxOfTheDaemon, SendsNothingAgainWhoseAnswerBreaksOffAfterAGoodStatus) {
  settings(kOn);
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", 1}}));
  ASSERT_EQ(client.flush(), "flushed") << daemon_.log();
  const auto kept = failed();
  ASSERT_FALSE(kept.empty());
  breakOff(true);
  take(100);
  ASSERT_TRUE(eventually([&] { return taken().size() >= kept.size() && isEmpty(); })) << daemon_.log();
  end();
  start();
  TestClient another(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(another.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(another.send(9, 1, Dictionary{{"number", 2}}));
  static_cast<void>(another.flush());
  EXPECT_FALSE(daemon_.logged("are left from before")) << daemon_.log();
  end();
  for (const auto& [body, times] : taken()) EXPECT_EQ(times, 1);
}

// Nobody can tell that from a server that keeps what it takes: it is not sent again.
TEST_F(OutboxOfTheDaemon, SendsNothingAgainThatAServerTookAndForgot) {
  settings(kOn);
  take(100);
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  for (int i = 0; i < 4; ++i) {
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", i}}));
    EXPECT_EQ(client.flush(), "flushed");
  }
  end();
  start();
  end();
  for (const auto& [body, times] : taken()) EXPECT_EQ(times, 1);
}

}  // namespace
}  // namespace kyt
