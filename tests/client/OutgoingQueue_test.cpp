// What waits for the daemon in a session's queue.
#include "client/OutgoingQueue.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "client/Figures.h"

namespace kyt::client {
namespace {

using std::chrono::seconds;

constexpr SteadyTime kNow{seconds(1000)};

MessageArguments message(uint16_t category, std::string_view text = "") {
  return {category, 1, 0, {{"text", text}}};
}

std::unique_ptr<Command> command(Method method, std::string* failure = nullptr) {
  KYTReporting::ObjectCompletion completion;
  if (failure != nullptr)
    completion = [failure](const Value&, const std::optional<Error>& error) {
      *failure = error ? error->localizedDescription : "";
    };
  return std::make_unique<Command>(Call{method, {}, std::move(completion)});
}

// In order: a message's category, a call's name.
std::vector<std::string> popAll(OutgoingQueue& queue) REQUIRES(libraryThread) {
  std::vector<std::string> order;
  OutgoingQueue::Item item;
  while (queue.pop(item))
    order.push_back(item.command ? std::string(wire::contractOf(item.command->call.method).member)
                                 : std::to_string(item.message.category));
  return order;
}

TEST(OutgoingQueue, KeepsMessagesAndCallsInOrder) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  EXPECT_TRUE(queue.pushMessage(message(1)));
  EXPECT_EQ(queue.pushCommand(command(Method::fetchDisplayURL)), nullptr);
  EXPECT_TRUE(queue.pushMessage(message(2)));
  EXPECT_EQ(queue.messages(), 2U);
  EXPECT_FALSE(queue.isEmpty());
  EXPECT_EQ(popAll(queue), (std::vector<std::string>{"1", "FetchDisplayURL", "2"}));
  EXPECT_TRUE(queue.isEmpty());
}

TEST(OutgoingQueue, RefusesMessagesBeyondItsNumber) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  for (uint16_t i = 0; i < 64; ++i) EXPECT_TRUE(queue.pushMessage(message(i)));
  EXPECT_FALSE(queue.pushMessage(message(64)));
  EXPECT_EQ(queue.messages(), 64U);
  OutgoingQueue::Item item;
  ASSERT_TRUE(queue.pop(item));
  EXPECT_TRUE(queue.pushMessage(message(65)));
}

TEST(OutgoingQueue, RefusesMessagesBeyondItsBytesUntilSomeHaveLeft) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 64 * 1024);
  const std::string half(32 * 1024, 'x');
  EXPECT_TRUE(queue.pushMessage(message(1, half)));
  EXPECT_FALSE(queue.pushMessage(message(2, half)));
  EXPECT_TRUE(queue.pushMessage(message(3)));
  EXPECT_EQ(popAll(queue), (std::vector<std::string>{"1", "3"}));
  EXPECT_TRUE(queue.pushMessage(message(4, half)));
}

TEST(OutgoingQueue, TakesCallsThoughItIsFullAndNoMessageBeforeTheyHaveLeft) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  for (uint16_t i = 0; i < 64; ++i) EXPECT_TRUE(queue.pushMessage(message(i)));
  EXPECT_EQ(queue.pushCommand(command(Method::flushMessagesWithCompletion)), nullptr);
  OutgoingQueue::Item item;
  ASSERT_TRUE(queue.pop(item));
  // It would overtake the flush.
  EXPECT_FALSE(queue.pushMessage(message(64)));
  EXPECT_EQ(queue.pushCommand(command(Method::fetchDisplayURL)), nullptr);
  const std::vector<std::string> order = popAll(queue);
  ASSERT_EQ(order.size(), 65U);
  EXPECT_EQ(order[63], "FlushMessagesWithCompletion");
  EXPECT_EQ(order[64], "FetchDisplayURL");
  EXPECT_TRUE(queue.pushMessage(message(65)));
}

TEST(OutgoingQueue, GivesBackACallWhenThereIsNoMoreRoomForCalls) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  std::string failure = "not told";
  std::unique_ptr<Command> refused;
  size_t taken = 0;
  for (; taken < 10000 && !refused; ++taken)
    refused = queue.pushCommand(command(Method::flushMessagesWithCompletion, &failure));
  ASSERT_NE(refused, nullptr);
  EXPECT_EQ(popAll(queue).size(), taken - 1);
  refused->call.answer.fail(ClientError::queueFull, "full");
  EXPECT_EQ(failure, "full");
}

TEST(OutgoingQueue, TakesTheCompletionsWhoseDeadlineHasPassed) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  std::string flush = "waits", states = "waits", never = "waits";
  auto early = command(Method::flushMessagesWithCompletion, &flush);
  early->deadline = kNow;
  auto late = command(Method::uploadLogData, &states);
  late->deadline = kNow + seconds(5);
  EXPECT_FALSE(queue.hasNewCommand());
  EXPECT_EQ(queue.pushCommand(std::move(early)), nullptr);
  EXPECT_EQ(queue.pushCommand(std::move(late)), nullptr);
  EXPECT_EQ(queue.pushCommand(command(Method::fetchDisplayURL, &never)), nullptr);
  EXPECT_TRUE(queue.hasNewCommand());

  std::vector<Answer> expired = queue.takeExpired(kNow).answers;
  ASSERT_EQ(expired.size(), 1U);
  expired[0].fail(ClientError::timedOut, "late");
  EXPECT_EQ(flush, "late");
  EXPECT_FALSE(queue.hasNewCommand());
  EXPECT_EQ(queue.nextDeadline(), kNow + seconds(5));
  EXPECT_TRUE(queue.takeExpired(kNow + seconds(4)).answers.empty());
  EXPECT_EQ(queue.takeExpired(kNow + seconds(5)).answers.size(), 1U);
  EXPECT_EQ(queue.nextDeadline(), SteadyTime::max());
  EXPECT_EQ(never, "waits");
}

TEST(OutgoingQueue, KeepsALateCallInItsPlaceAndSaysWhetherItIsStillGiven) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  for (const Method method :
       {Method::flushMessagesWithCompletion, Method::startConfigWithCompletionHandler}) {
    auto late = command(method);
    late->deadline = kNow;
    EXPECT_EQ(queue.pushCommand(std::move(late)), nullptr);
  }
  (void)queue.takeExpired(kNow);
  OutgoingQueue::Item item;
  ASSERT_TRUE(queue.pop(item));
  EXPECT_FALSE(item.command->given);
  ASSERT_TRUE(queue.pop(item));
  EXPECT_TRUE(item.command->given);
}

TEST(OutgoingQueue, LooksAtNoDeadlineWhileTheyAreSuspended) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  auto late = command(Method::flushMessagesWithCompletion);
  late->deadline = kNow;
  EXPECT_EQ(queue.pushCommand(std::move(late)), nullptr);
  queue.suspendDeadlines();
  EXPECT_FALSE(queue.hasNewCommand());
  EXPECT_TRUE(queue.takeExpired(kNow).answers.empty());
  queue.lookAgain();
  EXPECT_EQ(queue.takeExpired(kNow).answers.size(), 1U);
}

TEST(OutgoingQueue, LosesAndReordersNothingOfManyThreads) {
  libraryThread.assertCurrent();
  OutgoingQueue queue(64, 1 << 20);
  constexpr uint16_t kThreads = 3, kEach = 500;
  std::vector<std::thread> threads;
  for (uint16_t thread = 0; thread < kThreads; ++thread)
    threads.emplace_back([&queue, thread] {
      for (uint16_t i = 0; i < kEach; ++i) {
        while (!queue.pushMessage({thread, i, 0, {}})) std::this_thread::yield();
        if (i % 50 != 0) continue;
        EXPECT_EQ(queue.pushCommand(command(Method::fetchDisplayURL)), nullptr);
      }
    });
  size_t calls = 0;
  std::vector<int> last(kThreads, -1);
  OutgoingQueue::Item item;
  for (size_t got = 0; got < kThreads * (kEach + kEach / 50);) {
    (void)queue.takeExpired(kNow);
    if (!queue.pop(item)) {
      std::this_thread::yield();
      continue;
    }
    ++got;
    if (item.command) {
      ++calls;
    } else {
      EXPECT_EQ(item.message.type, last[item.message.category] + 1);
      last[item.message.category] = item.message.type;
    }
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(calls, size_t{kThreads} * kEach / 50);
  EXPECT_TRUE(queue.isEmpty());
}

TEST(OutgoingQueue, CountsMessagesAndNoCalls) {
  OutgoingQueue queue(64, 4096);
  libraryThread.assertCurrent();
  const auto call = [](Method method, bool expires) {
    auto made = std::make_unique<Command>(Call{method});
    if (expires) made->deadline = SteadyTime(std::chrono::seconds(1));
    return made;
  };
  EXPECT_TRUE(queue.pushMessage({1, 1, 0, {}}));
  EXPECT_EQ(queue.pushCommand(call(Method::flushMessagesWithCompletion, false)), nullptr);
  EXPECT_EQ(queue.pushCommand(call(Method::sendMessageWithDictionary, false)), nullptr);
  EXPECT_EQ(queue.pushCommand(call(Method::sendMessageWithDictionary, true)), nullptr);
  EXPECT_EQ(queue.accepted(), 3U);
  EXPECT_EQ(queue.messages(), 3U);
  const OutgoingQueue::Expired late = queue.takeExpired(SteadyTime(std::chrono::seconds(2)));
  EXPECT_EQ(late.messages, 1U);
  EXPECT_EQ(queue.messages(), 2U) << "the one that is too late is not sent";
  OutgoingQueue::Item item;
  while (queue.pop(item)) {
  }
  EXPECT_EQ(queue.messages(), 0U);
  EXPECT_EQ(queue.accepted(), 3U);
}

TEST(Figures, AreTheStatisticsOfTheirNames) {
  Figures figures;
  Figure* const all[] = {&figures.written,       &figures.droppedQueueFull,  &figures.lostOnConnectionEnd,
                         &figures.droppedClosed, &figures.droppedInvalid,    &figures.connections,
                         &figures.waitedTooLong, &figures.replayFailed,      &figures.sentUnconfigured,
                         &figures.lostInQueue,   &figures.droppedUnsendable, &figures.droppedTooLate};
  uint64_t count = 0;
  for (Figure* figure : all) figure->add(++count);
  EXPECT_EQ(figures.written.add(100), 1U) << "the figure before";
  const KYTReporting::Statistics told = figures.statistics(20, 10);
  EXPECT_EQ(
      (std::vector<uint64_t>{told.sent, told.droppedQueueFull, told.lostOnConnectionEnd, told.droppedClosed,
                             told.droppedInvalid, told.connections, told.waitedTooLong, told.replayFailed,
                             told.sentUnconfigured, told.lostInQueue, told.droppedUnsendable,
                             told.droppedTooLate, told.queued, told.accepted}),
      (std::vector<uint64_t>{98, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 10, 20}));
}

TEST(Figures, AreAllAddedUp) {
  constexpr size_t kFigures = sizeof(KYTReporting::Statistics) / sizeof(uint64_t);
  EXPECT_EQ(std::size(kLosses) + std::size(kOtherFigures), kFigures);
  KYTReporting::Statistics one, sum;
  uint64_t count = 0;
  for (const NamedFigure& loss : kLosses) one.*loss.figure = ++count;
  for (const auto figure : kOtherFigures) one.*figure = ++count;
  EXPECT_EQ(count, kFigures);
  addTo(sum, one);
  addTo(sum, one);
  for (const NamedFigure& loss : kLosses) EXPECT_EQ(sum.*loss.figure, 2 * (one.*loss.figure)) << loss.reason;
  for (const auto figure : kOtherFigures) EXPECT_EQ(sum.*figure, 2 * (one.*figure));
}

}  // namespace
}  // namespace kyt::client
