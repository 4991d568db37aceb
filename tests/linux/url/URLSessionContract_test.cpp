// What every implementation of the URL session port promises, tested on the real one and on the one in
// memory.
#include <atomic>
#include <thread>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/FakeURLSession.h"
#include "platform/queues/WorkerPool.h"
#include "tests/linux/url/CurlURLSessionFixture.h"

namespace kyt {
namespace {

// One implementation with a server behind it that answers 200 and the request's body.
class Implementation {
 public:
  virtual ~Implementation() = default;
  virtual URLSessionFactory& factory() = 0;
  virtual std::string url() = 0;
  virtual void answerAll() = 0;  // from now on; until then requests stay open
};

// The answer is the beginning of the request's body: what servers answer is small, and counts too.
constexpr size_t kEchoed = 1000;

class RealImplementation final : public Implementation {
 public:
  RealImplementation() {
    server_.setHandler([](const TestHTTPServer::Request& request) {
      return TestHTTPServer::Reply{.body = request.body.substr(0, kEchoed),
                                   .behaviour = TestHTTPServer::Behaviour::hold};
    });
  }
  URLSessionFactory& factory() override { return factory_; }
  std::string url() override { return server_.url("/"); }
  void answerAll() override { server_.release(); }

 private:
  TestHTTPServer server_;
  MemoryLogSink sink_;
  Log log_{sink_};
  Counters counters_;
  CurlURLSessionFactory factory_{{}, log_, counters_};
};

class FakeImplementation final : public Implementation {
 public:
  ~FakeImplementation() override { pool_.shutDown(); }
  URLSessionFactory& factory() override { return factory_; }
  std::string url() override { return "http://server.example/"; }
  void answerAll() override {
    factory_.setResponder([](const URLRequest& request) {
      return FakeURLSessionFactory::Reply{.body = std::string(request.body.view().substr(0, kEchoed))};
    });
    for (size_t i = 0; i < factory_.requestCount(); ++i)
      factory_.complete(i, 200, {}, factory_.request(i).body.view().substr(0, kEchoed));
  }

 private:
  WorkerPool pool_{{}};
  FakeURLSessionFactory factory_{&pool_};
};

template <typename T>
class URLSessionContract : public testing::Test {
 protected:
  URLRequest request(std::string_view body = "body") {
    URLRequest made;
    made.method = "POST";
    made.url = implementation_.url();
    made.body = Data(body);
    return made;
  }
  URLRequest awaited(std::string_view body = "body") {
    URLRequest made = request(body);
    made.isAwaited = true;
    return made;
  }
  URLSessionFactory& factory() { return implementation_.factory(); }
  bool drained() {
    return eventually([&] { return factory().outstanding() == 0; });
  }
  T implementation_;
};
using Implementations = testing::Types<RealImplementation, FakeImplementation>;
TYPED_TEST_SUITE(URLSessionContract, Implementations);

TYPED_TEST(URLSessionContract, CompletesOnceOnAnotherThread) {
  auto urls = this->factory().create({});
  this->implementation_.answerAll();
  Outcome outcome;
  urls->start(this->request(), outcome.completion());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200);
  EXPECT_EQ(outcome.body(), "body");
  EXPECT_NE(outcome.thread(), std::this_thread::get_id());
  EXPECT_TRUE(this->drained());
  EXPECT_EQ(outcome.calls(), 1);
}

TYPED_TEST(URLSessionContract, CountsWhatIsOutstanding) {
  auto urls = this->factory().create({});
  Outcome outcome;
  urls->start(this->request(), outcome.completion());
  urls->start(this->request(), nullptr);
  EXPECT_EQ(this->factory().outstanding(), 2u);
  this->implementation_.answerAll();
  EXPECT_TRUE(this->drained());
  EXPECT_EQ(this->factory().figures().started, 2u);
  EXPECT_EQ(this->factory().figures().completed, 2u);
  EXPECT_EQ(this->factory().figures().failed, 0u);
}

TYPED_TEST(URLSessionContract, CompletesWhatWasStartedBeforeTheSessionIsGone) {
  auto urls = this->factory().create({});
  Outcome outcome;
  urls->start(this->request(), outcome.completion());
  urls.reset();
  EXPECT_FALSE(outcome.isDone());
  this->implementation_.answerAll();
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200);
}

TYPED_TEST(URLSessionContract, RefusesWhatIsStartedAfterInvalidation) {
  auto urls = this->factory().create({});
  urls->finishTasksAndInvalidate();
  urls->finishTasksAndInvalidate();
  Outcome outcome;
  urls->start(this->request(), outcome.completion());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(outcome.error()->domain, kKYTURLErrorDomain);
  EXPECT_FALSE(outcome.data());
  EXPECT_FALSE(outcome.response());
}

TYPED_TEST(URLSessionContract, CancelsATask) {
  auto urls = this->factory().create({});
  Outcome outcome;
  const auto task = urls->start(this->request(), outcome.completion());
  task->cancel();
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.errorCode(), kURLErrorCancelled);
  this->implementation_.answerAll();
  task->cancel();
  EXPECT_TRUE(this->drained());
  EXPECT_EQ(outcome.calls(), 1);
}

TYPED_TEST(URLSessionContract, CancelsAllForGood) {
  auto urls = this->factory().create({});
  Outcome before, after;
  urls->start(this->request(), before.completion());
  this->factory().cancelAll();
  urls->start(this->request(), after.completion());
  ASSERT_TRUE(before.wait() && after.wait());
  EXPECT_EQ(before.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(after.errorCode(), kURLErrorCancelled);
  EXPECT_TRUE(this->drained());
  EXPECT_EQ(this->factory().figures().failed, 2u);
}

TYPED_TEST(URLSessionContract, CancelsWhatIsAwaitedForGoodAndNothingElse) {
  auto urls = this->factory().create({}), other = this->factory().create({});
  Outcome awaited, awaitedElsewhere, plain, lateAwaited, latePlain;
  urls->start(this->awaited(), awaited.completion());
  urls->start(this->request("plain"), plain.completion());
  other->start(this->awaited(), awaitedElsewhere.completion());
  this->factory().cancelAwaited();
  ASSERT_TRUE(awaited.wait() && awaitedElsewhere.wait());
  EXPECT_EQ(awaited.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(awaited.error()->domain, kKYTURLErrorDomain);
  EXPECT_FALSE(awaited.data());
  EXPECT_FALSE(awaited.response());
  EXPECT_EQ(awaitedElsewhere.errorCode(), kURLErrorCancelled);
  this->factory().cancelAwaited();
  urls->start(this->awaited(), lateAwaited.completion());
  ASSERT_TRUE(lateAwaited.wait());
  EXPECT_EQ(lateAwaited.errorCode(), kURLErrorCancelled);
  urls->start(this->request("late"), latePlain.completion());
  EXPECT_FALSE(plain.isDone());
  this->implementation_.answerAll();
  ASSERT_TRUE(plain.wait() && latePlain.wait());
  EXPECT_EQ(plain.body(), "plain");
  EXPECT_EQ(latePlain.body(), "late");
  EXPECT_TRUE(this->drained());
  EXPECT_EQ(this->factory().figures().failed, 3u);
  EXPECT_EQ(awaited.calls(), 1);
  EXPECT_EQ(lateAwaited.calls(), 1);
}

TYPED_TEST(URLSessionContract, RefusesWhatIsAwaitedEvenBeforeAnythingWasStarted) {
  this->factory().cancelAwaited();
  auto urls = this->factory().create({});
  Outcome outcome;
  urls->start(this->awaited(), outcome.completion());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.errorCode(), kURLErrorCancelled);
  EXPECT_TRUE(this->drained());
}

// Threads that wait for one request after the other, as uploads do, while the shut-down begins.
TYPED_TEST(URLSessionContract, LeavesNoThreadWaitingWhenAwaitedRequestsAreStartedMeanwhile) {
  constexpr int kThreads = 8, kAfterwards = 5;
  std::atomic<int> started{0}, wrong{0}, unanswered{0};
  {
    std::vector<std::jthread> threads;
    for (int i = 0; i < kThreads; ++i) {
      threads.emplace_back([&] {
        auto urls = this->factory().create({});
        for (int cancelled = 0; cancelled < kAfterwards; ++cancelled) {
          Outcome outcome;
          urls->start(this->awaited(), outcome.completion());
          ++started;
          // Nobody answers: only the cancelling ends the first, and nothing but a refusal the others.
          if (!outcome.wait()) ++unanswered;
          if (outcome.errorCode() != kURLErrorCancelled || outcome.calls() != 1) ++wrong;
        }
      });
    }
    EXPECT_TRUE(eventually([&] { return started > 0; }));
    this->factory().cancelAwaited();
  }
  EXPECT_EQ(unanswered, 0);
  EXPECT_EQ(wrong, 0);
  EXPECT_TRUE(this->drained());
  EXPECT_EQ(this->factory().figures().failed, static_cast<uint64_t>(kThreads) * kAfterwards);
}

TYPED_TEST(URLSessionContract, CompletesOnceWhenAReplyAndTheCancellingRace) {
  constexpr size_t kRequests = 40;
  auto urls = this->factory().create({});
  std::vector<Outcome> outcomes(kRequests);
  for (Outcome& outcome : outcomes) urls->start(this->awaited(), outcome.completion());
  {
    const std::jthread answering([&] { this->implementation_.answerAll(); });
    this->factory().cancelAwaited();
  }
  uint64_t replies = 0;
  for (const Outcome& outcome : outcomes) {
    ASSERT_TRUE(outcome.wait());
    if (outcome.status() == 200)
      ++replies;
    else
      EXPECT_EQ(outcome.errorCode(), kURLErrorCancelled);
  }
  EXPECT_TRUE(this->drained());
  for (const Outcome& outcome : outcomes) EXPECT_EQ(outcome.calls(), 1);
  EXPECT_EQ(this->factory().figures().completed, replies);
  EXPECT_EQ(this->factory().figures().failed, kRequests - replies);
}

TYPED_TEST(URLSessionContract, RefusesWhatWouldMakeTooMuchOutstanding) {
  auto urls = this->factory().create({}), other = this->factory().create({});
  const std::string piece(Limits::maxOutstandingBytes / 16, 'x');
  std::vector<Outcome> admitted(15);  // with what each request costs one more is too much
  for (Outcome& outcome : admitted) urls->start(this->request(piece), outcome.completion());
  Outcome refused, small, elsewhere;
  urls->start(this->request(piece), refused.completion());
  ASSERT_TRUE(refused.wait());
  EXPECT_EQ(refused.errorCode(), kURLErrorOutstandingTooMuch);
  EXPECT_EQ(refused.error()->domain, kKYTURLErrorDomain);
  EXPECT_EQ(this->factory().figures().refused, 1u);
  urls->start(this->request("small"), small.completion());
  other->start(this->request("elsewhere"), elsewhere.completion());
  this->implementation_.answerAll();
  for (Outcome& outcome : admitted) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.errorText(), "");
  }
  ASSERT_TRUE(small.wait() && elsewhere.wait());
  EXPECT_EQ(small.body(), "small");
  EXPECT_EQ(elsewhere.body(), "elsewhere");
  EXPECT_TRUE(this->drained());
  std::vector<Outcome> again(15);  // there is room again
  for (Outcome& outcome : again) urls->start(this->request(piece), outcome.completion());
  for (Outcome& outcome : again) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.errorText(), "");
  }
  EXPECT_EQ(this->factory().figures().refused, 1u);
}

// Single messages of all users share one session.
TYPED_TEST(URLSessionContract, RefusesInASharedSessionTheUserOfWhomTooMuchIsOutstandingThereAlone) {
  UserBudget budget(UserShares::of(Limits(), uint64_t{16} << 30, 4096));
  auto urls = this->factory().create({});
  const std::string piece(Limits::maxOutstandingBytes / 16, 'x');
  const auto start = [&](uint32_t user, Outcome& outcome) {
    URLRequest request = this->request(piece);
    request.account = budget.account(user);
    urls->start(std::move(request), outcome.completion());
  };
  std::vector<Outcome> admitted(15);
  for (Outcome& outcome : admitted) start(1, outcome);
  Outcome refused;
  start(1, refused);
  ASSERT_TRUE(refused.wait());
  EXPECT_EQ(refused.errorCode(), kURLErrorOutstandingTooMuch);
  std::vector<Outcome> ofAnother(3);
  for (Outcome& outcome : ofAnother) start(2, outcome);
  this->implementation_.answerAll();
  for (const std::vector<Outcome>* outcomes : {&admitted, &ofAnother})
    for (const Outcome& outcome : *outcomes) {
      ASSERT_TRUE(outcome.wait());
      EXPECT_EQ(outcome.errorText(), "");
    }
  EXPECT_TRUE(this->drained());
  EXPECT_EQ(this->factory().figures().refused, 1u);
}

TYPED_TEST(URLSessionContract, RefusesTheUserOfWhomTooMuchIsOutstanding) {
  Limits limits;
  limits.maxBytesPerUser = 3u << 20;
  UserBudget budget(UserShares::of(limits, 0, 0));
  auto urls = this->factory().create({}), other = this->factory().create({});
  const auto start = [&](URLSession& session, uint32_t user, size_t bytes, Outcome& outcome) {
    URLRequest request = this->request(std::string(bytes, 'x'));
    request.account = budget.account(user);
    session.start(std::move(request), outcome.completion());
  };
  Outcome first, second, refused, ofAnother;
  start(*urls, 1, 1u << 20, first);
  start(*other, 1, 1u << 20, second);  // of all its sessions
  start(*urls, 1, 1u << 20, refused);  // an eighth is for others than requests
  ASSERT_TRUE(refused.wait());
  EXPECT_EQ(refused.errorCode(), kURLErrorOutstandingTooMuch);
  start(*urls, 2, 1u << 20, ofAnother);
  this->implementation_.answerAll();
  for (Outcome* outcome : {&first, &second, &ofAnother}) {
    ASSERT_TRUE(outcome->wait());
    EXPECT_EQ(outcome->errorText(), "");
  }
  EXPECT_TRUE(this->drained());
  EXPECT_TRUE(budget.account(1)->holdsNothing());
  EXPECT_EQ(this->factory().figures().refused, 1u);
}

TYPED_TEST(URLSessionContract, ARequestOfAnySizeLeavesRoomForSmallOnes) {
  auto urls = this->factory().create({});
  Outcome large, small;
  urls->start(this->request(std::string(Limits::maxOutstandingBytes + 1, 'x')), large.completion());
  urls->start(this->request("small"), small.completion());
  this->factory().cancelAll();
  ASSERT_TRUE(large.wait() && small.wait());
  EXPECT_EQ(large.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(small.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(this->factory().figures().refused, 0u);
}

TYPED_TEST(URLSessionContract, StartsARequestFromACompletion) {
  this->implementation_.answerAll();
  auto urls = this->factory().create({});
  Outcome second;
  urls->start(this->request("first"),
              [&](auto, auto, auto) { urls->start(this->request("second"), second.completion()); });
  ASSERT_TRUE(second.wait());
  EXPECT_EQ(second.body(), "second");
  EXPECT_TRUE(this->drained());
}

}  // namespace
}  // namespace kyt
