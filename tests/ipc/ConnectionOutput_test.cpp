// What is kept for a client that does not read, by the kind of message, on a stream in memory.
#include "platform/ipc/ConnectionOutput.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "WireTestSupport.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/MemoryStream.h"

namespace kyt {
namespace {

class ConnectionOutputTest : public ::testing::Test {
 protected:
  using Kind = ConnectionOutput::Kind;
  using Sent = ConnectionOutput::Sent;
  static constexpr size_t kMostQueued = 20000;

  ConnectionOutputTest() {
    output_.setObserver(observer_);
    output_.open();
  }
  Sent send(Kind kind, const std::string& text) {
    return output_.send(
        [&](MessageWriter& out, uint32_t serial) {
          ++built_;
          out.beginSignal(serial, "/a", "b.c", "Passed", "s");
          out.writeString(text);
          return out.end();
        },
        kind);
  }
  // How many whole messages have reached the client; the rest of the last one comes later.
  [[nodiscard]] size_t arrived() const {
    size_t count = 0;
    for (std::string_view rest = pipe_->fromServer; !rest.empty(); ++count) {
      Message message;
      const Frame read = test::frame(rest, message);
      if (read.status != FrameStatus::complete) break;
      rest.remove_prefix(read.size);
    }
    return count;
  }
  struct Observer final : ConnectionOutput::Observer {
    void outputNeedsRoom() override { ++needsRoom; }
    void outputPaused() override { ++paused; }
    void outputDrained() override {}
    void outputOverflowed() override { ++overflowed; }
    void outputBroken() override {}
    int needsRoom = 0, paused = 0, overflowed = 0;
  };

  std::shared_ptr<MemoryPipe> pipe_ = std::make_shared<MemoryPipe>();
  MemoryStream stream_{pipe_, 7};
  std::shared_ptr<Observer> observer_ = std::make_shared<Observer>();
  ConnectionOutput output_{stream_, kMostQueued, nullptr};
  int built_ = 0;
};

TEST_F(ConnectionOutputTest, KeepsOneOptionalMessageForAClientThatDoesNotRead) {
  EXPECT_EQ(send(Kind::optional, "first"), Sent::yes);
  EXPECT_EQ(arrived(), 1U);
  pipe_->room = pipe_->fromServer.size() + 10;
  EXPECT_EQ(send(Kind::optional, "second"), Sent::yes);
  EXPECT_EQ(observer_->needsRoom, 1);
  for (int i = 0; i < 1000; ++i) ASSERT_EQ(send(Kind::optional, "more"), Sent::queueFull);
  EXPECT_EQ(built_, 2) << "what does not leave is not written either";
  EXPECT_EQ(arrived(), 1U);
  pipe_->room = SIZE_MAX;
  output_.writable();
  EXPECT_EQ(arrived(), 2U);
  EXPECT_EQ(send(Kind::optional, "third"), Sent::yes);
  EXPECT_EQ(arrived(), 3U);
  EXPECT_EQ(observer_->paused + observer_->overflowed, 0);
}

TEST_F(ConnectionOutputTest, SendsNothingOptionalWhileAnAnswerWaits) {
  pipe_->room = 10;
  EXPECT_EQ(send(Kind::ordinary, "answer"), Sent::yes);
  EXPECT_EQ(send(Kind::optional, "news"), Sent::queueFull);
  EXPECT_EQ(send(Kind::ordinary, "another"), Sent::yes);
  pipe_->room = SIZE_MAX;
  output_.writable();
  EXPECT_EQ(arrived(), 2U);
}

TEST_F(ConnectionOutputTest, DropsADroppableMessageThatWouldPassTheLimitAndKeepsTheRest) {
  pipe_->room = 0;
  EXPECT_EQ(send(Kind::droppable, std::string(kMostQueued / 2, 'a')), Sent::yes);
  EXPECT_EQ(send(Kind::droppable, std::string(kMostQueued, 'b')), Sent::queueFull);
  EXPECT_EQ(send(Kind::droppable, "c"), Sent::yes);
  EXPECT_EQ(observer_->overflowed, 0);
  pipe_->room = SIZE_MAX;
  output_.writable();
  EXPECT_EQ(arrived(), 2U);
}

TEST_F(ConnectionOutputTest, EndsWithOrdinaryMessagesPastTwiceTheLimitAndNotWithVitalOnes) {
  pipe_->room = 0;
  EXPECT_EQ(send(Kind::vital, std::string(3 * kMostQueued, 'a')), Sent::yes);
  EXPECT_EQ(observer_->overflowed, 0);
  EXPECT_EQ(send(Kind::ordinary, "b"), Sent::yes);
  EXPECT_EQ(observer_->overflowed, 1);
  EXPECT_EQ(send(Kind::optional, "c"), Sent::closed);
}

TEST_F(ConnectionOutputTest, SaysThatABoundedMessageDoesNotFitAndGoesOn) {
  pipe_->room = 0;
  EXPECT_EQ(send(Kind::bounded, std::string(2 * kMostQueued, 'a')), Sent::queueFull);
  EXPECT_EQ(send(Kind::ordinary, "why not"), Sent::yes);
  EXPECT_EQ(send(Kind::bounded, std::string(kMostQueued, 'b')), Sent::yes);
  EXPECT_EQ(send(Kind::bounded, std::string(kMostQueued, 'c')), Sent::queueFull);
  EXPECT_EQ(observer_->overflowed, 0);
  pipe_->room = SIZE_MAX;
  output_.writable();
  EXPECT_EQ(arrived(), 2U);
  EXPECT_EQ(send(Kind::bounded, std::string(kMostQueued, 'c')), Sent::yes);
  EXPECT_EQ(arrived(), 3U);
}

TEST_F(ConnectionOutputTest, SaysThatABoundedMessageHasNoRoomInItsUsersShare) {
  UserShares shares;
  shares[Share::bytes] = 4 * Limits::socketBytes;
  const auto account = std::make_shared<UserAccount>(1000, shares);
  ConnectionOutput output{stream_, size_t{1} << 30, account};
  output.setObserver(observer_);
  output.open();
  const auto send = [&output](Kind kind, size_t bytes) {
    return output.send(
        [bytes](MessageWriter& out, uint32_t serial) {
          out.beginSignal(serial, "/a", "b.c", "Passed", "s");
          out.writeString(std::string(bytes, 'a'));
          return out.end();
        },
        kind);
  };
  pipe_->room = 100;
  EXPECT_EQ(send(Kind::bounded, 4 * Limits::socketBytes), Sent::queueFull);
  EXPECT_EQ(account->holds(Share::bytes), 0U);
  EXPECT_EQ(send(Kind::bounded, 2 * Limits::socketBytes), Sent::yes);
  EXPECT_GT(account->holds(Share::bytes), 2 * Limits::socketBytes);
  EXPECT_EQ(send(Kind::bounded, 2 * Limits::socketBytes), Sent::queueFull);
  EXPECT_EQ(observer_->overflowed, 0);
  pipe_->room = SIZE_MAX;
  output.writable();
  EXPECT_EQ(arrived(), 1U);
  EXPECT_EQ(account->holds(Share::bytes), 0U);
  // What the socket takes at once needs no share.
  Charge others(account, Share::bytes);
  others.setAnyway(5 * Limits::socketBytes);
  EXPECT_EQ(send(Kind::bounded, 1000), Sent::yes);
  EXPECT_EQ(arrived(), 2U);
  EXPECT_EQ(observer_->overflowed, 0);
}

TEST_F(ConnectionOutputTest, SaysThatAMessageCannotBeWrittenAndLeavesNothingOfIt) {
  const auto sent = output_.send(
      [](MessageWriter& out, uint32_t serial) {
        out.beginSignal(serial, "/a", "b.c", "Passed", "s");
        out.writeString(std::string(wire::kMaxMessageBytes, 'x'));
        return out.end();
      },
      Kind::optional);
  EXPECT_EQ(sent, Sent::refused);
  EXPECT_EQ(pipe_->fromServer, "");
  EXPECT_EQ(send(Kind::optional, "whole"), Sent::yes);
  EXPECT_EQ(arrived(), 1U);
}

}  // namespace
}  // namespace kyt
