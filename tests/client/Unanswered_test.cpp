// What the daemon has been sent and has not answered.
#include "client/Unanswered.h"

#include <gtest/gtest.h>

namespace kyt::client {
namespace {

using std::chrono::milliseconds;

constexpr SteadyTime kNow{std::chrono::seconds(1000)};

std::unique_ptr<Command> command(Method method) {
  return std::make_unique<Command>(Call{method});
}

TEST(Unanswered, GivesEachReplyItsCall) {
  Unanswered sent;
  sent.addCall(1, command(Method::fetchDisplayURL));
  sent.addCall(2, command(Method::flushMessagesWithCompletion));
  const auto second = sent.take(2), first = sent.take(1);
  ASSERT_TRUE(first && second);
  EXPECT_EQ(first->call.method, Method::fetchDisplayURL);
  EXPECT_EQ(second->call.method, Method::flushMessagesWithCompletion);
  EXPECT_EQ(sent.take(2), nullptr) << "answered already";
  EXPECT_EQ(sent.take(99), nullptr);
}

TEST(Unanswered, CountsTheMessagesThatNoReplyCameAfter) {
  Unanswered sent;
  for (uint32_t serial = 1; serial <= 3; ++serial) sent.addMessage(serial);
  sent.addCall(4, command(Method::fetchDisplayURL));
  sent.addMessage(5);
  sent.addMessage(6);
  EXPECT_NE(sent.take(4), nullptr);
  Unanswered::Left left = sent.takeAll();
  EXPECT_EQ(left.messages, 2U);
  EXPECT_TRUE(left.answers.empty());
  EXPECT_EQ(sent.takeAll().messages, 0U);
}

TEST(Unanswered, CountsAllMessagesWhenAReplyCameToNothingOfItsOwn) {
  Unanswered sent;
  sent.addMessage(1);
  EXPECT_EQ(sent.take(2), nullptr);
  EXPECT_EQ(sent.takeAll().messages, 1U);
}

TEST(Unanswered, CountsAMessageWithAnAnswerThatDoesNotComeAndNoOtherCall) {
  Unanswered sent;
  sent.addCall(1, command(Method::sendMessageWithDictionary));
  sent.addCall(2, command(Method::sendMessageWithSessionInfo));
  sent.addCall(3, command(Method::flushMessagesWithCompletion));
  sent.addMessage(4);
  EXPECT_EQ(sent.messages(), 1U) << "calls are told of their end";
  const Unanswered::Left left = sent.takeAll();
  EXPECT_EQ(left.messages, 3U);
  EXPECT_EQ(left.answers.size(), 3U);
  EXPECT_EQ(sent.messages(), 0U);
}

TEST(Unanswered, AsksForAPingAtOnceWhenManyMessagesWait) {
  Unanswered sent;
  uint32_t serial = 0;
  sent.addMessage(++serial);
  sent.addPing(++serial, kNow);
  EXPECT_EQ(sent.take(serial), nullptr);
  EXPECT_EQ(sent.messages(), 0U);
  for (uint64_t i = 1; i < KYTReporting::kMostUnacknowledged / 4; ++i) sent.addMessage(++serial);
  EXPECT_EQ(sent.nextPing(), kNow + milliseconds(250));
  sent.addMessage(++serial);
  EXPECT_EQ(sent.nextPing(), kNow);
  sent.addPing(++serial, kNow);
  EXPECT_EQ(sent.nextPing(), std::nullopt);
}

TEST(Unanswered, AcknowledgesWhereSerialsBeginAgain) {
  Unanswered sent;
  sent.addMessage(UINT32_MAX);
  sent.addMessage(0);
  sent.addCall(1, command(Method::fetchDisplayURL));
  EXPECT_NE(sent.take(1), nullptr);
  EXPECT_EQ(sent.takeAll().messages, 0U);
}

TEST(Unanswered, AsksForAPingWhileMessagesWaitAndNoneIsOnItsWay) {
  Unanswered sent;
  EXPECT_EQ(sent.nextPing(), std::nullopt);
  sent.addMessage(1);
  ASSERT_TRUE(sent.nextPing());
  EXPECT_LE(*sent.nextPing(), kNow) << "the first at once";
  sent.addPing(2, kNow);
  EXPECT_EQ(sent.nextPing(), std::nullopt);
  sent.addMessage(3);
  EXPECT_EQ(sent.take(2), nullptr);
  EXPECT_EQ(sent.nextPing(), kNow + milliseconds(250));
  EXPECT_EQ(sent.takeAll().messages, 1U) << "what was sent after the ping";
}

TEST(Unanswered, LeavesTheAnswersInTheirOrderWhenTheConnectionEnds) {
  Unanswered sent;
  std::string told;
  for (uint32_t serial = 1; serial <= 3; ++serial) {
    KYTReporting::SuccessCompletion completion = [&told, serial](bool, const std::optional<Error>&) {
      told += std::to_string(serial);
    };
    sent.addCall(serial, std::make_unique<Command>(Call{Method::uploadLogData, {}, std::move(completion)}));
  }
  sent.addMessage(4);
  sent.addPing(5, kNow);
  Unanswered::Left left = sent.takeAll();
  for (Answer& answer : left.answers) answer.fail(ClientError::notConnected, "ended");
  EXPECT_EQ(told, "123");
  sent.addMessage(1);
  EXPECT_NE(sent.nextPing(), std::nullopt) << "the ping is gone with its connection";
}

}  // namespace
}  // namespace kyt::client
