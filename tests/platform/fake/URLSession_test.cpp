// Waiting for a request, over the URL session in memory.
#include "platform/URLSession.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <optional>
#include <thread>
#include <utility>

#include "platform/base/Blocking.h"
#include "platform/base/Semaphore.h"
#include "platform/fake/FakeURLSession.h"

namespace kyt {
namespace {

class StartAndWait : public ::testing::Test {
 protected:
  URLReply fetch() {
    URLRequest request;
    request.url = "https://example.org/file";
    return startAndWait(std::move(request), [this](URLRequest sent, URLCompletion completion) {
      session_->start(std::move(sent), std::move(completion));
    });
  }

  FakeURLSessionFactory factory_;
  std::unique_ptr<URLSession> session_ = factory_.create({});
};

TEST_F(StartAndWait, ReturnsWhatTheCompletionWasCalledWith) {
  factory_.setResponder([](const URLRequest&) {
    return FakeURLSessionFactory::Reply{404, {{"Server", "one"}}, "not here", std::nullopt};
  });
  const URLReply reply = fetch();
  EXPECT_EQ(reply.data, Data("not here"));
  ASSERT_TRUE(reply.response);
  EXPECT_EQ(reply.response->status, 404);
  EXPECT_EQ(reply.response->header("server"), "one");
  EXPECT_FALSE(reply.error);
  EXPECT_EQ(factory_.lastRequest().url, "https://example.org/file");
}

TEST_F(StartAndWait, ReturnsTheErrorOfARequestThatFailed) {
  factory_.setResponder([](const URLRequest&) {
    return FakeURLSessionFactory::Reply{0, {}, "", Error{kKYTURLErrorDomain, 6, "no such host"}};
  });
  const URLReply reply = fetch();
  EXPECT_FALSE(reply.data);
  ASSERT_TRUE(reply.error);
  EXPECT_EQ(reply.error->localizedDescription, "no such host");
}

// Tells when its thread begins to wait.
class Waiting final : public BlockingObserver {
 public:
  explicit Waiting(Semaphore& begun) : begun_(begun) {}
  void willBlock(BlockingKind) override { begun_.signal(); }
  void hasBlocked() override {}

 private:
  Semaphore& begun_;
};

TEST_F(StartAndWait, WaitsUntilTheCompletionHasRunOnAnotherThread) {
  Semaphore begun;
  std::atomic<bool> returned{false};
  URLReply reply;
  std::thread caller([&] {
    Waiting waiting(begun);
    BlockingObserver* former = BlockingObserver::exchange(&waiting);
    reply = fetch();
    returned = true;
    BlockingObserver::exchange(former);
  });
  EXPECT_TRUE(begun.waitFor(std::chrono::seconds(30)));
  EXPECT_FALSE(returned);
  EXPECT_TRUE(factory_.complete(0, 200, {}, "late"));
  caller.join();
  EXPECT_EQ(reply.data, Data("late"));
}

TEST_F(StartAndWait, IsEndedByTheShutDownLikeAllThatThreadsWaitFor) {
  URLReply reply;
  std::thread caller([&] { reply = fetch(); });
  EXPECT_TRUE(factory_.waitForRequests(1));
  EXPECT_TRUE(factory_.lastRequest().isAwaited);
  factory_.cancelAwaited();
  EXPECT_FALSE(factory_.isOpen(0));
  factory_.cancelAll();  // whatever was expected, the test ends
  caller.join();
  ASSERT_TRUE(reply.error);
  EXPECT_EQ(reply.error->code, kURLErrorCancelled);
}

TEST(MayHaveLeft, IsAllThatWasAnsweredOrCutOff) {
  const auto failed = [](int32_t code) { return Error{kKYTURLErrorDomain, code, "failed"}; };
  EXPECT_TRUE(mayHaveLeft(URLResponse{503, {}}, std::nullopt));
  EXPECT_TRUE(mayHaveLeft(URLResponse{200, {}}, failed(56)));
  for (const int32_t code : {18, 28, 52, 55, 56, static_cast<int>(kURLErrorCancelled)})
    EXPECT_TRUE(mayHaveLeft(std::nullopt, failed(code))) << code;
  for (const int32_t code : {6, 7, 35, 60, static_cast<int>(kURLErrorWaitingTooMuch),
                             static_cast<int>(kURLErrorOutstandingTooMuch)})
    EXPECT_FALSE(mayHaveLeft(std::nullopt, failed(code))) << code;
}

}  // namespace
}  // namespace kyt
