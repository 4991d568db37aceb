#include "outbox/OutboxURLSession.h"

#include "tests/outbox/OutboxFixture.h"

namespace kyt {
namespace {

class OutboxURLSessionTest : public OutboxFixture {};

TEST_F(OutboxURLSessionTest, KeepsWhatFailedAndTellsItsSessionThatItWasTaken) {
  start();
  for (const int status : {408, 425, 429, 500, 502, 503, 504}) {
    const auto outcome = post(std::to_string(status));
    answer(last(), status);
    EXPECT_EQ(outcome->calls, 1) << status;
    EXPECT_FALSE(outcome->error) << status;
    EXPECT_FALSE(outcome->response) << status;
  }
  for (const int32_t code : {6, 7, 28, 56, kURLErrorWaitingTooMuch, kURLErrorOutstandingTooMuch}) {
    const auto outcome = post(std::to_string(code));
    fail(last(), code);
    EXPECT_EQ(outcome->calls, 1) << code;
    EXPECT_FALSE(outcome->error) << code;
  }
  EXPECT_EQ(disk_->posts.size(), 13U);
  EXPECT_EQ(row().outbox, 26U);
  EXPECT_EQ(row().delivered, 0U);
  EXPECT_EQ(test_.counters.value(Reason::postFailed), 0U);
}

TEST_F(OutboxURLSessionTest, PassesEveryOtherAnswer) {
  start();
  for (const int status : {200, 204, 301, 400, 404, 413, 501, 505, 507, 599}) {
    const auto outcome = post();
    answer(last(), status);
    ASSERT_EQ(outcome->calls, 1) << status;
    ASSERT_TRUE(outcome->response) << status;
    EXPECT_EQ(outcome->response->status, status);
  }
  const auto outcome = post("body", 1000, "events.example.org/v1");
  fail(last(), 1);
  EXPECT_TRUE(outcome->error);
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(OutboxURLSessionTest, KeepsNothingButPostsOfEvents) {
  start();
  int failed = 0;
  for (const char* method : {"GET", "POST", "PUT"}) {
    URLRequest request;
    request.method = method;
    request.url = std::string(kServer) + "/upload";
    session_->start(std::move(request), [&failed](auto, auto, auto error) { failed += error ? 1 : 0; });
    EXPECT_FALSE(network_->lastRequest().neverWaits);
    fail(last());
  }
  EXPECT_EQ(failed, 3);
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_EQ(factory_->outstanding(), 0U);
}

TEST_F(OutboxURLSessionTest, SendsAgainWhatWasSentByteForByte) {
  start();
  static_cast<void>(post(std::string_view("\0\x1f\x8b body", 8)));
  const URLRequest first = network_->lastRequest();
  answer(last(), 503);
  pass(std::chrono::seconds(5));
  ASSERT_EQ(network_->requestCount(), 2U);
  const URLRequest again = network_->lastRequest();
  EXPECT_EQ(again.method, first.method);
  EXPECT_EQ(again.url, first.url);
  EXPECT_EQ(again.headers, first.headers);
  EXPECT_EQ(again.body, first.body);
  EXPECT_EQ(again.identity, first.identity);
  EXPECT_EQ(again.allowsCellularAccess, first.allowsCellularAccess);
  EXPECT_EQ(network_->configurationOf(1).sourceApplication, "com.example.test");
  EXPECT_TRUE(again.neverWaits);
}

TEST_F(OutboxURLSessionTest, GoesTheUsualWayWhereThePostCannotBeKept) {
  start();
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "disk full"};
  const auto outcome = post();
  answer(last(), 503);
  ASSERT_EQ(outcome->calls, 1);
  EXPECT_EQ(outcome->response->status, 503);
  EXPECT_EQ(test_.counters.value(Reason::postNotKept), 1U);
  EXPECT_EQ(row().outbox, 0U);
  EXPECT_EQ(row().droppedFor(Reason::postRefused), 2U);
}

TEST_F(OutboxURLSessionTest, WaitsForConnectivityOnlyWhereThePostCannotBeKept) {
  start();
  static_cast<void>(post());
  EXPECT_TRUE(network_->lastRequest().neverWaits);
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "disk full"};
  const auto outcome = post("second");
  const size_t second = last();
  fail(second);
  EXPECT_EQ(outcome->calls, 0);
  ASSERT_EQ(last(), second + 1);
  EXPECT_FALSE(network_->lastRequest().neverWaits);
  EXPECT_EQ(body(last()), "second");
  static_cast<void>(post("third"));
  EXPECT_FALSE(network_->lastRequest().neverWaits) << "the disk has failed a moment ago";
  answer(second + 1, 200);
  EXPECT_EQ(outcome->calls, 1);
  EXPECT_EQ(row().delivered, 2U);
}

TEST_F(OutboxURLSessionTest, StartsNothingAgainThatWasCollectedByAConsentThatIsGone) {
  start();
  isByConsent_ = true;
  for (const int32_t code : {6, 7, 45}) {
    test_.consent.setAllowed(true);
    const auto outcome = post();
    test_.consent.setAllowed(false);
    const size_t before = network_->requestCount();
    fail(last(), code);
    EXPECT_EQ(network_->requestCount(), before) << "it would leave once there is a network";
    EXPECT_EQ(outcome->calls, 1);
    EXPECT_TRUE(outcome->error);
  }
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(OutboxURLSessionTest, KeepsWhatFailsAfterItWaitedForConnectivity) {
  start();
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "disk full"};
  const auto outcome = post();
  fail(last());
  disk_->problem.reset();
  pass(Outbox::kDiskPause);
  answer(last(), 503);
  EXPECT_EQ(outcome->calls, 1);
  EXPECT_FALSE(outcome->response);
  EXPECT_EQ(disk_->posts.size(), 1U);
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "disk full"};
  const auto lost = post();
  fail(last());
  ASSERT_EQ(lost->calls, 0);
  fail(last());
  EXPECT_EQ(lost->calls, 1) << "once is enough";
  EXPECT_TRUE(lost->error);
}

TEST_F(OutboxURLSessionTest, KeepsWhatTheEndOfTheDaemonCutsOff) {
  start();
  const auto outcome = post();
  factory_->cancelAll();
  drain();
  EXPECT_EQ(outcome->calls, 1);
  EXPECT_FALSE(outcome->error);
  EXPECT_EQ(disk_->posts.size(), 1U);
  EXPECT_EQ(factory_->outstanding(), 0U);
}

TEST_F(OutboxURLSessionTest, CountsAPostAsOutstandingUntilItIsOnDisk) {
  start();
  static_cast<void>(post());
  network_->fail(last(), Error{kKYTURLErrorDomain, 7, "unreachable"});
  EXPECT_EQ(factory_->outstanding(), 1U);
  drain();
  EXPECT_EQ(factory_->outstanding(), 0U);
  pass(std::chrono::seconds(5));
  EXPECT_EQ(network_->outstanding(), 1U);
  EXPECT_EQ(factory_->outstanding(), 0U) << "a repeat holds up no shut-down";
}

TEST_F(OutboxURLSessionTest, KeepsPostsOfASessionThatHasEnded) {
  start();
  const auto outcome = post();
  session_.reset();
  fail(last());
  EXPECT_EQ(outcome->calls, 1);
  EXPECT_EQ(disk_->posts.size(), 1U);
}

}  // namespace
}  // namespace kyt
