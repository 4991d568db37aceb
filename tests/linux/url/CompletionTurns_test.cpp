#include <algorithm>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/base/UserBudget.h"
#include "platform/queues/SerialQueue.h"
#include "tests/linux/url/CurlURLSessionFixture.h"

namespace kyt {
namespace {

// Completions say in which order they ran. Both workers that may run at once are held until all requests have ended, and
// then one of them alone goes on, so that the order is the queues' and neither the network's nor the scheduler's.
class CompletionTurns : public CurlURLSessionFixture {
 protected:
  static constexpr uint32_t kAnn = 1001, kBob = 1002;

  CompletionTurns() {
    shares_ = UserShares::of(Limits(), uint64_t{16} << 30, 4096);
    budget_ = std::make_unique<UserBudget>(shares_);
  }
  ~CompletionTurns() override {
    letGo(2);
    factory_.reset();  // what completions use is there until they have run
  }

  URLRequest postOf(uint32_t user) {
    URLRequest request = post(server_.url("/"), "x");
    request.account = budget_->account(user);
    return request;
  }
  URLCompletion noting(std::string name) {
    return [this, name = std::move(name)](std::optional<Data>, std::optional<URLResponse>,
                                          std::optional<Error>) {
      std::lock_guard lock(mutex_);
      order_.push_back(name);
      changed_.notify_all();
    };
  }
  // Two queues of Ann's, so both workers.
  void holdTheWorkers() {
    for (int i = 0; i < 2; ++i) {
      holders_.push_back(session());
      holders_.back()->start(postOf(kAnn), [this](std::optional<Data>, std::optional<URLResponse>,
                                                  std::optional<Error>) { hold(); });
    }
    std::unique_lock lock(mutex_);
    ASSERT_TRUE(changed_.wait_for(lock, kTestDeadline, [this] { return held_ == 2; }));
  }
  // Once so many requests have ended; returns how many completions ran before that one.
  size_t placeOf(const std::string& name, uint64_t ended) {
    EXPECT_TRUE(eventually([&] { return factory().figures().completed == ended; }));
    letGo(1);
    std::unique_lock lock(mutex_);
    EXPECT_TRUE(changed_.wait_for(
        lock, kTestDeadline, [&] { return std::find(order_.begin(), order_.end(), name) != order_.end(); }));
    return static_cast<size_t>(std::find(order_.begin(), order_.end(), name) - order_.begin());
  }
  void hold() {
    std::unique_lock lock(mutex_);
    const int number = ++held_;
    changed_.notify_all();
    changed_.wait(lock, [&] { return number <= letGo_; });
  }
  void letGo(int howMany) {
    std::lock_guard lock(mutex_);
    letGo_ = howMany;
    changed_.notify_all();
  }

  TestHTTPServer server_;
  UserShares shares_;
  std::unique_ptr<UserBudget> budget_;
  std::mutex mutex_;
  std::condition_variable changed_;
  int held_ = 0;
  int letGo_ = 0;
  std::vector<std::string> order_;
  std::vector<std::unique_ptr<URLSession>> holders_;
};

// Single messages of all users share a session.
TEST_F(CompletionTurns, ThousandsOfOneUserInASharedSessionHoldUpNoOtherUsersOne) {
  constexpr size_t kPosts = 3000;
  auto shared = session();
  holdTheWorkers();
  for (size_t i = 0; i < kPosts; ++i) shared->start(postOf(kAnn), noting("ann's"));
  EXPECT_TRUE(eventually([&] { return factory().figures().completed == 2 + kPosts; }));
  shared->start(postOf(kBob), noting("bob's"));
  EXPECT_LE(placeOf("bob's", 2 + kPosts + 1), SerialQueue::kFairShare);
}

TEST_F(CompletionTurns, ManySessionsOfOneUserHoldUpNoOtherUsersOne) {
  constexpr size_t kSessions = 100, kPosts = 20;
  std::vector<std::unique_ptr<URLSession>> anns;
  holdTheWorkers();
  for (size_t i = 0; i < kSessions; ++i) {
    anns.push_back(session());
    for (size_t j = 0; j < kPosts; ++j) anns.back()->start(postOf(kAnn), noting("ann's"));
    EXPECT_TRUE(eventually([&] { return factory().figures().completed == 2 + (i + 1) * kPosts; }));
  }
  auto bobs = session();
  bobs->start(postOf(kBob), noting("bob's"));
  EXPECT_LE(placeOf("bob's", 2 + kSessions * kPosts + 1), kPosts) << "one queue of Ann's has its turn before";
}

// In the session that all users share, one whose completion takes long holds up his own alone.
TEST_F(CompletionTurns, OneUsersCompletionThatTakesLongHoldsUpNoOtherUserOfItsSession) {
  auto shared = session();
  shared->start(postOf(kAnn),
                [this](std::optional<Data>, std::optional<URLResponse>, std::optional<Error>) { hold(); });
  {
    std::unique_lock lock(mutex_);
    ASSERT_TRUE(changed_.wait_for(lock, kTestDeadline, [this] { return held_ == 1; }));
  }
  EXPECT_EQ(perform(*shared, postOf(kBob)).status(), 200);
}

}  // namespace
}  // namespace kyt
