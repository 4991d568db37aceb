// Large batches, which are posted beside the session's queue: nothing that others see differs from the posts on it.
#include <atomic>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/base/UserBudget.h"
#include "platform/queues/LineOrder.h"
#include "tests/backends/https/HTTPSFixture.h"

namespace kyt {
namespace {

constexpr int kEvents = 50;  // one more makes a flush

class HTTPSPostBackendBeside : public HTTPSFixture {
 protected:
  HTTPSPostBackendBeside() { showsNothing(); }
  void showsNothing() {
    platform_.consent.setAllowed(false);
    entry_.set("override_dnu", 1);
  }
  void showsText() {
    platform_.consent.setAllowed(true);
    entry_.remove("override_dnu");
  }
  void setDigest() {
    constexpr std::string_view key = "a digest key";
    backend().setDigestKey(Data(key));
  }
  static Dictionary large(int number) {
    return Dictionary{{"number", number}, {"text", std::string(2000, static_cast<char>('a' + number % 20))}};
  }
  // So many that the next of them flushes the batch, then that.
  Value sendBatch() {
    Value answer;
    for (int i = 0; i <= kEvents; ++i) answer = send(5, large(i));
    return answer;
  }
};

struct Reader final : AnswerReader {
  bool wantsAnswer(size_t) override { return wants; }
  bool wants = false;
};

TEST_F(HTTPSPostBackendBeside, ALargeBatchIsPostedByAnotherThread) {
  decided();
  EXPECT_TRUE(sendBatch().isNull());
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_EQ(platform_.deflate.calls.streams, 0) << "nothing is compressed yet";
  platform_.executor.runAll();
  ASSERT_EQ(poster_->requests.size(), 1u);
  ASSERT_EQ(events(0).size(), static_cast<size_t>(kEvents));
  for (int i = 0; i < kEvents; ++i)
    EXPECT_EQ(events(0)[static_cast<size_t>(i)].find("number")->intValue(), i);
}

// One large batch may be written at a time here: what waits beside needs that place, and the flush behind it too.
TEST_F(HTTPSPostBackendBeside, AFlushBehindLargeBatchesThatWaitDoesNotWaitForItself) {
  decided();
  const std::string much(8000, 'm');
  const auto sendLargeBatch = [&](int events) {
    for (int i = 0; i < events; ++i) send(5, Dictionary{{"number", i}, {"text", much}});
  };
  sendLargeBatch(kEvents + 1);
  sendLargeBatch(kEvents);
  sendLargeBatch(40);
  EXPECT_TRUE(poster_->requests.empty());
  FlushAnswer answer;
  backend().flushMessagesWithCompletion(answer.completion());
  ASSERT_EQ(poster_->requests.size(), 3u);
  EXPECT_EQ(events(0).size(), static_cast<size_t>(kEvents));
  EXPECT_EQ(events(2).size(), 41u);
}

TEST_F(HTTPSPostBackendBeside, EventsThatLeaveTheirMessageForWantOfAClientIDCountOnce) {
  entry_.set("extras_on_internal", 1);
  facts_.isInternal = true;
  facts_.udid = std::nullopt;
  decided();
  sendBatch();
  platform_.executor.runAll();
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(dropped(Reason::postWithoutClientID), static_cast<uint64_t>(kEvents));
  poster_->answer(0, 404);
  EXPECT_EQ(dropped(Reason::postRefused), 0u);
}

TEST_F(HTTPSPostBackendBeside, ItsRequestIsTheSameAsOnTheSessionsQueue) {
  setDigest();
  decided();
  sendBatch();
  platform_.executor.runAll();
  const URLRequest beside = poster_->requests.at(0);
  FlushAnswer answer;
  showsNothing();
  make(Array{entry_});
  setDigest();
  decided();
  for (int i = 0; i < kEvents; ++i) send(5, large(i));
  backend().flushMessagesWithCompletion(answer.completion());
  ASSERT_EQ(poster_->requests.size(), 2u);
  const URLRequest& here = poster_->requests.at(1);
  EXPECT_EQ(here.url, beside.url);
  EXPECT_EQ(here.headers, beside.headers);
  EXPECT_TRUE(here.body == beside.body);
}

TEST_F(HTTPSPostBackendBeside, ItsLinesStandBeforeThoseOfWhatComesAfterIt) {
  LineOrder order;
  const LineOrder::Scope scope(order);
  decided();
  sendBatch();
  platform_.log.normal("what comes after it");
  platform_.executor.runAll();
  std::vector<std::string> lines;
  for (const MemoryLogSink::Line& line : platform_.sink.lines())
    for (const char* known : {"event threshold", "Compressed file", "Batching", "what comes after it"})
      if (line.line.find(known) != std::string::npos) lines.emplace_back(known);
  const size_t last = lines.size();
  ASSERT_GE(last, 4u);
  EXPECT_EQ(lines[last - 4], "Batching") << "of the event that is too much";
  EXPECT_EQ(lines[last - 3], "event threshold");
  EXPECT_EQ(lines[last - 2], "Compressed file");
  EXPECT_EQ(lines[last - 1], "what comes after it");
}

TEST_F(HTTPSPostBackendBeside, ASessionWhoseLinesWaitInMassesWaitsForThePost) {
  LineOrder order;
  const LineOrder::Scope scope(order);
  decided();
  sendBatch();
  for (size_t i = 0; i <= LineOrder::kMuch / 1000; ++i)
    platform_.log.normal("%s", std::string(1000, 'x').c_str());
  ASSERT_TRUE(LineOrder::holdsMuch());
  EXPECT_TRUE(poster_->requests.empty());
  send(5);
  EXPECT_EQ(poster_->requests.size(), 1u);
  EXPECT_FALSE(LineOrder::holdsMuch());
}

TEST_F(HTTPSPostBackendBeside, ASmallBatchIsPostedAtOnce) {
  decided();
  for (int i = 0; i <= kEvents; ++i) send(5);
  EXPECT_EQ(poster_->requests.size(), 1u);
}

TEST_F(HTTPSPostBackendBeside, WhatIsPostedLaterLeavesLater) {
  decided();
  sendBatch();
  FlushAnswer answer;
  backend().flushMessagesWithCompletion(answer.completion());
  ASSERT_EQ(poster_->requests.size(), 2u);
  EXPECT_EQ(events(0).size(), static_cast<size_t>(kEvents));
  EXPECT_EQ(events(1).size(), 1u);
  sendBatch();
  send(6, {}, 1);
  ASSERT_EQ(poster_->requests.size(), 5u);
  EXPECT_EQ(events(2).size(), static_cast<size_t>(kEvents));
  EXPECT_EQ(events(3).size(), 1u);
  EXPECT_EQ(events(4).at(0).find("_method")->intValue(), 6);
}

TEST_F(HTTPSPostBackendBeside, CleanUpHandsEverythingToThePoster) {
  decided();
  sendBatch();
  backend().cleanup();
  EXPECT_EQ(poster_->requests.size(), 1u);
}

TEST_F(HTTPSPostBackendBeside, ItLeavesThoughItsBackEndHasGone) {
  decided();
  for (int i = 0; i < kEvents; ++i) send(5, large(i));
  send(5);
  backend_.reset();
  platform_.executor.runAll();
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(events(0).size(), static_cast<size_t>(kEvents));
  poster_->answer(0, 503);
}

TEST_F(HTTPSPostBackendBeside, ATextThatIsWantedIsMadeAtOnceAndOneThatIsNotFreezesTheStateAllTheSame) {
  showsText();
  Reader reader;
  decided();
  backend().setAnswerReader(&reader);
  EXPECT_TRUE(sendBatch().isNull());
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_TRUE(backend().immutable());
  reader.wants = true;
  for (int i = 0; i + 1 < kEvents; ++i) send(5, large(i));
  EXPECT_TRUE(send(5).isString());
  ASSERT_EQ(poster_->requests.size(), 2u) << "with the one before it";
  EXPECT_EQ(events(0).size(), static_cast<size_t>(kEvents));
}

TEST_F(HTTPSPostBackendBeside, RecordsCountWithTheUserUntilTheirRequestDoes) {
  const auto account = platform_.budget.account(1000);
  decided();
  backend().setUserAccount(account);
  sendBatch();
  const uint64_t before = account->holds(Share::bytes);
  EXPECT_GT(before, 2000u * kEvents);
  platform_.executor.runAll();
  EXPECT_LT(account->holds(Share::bytes), before / 10) << "but for the one event of the next batch";
  EXPECT_EQ(poster_->requests.at(0).account, account);
}

TEST_F(HTTPSPostBackendBeside, ARefusalSwitchesTheBackEndOff) {
  decided();
  sendBatch();
  platform_.executor.runAll();
  poster_->answer(0, 503);
  EXPECT_EQ(backend().state(), kBackendStateDisabled);
  EXPECT_EQ(dropped(Reason::postRefused), static_cast<uint64_t>(kEvents));
}

TEST_F(HTTPSPostBackendBeside, WithoutAPosterItsEventsAreCounted) {
  decided().setReportingSessionConnectivityDelegate({});
  sendBatch();
  platform_.executor.runAll();
  EXPECT_EQ(dropped(Reason::postWithoutPoster), static_cast<uint64_t>(kEvents));
}

TEST_F(HTTPSPostBackendBeside, EveryEventLeavesInOrderWhileAnotherThreadPosts) {
  class NumbersOfEvents final : public ReportingSessionConnectivityInterface {
   public:
    void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion) override {
      MutexLock lock(mutex_);
      requests_.push_back(std::move(request));
    }
    std::vector<URLRequest> take() {
      MutexLock lock(mutex_);
      return std::move(requests_);
    }

   private:
    Mutex mutex_;
    std::vector<URLRequest> requests_ GUARDED_BY(mutex_);
  };
  const auto poster = std::make_shared<NumbersOfEvents>();
  platform_.log.setLevel(LogLevel::error);
  decided().setReportingSessionConnectivityDelegate(poster);
  constexpr int kAll = 20 * kEvents;
  {
    std::jthread worker([this](const std::stop_token& stop) {
      while (!stop.stop_requested()) {
        platform_.executor.runAll();
        std::this_thread::yield();
      }
    });
    for (int i = 0; i < kAll; ++i) send(5, large(i));
    backend().cleanup();
  }
  poster_->requests = poster->take();
  int next = 0;
  for (size_t post = 0; post < poster_->requests.size(); ++post)
    for (const Dictionary& record : events(post)) EXPECT_EQ(record.find("number")->intValue(), next++);
  EXPECT_EQ(next, kAll - kEvents) << "all but the last batch";
}

}  // namespace
}  // namespace kyt
