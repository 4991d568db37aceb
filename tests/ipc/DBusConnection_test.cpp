// Turns, time and gathering of replies, step by step, on streams in memory.
#include "platform/ipc/DBusConnection.h"

#include <gtest/gtest.h>

#include "WireTestSupport.h"
#include "platform/Entitlements.h"
#include "platform/base/Blocking.h"
#include "platform/base/Limits.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/fake/MemoryStream.h"
#include "platform/ipc/DBusServer.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

constexpr int kStream = 7;

class CountingSession : public ClientSessionInterface {
 public:
  void setSessionInfo(Dictionary, std::optional<Dictionary>, Value, bool) override { ++calls; }
  void startConfigWithCompletionHandler(StatesReply reply) override { held.push_back(std::move(reply)); }
  void fetchStatesWithUserInfo(std::optional<Dictionary>, StatesReply reply) override { reply(std::nullopt); }
  void fetchDisplayURL(StringReply reply) override {
    ++calls;
    if (onDisplayURL) {
      onDisplayURL(std::move(reply));
    } else if (blocks) {
      reply("early");
      BlockingScope blocking;
      writesWhenBlocked = writes();
    } else {
      reply("url");
    }
  }
  void sendMessageWithDictionary(Dictionary, ObjectReply) override { ++calls; }
  void flushMessagesWithCompletion(ResultReply) override {}
  void finishSessionGracefully() override { ++calls; }
  void uploadFileAtPath(String, String, std::optional<FileExtension>, SuccessReply) override {}
  void uploadLogData(Value, SuccessErrorReply) override {}
  void sendMessageWithSessionInfo(Dictionary, std::optional<Dictionary>, uint16_t, uint16_t,
                                  std::optional<Dictionary>, StringReply) override {}
  void updateSharedDataWithDictionary(Dictionary) override {}
  void updateSharedDataForKey(String, Value) override {}
  void setDigestKey(Data, int32_t) override {}

  int calls = 0;
  bool blocks = false;
  size_t writesWhenBlocked = 0;
  std::function<size_t()> writes;
  std::vector<StatesReply> held;
  std::function<void(StringReply)> onDisplayURL;
};

class NoEntitlements final : public Entitlements {
 public:
  Value valueFor(const PeerCredentials&, std::string_view) override { return {}; }
};

class Connected : public ::testing::Test, public ListenerDelegate {
 protected:
  Connected() {
    auto acceptor = std::make_unique<MemoryAcceptor>();
    acceptor_ = acceptor.get();
    server_ = std::make_unique<DBusServer>(
        DBusServerServices{limits_, counters_, log_, clock_, timers_, executor_, reactor_, entitlements_,
                           budget_, "00112233445566778899aabbccddeeff"},
        std::move(acceptor));
    server_->setDelegate(*this);
    server_->resume();
    session_->writes = [this] { return pipe_->writes; };
    pipe_->credentials.uid = 1000;
    acceptor_->waiting.push_back(std::make_unique<MemoryStream>(pipe_, kStream));
    EXPECT_TRUE(reactor_.report(MemoryAcceptor::kDescriptor, ready::readable));
    executor_.runAll();
  }
  ~Connected() override {
    server_->invalidateConnections();
    executor_.runAll();
    EXPECT_EQ(server_->connectionCount(), 0u);
    EXPECT_TRUE(pipe_->closed);
  }
  bool listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& connection) override {
    connection->setExportedObject(session_);
    connection->setInterruptionHandler([this] { ++interruptions_; });
    connection->setInvalidationHandler([this] { ++invalidations_; });
    connection->resume();
    connection_ = connection;
    return true;
  }
  void shakeHands() {
    say(ClientHandshake::opening(1000));
    executor_.runAll();
    EXPECT_NE(pipe_->fromServer.find("AGREE_UNIX_FD\r\n"), std::string::npos);
    pipe_->fromServer.clear();
    pipe_->writes = pipe_->reads = 0;
  }
  void say(std::string_view bytes) {
    pipe_->toServer.append(bytes);
    EXPECT_TRUE(reactor_.report(kStream, ready::readable));
  }
  static std::string calls(std::string_view member, unsigned count) {
    std::string bytes;
    MessageWriter writer(bytes);
    for (unsigned i = 1; i <= count; ++i) {
      writer.beginCall(i, {.member = member});
      EXPECT_TRUE(writer.end());
    }
    return bytes;
  }
  static std::string displayURLCalls(unsigned count) { return calls("FetchDisplayURL", count); }

  Limits limits_ = [] {
    Limits limits;
    limits.maxQueuedBytes = 20000;
    return limits;
  }();
  UserBudget budget_{UserShares::of(limits_, uint64_t{1} << 30, 65536)};
  Counters counters_;
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  ManualClock clock_;
  ManualTimers timers_{clock_};
  ManualExecutor executor_;
  ManualReactor reactor_;
  NoEntitlements entitlements_;
  std::shared_ptr<MemoryPipe> pipe_ = std::make_shared<MemoryPipe>();
  std::shared_ptr<CountingSession> session_ = std::make_shared<CountingSession>();
  std::shared_ptr<Connection> connection_;
  MemoryAcceptor* acceptor_ = nullptr;
  std::unique_ptr<DBusServer> server_;
  int interruptions_ = 0, invalidations_ = 0;
};

using DBusConnectionTest = Connected;

TEST_F(DBusConnectionTest, EndsAHandshakeThatTakesThirtySeconds) {
  say(std::string("\0AUTH", 5));
  executor_.runAll();
  timers_.advance(std::chrono::milliseconds(29900));
  executor_.runAll();
  EXPECT_EQ(invalidations_, 0);
  timers_.advance(std::chrono::milliseconds(200));
  executor_.runAll();
  EXPECT_EQ(interruptions_, 1);
  EXPECT_EQ(invalidations_, 1);
  EXPECT_EQ(counters_.value(Reason::handshakeTimedOut), 1u);
  EXPECT_TRUE(pipe_->closed);
}

TEST_F(DBusConnectionTest, HasNoTimerOnceTheHandshakeIsDone) {
  EXPECT_EQ(timers_.pending(), 1u);
  shakeHands();
  EXPECT_EQ(timers_.pending(), 0u);
}

TEST_F(DBusConnectionTest, MessagesToAClientWaitForTheEndOfItsHandshake) {
  EXPECT_FALSE(connection_->remoteObjectProxy().sendMessageToClient(std::nullopt, 0, 1, 2, std::nullopt));
  executor_.runAll();
  EXPECT_TRUE(pipe_->fromServer.empty());
  say(ClientHandshake::opening(1000));
  executor_.runAll();
  const std::string& said = pipe_->fromServer;
  EXPECT_EQ(said.substr(0, 3), "OK ");
  Message message;
  const size_t start = said.find("AGREE_UNIX_FD\r\n") + 15;
  ASSERT_EQ(test::frame(std::string_view(said).substr(start), message).status, FrameStatus::complete);
  EXPECT_EQ(message.member, "SendMessageToClient");
}

TEST_F(DBusConnectionTest, AnswersThePipelinedCallsOfATurnInOneWrite) {
  shakeHands();
  say(displayURLCalls(100));
  executor_.runAll();
  EXPECT_EQ(session_->calls, 100);
  EXPECT_EQ(pipe_->writes, 1u);
  EXPECT_EQ(pipe_->reads, 2u) << "who sent many calls may have sent more meanwhile";
  EXPECT_EQ(reactor_.waitsFor(kStream), ready::readable);
}

TEST_F(DBusConnectionTest, ReadsOnceForFewCalls) {
  shakeHands();
  say(displayURLCalls(10));
  executor_.runAll();
  EXPECT_EQ(session_->calls, 10);
  EXPECT_EQ(pipe_->reads, 1u) << "a read that does not fill the buffer is the last";
  EXPECT_EQ(reactor_.waitsFor(kStream), ready::readable);
}

TEST_F(DBusConnectionTest, WritesWhatItGatheredBeforeAnOperationBlocks) {
  shakeHands();
  session_->blocks = true;
  say(displayURLCalls(1));
  executor_.runAll();
  EXPECT_EQ(session_->writesWhenBlocked, 1u);
}

TEST_F(DBusConnectionTest, HandsItsWorkerBackAfter256Calls) {
  shakeHands();
  say(displayURLCalls(600));
  unsigned turns = 0;
  std::vector<int> callsAfterTurn;
  while (executor_.runOne()) {
    ++turns;
    callsAfterTurn.push_back(session_->calls);
    EXPECT_EQ(reactor_.waitsFor(kStream), session_->calls < 600 ? 0u : ready::readable);
  }
  EXPECT_EQ(callsAfterTurn, (std::vector<int>{256, 512, 600}));
  EXPECT_EQ(reactor_.waitsFor(kStream), ready::readable);
}

TEST_F(DBusConnectionTest, HandsItsWorkerBackWhenItsCallsTakeLong) {
  session_->onDisplayURL = [this](StringReply reply) {
    clock_.advance(std::chrono::microseconds(5));
    reply("url");
  };
  shakeHands();
  say(displayURLCalls(120));
  std::vector<int> callsAfterTurn;
  while (executor_.runOne()) callsAfterTurn.push_back(session_->calls);
  EXPECT_EQ(callsAfterTurn, (std::vector<int>{48, 96, 120})) << "200 microseconds, looked at after every 16";
}

TEST_F(DBusConnectionTest, HandsItsWorkerBackAfterAMebibyte) {
  shakeHands();
  std::string bytes;
  MessageWriter writer(bytes);
  for (uint32_t i = 1; i <= 40; ++i) {
    writer.beginCall(i, {.member = "SendMessageWithDictionary", .signature = "a{sv}", .expectsReply = false});
    writer.writeDictionary({{"text", std::string(60000, 'x')}});
    ASSERT_TRUE(writer.end());
  }
  say(bytes);
  ASSERT_TRUE(executor_.runOne());
  EXPECT_GE(session_->calls, 15);
  EXPECT_LE(session_->calls, 18);
  executor_.runAll();
  EXPECT_EQ(session_->calls, 40);
}

TEST_F(DBusConnectionTest, RepliesFromOutsideATurnLeaveAtOnce) {
  shakeHands();
  say(calls("StartConfigWithCompletionHandler", 1));
  executor_.runAll();
  ASSERT_EQ(session_->held.size(), 1u);
  EXPECT_EQ(pipe_->writes, 0u);
  session_->held[0](Array{"a"});
  EXPECT_EQ(pipe_->writes, 1u);
  session_->held[0](Array{"again"});
  EXPECT_EQ(pipe_->writes, 1u) << "a second answer is none";
}

TEST_F(DBusConnectionTest, AnswersThatComeAfterTheEndAreDropped) {
  shakeHands();
  say(calls("StartConfigWithCompletionHandler", 1));
  pipe_->ended = true;
  executor_.runAll();
  EXPECT_TRUE(reactor_.report(kStream, ready::readable | ready::ended));
  executor_.runAll();
  EXPECT_EQ(invalidations_, 1);
  EXPECT_EQ(interruptions_, 0);
  EXPECT_TRUE(pipe_->closed);
  session_->held[0](Array{"a"});
  session_->held.clear();
  EXPECT_TRUE(pipe_->fromServer.empty());
}

TEST_F(DBusConnectionTest, WaitsForRoomAndGoesOnWhereItStopped) {
  shakeHands();
  pipe_->room = 100;
  say(displayURLCalls(50));
  executor_.runAll();
  EXPECT_EQ(pipe_->fromServer.size(), 100u);
  EXPECT_EQ(reactor_.waitsFor(kStream), ready::readable | ready::writable);
  std::string all;
  while (reactor_.waitsFor(kStream) == (ready::readable | ready::writable)) {
    all += std::exchange(pipe_->fromServer, std::string());
    ASSERT_TRUE(reactor_.report(kStream, ready::writable));
  }
  all += pipe_->fromServer;
  size_t at = 0;
  for (uint32_t i = 1; i <= 50; ++i) {
    Message message;
    const Frame frame = test::frame(std::string_view(all).substr(at), message);
    ASSERT_EQ(frame.status, FrameStatus::complete);
    EXPECT_EQ(message.replySerial, i);
    at += frame.size;
  }
  EXPECT_EQ(at, all.size());
}

TEST_F(DBusConnectionTest, EndsWhenTheRestOfAMessageDoesNotCome) {
  shakeHands();
  const std::string call = displayURLCalls(1);
  say(call + call.substr(0, 20));
  executor_.runAll();
  EXPECT_EQ(session_->calls, 1);
  timers_.advance(std::chrono::seconds(29));
  executor_.runAll();
  EXPECT_EQ(invalidations_, 0);
  timers_.advance(std::chrono::seconds(1));
  executor_.runAll();
  EXPECT_EQ(invalidations_, 1);
  EXPECT_EQ(interruptions_, 1);
  EXPECT_EQ(counters_.value(Reason::messageTimedOut), 1u);
  EXPECT_TRUE(sink_.contains(LogLevel::normal, "the rest of a message did not come"));
}

TEST_F(DBusConnectionTest, GoesOnWhileEachMessageIsCompletedInTime) {
  shakeHands();
  const std::string call = displayURLCalls(1);
  say(call.substr(0, 20));
  executor_.runAll();
  for (int i = 1; i <= 5; ++i) {
    timers_.advance(std::chrono::seconds(20));
    executor_.runAll();
    say(call.substr(20) + call.substr(0, 20));
    executor_.runAll();
    ASSERT_EQ(session_->calls, i);
  }
  say(call.substr(20));
  executor_.runAll();
  timers_.advance(std::chrono::seconds(100));
  executor_.runAll();
  EXPECT_EQ(invalidations_, 0);
  EXPECT_EQ(timers_.pending(), 0u) << "an idle connection has no timer";
}

TEST_F(DBusConnectionTest, PausesAClientThatDoesNotReadAndGoesOnAsItDoes) {
  shakeHands();
  pipe_->room = 5000;
  constexpr int kCalls = 2000;
  say(displayURLCalls(kCalls));
  executor_.runAll();
  EXPECT_LT(session_->calls, 700);
  EXPECT_EQ(reactor_.waitsFor(kStream), ready::writable) << "it reads no more";
  EXPECT_EQ(counters_.value(Reason::queuedBytesExceeded), 1u);
  size_t answered = 0;
  while ((reactor_.waitsFor(kStream) & ready::writable) != 0) {
    answered += std::exchange(pipe_->fromServer, std::string()).size();
    ASSERT_TRUE(reactor_.report(kStream, ready::writable));
    executor_.runAll();
  }
  answered += pipe_->fromServer.size();
  EXPECT_EQ(session_->calls, kCalls);
  EXPECT_EQ(answered % kCalls, 0u);
  EXPECT_EQ(reactor_.waitsFor(kStream), ready::readable);
}

TEST_F(DBusConnectionTest, HandlesWhatWasReadBeforeItFinishes) {
  shakeHands();
  say(displayURLCalls(400));
  ASSERT_TRUE(executor_.runOne());
  connection_->finish();
  pipe_->toServer += displayURLCalls(5);
  executor_.runAll();
  EXPECT_EQ(session_->calls, 400);
  EXPECT_EQ(invalidations_, 1);
  EXPECT_TRUE(pipe_->closed);
}

TEST_F(DBusConnectionTest, EveryTruncationOfAConversationEndsItInTheRightWay) {
  for (const std::string& call : test::everyCall()) {
    for (const size_t cut : {size_t{1}, size_t{15}, size_t{17}, call.size() - 1, call.size()}) {
      auto pipe = std::make_shared<MemoryPipe>();
      pipe->credentials.uid = 1000;
      pipe->toServer = ClientHandshake::opening(1000) + call.substr(0, cut);
      pipe->ended = true;
      pipe->passed = 2;
      const int interruptions = interruptions_, invalidations = invalidations_;
      acceptor_->waiting.push_back(std::make_unique<MemoryStream>(pipe, 8));
      ASSERT_TRUE(reactor_.report(MemoryAcceptor::kDescriptor, ready::readable));
      executor_.runAll();
      while (reactor_.report(8, ready::readable)) executor_.runAll();
      EXPECT_EQ(invalidations_, invalidations + 1);
      EXPECT_TRUE(pipe->closed);
      const bool whole = cut == call.size();
      EXPECT_EQ(interruptions_, interruptions + (whole ? 0 : 1)) << cut;
    }
  }
}

TEST_F(DBusConnectionTest, TriesAgainToAcceptAfterAPauseWhenNoDescriptorsAreLeft) {
  acceptor_->whenEmpty = AcceptStatus::exhausted;
  ASSERT_TRUE(reactor_.report(MemoryAcceptor::kDescriptor, ready::readable));
  executor_.runAll();
  EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), 0u) << "it must not spin";
  EXPECT_EQ(counters_.value(Reason::tooManyConnections), 1u);
  acceptor_->whenEmpty = AcceptStatus::wouldBlock;
  timers_.advance(std::chrono::milliseconds(100));
  executor_.runAll();
  EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), ready::readable);
}

TEST_F(DBusConnectionTest, TriesAgainToAcceptAfterAnyOtherFailure) {
  acceptor_->whenEmpty = AcceptStatus::failed;
  ASSERT_TRUE(reactor_.report(MemoryAcceptor::kDescriptor, ready::readable));
  for (int i = 0; i < 3; ++i) {
    executor_.runAll();
    EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), 0u) << "it must not spin";
    timers_.advance(std::chrono::seconds(1));
  }
  EXPECT_EQ(counters_.value(Reason::acceptFailed), 3u);
  EXPECT_EQ(sink_.count(LogLevel::error, "DBusServer(accept): the listening socket failed, trying again"),
            1u);
  acceptor_->whenEmpty = AcceptStatus::wouldBlock;
  executor_.runAll();
  EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), ready::readable);
}

TEST_F(DBusConnectionTest, WatchesItsSocketAnewWhenTheSystemRefused) {
  reactor_.refuses = true;
  reactor_.refuseToRearm(true);
  ASSERT_TRUE(reactor_.report(MemoryAcceptor::kDescriptor, ready::readable));
  executor_.runAll();
  EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), 0u);
  EXPECT_EQ(counters_.value(Reason::acceptFailed), 1u);
  timers_.advance(std::chrono::seconds(1));
  executor_.runAll();
  EXPECT_EQ(counters_.value(Reason::acceptFailed), 2u);
  reactor_.refuses = false;
  timers_.advance(std::chrono::seconds(1));
  executor_.runAll();
  EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), ready::readable);
}

TEST_F(DBusConnectionTest, LeavesWhoComesWhileAcceptingPausesInTheLine) {
  server_->pauseAccepting();
  const auto pipe = std::make_shared<MemoryPipe>();
  acceptor_->waiting.push_back(std::make_unique<MemoryStream>(pipe, kStream + 1));
  static_cast<void>(reactor_.report(MemoryAcceptor::kDescriptor, ready::readable));
  executor_.runAll();
  EXPECT_EQ(server_->connectionCount(), 1u);
  EXPECT_EQ(acceptor_->waiting.size(), 1u);
  EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), 0u) << "what waits there must not wake anybody";
  server_->resumeAccepting();
  executor_.runAll();
  EXPECT_EQ(server_->connectionCount(), 2u);
  EXPECT_EQ(reactor_.waitsFor(MemoryAcceptor::kDescriptor), ready::readable);
  server_->stopAccepting();
  server_->resumeAccepting();
  acceptor_->waiting.push_back(std::make_unique<MemoryStream>(pipe, kStream + 2));
  executor_.runAll();
  EXPECT_EQ(acceptor_->waiting.size(), 1u) << "the end of accepting is for good";
}

TEST_F(DBusConnectionTest, TellsAClientWhoseHandshakeTheEndCutsOffThatItMayComeAgain) {
  connection_->finish();
  executor_.runAll();
  EXPECT_EQ(pipe_->fromServer, kServerEnds);
  ClientHandshake handshake;
  size_t consumed = 0;
  EXPECT_EQ(handshake.feed(std::as_bytes(std::span(pipe_->fromServer)), consumed),
            ClientHandshake::Status::failed);
  EXPECT_TRUE(handshake.serverEnds());
  EXPECT_STREQ(handshake.problem(), "the daemon is ending");
}

TEST_F(DBusConnectionTest, DescriptorsBehindBeginInOneReadBelongToTheirMessage) {
  std::string bytes = ClientHandshake::opening(1000);
  MessageWriter writer(bytes);
  writer.beginCall(1, {.member = "FetchDisplayURL", .unixFds = 2});
  ASSERT_TRUE(writer.end());
  pipe_->passed = 2;
  const int closed = MemoryPipe::closedDescriptors;
  say(bytes);
  executor_.runAll();
  EXPECT_EQ(counters_.value(Reason::malformedMessage), 0u);
  EXPECT_EQ(session_->calls, 1);
  EXPECT_EQ(MemoryPipe::closedDescriptors, closed + 2) << "that call does not want them";
}

TEST_F(DBusConnectionTest, DescriptorsOfTheHandshakeItselfAreClosed) {
  const std::string opening = ClientHandshake::opening(1000);
  const int closed = MemoryPipe::closedDescriptors;
  pipe_->passed = 2;
  say(opening.substr(0, 10));
  executor_.runAll();
  EXPECT_EQ(MemoryPipe::closedDescriptors, closed + 2);
  pipe_->passed = 3;
  say(opening.substr(10));
  executor_.runAll();
  EXPECT_EQ(MemoryPipe::closedDescriptors, closed + 5);
}

TEST_F(DBusConnectionTest, AHandshakeThatBreaksOffLeavesNoTimer) {
  say(std::string("\0AUTH", 5));
  executor_.runAll();
  EXPECT_EQ(timers_.pending(), 1u);
  pipe_->ended = true;
  ASSERT_TRUE(reactor_.report(kStream, ready::readable));
  executor_.runAll();
  EXPECT_EQ(invalidations_, 1);
  EXPECT_EQ(timers_.pending(), 0u);
}

TEST_F(DBusConnectionTest, HandlesNoCallAfterItWasInvalidated) {
  shakeHands();
  session_->onDisplayURL = [this](StringReply reply) {
    reply("url");
    connection_->invalidate();
  };
  say(displayURLCalls(5));
  executor_.runAll();
  EXPECT_EQ(session_->calls, 1);
  EXPECT_EQ(invalidations_, 1);
}

TEST_F(DBusConnectionTest, WhatATurnsDeferredWorkAnswersLeavesBeforeTheEnd) {
  shakeHands();
  const auto other = SerialQueue::create("test.other", executor_);
  session_->onDisplayURL = [&](StringReply reply) {
    other->async([reply = std::move(reply)]() mutable { reply("late"); });
    connection_->invalidate();
  };
  say(displayURLCalls(1));
  executor_.runAll();
  EXPECT_TRUE(pipe_->closed);
  EXPECT_NE(pipe_->fromServer.find("late"), std::string::npos);
}

TEST_F(DBusConnectionTest, AClientThatEndedItsSideIsReadToTheEndAlthoughItTakesNoReplies) {
  shakeHands();
  pipe_->room = 100;
  constexpr int kCalls = 800;  // replies of more than the limit, and less than twice that
  say(displayURLCalls(kCalls));
  executor_.runAll();
  EXPECT_LT(session_->calls, kCalls);
  EXPECT_EQ(counters_.value(Reason::queuedBytesExceeded), 1u);
  pipe_->ended = true;
  ASSERT_TRUE(reactor_.report(kStream, ready::ended));
  executor_.runAll();
  EXPECT_EQ(session_->calls, kCalls);
  EXPECT_EQ(invalidations_, 1);
  EXPECT_TRUE(pipe_->closed);
  EXPECT_EQ(counters_.value(Reason::clientNotReading), 0u);
}

TEST_F(DBusConnectionTest, NothingIsKeptForAClientThatPassedTwiceTheLimit) {
  shakeHands();
  pipe_->room = 0;
  say(calls("StartConfigWithCompletionHandler", 1));
  executor_.runAll();
  ASSERT_EQ(session_->held.size(), 1u);
  session_->held[0](Array{std::string(50000, 'x')});
  EXPECT_TRUE(connection_->remoteObjectProxy().sendMessageToClient(std::nullopt, 0, 1, 2, std::nullopt))
      << "before its queue has seen to the end";
  EXPECT_EQ(counters_.value(Reason::aggregatorMessageDropped), 1u);
  EXPECT_TRUE(connection_->remoteObjectProxy().sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt));
  EXPECT_EQ(counters_.value(Reason::aggregatorMessageDropped), 1u) << "nobody misses the end of aggregation";
  executor_.runAll();
  EXPECT_EQ(invalidations_, 1);
  EXPECT_TRUE(pipe_->closed);
}

TEST_F(DBusConnectionTest, AMessageThatCannotBeWrittenIsAnErrorAndCounted) {
  shakeHands();
  Value nested = 1;
  for (int depth = 0; depth < 70; ++depth) nested = Value(Array{nested});
  const auto error = connection_->remoteObjectProxy().sendMessageToClient(std::nullopt, 0, 1, 2,
                                                                          Dictionary{{"nested", nested}});
  ASSERT_TRUE(error);
  EXPECT_EQ(error->localizedDescription, "The message is too large or nested too deeply");
  EXPECT_EQ(counters_.value(Reason::aggregatorMessageDropped), 1u);
  EXPECT_FALSE(connection_->remoteObjectProxy().sendMessageToClient(std::nullopt, 0, 1, 2, std::nullopt));
  EXPECT_EQ(counters_.value(Reason::aggregatorMessageDropped), 1u);
}

// Others end a session's aggregation: what they send must not cut it off.
TEST_F(DBusConnectionTest, TheMessageThatEndsAnAggregationEndsNoConnection) {
  shakeHands();
  pipe_->room = 0;
  say(calls("StartConfigWithCompletionHandler", 1));
  executor_.runAll();
  ASSERT_EQ(session_->held.size(), 1u);
  session_->held[0](Array{std::string(39880, 'x')});  // nearly twice the limit
  EXPECT_FALSE(connection_->remoteObjectProxy().sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt));
  executor_.runAll();
  EXPECT_EQ(invalidations_, 0);
  pipe_->room = SIZE_MAX;
  ASSERT_TRUE(reactor_.report(kStream, ready::writable));
  executor_.runAll();
  EXPECT_GT(pipe_->fromServer.size(), 40000u) << "or there was room for it";
  EXPECT_NE(pipe_->fromServer.find("SendMessageToClient"), std::string::npos);
}

// At the deadline of a shut-down.
TEST_F(DBusConnectionTest, InvalidatingEndsTheWaitOfAFinishedConnectionToBeWritten) {
  shakeHands();
  pipe_->room = 10;
  say(displayURLCalls(5));
  executor_.runAll();
  connection_->finish();
  executor_.runAll();
  EXPECT_EQ(invalidations_, 1);
  EXPECT_FALSE(pipe_->closed) << "it waits for room";
  connection_->invalidate();
  executor_.runAll();
  EXPECT_TRUE(pipe_->closed);
  EXPECT_EQ(server_->connectionCount(), 0u);
  EXPECT_EQ(invalidations_, 1);
}

TEST_F(DBusConnectionTest, InvalidatingRightAfterFinishingWaitsForNothing) {
  shakeHands();
  pipe_->room = 10;
  say(displayURLCalls(5));
  executor_.runAll();
  connection_->finish();
  connection_->invalidate();
  executor_.runAll();
  EXPECT_EQ(invalidations_, 1);
  EXPECT_TRUE(pipe_->closed);
}

// Its rest would be missing where the client is read again.
TEST_F(DBusConnectionTest, EndsWhereAPausedClientsRestFindsNoRoom) {
  shakeHands();
  pipe_->room = 0;
  session_->onDisplayURL = [](StringReply reply) { reply(std::string(1000, 'x')); };
  const auto account = budget_.account(1000);
  const uint64_t room = limits_.maxQueuedBytes + Limits::socketBytes + 20000;
  account->takeAnyway(Share::bytes, account->most(Share::bytes) - account->holds(Share::bytes) - room);
  say(displayURLCalls(500));
  executor_.runAll();
  EXPECT_EQ(counters_.value(Reason::queuedBytesExceeded), 1u);
  EXPECT_EQ(counters_.value(Reason::userBytesExceeded), 1u);
  EXPECT_EQ(invalidations_, 1);
  EXPECT_EQ(interruptions_, 1);
}

TEST(DBusServerInMemory, FreesConnectionsThatAreThereWhenItGoes) {
  const Limits limits;
  UserBudget budget{UserShares::of(limits, uint64_t{1} << 30, 65536)};
  Counters counters;
  MemoryLogSink sink;
  Log log(sink, LogLevel::debug);
  ManualClock clock;
  ManualTimers timers(clock);
  ManualExecutor executor;
  ManualReactor reactor;
  NoEntitlements entitlements;
  struct Keeper final : ListenerDelegate {
    bool listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& c) override {
      c->setExportedObject(std::make_shared<CountingSession>());
      c->resume();
      connection = c;
      return true;
    }
    std::weak_ptr<Connection> connection;
  } keeper;
  auto acceptor = std::make_unique<MemoryAcceptor>();
  MemoryAcceptor* accepting = acceptor.get();
  auto server = std::make_unique<DBusServer>(
      DBusServerServices{limits, counters, log, clock, timers, executor, reactor, entitlements, budget, "id"},
      std::move(acceptor));
  server->setDelegate(keeper);
  server->resume();
  accepting->waiting.push_back(std::make_unique<MemoryStream>(std::make_shared<MemoryPipe>(), kStream));
  ASSERT_TRUE(reactor.report(MemoryAcceptor::kDescriptor, ready::readable));
  executor.runAll();
  ASSERT_FALSE(keeper.connection.expired());
  server.reset();
  EXPECT_TRUE(keeper.connection.expired());
}

}  // namespace
}  // namespace kyt
