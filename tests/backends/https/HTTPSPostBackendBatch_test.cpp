// The road of one event by state and flag, the batch and its flush.
#include "platform/objects/ObjectSize.h"
#include "tests/backends/https/HTTPSFixture.h"

namespace kyt {
namespace {

class HTTPSPostBackendBatch : public HTTPSFixture {
 protected:
  HTTPSPostBackend& inState(int32_t state) {
    decided();
    backend().setState(state);
    return backend();
  }
  FlushAnswer flush() {
    FlushAnswer answer;
    backend().flushMessagesWithCompletion(answer.completion());
    return answer;
  }
  // Flushes, answers the request, and says how many records it had.
  size_t postedRecords() {
    const size_t before = poster_->requests.size();
    backend().flushMessagesWithCompletion(nullptr);
    return poster_->requests.size() == before ? 0 : events(before).size();
  }
  bool logged(const char* text) const { return platform_.sink.contains(LogLevel::debug, text); }
};

TEST_F(HTTPSPostBackendBatch, ADisabledBackEndDropsEvents) {
  inState(kBackendStateDisabled);
  EXPECT_TRUE(send(5, {}, 3).isNull());
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_EQ(backend().batchedEventsSize(), 0u);
  EXPECT_EQ(dropped(Reason::eventDroppedByState), 1u);
}

TEST_F(HTTPSPostBackendBatch, AnUndecidedBackEndBatchesWhateverTheFlag) {
  backend();
  for (const int32_t flag : {0, 1, 2, 3}) EXPECT_TRUE(send(5, {}, flag).isNull());
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_EQ(backend().state(), kBackendStateUndecided);
  EXPECT_TRUE(logged("HTTPSPostBackend(sendMessage): Batching 0, 1, 1"));
  EXPECT_TRUE(logged("HTTPSPostBackend(sendMessage): realtime is 0"));
  EXPECT_TRUE(logged("HTTPSPostBackend(sendMessage): realtime is 1"));
  decided();
  EXPECT_EQ(postedRecords(), 4u);
}

TEST_F(HTTPSPostBackendBatch, SaysWhetherAnEventIsRealtime) {
  backend();
  for (const auto& [flag, line] :
       {std::pair(0, "realtime is 0"), std::pair(1, "realtime is 1"), std::pair(2, "realtime is 0"),
        std::pair(3, "realtime is 1"), std::pair(7, "realtime is 0")}) {
    platform_.sink.clear();
    send(5, {}, flag);
    EXPECT_TRUE(logged((std::string("HTTPSPostBackend(sendMessage): ") + line).c_str())) << flag;
  }
}

TEST_F(HTTPSPostBackendBatch, AnExpediteMessageFreesAHeldBackEndAndIsItselfBatched) {
  inState(kBackendStateHeld);
  send(5);
  send(5, {}, 2);
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_EQ(backend().state(), kBackendStateEnabled);
  backend().setBatchEvents(false);
  send(6);
  EXPECT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(postedRecords(), 2u);
}

TEST_F(HTTPSPostBackendBatch, FlagThreeFreesAHeldBackEndTooAndFlagSixDoesNot) {
  inState(kBackendStateHeld);
  send(5, {}, 6);
  EXPECT_EQ(backend().state(), kBackendStateHeld);
  send(5, {}, 3);
  EXPECT_EQ(backend().state(), kBackendStateEnabled);
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(HTTPSPostBackendBatch, WithoutUserInformationARequiringSessionBatchesEvenRealtimeEvents) {
  inState(kBackendStateEnabled);
  backend().setUserInfoDict(std::nullopt);
  send(5, {}, 1);
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(HTTPSPostBackendBatch, ASessionThatNeedsNoUserInformationSendsAndFlushesWithoutIt) {
  userInfo_ = std::nullopt;
  facts_.requireUserInfo = false;
  inState(kBackendStateEnabled);
  send(5);
  EXPECT_EQ(postedRecords(), 1u);
  backend().setBatchEvents(false);
  send(6);
  EXPECT_EQ(poster_->requests.size(), 2u);
}

TEST_F(HTTPSPostBackendBatch, SendsAloneWhatIsNotBatched) {
  inState(kBackendStateEnabled);
  backend().setBatchEvents(false);
  const Value text = send(5);
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(events(0).size(), 1u);
  EXPECT_EQ(poster_->requests[0].url, "https://post.example.org/events");
  EXPECT_EQ(poster_->header(0, "X-KYT-Event-Map"), "5 2");
  ASSERT_NE(text.string(), nullptr);
  EXPECT_EQ(std::get<Value>(platform_.json.parse(*text.string())), message(0));
  EXPECT_TRUE(logged("HTTPSPostBackend(sendMessage): Sending 2, 0, 1"));
  EXPECT_FALSE(backend().immutable());
}

TEST_F(HTTPSPostBackendBatch, ARealtimeEventWithoutABatchIsJustSent) {
  inState(kBackendStateEnabled);
  const Value text = send(5, {}, 1);
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(poster_->requests[0].url, "https://post.example.org/realtime");
  EXPECT_FALSE(backend().immutable());
  EXPECT_NE(text.string()->view().substr(0, 7), "Flushed");
}

TEST_F(HTTPSPostBackendBatch, ARealtimeEventFlushesTheBatchFirst) {
  inState(kBackendStateEnabled);
  send(5);
  const Value text = send(6, {}, 1);
  ASSERT_EQ(poster_->requests.size(), 2u);
  EXPECT_EQ(events(0).at(0).find("_method")->intValue(), 5);
  EXPECT_EQ(events(1).at(0).find("_method")->intValue(), 6);
  const std::string_view shown = text.string()->view();
  EXPECT_EQ(shown.substr(0, 17), "Flushed events:\n{");
  EXPECT_NE(shown.find("\nStandalone event:\n{"), std::string_view::npos);
  EXPECT_TRUE(backend().immutable());
  EXPECT_TRUE(logged(
      "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing "
      "Flush here to keep events in order."));
}

// Says whether texts are wanted, and keeps what it was asked.
struct Reader final : AnswerReader {
  bool wantsAnswer(size_t leastBytes) override {
    asked.push_back(leastBytes);
    return wants;
  }
  bool wants = false;
  std::vector<size_t> asked;
};

TEST_F(HTTPSPostBackendBatch, MakesNoTextThatNobodyWantsAndFreezesTheStateAllTheSame) {
  Reader reader;
  inState(kBackendStateEnabled);
  backend().setAnswerReader(&reader);
  send(5);
  FlushAnswer answer;
  EXPECT_TRUE(backend().flushMessagesWithCompletion(answer.completion()).isNull());
  EXPECT_TRUE(backend().immutable());
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(events(0).size(), 1u);
  poster_->answer(0, 200);
  EXPECT_EQ(answer.calls, 1);
  EXPECT_TRUE(answer.result.isNull());
  EXPECT_EQ(answer.error, std::nullopt);
  EXPECT_EQ(reader.asked, std::vector<size_t>{PostRequest::prettyText(body(0)).string()->size()});
}

TEST_F(HTTPSPostBackendBatch, MakesTheTextThatIsWantedAsLongAsItSaid) {
  Reader reader;
  reader.wants = true;
  inState(kBackendStateEnabled);
  backend().setAnswerReader(&reader);
  send(5);
  const Value text = backend().flushMessagesWithCompletion(nullptr);
  ASSERT_TRUE(text.isString());
  ASSERT_EQ(reader.asked.size(), 1u);
  EXPECT_EQ(text.string()->size(), reader.asked[0]);
}

TEST_F(HTTPSPostBackendBatch, AsksOnceForTheTextOfAnEventAndOfTheFlushBeforeIt) {
  Reader reader;
  reader.wants = true;
  inState(kBackendStateEnabled);
  backend().setAnswerReader(&reader);
  send(5);
  const Value both = send(6, {}, 1);
  ASSERT_TRUE(both.isString());
  ASSERT_EQ(reader.asked.size(), 1u);
  EXPECT_GE(both.string()->size(), reader.asked[0]);
  EXPECT_GT(reader.asked[0], both.string()->size() - 50) << "all but what stands between them";
  reader.wants = false;
  send(5);
  EXPECT_TRUE(send(6, {}, 1).isNull());
  EXPECT_EQ(reader.asked.size(), 2u);
  EXPECT_EQ(poster_->requests.size(), 4u);
}

TEST_F(HTTPSPostBackendBatch, AsksForNoTextThatMayNotBeShown) {
  Reader reader;
  platform_.consent.setAllowed(false);
  entry_.set("override_dnu", 1);
  inState(kBackendStateEnabled);
  backend().setAnswerReader(&reader);
  send(5);
  send(6, {}, 1);
  EXPECT_EQ(poster_->requests.size(), 2u);
  EXPECT_TRUE(reader.asked.empty());
}

TEST_F(HTTPSPostBackendBatch, WhereNothingMayBeShownNothingIsReturnedAndNothingFrozen) {
  platform_.consent.setAllowed(false);
  entry_.set("override_dnu", 1);
  inState(kBackendStateEnabled);
  send(5);
  EXPECT_TRUE(send(6, {}, 1).isNull());
  EXPECT_EQ(poster_->requests.size(), 2u);
  EXPECT_FALSE(backend().immutable());
}

TEST_F(HTTPSPostBackendBatch, TheFiftyFirstRecordOfAMethodFlushesTheBatch) {
  inState(kBackendStateEnabled);
  send(9);
  for (int i = 0; i < 50; ++i) EXPECT_TRUE(send(5).isNull());
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_FALSE(send(5).isNull());
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(events(0).size(), 51u);
  EXPECT_TRUE(logged(
      "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method 5"));
  EXPECT_EQ(postedRecords(), 1u);
}

TEST_F(HTTPSPostBackendBatch, WithAThresholdOfZeroEveryRecordFlushesTheOneBefore) {
  entry_.set("event_threshold", 0);
  inState(kBackendStateEnabled);
  for (int i = 0; i < 4; ++i) send(5);
  EXPECT_EQ(poster_->requests.size(), 3u);
  for (size_t i = 0; i < 3; ++i) EXPECT_EQ(events(i).size(), 1u);
}

TEST_F(HTTPSPostBackendBatch, CountsEachMethodForItself) {
  entry_.set("event_threshold", 1);
  inState(kBackendStateEnabled);
  for (const uint16_t method : {5, 6, 4, 5, 6, 4}) send(method);
  EXPECT_TRUE(poster_->requests.empty());
  send(4);
  EXPECT_EQ(poster_->requests.size(), 1u);
  for (const uint16_t method : {5, 6, 4}) send(method);  // all counts began anew
  EXPECT_EQ(poster_->requests.size(), 1u);
}

TEST_F(HTTPSPostBackendBatch, ReachingTheThresholdInStatesZeroAndThreeDiscardsTheBatch) {
  for (const int32_t state : {kBackendStateUndecided, kBackendStateHeld}) {
    const uint64_t before = dropped(Reason::batchDiscarded);
    inState(state);
    for (int i = 0; i < 51; ++i) EXPECT_TRUE(send(5).isNull());
    EXPECT_EQ(dropped(Reason::batchDiscarded), before + 50);
    EXPECT_TRUE(poster_->requests.empty());
    backend().setState(kBackendStateEnabled);
    EXPECT_EQ(postedRecords(), 1u);
    backend_.reset();
    poster_->requests.clear();
  }
}

TEST_F(HTTPSPostBackendBatch, CountsTowardsItsUserUntilItIsARequestOrDiscarded) {
  const auto account = platform_.budget.account(1000);
  const auto holds = [&] { return account->holds(Share::bytes); };
  backend().setUserAccount(account);
  inState(kBackendStateEnabled);
  send(5, {{"k", std::string(30000, 'x')}});
  EXPECT_GT(holds(), 30000u);
  flush();
  EXPECT_EQ(holds(), 0u);
  EXPECT_EQ(poster_->requests.at(0).account, account);
  send(5, {{"k", std::string(30000, 'x')}});
  backend().setState(kBackendStateDisabled);
  flush();
  EXPECT_EQ(holds(), 0u) << "discarded";
  backend().setState(kBackendStateEnabled);
  send(5, {{"k", std::string(30000, 'x')}});
  EXPECT_GT(holds(), 30000u);
  backend_.reset();
  EXPECT_EQ(holds(), 0u) << "gone";
}

TEST_F(HTTPSPostBackendBatch, DropsEventsThatItsUserHasNoRoomFor) {
  platform_.budget.shares()[Share::bytes] = 100000;
  const auto account = platform_.budget.account(1000);
  backend().setUserAccount(account);
  inState(kBackendStateEnabled);
  for (int i = 0; i < 10; ++i) send(5, {{"k", std::string(20000, 'x')}});
  EXPECT_EQ(dropped(Reason::userBatchesFull), 7u) << "a quarter stays free";
  EXPECT_EQ(platform_.sink.count(LogLevel::error, "HTTPSPostBackend(batchEvent): user 1000 holds "), 1u);
  EXPECT_EQ(postedRecords(), 3u);
  send(5, {{"k", std::string(20000, 'x')}});
  EXPECT_EQ(postedRecords(), 1u);
}

TEST_F(HTTPSPostBackendBatch, AnEventDroppedFromAnEmptyBatchLeavesNothingToFlush) {
  platform_.limits.maxBatchBytes = 20000;
  inState(kBackendStateEnabled);
  send(5, {{"k", std::string(30000, 'x')}});
  EXPECT_EQ(dropped(Reason::batchFull), 1u);
  EXPECT_EQ(flush().error->localizedDescription, "Nothing to flush");
  send(5);
  send(5, {{"k", std::string(30000, 'x')}});
  EXPECT_EQ(postedRecords(), 1u);  // what was there before stays
}

TEST_F(HTTPSPostBackendBatch, AForcedFlushThatKeepsTheBatchStillAppends) {
  entry_.set("event_threshold", 0);
  inState(kBackendStateEnabled);
  backend().setUserInfoDict(std::nullopt);
  for (int i = 0; i < 3; ++i) send(5);
  EXPECT_TRUE(poster_->requests.empty());
  backend().setUserInfoDict(userInfo_);
  EXPECT_EQ(postedRecords(), 3u);
}

TEST_F(HTTPSPostBackendBatch, FlushingNothingSaysSo) {
  inState(kBackendStateEnabled);
  const FlushAnswer answer = flush();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_TRUE(answer.result.isNull());
  EXPECT_EQ(answer.error, (Error{kKYTReportingErrorDomain, -1, "Nothing to flush"}));
  EXPECT_TRUE(backend().flushMessagesWithCompletion(nullptr).isNull());
}

TEST_F(HTTPSPostBackendBatch, AFlushWhileNotEnabledDiscardsTheBatch) {
  inState(kBackendStateHeld);
  send(5);
  send(6);
  EXPECT_EQ(flush().error, (Error{kKYTReportingErrorDomain, -1, "Nothing to flush"}));
  EXPECT_EQ(dropped(Reason::batchDiscarded), 2u);
  EXPECT_EQ(backend().batchedEventsSize(), 0u);
  backend().setState(kBackendStateEnabled);
  EXPECT_EQ(flush().error->localizedDescription, "Nothing to flush");
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(HTTPSPostBackendBatch, WhatIsNotEnabledDiscardsItsBatchBeforeItAsksForUserInformation) {
  inState(kBackendStateHeld);
  send(5);
  backend().setUserInfoDict(std::nullopt);
  EXPECT_EQ(flush().error->localizedDescription, "Nothing to flush");
  EXPECT_EQ(dropped(Reason::batchDiscarded), 1u);
}

TEST_F(HTTPSPostBackendBatch, AFlushGoesToTheOrdinaryAddress) {
  inState(kBackendStateEnabled);
  send(5);
  flush();
  EXPECT_EQ(poster_->requests.at(0).url, "https://post.example.org/events");
}

TEST_F(HTTPSPostBackendBatch, ADiscardedBatchForgetsItsCounts) {
  entry_.set("event_threshold", 1);
  inState(kBackendStateHeld);
  send(5);
  send(5);
  flush();
  backend().setState(kBackendStateEnabled);
  send(5);
  send(5);
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(HTTPSPostBackendBatch, AFlushWithoutRequiredUserInformationKeepsTheBatch) {
  inState(kBackendStateEnabled);
  send(5);
  backend().setUserInfoDict(Dictionary{});
  EXPECT_EQ(flush().error, (Error{kKYTReportingErrorDomain, -1, "Can not flush: userInfo is required"}));
  backend().setUserInfoDict(userInfo_);
  EXPECT_EQ(postedRecords(), 1u);
}

TEST_F(HTTPSPostBackendBatch, AFlushAnswersWhenItsPostIsAnswered) {
  inState(kBackendStateEnabled);
  send(5);
  FlushAnswer answer;
  const Value text = backend().flushMessagesWithCompletion(answer.completion());
  EXPECT_EQ(answer.calls, 0);
  poster_->answer(0, 200);
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.result, text);
  EXPECT_FALSE(answer.error);
  EXPECT_NE(text.string()->view().find('\n'), std::string_view::npos);
  EXPECT_FALSE(poster_->header(0, "X-KYT-Event-Map"));
  EXPECT_TRUE(logged("HTTPSPostBackend(flushMessagesWithCompletion): called"));
}

TEST_F(HTTPSPostBackendBatch, PostsRecordsInTheirOrder) {
  inState(kBackendStateEnabled);
  for (uint16_t method = 1; method <= 5; ++method) send(method);
  flush();
  const std::vector<Dictionary> records = events(0);
  ASSERT_EQ(records.size(), 5u);
  for (uint16_t i = 0; i < 5; ++i) EXPECT_EQ(records[i].find("_method")->intValue(), i + 1);
}

TEST_F(HTTPSPostBackendBatch, AFlushWhoseRecordsAreAllRefusedPostsNothing) {
  entry_.set("event_whitelist", Array{1});
  inState(kBackendStateEnabled);
  send(5);
  const FlushAnswer answer = flush();
  EXPECT_EQ(answer.error, (Error{kKYTReportingErrorDomain, -1,
                                 "Nothing to flush: batched events were completely filtered out"}));
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_TRUE(logged(
      "flushMessagesWithCompletion: Dropping event with category 5 as it is not whitelisted for backend "
      "httppost"));
  EXPECT_EQ(dropped(Reason::batchedEventFiltered), 1u);
  EXPECT_FALSE(backend().immutable());
  EXPECT_EQ(flush().error->localizedDescription, "Nothing to flush");
}

TEST_F(HTTPSPostBackendBatch, WhatBothListsRefuseIsNotWhitelisted) {
  entry_.set("event_whitelist", Array{1});
  entry_.set("event_blacklist", Array{5});
  inState(kBackendStateEnabled);
  send(5);
  flush();
  EXPECT_TRUE(logged("Dropping event with category 5 as it is not whitelisted for backend httppost"));
  EXPECT_FALSE(logged("is blacklisted"));
}

TEST_F(HTTPSPostBackendBatch, CategoriesOfAFlushHaveSixteenBits) {
  entry_.set("event_whitelist", Array{300, 65535});
  inState(kBackendStateEnabled);
  for (const uint16_t method : {300, 44, 65535}) send(method);
  EXPECT_EQ(postedRecords(), 2u);
}

TEST_F(HTTPSPostBackendBatch, AFlushSkipsWhatTheBlacklistHolds) {
  entry_.set("event_blacklist", Array{5});
  inState(kBackendStateEnabled);
  send(5);
  send(6);
  flush();
  ASSERT_EQ(events(0).size(), 1u);
  EXPECT_EQ(events(0)[0].find("_method")->intValue(), 6);
  EXPECT_TRUE(logged(
      "flushMessagesWithCompletion: Dropping event with category 5 as it is blacklisted for backend httppost"));
}

TEST_F(HTTPSPostBackendBatch, AFlushMergesTheFilteredUserInformationOfNow) {
  userInfo_ = std::nullopt;
  backend();
  send(5, {{"extra", "payload"}});
  backend().setUserInfoDict(Dictionary{{kKYTReportingUserInfoClientName, "a"},
                                       {kKYTReportingUserInfoServiceName, "b"},
                                       {"extra", "user"},
                                       {"secret", "s"}});
  decided();
  flush();
  const Dictionary record = events(0).at(0);
  EXPECT_EQ(*record.find("extra"), Value("user"));
  EXPECT_EQ(*record.find("ClientName"), Value("a"));
  EXPECT_FALSE(record.contains("secret"));
}

TEST_F(HTTPSPostBackendBatch, AFilterBoundToAMethodDoesNotTouchTheUserInformationOfAFlush) {
  entry_.set("filters", Array{Dictionary{{"key", "phone"}, {"action", "remove"}, {"method", 5}}});
  userInfo_->set("phone", "1");
  inState(kBackendStateEnabled);
  send(5);
  flush();
  EXPECT_TRUE(events(0).at(0).contains("phone"));
}

TEST_F(HTTPSPostBackendBatch, SharedDataIsInTheRecord) {
  inState(kBackendStateEnabled);
  backend().sendMessage({{kKYTReportingMessageBlobClientData, Dictionary{{"k", 1}}},
                         {kKYTReportingMessageBlobSharedData, Dictionary{{"shared", 2}, {"secret", 3}}}},
                        {1, 0}, 5, 2, MessageFlag{});
  flush();
  EXPECT_EQ(events(0).at(0).find("shared")->intValue(), 2);
  EXPECT_FALSE(events(0).at(0).contains("secret"));
}

TEST_F(HTTPSPostBackendBatch, ANewSessionIDIsWrittenIntoTheBatch) {
  inState(kBackendStateEnabled);
  send(5);
  backend().setCorrelatedSessionID("12.77");
  EXPECT_EQ(backend().combinedSessionIDString(), String("12.77"));
  send(6);
  flush();
  for (const Dictionary& record : events(0)) EXPECT_EQ(*record.find("_sessionID"), Value("12.77"));
  backend().setCorrelatedSessionID("13.77");  // without a batch
}

// New records of such a client have their session's number; those in the batch get the text all the same.
TEST_F(HTTPSPostBackendBatch, ANewSessionIDReplacesTheNumberOfAClientThatSendsNumbers) {
  facts_.compType = 7;
  inState(kBackendStateEnabled);
  send(5);
  backend().setCorrelatedSessionID("12.77");
  send(6);
  flush();
  EXPECT_EQ(*events(0).at(0).find("_sessionID"), Value("12.77"));
  EXPECT_EQ(*events(0).at(1).find("_sessionID"), Value(77));
}

TEST_F(HTTPSPostBackendBatch, CountsARecordByTheMethodThatSharedDataGaveIt) {
  entry_.set("event_threshold", 1);
  inState(kBackendStateEnabled);
  for (const uint16_t method : {5, 6, 7}) {
    EXPECT_TRUE(poster_->requests.empty());
    backend().sendMessage({{kKYTReportingMessageBlobClientData, Dictionary()},
                           {kKYTReportingMessageBlobSharedData, Dictionary{{"_method", 9}}}},
                          {1000000025, 0}, method, 2, MessageFlag{});
  }
  ASSERT_EQ(poster_->requests.size(), 1u) << "the third of method 9";
  EXPECT_EQ(events(0).size(), 2u);
  EXPECT_TRUE(logged(
      "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method 9"));
}

TEST_F(HTTPSPostBackendBatch, AListSeesTheMethodThatUserInformationGaveARecord) {
  userInfo_->set("_method", 9);
  entry_.set("event_blacklist", Array{9});
  inState(kBackendStateEnabled);
  send(5);
  EXPECT_EQ(flush().error->localizedDescription,
            "Nothing to flush: batched events were completely filtered out");
  EXPECT_TRUE(logged(
      "flushMessagesWithCompletion: Dropping event with category 9 as it is blacklisted for backend httppost"));
  backend_.reset();
  entry_.set("event_blacklist", Array{5});
  inState(kBackendStateEnabled);
  send(5);
  EXPECT_EQ(postedRecords(), 1u);
}

TEST_F(HTTPSPostBackendBatch, AListSeesTheMethodFromBeforeTheFlushMergedUserInformation) {
  userInfo_ = std::nullopt;
  entry_.set("event_whitelist", Array{5});
  inState(kBackendStateEnabled);
  send(5);
  backend().setUserInfoDict(Dictionary{
      {kKYTReportingUserInfoClientName, "a"}, {kKYTReportingUserInfoServiceName, "b"}, {"_method", 9}});
  backend().updateState();
  flush();
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(*events(0).at(0).find("_method"), Value(9));
}

TEST_F(HTTPSPostBackendBatch, ReportsTheSizeOfItsRecords) {
  inState(kBackendStateEnabled);
  EXPECT_EQ(backend().batchedEventsSize(), 0u);
  send(5, {{"k", std::string(1000, 'x')}});
  const uint64_t one = backend().batchedEventsSize();
  EXPECT_GT(one, 1000u);
  send(5, {{"k", std::string(1000, 'x')}});
  EXPECT_EQ(backend().batchedEventsSize(), 2 * one);
  flush();
  EXPECT_EQ(backend().batchedEventsSize(), 0u);
}

TEST_F(HTTPSPostBackendBatch, ItsSizeFollowsANewCombinedSessionID) {
  inState(kBackendStateHeld);
  send(5);
  send(5);
  backend().setCorrelatedSessionID("short");
  const uint64_t before = backend().batchedEventsSize();
  backend().setCorrelatedSessionID(std::string(200, 'x'));
  EXPECT_GE(backend().batchedEventsSize(), before + 2 * 200);
}

TEST_F(HTTPSPostBackendBatch, PastItsLimitDropsNewEventsAndSaysSoOnceAMinute) {
  platform_.limits.maxBatchBytes = 20000;
  inState(kBackendStateHeld);
  for (int i = 0; i < 40; ++i) send(static_cast<uint16_t>(i), {{"k", std::string(1000, 'x')}});
  const uint64_t first = dropped(Reason::batchFull);
  EXPECT_GT(first, 20u);
  EXPECT_LT(first, 35u);
  const char line[] =
      "HTTPSPostBackend(batchEvent): the batch of backend httppost is full (20000 bytes), dropping events";
  EXPECT_EQ(platform_.sink.count(LogLevel::error, line), 1u);
  platform_.clock.advance(std::chrono::seconds(61));
  send(1, {{"k", std::string(1000, 'x')}});
  EXPECT_EQ(platform_.sink.count(LogLevel::error, line), 2u);
  backend().setState(kBackendStateEnabled);
  EXPECT_EQ(postedRecords(), 40 - first);
  EXPECT_TRUE(send(1).isNull());
  EXPECT_EQ(postedRecords(), 1u);  // there is room again
}

TEST_F(HTTPSPostBackendBatch, AForcedFlushThatKeepsTheBatchMakesNoRoom) {
  platform_.limits.maxBatchBytes = 20000;
  entry_.set("event_threshold", 0);
  inState(kBackendStateEnabled);
  backend().setUserInfoDict(std::nullopt);
  for (int i = 0; i < 40; ++i) send(5, {{"k", std::string(1000, 'x')}});
  EXPECT_GT(dropped(Reason::batchFull), 20u);
}

TEST_F(HTTPSPostBackendBatch, CountsWhatContainersHoldTowardsItsLimit) {
  platform_.limits.maxBatchBytes = 20000;
  inState(kBackendStateHeld);
  Array deep;
  for (int i = 0; i < 30; ++i) deep.append(Value(Dictionary{{"k", std::string(1000, 'x')}}));
  send(5, {{"array", deep}});
  const std::string bytes(30000, 'x');
  send(5, {{"data", Data(std::string_view(bytes))}});
  EXPECT_EQ(dropped(Reason::batchFull), 2u);
}

TEST_F(HTTPSPostBackendBatch, LateUserInformationDoesNotMakeAMessagePastTheLimit) {
  platform_.limits.maxBatchBytes = 100000;
  userInfo_ = std::nullopt;
  backend();
  for (uint16_t i = 1; i <= 40; ++i) send(i);
  EXPECT_EQ(dropped(Reason::batchFull), 0u);
  backend().setUserInfoDict(Dictionary{{kKYTReportingUserInfoClientName, "a"},
                                       {kKYTReportingUserInfoServiceName, "b"},
                                       {"note", std::string(10000, 'x')}});
  decided();
  flush();
  const std::vector<Dictionary> records = events(0);
  EXPECT_GT(records.size(), 5u);
  EXPECT_LT(records.size(), 10u);
  EXPECT_EQ(records.front().find("_method")->intValue(), 1);  // the newest are dropped
  EXPECT_EQ(records.size() + dropped(Reason::batchFull), 40u);
}

TEST_F(HTTPSPostBackendBatch, UserInformationThatTheRecordsHaveAlreadyCountsOnce) {
  userInfo_->set("note", std::string(1000, 'x'));
  platform_.limits.maxBatchBytes = 100000;
  inState(kBackendStateEnabled);
  uint16_t batched = 0;
  while (dropped(Reason::batchFull) == 0) send(++batched);
  flush();
  EXPECT_EQ(events(0).size(), batched - 1u);
  EXPECT_EQ(dropped(Reason::batchFull), 1u);
}

TEST_F(HTTPSPostBackendBatch, AppendsLaterOnTheStateQueue) {
  inState(kBackendStateEnabled);
  platform_.executor.runAll();
  send(5);
  EXPECT_EQ(platform_.executor.pending(), 1u);
  platform_.executor.runAll();
  EXPECT_EQ(postedRecords(), 1u);
}

TEST_F(HTTPSPostBackendBatch, CanBeDestroyedWithARecordOnItsWayIntoTheBatch) {
  inState(kBackendStateEnabled);
  send(5);
  backend_.reset();
  platform_.executor.runAll();
  EXPECT_EQ(dropped(Reason::batchDiscarded), 1u);  // it is lost, and counted
}

}  // namespace
}  // namespace kyt
