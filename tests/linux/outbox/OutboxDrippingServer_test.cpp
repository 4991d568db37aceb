// The outbox on the real network: a server that gives its answer a byte at a time holds its own posts up for a while, and
// nobody else's. The outbox's clock and disk are moved by hand.
#include <gtest/gtest.h>

#include "outbox/Outbox.h"
#include "outbox/OutboxURLSession.h"
#include "platform/base/Limits.h"
#include "platform/fake/FakePostStore.h"
#include "platform/linux/url/CurlURLSession.h"
#include "tests/support/Eventually.h"
#include "tests/support/TestHTTPServer.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

class OutboxBesideADrippingServer : public testing::Test {
 protected:
  OutboxBesideADrippingServer() {
    test_.consent.setAllowed(true);
    test_.random.setDraw(4999);
  }
  void start() {
    network_ = std::make_unique<CurlURLSessionFactory>(options_, test_.log, test_.counters);
    outbox_ = Outbox::create({test_.clock, test_.timers, test_.random, test_.executor, test_.consent,
                              test_.counters, test_.log, books_, test_.departures, *network_, store_},
                             {.enabled = true});
    factory_ = std::make_unique<OutboxURLSessionFactory>(*network_, outbox_, test_.executor);
    session_ = factory_->create({});
    outbox_->begin();
    test_.executor.runAll();
  }
  void TearDown() override {
    outbox_->stopSending();
    test_.executor.runAll();
    session_.reset();
    factory_.reset();
    network_.reset();
  }
  void postAndKeep(const TestHTTPServer& server) {
    auto posted = std::make_shared<PostedEvents>(BookedEvents(), test_.counters);
    URLRequest request;
    request.method = "POST";
    request.url = server.url("/events");
    request.body = Data("body");
    request.events = posted->events();
    const size_t before = disk_->posts.size();
    session_->start(std::move(request), [posted](auto, auto, auto) { posted->delivered(); });
    ASSERT_TRUE(eventually([&] {
      test_.executor.runAll();
      return disk_->posts.size() > before;
    }));
  }
  template <typename Condition>
  [[nodiscard]] bool comesTrue(Condition condition) {
    return eventually([&] {
      test_.executor.runAll();
      return condition();
    });
  }
  [[nodiscard]] Outbox::Server of(const TestHTTPServer& server) {
    for (Outbox::Server& one : outbox_->list())
      if (server.url("/").starts_with(one.server)) return std::move(one);
    return {};
  }
  void pass(Duration time) {
    test_.timers.advance(time, [this] { test_.executor.runAll(); });
  }

  TestPlatform test_;
  CurlURLSessionOptions options_;
  Books books_;
  const std::shared_ptr<FakePostStore::Disk> disk_ = std::make_shared<FakePostStore::Disk>();
  FakePostStore store_{disk_};
  TestHTTPServer dripping_, good_;
  std::unique_ptr<CurlURLSessionFactory> network_;
  std::shared_ptr<Outbox> outbox_;
  std::unique_ptr<OutboxURLSessionFactory> factory_;
  std::unique_ptr<URLSession> session_;
};

TEST_F(OutboxBesideADrippingServer, EndsARepeatThatTakesTooLongAndSendsItAgain) {
  options_.requestTime = milliseconds(700);
  start();
  dripping_.setReply({.status = 503});
  good_.setReply({.status = 503});
  postAndKeep(dripping_);
  postAndKeep(good_);
  // It would go on for an hour.
  dripping_.setReply({.status = 503,
                      .body = std::string(180000, 'x'),
                      .behaviour = TestHTTPServer::Behaviour::drip,
                      .interval = milliseconds(20)});
  good_.setReply({});
  pass(seconds(5));
  EXPECT_TRUE(comesTrue([&] { return of(good_).posts == 0; })) << "it waits for nobody";
  EXPECT_TRUE(comesTrue([&] { return of(dripping_).posts == 1 && of(dripping_).inFlight == 0; }));
  EXPECT_EQ(of(dripping_).lastStatus, 503);
  EXPECT_EQ(dripping_.requestCount(), 2U);
  dripping_.setReply({});
  pass(seconds(10));
  EXPECT_TRUE(comesTrue([&] { return disk_->posts.empty(); }));
}

TEST_F(OutboxBesideADrippingServer, TakesItsWordWhereItSaidThatItTookThePost) {
  options_.requestTime = milliseconds(700);
  start();
  dripping_.setReply({.status = 503});
  postAndKeep(dripping_);
  dripping_.setReply({.body = std::string(180000, 'x'),
                      .behaviour = TestHTTPServer::Behaviour::drip,
                      .interval = milliseconds(20)});
  pass(seconds(5));
  EXPECT_TRUE(comesTrue([&] { return disk_->posts.empty(); }));
  EXPECT_EQ(dripping_.requestCount(), 2U);
}

}  // namespace
}  // namespace kyt
