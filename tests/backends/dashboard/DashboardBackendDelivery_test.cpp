// Reliable delivery, tick by tick, and the end.
#include "tests/backends/dashboard/DashboardFixture.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;
using DashboardDelivery = DashboardFixture;

TEST(UDPPacketToSend, CopiesItsBytesAndBeginsUnsent) {
  std::string bytes(100, 'x');
  const auto packet =
      UDPPacketToSend::initWithBytes(reinterpret_cast<const std::byte*>(bytes.data()), 100, 65535);
  bytes.assign(100, 'y');
  EXPECT_EQ(packet->data().view(), std::string(100, 'x'));
  EXPECT_EQ(packet->eventNumber(), 65535);
  EXPECT_EQ(packet->state(), 0);
  EXPECT_EQ(packet->numberOfChecks(), 0);
  EXPECT_EQ(packet->numberOfRetransmits(), 0);
}

TEST_F(DashboardDelivery, SendsFiveTimesInAllAndGivesUp) {
  ASSERT_NE(make(reliable()), nullptr);
  send(7, {{"k", "v"}});
  std::vector<int> sentAt{0};
  int removedAt = -1;
  for (int t = 1; t <= 25; ++t) {
    const size_t before = socket().sent.size();
    tick();
    for (size_t i = before; i < socket().sent.size(); ++i) sentAt.push_back(t);
    if (removedAt < 0 && queued().empty()) removedAt = t;
  }
  EXPECT_EQ(sentAt, (std::vector<int>{0, 2, 5, 10, 19}));
  EXPECT_EQ(removedAt, 20);
  for (const std::string& datagram : socket().sent) EXPECT_EQ(datagram, socket().sent[0]);
}

TEST_F(DashboardDelivery, TicksWithNothingToDoChangeNothing) {
  for (const Dictionary& how : {profile(), reliable()}) {
    ASSERT_NE(make(how), nullptr);
    tick(50);
    EXPECT_TRUE(socket().open);
    EXPECT_EQ(platform_.timers.pending(), 1u);
    EXPECT_TRUE(platform_.sink.lines().empty());
    send(1);
    EXPECT_EQ(socket().sent.size(), 1u);
  }
}

TEST_F(DashboardDelivery, TicksEveryPeriodOfTheProfile) {
  ASSERT_NE(make(profile({{"reliable", "40"}})), nullptr);
  send(1);
  tick(1, 79ms);
  EXPECT_EQ(socket().sent.size(), 1u);
  tick(1, 1ms);
  EXPECT_EQ(socket().sent.size(), 2u);
}

TEST_F(DashboardDelivery, TakesAPeriodBelow10MillisecondsForThat) {
  for (const Value& period : {Value(0), Value(-5), Value(9), Value("soon")}) {
    ASSERT_NE(make(profile({{"reliable", period}})), nullptr);
    EXPECT_TRUE(backend_->reliableUDP());
    send(1);
    tick(1, 19ms);
    EXPECT_EQ(socket().sent.size(), 1u);
    tick(1, 1ms);
    EXPECT_EQ(socket().sent.size(), 2u);
  }
}

TEST_F(DashboardDelivery, AnAcknowledgementEndsIt) {
  ASSERT_NE(make(reliable()), nullptr);
  send(0x1234);
  EXPECT_EQ(queued(), (std::vector<uint16_t>{0x1234}));
  EXPECT_EQ(backend_->messageQueue()[0]->state(), UDPPacketToSend::kWaiting);
  EXPECT_TRUE(acknowledge(0x1234));
  EXPECT_TRUE(queued().empty());
  tick(25);
  EXPECT_EQ(socket().sent.size(), 1u);
}

TEST_F(DashboardDelivery, AnAcknowledgementEndsTheFirstOfItsNumberAlone) {
  ASSERT_NE(make(reliable()), nullptr);
  for (const uint16_t number : {6, 7, 8, 7}) send(number);
  const UDPPacketToSend* last = backend_->messageQueue()[3].get();
  EXPECT_TRUE(acknowledge(7));
  EXPECT_EQ(queued(), (std::vector<uint16_t>{6, 8, 7}));
  EXPECT_EQ(backend_->messageQueue()[2].get(), last);
  EXPECT_TRUE(acknowledge(7, 1088));
  EXPECT_EQ(queued(), (std::vector<uint16_t>{6, 8}));
  EXPECT_TRUE(acknowledge(7));  // a repeated one changes nothing
  EXPECT_EQ(queued(), (std::vector<uint16_t>{6, 8}));
}

TEST_F(DashboardDelivery, TheNumberAfter65535IsAcknowledgedAsZero) {
  ASSERT_NE(make(reliable()), nullptr);
  for (const uint16_t number : {65534, 65535, 0, 1}) send(number);
  EXPECT_TRUE(acknowledge(0));
  EXPECT_EQ(queued(), (std::vector<uint16_t>{65534, 65535, 1}));
  EXPECT_TRUE(acknowledge(65535));
  EXPECT_EQ(queued(), (std::vector<uint16_t>{65534, 1}));
}

TEST_F(DashboardDelivery, AShortOrWrongAcknowledgementChangesNothing) {
  ASSERT_NE(make(reliable()), nullptr);
  send(0);
  EXPECT_TRUE(acknowledge(0, 1));
  EXPECT_TRUE(acknowledge(0, 60));
  EXPECT_TRUE(acknowledge(0, 61));
  EXPECT_TRUE(arrive(""));
  EXPECT_TRUE(acknowledge(1));
  EXPECT_EQ(queued(), (std::vector<uint16_t>{0}));
  EXPECT_TRUE(acknowledge(0, 62));
  EXPECT_TRUE(queued().empty());
}

TEST_F(DashboardDelivery, AFailedReadIsFollowedByTheNext) {
  ASSERT_NE(make(reliable()), nullptr);
  send(5);
  EXPECT_TRUE(report());  // nothing is there
  EXPECT_TRUE(platform_.reactor.report(socket().descriptor, ready::failed));
  platform_.executor.runAll();
  EXPECT_EQ(queued(), (std::vector<uint16_t>{5}));
  EXPECT_TRUE(acknowledge(5));
  EXPECT_TRUE(queued().empty());
}

// The reactor is silent until the queue has read, however long that takes.
TEST_F(DashboardDelivery, ASocketIsReportedOnceForEachRead) {
  ASSERT_NE(make(reliable()), nullptr);
  const int descriptor = socket().descriptor;
  EXPECT_TRUE(platform_.reactor.report(descriptor, ready::readable));
  EXPECT_FALSE(platform_.reactor.report(descriptor, ready::readable));
  platform_.executor.runAll();
  EXPECT_TRUE(platform_.reactor.report(descriptor, ready::readable));
}

TEST_F(DashboardDelivery, SixtyThatFailLeaveThe50Newest) {
  for (const Dictionary& how : {profile(), reliable()}) {
    platform_.udpSockets.faults.send = 0;
    ASSERT_NE(make(how), nullptr);
    platform_.udpSockets.faults.send = 105;
    for (uint16_t number = 1; number <= 60; ++number) send(number);
    std::vector<uint16_t> expected;
    for (uint16_t number = 11; number <= 60; ++number) expected.push_back(number);
    EXPECT_EQ(queued(), expected);
    EXPECT_EQ(socket().attempts, 60u);
  }
  platform_.udpSockets.faults.send = 0;
}

TEST_F(DashboardDelivery, OfManyUnacknowledgedOnesTheNewestStay) {
  ASSERT_NE(make(reliable()), nullptr);
  for (uint16_t number = 1; number <= 50; ++number) send(number);
  EXPECT_EQ(queued().front(), 1);
  send(51);
  EXPECT_EQ(queued().size(), 50u);
  EXPECT_EQ(queued().front(), 2);
}

TEST_F(DashboardDelivery, WhatWaitsCountsForItsUserAndOlderOnesGiveWay) {
  const auto account = platform_.budget.account(1000);
  ASSERT_NE(make(reliable()), nullptr);
  backend_->setUserAccount(account);
  send(1);
  const uint64_t one = account->holds(Share::bytes);
  EXPECT_GE(one, UDPPacketToSend::kCost + DashboardDatagram::kHeaderSize);
  send(2);
  send(3);
  EXPECT_EQ(account->holds(Share::bytes), 3 * one);
  const uint64_t most = account->most(Share::bytes);
  account->takeAnyway(Share::bytes, most - most / kLeftForMessages - 3 * one);
  send(4);
  EXPECT_EQ(queued(), (std::vector<uint16_t>{2, 3, 4}));
  EXPECT_EQ(platform_.counters.value(Reason::datagramDisplaced), 1u);
  account->takeAnyway(Share::bytes, 3 * one);
  send(5);
  EXPECT_EQ(queued(), std::vector<uint16_t>());
  EXPECT_EQ(platform_.counters.value(Reason::datagramDisplaced), 5u);
  account->giveBack(Share::bytes, most - most / kLeftForMessages);
  EXPECT_TRUE(account->holdsNothing());
  send(6);
  backend_.reset();
  platform_.executor.runAll();
  EXPECT_TRUE(account->holdsNothing());
}

TEST_F(DashboardDelivery, InPlainModeWhatWentOutIsForgotten) {
  ASSERT_NE(make(profile()), nullptr);
  send(1);
  EXPECT_TRUE(queued().empty());
  tick(5);
  EXPECT_EQ(socket().attempts, 1u);
}

TEST_F(DashboardDelivery, InPlainModeWhatFailedIsSentAgainEachTickUntilItGoesOut) {
  ASSERT_NE(make(profile()), nullptr);
  platform_.udpSockets.faults.send = 105;
  send(1);
  send(2);
  tick(3);
  EXPECT_EQ(socket().attempts, 8u);
  EXPECT_EQ(queued(), (std::vector<uint16_t>{1, 2}));
  platform_.udpSockets.faults.send = 0;
  tick();
  EXPECT_TRUE(queued().empty());
  EXPECT_EQ(socket().sent.size(), 2u);
  tick(5);
  EXPECT_EQ(socket().attempts, 10u);
}

TEST_F(DashboardDelivery, APartialSendIsAFailedOne) {
  ASSERT_NE(make(profile()), nullptr);
  platform_.udpSockets.faults.sendOnly = 63;
  send(1);
  EXPECT_EQ(queued(), (std::vector<uint16_t>{1}));
  EXPECT_EQ(backend_->messageQueue()[0]->state(), UDPPacketToSend::kUnsent);
}

TEST_F(DashboardDelivery, InReliableModeWhatFailedWaitsFromItsFirstFullSend) {
  ASSERT_NE(make(reliable()), nullptr);
  platform_.udpSockets.faults.send = 105;
  send(1);
  tick(10);
  EXPECT_EQ(backend_->messageQueue()[0]->state(), UDPPacketToSend::kUnsent);
  platform_.udpSockets.faults.send = 0;
  tick();
  EXPECT_EQ(backend_->messageQueue()[0]->state(), UDPPacketToSend::kWaiting);
  EXPECT_EQ(socket().sent.size(), 1u);
  tick();
  EXPECT_EQ(socket().sent.size(), 1u);
  tick();
  EXPECT_EQ(socket().sent.size(), 2u);
}

TEST_F(DashboardDelivery, AFailedRetransmissionIsTriedEachTickAndCountsNothing) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  platform_.udpSockets.faults.send = 105;
  tick(10);
  EXPECT_EQ(socket().attempts, 1u + 9u);  // at ticks 2 to 10
  EXPECT_EQ(backend_->messageQueue()[0]->numberOfChecks(), 1);
  EXPECT_EQ(backend_->messageQueue()[0]->numberOfRetransmits(), 0);
  platform_.udpSockets.faults.send = 0;
  tick();
  EXPECT_EQ(backend_->messageQueue()[0]->numberOfChecks(), 0);
  EXPECT_EQ(backend_->messageQueue()[0]->numberOfRetransmits(), 1);
  tick(2);
  EXPECT_EQ(socket().sent.size(), 2u);
  tick();
  EXPECT_EQ(socket().sent.size(), 3u);
}

// One that is removed in the middle of a walk hides none behind it.
TEST_F(DashboardDelivery, AWalkMissesNoRecord) {
  ASSERT_NE(make(profile()), nullptr);
  platform_.udpSockets.faults.send = 105;
  for (uint16_t number = 1; number <= 4; ++number) send(number);
  platform_.udpSockets.faults.send = 0;
  tick();
  EXPECT_EQ(socket().sent.size(), 4u);
  EXPECT_TRUE(queued().empty());
}

TEST_F(DashboardDelivery, ARecordOfAnotherStateIsLeftAlone) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  send(2);
  backend_->messageQueue()[0]->setState(2);
  tick(25);
  EXPECT_EQ(queued(), (std::vector<uint16_t>{1}));
  EXPECT_EQ(socket().sent.size(), 1u + 5u);
  EXPECT_EQ(backend_->messageQueue()[0]->numberOfChecks(), 0);
}

TEST_F(DashboardDelivery, TheLastResortEndsReliableDeliveryToo) {
  ASSERT_NE(make(profile({{"reliable", 5000}})), nullptr);  // too slow to give up before
  send(1);
  backend_->cleanup();
  tick(1, 5000ms);
  EXPECT_EQ(backend_->cleanupState(), 2);
  tick(1, 9499ms);
  EXPECT_TRUE(socket().open);
  tick(1, 1ms);
  EXPECT_FALSE(socket().open);
  EXPECT_EQ(platform_.reactor.waitsFor(socket().descriptor), 0u);
  EXPECT_EQ(platform_.timers.pending(), 0u);
}

TEST_F(DashboardDelivery, ACleanUpWithNothingPendingEndsEverythingAtOnce) {
  for (const Dictionary& how : {profile(), reliable()}) {
    ASSERT_NE(make(how), nullptr);
    const int descriptor = socket().descriptor;
    backend_->cleanup();
    EXPECT_EQ(backend_->socketDescriptor(), descriptor);  // on the network queue, not here
    platform_.executor.runAll();
    EXPECT_EQ(backend_->socketDescriptor(), -1);
    EXPECT_FALSE(socket().open);
    EXPECT_EQ(platform_.timers.pending(), 0u);
    EXPECT_EQ(platform_.reactor.waitsFor(descriptor), 0u);
    EXPECT_EQ(backend_->cleanupState(), 0);
  }
}

TEST_F(DashboardDelivery, ACleanUpComesAfterWhatWasSentBefore) {
  ASSERT_NE(make(profile()), nullptr);
  backend_->sendMessage({}, {1, 0}, 2, 3, EventID{1});
  backend_->cleanup();
  platform_.executor.runAll();
  EXPECT_EQ(socket().sent.size(), 1u);
  EXPECT_FALSE(socket().open);
}

TEST_F(DashboardDelivery, ACleanUpWaitsForWhatIsPendingWhenTheSessionIsGone) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  backend_->cleanup();
  platform_.executor.runAll();
  const std::weak_ptr<DashboardBackend> watched = backend_;
  backend_.reset();
  ASSERT_FALSE(watched.expired());
  EXPECT_EQ(watched.lock()->cleanupState(), 1);
  tick();
  EXPECT_EQ(watched.lock()->cleanupState(), 2);
  EXPECT_EQ(
      platform_.sink.count(LogLevel::normal,
                           "DashboardBackend(myPeriodicTask): scheduled last resort clean-up in 9500 ms."),
      1u);
  acknowledge(1);
  EXPECT_TRUE(socket().open);
  tick();
  EXPECT_EQ(
      platform_.sink.count(LogLevel::normal, "DashboardBackend(myPeriodicTask): clean up at myPeriodicTask."),
      1u);
  EXPECT_FALSE(socket().open);
  EXPECT_TRUE(watched.expired());
  EXPECT_EQ(platform_.timers.pending(), 0u);
}

TEST_F(DashboardDelivery, ACleanUpEndsWithTheLastPacketGivenUp) {
  ASSERT_NE(make(profile({{"reliable", 100}})), nullptr);
  send(1);
  backend_->cleanup();
  tick(19, 100ms);
  EXPECT_TRUE(socket().open);
  tick(1, 100ms);
  EXPECT_FALSE(socket().open);
  EXPECT_EQ(socket().sent.size(), 5u);
  EXPECT_FALSE(platform_.sink.contains("can't"));
}

TEST_F(DashboardDelivery, TheLastResortComes9500MillisecondsAfterTheNextTick) {
  ASSERT_NE(make(profile()), nullptr);
  platform_.udpSockets.faults.send = 105;
  send(1);
  backend_->cleanup();
  tick();
  EXPECT_EQ(backend_->cleanupState(), 2);
  tick(1, 9499ms);
  EXPECT_TRUE(socket().open);
  tick(1, 1ms);
  EXPECT_FALSE(socket().open);
  EXPECT_EQ(backend_->socketDescriptor(), -1);
  EXPECT_EQ(platform_.timers.pending(), 0u);
  EXPECT_EQ(platform_.sink.count("last resort"), 1u);
  EXPECT_EQ(platform_.sink.count("clean up at myPeriodicTask"), 0u);
}

TEST_F(DashboardDelivery, TheLastResortIsTakenBackWhenNothingIsPendingAnyMore) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  backend_->cleanup();
  tick();
  EXPECT_EQ(platform_.timers.pending(), 2u);
  acknowledge(1);
  tick();
  EXPECT_FALSE(socket().open);
  EXPECT_EQ(platform_.timers.pending(), 0u);
}

TEST_F(DashboardDelivery, ASecondCleanUpChangesNothing) {
  ASSERT_NE(make(reliable()), nullptr);
  backend_->cleanup();
  backend_->cleanup();
  platform_.executor.runAll();
  EXPECT_FALSE(socket().open);
  send(1);  // is kept, and goes nowhere
  EXPECT_EQ(socket().attempts, 0u);
  EXPECT_EQ(queued(), (std::vector<uint16_t>{1}));
}

TEST_F(DashboardDelivery, ASecondCleanUpDoesNotPutOffTheLastResort) {
  ASSERT_NE(make(profile()), nullptr);
  platform_.udpSockets.faults.send = 105;
  send(1);
  backend_->cleanup();
  tick();
  tick(1, 5000ms);
  backend_->cleanup();
  tick(1, 4499ms);
  EXPECT_TRUE(socket().open);
  tick(1, 1ms);
  EXPECT_FALSE(socket().open);
  EXPECT_EQ(platform_.timers.pending(), 0u);
}

// Nothing would ever end it again: its timer is gone.
TEST_F(DashboardDelivery, ACleanUpAfterTheEndKeepsNothingAlive) {
  ASSERT_NE(make(reliable()), nullptr);
  backend_->cleanup();
  send(1);
  backend_->cleanup();
  platform_.executor.runAll();
  EXPECT_EQ(queued(), (std::vector<uint16_t>{1}));
  const std::weak_ptr<DashboardBackend> watched = backend_;
  backend_.reset();
  EXPECT_TRUE(watched.expired());
}

TEST_F(DashboardDelivery, WithoutACleanUpItEndsWithItsOwner) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  backend_.reset();
  EXPECT_FALSE(socket().open);
  EXPECT_EQ(platform_.timers.pending(), 0u);
}

// A tick, a report and a datagram that were under way when the owner let go find nothing.
TEST_F(DashboardDelivery, WorkThatComesTooLateDoesNothing) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  platform_.timers.advance(500ms);
  platform_.reactor.report(socket().descriptor, ready::readable);
  backend_.reset();
  platform_.executor.runAll();
  EXPECT_FALSE(socket().open);
  EXPECT_EQ(socket().attempts, 1u);
}

TEST_F(DashboardDelivery, AReportThatComesAfterTheCleanUpDoesNothing) {
  ASSERT_NE(make(reliable()), nullptr);
  backend_->cleanup();
  platform_.reactor.report(socket().descriptor, ready::readable);
  platform_.executor.runAll();
  EXPECT_FALSE(socket().open);
}

TEST_F(DashboardDelivery, CountsWhatOthersDisplace) {
  ASSERT_NE(make(reliable()), nullptr);
  for (uint16_t number = 1; number <= 50; ++number) send(number);
  EXPECT_EQ(platform_.counters.value(Reason::datagramDisplaced), 0u);
  for (uint16_t number = 51; number <= 53; ++number) send(number);
  EXPECT_EQ(platform_.counters.value(Reason::datagramDisplaced), 3u);
}

TEST_F(DashboardDelivery, CountsWhatNobodyAcknowledges) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  send(2);
  send(3);
  acknowledge(2);
  tick(19);
  EXPECT_EQ(platform_.counters.value(Reason::datagramUnacknowledged), 0u);
  tick();
  EXPECT_EQ(platform_.counters.value(Reason::datagramUnacknowledged), 2u);
  backend_.reset();
  EXPECT_EQ(platform_.counters.value(Reason::datagramGivenUp), 0u);
}

TEST_F(DashboardDelivery, CountsWhatTheLastResortGivesUp) {
  ASSERT_NE(make(profile()), nullptr);
  platform_.udpSockets.faults.send = 105;
  send(1);
  send(2);
  backend_->cleanup();
  tick();
  tick(1, 9499ms);
  EXPECT_EQ(platform_.counters.value(Reason::datagramGivenUp), 0u);
  tick(1, 1ms);
  EXPECT_EQ(platform_.counters.value(Reason::datagramGivenUp), 2u);
  send(3);  // after the end
  backend_.reset();
  platform_.executor.runAll();
  EXPECT_EQ(platform_.counters.value(Reason::datagramGivenUp), 3u);
}

TEST_F(DashboardDelivery, CountsWhatEndsWithItsOwner) {
  ASSERT_NE(make(reliable()), nullptr);
  send(1);
  backend_.reset();
  EXPECT_EQ(platform_.counters.value(Reason::datagramGivenUp), 1u);
}

TEST_F(DashboardDelivery, CountsRoutedEventsWhichItDoesNotSend) {
  ASSERT_NE(make(profile()), nullptr);
  backend_->KYTReportingBackend::sendMessage({{"k", "v"}}, {1, 0}, 2, 3, MessageFlag{0});
  EXPECT_EQ(platform_.counters.value(Reason::notForThisBackEnd), 1u);
}

}  // namespace
}  // namespace kyt
