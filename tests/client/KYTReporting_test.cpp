#include "kytreporting/KYTReporting.h"

#include <gtest/gtest.h>
#include <linux/seccomp.h>
#include <pthread.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <set>
#include <span>
#include <string>
#include <thread>

#include "client/Loop.h"
#include "platform/objects/SessionInfoKeys.h"
#include "tests/client/AnswerOf.h"
#include "tests/client/TestDaemon.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

class KYTReportingTest : public testing::Test {
 protected:
  KYTReporting::Options options(size_t maxQueued = 4096) const {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = {{kKYTReportingSessionInfoSessionID, 42}, {kKYTReportingSessionInfoClientType, 7}};
    made.maxQueuedMessages = maxQueued;
    return made;
  }
  static std::string statesOf(KYTReporting& session) {
    std::promise<std::string> answer;
    session.startConfiguration([&answer](auto states, std::optional<Error> error) {
      std::string text = error ? "error " + error->localizedDescription : states ? "" : "none";
      if (states)
        for (const std::string& name : *states) text += name + " ";
      answer.set_value(text);
    });
    return answerOf(answer);
  }

  TemporaryFolder folder_;
  const std::string socket_ = folder_ / "socket";
  TestDaemon daemon_{socket_};
};

TEST_F(KYTReportingTest, TellsWhoItIsBeforeAnythingElseAndKeepsTheOrderOfWhatItIsTold) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_EQ(statesOf(*session), "httppost qrs ");
  EXPECT_TRUE(session->sendMessage(1, 2, {{"a", 1}}));
  session->setDigestKey(Data("key"), 5);
  EXPECT_TRUE(session->sendMessage(3, 4, {}, 1));
  session->updateSharedData({{"x", 1}, {"y", 2}});
  session->updateSharedData("x", Value());
  EXPECT_TRUE(session->finish());
  EXPECT_EQ(daemon_.calls(),
            (std::vector<std::string>{"SetSessionInfo 42", "StartConfig", "Send 1 2 -", "DigestKey key 5",
                                      "Send 3 4 1", "SharedData 2", "SharedData x=(null)", "Finish"}));
}

TEST_F(KYTReportingTest, CarriesEveryKindOfValueInAPayload) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  const Dictionary payload = {{"text", "überall"},
                              {"long", std::string(1000, 'x')},
                              {"int", -5},
                              {"big", ~0UL},
                              {"real", 0.1},
                              {"yes", true},
                              {"date", Date{1.5}},
                              {"data", Data("\x01\x02")},
                              {"array", Array{1, "two", Dictionary{{"three", 3}}}},
                              {"dictionary", Dictionary{{"k", "v"}}}};
  ASSERT_TRUE(session->sendMessage(1, 1, payload));
  ASSERT_TRUE(eventually([&] { return daemon_.count("Send") == 1; }));
  EXPECT_EQ(Value(daemon_.lastPayload()), Value(payload));
}

TEST_F(KYTReportingTest, WaitsForADaemonThatDoesNotRunYet) {
  const auto session = KYTReporting::open(options());
  for (int i = 0; i < 10; ++i) EXPECT_TRUE(session->sendMessage(1, 1, {{"i", i}}));
  ASSERT_TRUE(daemon_.start());
  EXPECT_TRUE(eventually([&] { return daemon_.count("Send") == 10; }));
  EXPECT_EQ(session->statistics().lostOnConnectionEnd, 0u);
}

TEST_F(KYTReportingTest, ReplaysIdentityConfigurationSharedDataAndDigestKeyToADaemonThatReturns) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_EQ(statesOf(*session), "httppost qrs ");
  session->updateSharedData({{"x", 1}, {"y", 2}});
  session->updateSharedData("y", Value());
  session->setDigestKey(Data("key"), 3);
  std::promise<void> fetched;
  session->fetchStates(Dictionary{{"ClientName", "later"}}, [&](auto, auto) { fetched.set_value(); });
  answerOf(fetched);
  daemon_.stop();
  const size_t before = daemon_.calls().size();
  ASSERT_TRUE(daemon_.start());
  ASSERT_TRUE(eventually([&] { return daemon_.calls().size() >= before + 4; }));
  const std::vector<std::string> all = daemon_.calls();
  EXPECT_EQ(
      std::vector<std::string>(all.begin() + static_cast<long>(before), all.end()),
      (std::vector<std::string>{"SetSessionInfo 42 user", "StartConfig", "SharedData 1", "DigestKey key 3"}));
  EXPECT_EQ(session->statistics().connections, 2u);
}

TEST_F(KYTReportingTest, CountsWhatADyingDaemonMayNotHaveTakenAndSendsTheRestToTheNext) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_EQ(statesOf(*session), "httppost qrs ");
  uint64_t taken = 0;
  std::atomic<bool> stop{false};
  std::thread killer([&] {
    (void)eventually([&] { return daemon_.count("Send") > 100; });
    daemon_.stop();
    ASSERT_TRUE(daemon_.start());
    stop = true;
  });
  while (!stop) {
    taken += session->sendMessage(1, 1, {}) ? 1 : 0;
    if (taken % 16 == 0) std::this_thread::yield();
  }
  killer.join();
  EXPECT_TRUE(session->finish(std::chrono::seconds(20)));
  const auto figures = session->statistics();
  const uint64_t arrived = daemon_.count("Send");
  EXPECT_LE(arrived, taken);
  EXPECT_GE(arrived + figures.lostOnConnectionEnd, taken);
}

TEST_F(KYTReportingTest, AnswersFalseAndCountsWhenTheQueueIsFull) {
  const auto session = KYTReporting::open(options(64));
  int taken = 0;
  for (int i = 0; i < 100; ++i) taken += session->sendMessage(1, 1, {}) ? 1 : 0;
  EXPECT_EQ(taken, 64);
  EXPECT_EQ(session->statistics().droppedQueueFull, 36u);
  EXPECT_EQ(session->statistics().queued, 64u);
}

TEST_F(KYTReportingTest, BoundsTheBytesOfItsQueueToo) {
  KYTReporting::Options small = options();
  small.maxQueuedBytes = 16384;
  const auto session = KYTReporting::open(std::move(small));
  const Dictionary payload = {{"text", std::string(5000, 'x')}};
  int taken = 0;
  for (int i = 0; i < 10; ++i) taken += session->sendMessage(1, 1, payload) ? 1 : 0;
  EXPECT_EQ(taken, 3);
}

TEST_F(KYTReportingTest, CountsAMessageThatIsTooLargeToBeSentAndGoesOn) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_TRUE(session->sendMessage(1, 1, {{"huge", std::string(2000000, 'x')}}));
  EXPECT_TRUE(session->sendMessage(2, 1, {}));
  EXPECT_TRUE(eventually([&] { return daemon_.count("Send 2") == 1; }));
  EXPECT_EQ(daemon_.count("Send 1"), 0u);
  EXPECT_EQ(session->statistics().droppedUnsendable, 1u);
  EXPECT_EQ(session->statistics().droppedInvalid, 0u);
}

TEST_F(KYTReportingTest, GivesTheAnswersOfTheDaemonToTheCompletions) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  std::promise<Value> posted;
  session->sendMessage(1, 1, {}, 0, [&](Value answer, auto) { posted.set_value(std::move(answer)); });
  EXPECT_EQ(answerOf(posted), Value("posted"));
  std::promise<std::optional<Error>> flushed;
  session->flush([&](const Value&, std::optional<Error> error) { flushed.set_value(std::move(error)); });
  const auto error = answerOf(flushed);
  ASSERT_TRUE(error);
  EXPECT_EQ(*error, (Error{"SomeDomain", -1, "Nothing to flush"}));
  std::promise<std::string> url;
  session->fetchDisplayURL([&](std::string text, auto) { url.set_value(std::move(text)); });
  EXPECT_EQ(answerOf(url), "https://display");
  std::promise<bool> log;
  session->uploadLogData(Array{1, 2}, [&](bool success, auto) { log.set_value(success); });
  EXPECT_FALSE(answerOf(log));
  EXPECT_EQ(daemon_.count("LogData 2"), 1u);
}

TEST_F(KYTReportingTest, PassesAFileAndItsFolderAsDescriptors) {
  ASSERT_TRUE(daemon_.start());
  const std::string file = folder_.write("a report.log", "content");
  const auto session = KYTReporting::open(options());
  std::promise<bool> done;
  session->uploadFile(file, [&](bool success, auto) { done.set_value(success); });
  EXPECT_TRUE(answerOf(done));
  EXPECT_EQ(daemon_.count("Upload file://" + folder_.path() + "/a%20report.log with descriptors"), 1u);
}

TEST_F(KYTReportingTest, AnswersAtOnceForAFileThatCannotBeOpened) {
  const auto session = KYTReporting::open(options());
  bool asked = false;
  session->uploadFile(folder_ / "missing", [&](bool success, std::optional<Error> error) {
    asked = true;
    EXPECT_FALSE(success);
    EXPECT_TRUE(error);
  });
  EXPECT_TRUE(asked);
}

TEST_F(KYTReportingTest, GivesAnErrorToCompletionsWhoseConnectionEnds) {
  daemon_.setHoldFlush(true);
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  std::promise<std::optional<Error>> flushed;
  session->flush([&](const Value&, std::optional<Error> error) { flushed.set_value(std::move(error)); });
  ASSERT_TRUE(eventually([&] { return daemon_.count("Flush") == 1; }));
  daemon_.stop();
  const auto error = answerOf(flushed);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, kKYTReportingClientErrorDomain);
}

TEST_F(KYTReportingTest, LosesNothingToADaemonThatRefusesIt) {
  daemon_.setAccepts(false);
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  ASSERT_TRUE(eventually([&] { return session->statistics().connections >= 2; }));
  EXPECT_EQ(session->statistics().lostOnConnectionEnd, 0u);
  daemon_.setAccepts(true);
  EXPECT_TRUE(eventually([&] { return daemon_.count("Send") == 1; }));
}

TEST_F(KYTReportingTest, RunsEveryCompletionBeforeItsDestructorReturns) {
  std::atomic<int> asked{0};
  {
    const auto session = KYTReporting::open(options());
    for (int i = 0; i < 5; ++i)
      session->flush([&](const Value&, std::optional<Error> error) { asked += error ? 1 : 100; });
  }
  EXPECT_EQ(asked, 5);
}

TEST_F(KYTReportingTest, MayBeClosedFromInsideItsOwnCompletion) {
  ASSERT_TRUE(daemon_.start());
  auto session = KYTReporting::open(options());
  std::promise<void> closed;
  session->startConfiguration([&](auto, auto) {
    session.reset();
    closed.set_value();
  });
  answerOf(closed);
  EXPECT_EQ(session, nullptr);
}

TEST_F(KYTReportingTest, RefusesWhatIsSentAfterItSaidGoodbye) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_TRUE(session->finish());
  EXPECT_FALSE(session->sendMessage(1, 1, {}));
  EXPECT_EQ(session->statistics().droppedClosed, 1u);
  std::promise<std::optional<Error>> flushed;
  session->flush([&](const Value&, std::optional<Error> error) { flushed.set_value(std::move(error)); });
  EXPECT_TRUE(answerOf(flushed));
}

TEST_F(KYTReportingTest, GoodbyeWithoutADaemonGivesUpAfterItsTime) {
  const auto session = KYTReporting::open(options());
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  EXPECT_FALSE(session->finish(std::chrono::milliseconds(50)));
}

TEST_F(KYTReportingTest, ReceivesAggregatedMessagesAndTheEndOfTheAggregation) {
  ASSERT_TRUE(daemon_.start());
  std::mutex mutex;
  std::vector<AggregatedMessage> got;
  KYTReporting::Options aggregating = options();
  aggregating.aggregationBlock = [&](const AggregatedMessage& message) {
    const std::lock_guard lock(mutex);
    got.push_back(message);
  };
  const auto session = KYTReporting::open(std::move(aggregating));
  ASSERT_TRUE(eventually([&] { return daemon_.count("SetSessionInfo 42 aggregates") == 1; }));
  daemon_.sendToClient(Dictionary{{"SessionID", 7}}, 12.5, 3, 4, Dictionary{{"k", "v"}});
  daemon_.sendToClient(std::nullopt, 0, 0, 0, std::nullopt);
  const auto count = [&] {
    const std::lock_guard lock(mutex);
    return got.size();
  };
  ASSERT_TRUE(eventually([&] { return count() == 2; }));
  const std::lock_guard lock(mutex);
  EXPECT_EQ(got[0].timestamp, 12.5);
  EXPECT_EQ(got[0].category, 3);
  EXPECT_EQ(got[0].type, 4);
  ASSERT_TRUE(got[0].payload);
  EXPECT_EQ(*got[0].payload, (Dictionary{{"k", "v"}}));
  EXPECT_FALSE(got[1].sessionInfo);
  EXPECT_FALSE(got[1].payload);
}

TEST_F(KYTReportingTest, SendsASingleMessageOnAConnectionOfItsOwn) {
  ASSERT_TRUE(daemon_.start());
  std::promise<std::string> done;
  KYTReporting::sendSingleMessage(options(), 5, 6, Dictionary{{"a", 1}},
                                  [&](std::string text, auto) { done.set_value(std::move(text)); });
  EXPECT_EQ(answerOf(done), "finished");
  EXPECT_EQ(daemon_.calls(), (std::vector<std::string>{"Single 5 6"}));
}

TEST_F(KYTReportingTest, ASingleMessageWithoutADaemonFails) {
  std::promise<std::optional<Error>> done;
  KYTReporting::sendSingleMessage(options(), 5, 6, std::nullopt, [&](auto, std::optional<Error> error) {
    done.set_value(std::move(error));
  });
  EXPECT_TRUE(answerOf(done));
}

TEST_F(KYTReportingTest, TakesItsInformationTypedAndSendsItWithTheKeysThatTheDaemonReads) {
  const Dictionary info = SessionInfo{.sessionID = 42,
                                      .clientType = 7,
                                      .clientVersion = 3,
                                      .batchEvent = true,
                                      .hierarchyToken = SessionInfo::HierarchyToken{"token", 1}};
  EXPECT_EQ(info, (Dictionary{{"SessionID", 42U},
                              {"ClientType", 7U},
                              {"ClientVersion", 3U},
                              {"BatchEvent", true},
                              {"RequireUserInfo", true},
                              {"HierarchyToken", Dictionary{{"TokenID", "token"}, {"Level", 1U}}}}));
  EXPECT_FALSE(KYTReporting::checkSessionInfo(info));
  ASSERT_TRUE(daemon_.start());
  KYTReporting::Options typed = options();
  typed.sessionInfo = SessionInfo{.sessionID = 43, .clientType = 7};
  const auto session = KYTReporting::open(std::move(typed));
  EXPECT_TRUE(session->finish());
  EXPECT_EQ(daemon_.calls(), (std::vector<std::string>{"SetSessionInfo 43", "Finish"}));
}

TEST_F(KYTReportingTest, NamesTheKeyThatIsWrongInASessionsInformation) {
  const auto problemOf = [](const Dictionary& info) {
    const std::optional<Error> error = KYTReporting::checkSessionInfo(info);
    return error ? error->localizedDescription : "none";
  };
  const std::string keys =
      "; there are SessionID, ClientType, ClientVersion, BatchEvent, RequireUserInfo, "
      "HierarchyToken";
  const std::string begin = "session information: ";
  EXPECT_EQ(problemOf({{"RequireUserinfo", true}}), begin + "there is no key \"RequireUserinfo\"" + keys);
  EXPECT_EQ(problemOf({{"ClientTyp\n", 7}}), begin + "there is no key \"ClientTyp\\n\"" + keys);
  EXPECT_EQ(problemOf({{"RequireUserInfo", "on"}}), begin + "\"RequireUserInfo\" is no boolean: on");
  EXPECT_EQ(problemOf({{"RequireUserInfo", Value()}}), begin + "\"RequireUserInfo\" is no boolean: (null)");
  EXPECT_EQ(problemOf({{"BatchEvent", 2}}), begin + "\"BatchEvent\" is no boolean: 2");
  EXPECT_EQ(problemOf({{"ClientType", 24}}), begin + "\"ClientType\" is no whole number from 0 to 23: 24");
  EXPECT_EQ(problemOf({{"ClientType", "7"}}), begin + "\"ClientType\" is no whole number from 0 to 23: 7");
  EXPECT_EQ(problemOf({{"ClientVersion", 65536}}),
            begin + "\"ClientVersion\" is no whole number from 0 to 65535: 65536");
  EXPECT_EQ(problemOf({{"SessionID", -1}}),
            begin + "\"SessionID\" is no whole number from 0 to 4294967295: -1");
  EXPECT_EQ(problemOf({{"HierarchyToken", "t"}}), begin + "\"HierarchyToken\" is no dictionary: t");
  EXPECT_EQ(problemOf({{"HierarchyToken", Dictionary{{"TokenId", "t"}}}}),
            "HierarchyToken: there is no key \"TokenId\"; there are TokenID, Level");
  EXPECT_EQ(problemOf({{"HierarchyToken", Dictionary{{"TokenID", 5}}}}),
            "HierarchyToken: \"TokenID\" is no text: 5");
  EXPECT_EQ(problemOf({}), "none");
  EXPECT_EQ(problemOf({{"SessionID", ~0U}, {"ClientType", 23}, {"BatchEvent", 1}, {"RequireUserInfo", 0U}}),
            "none");
}

TEST_F(KYTReportingTest, TypedInformationHasEveryKeyThatThereIs) {
  const auto keysOf = [](const Dictionary& dictionary) {
    std::set<std::string> keys;
    for (const DictionaryEntry& entry : dictionary) keys.insert(entry.key.str());
    return keys;
  };
  const auto expected = [](std::span<const SessionInfoKey> table) {
    std::set<std::string> keys;
    for (const SessionInfoKey& one : table) keys.insert(one.key);
    return keys;
  };
  const Dictionary info = SessionInfo{.hierarchyToken = SessionInfo::HierarchyToken{"t", 1}};
  EXPECT_EQ(keysOf(info), expected(sessionInfoKeys()));
  const Dictionary token = *info.find(kKYTReportingSessionInfoHierarchyToken)->dictionary();
  EXPECT_EQ(keysOf(token), expected(hierarchyTokenKeys()));
  EXPECT_FALSE(KYTReporting::checkSessionInfo(info));
}

TEST_F(KYTReportingTest, SendsNothingForASessionWhoseInformationIsWrong) {
  ASSERT_TRUE(daemon_.start());
  KYTReporting::Options wrong = options();
  wrong.sessionInfo.set("RequireUserinfo", true);
  {
    const auto session = KYTReporting::open(std::move(wrong));
    EXPECT_FALSE(session->sendMessage(1, 1, {}));
    EXPECT_EQ(session->statistics().droppedInvalid, 1U);
    std::promise<std::optional<Error>> configured;
    session->startConfiguration(
        [&](auto, std::optional<Error> error) { configured.set_value(std::move(error)); });
    const auto error = answerOf(configured);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code, static_cast<int32_t>(ClientError::invalid));
    EXPECT_NE(error->localizedDescription.find("\"RequireUserinfo\""), std::string::npos);
    EXPECT_FALSE(session->finish());
  }
  KYTReporting::Options single = options();
  single.sessionInfo.set("BatchEvent", "on");
  std::promise<std::optional<Error>> sent;
  KYTReporting::sendSingleMessage(
      std::move(single), 5, 6, std::nullopt,
      [&](auto, std::optional<Error> error) { sent.set_value(std::move(error)); });
  const auto error = answerOf(sent);
  ASSERT_TRUE(error);
  EXPECT_NE(error->localizedDescription.find("\"BatchEvent\""), std::string::npos);
  EXPECT_EQ(daemon_.connections(), 0U);
}

// Each of these ends the library's thread, which may be over before the call that started it.
TEST_F(KYTReportingTest, EveryThreadOfTheLibraryHasItsNameFromTheBeginning) {
  for (int i = 0; i < 300; ++i) {
    std::promise<std::string> named;
    KYTReporting::sendSingleMessage(options(), 5, 6, std::nullopt, [&](auto, auto) {
      char name[16] = {};
      pthread_getname_np(pthread_self(), name, sizeof name);
      named.set_value(name);
    });
    ASSERT_EQ(answerOf(named), "kytreporting") << i;
  }
}

TEST_F(KYTReportingTest, TakesMessagesFromManyThreadsAtOnceAndLosesNone) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options(65536));
  std::vector<std::thread> threads;
  std::atomic<uint64_t> taken{0};
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&] {
      for (int i = 0; i < 2000; ++i) taken += session->sendMessage(1, 1, {{"i", i}}) ? 1 : 0;
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_TRUE(session->finish(std::chrono::seconds(20)));
  EXPECT_EQ(daemon_.count("Send"), taken.load());
  EXPECT_EQ(session->statistics().sent, taken.load());
}

#ifndef __has_feature
#define __has_feature(feature) 0
#endif
// A forked child of a process with threads is nothing that the thread sanitizer follows.
#if __has_feature(thread_sanitizer)
#define KYT_NO_FORK_TEST 1
#endif
#ifndef KYT_NO_FORK_TEST
TEST_F(KYTReportingTest, IsInertInAForkedChildWhichMayOpenSessionsOfItsOwn) {
  ASSERT_TRUE(daemon_.start());
  auto session = KYTReporting::open(options());
  EXPECT_EQ(statesOf(*session), "httppost qrs ");
  const pid_t child = fork();
  if (child == 0) {
    bool right = !session->sendMessage(9, 9, {});
    session.reset();
    KYTReporting::Options own = options();
    own.sessionInfo.set(kKYTReportingSessionInfoSessionID, 77);
    auto second = KYTReporting::open(std::move(own));
    right = right && second->sendMessage(8, 8, {}) && second->finish();
    _exit(right ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  EXPECT_TRUE(session->finish());
  EXPECT_EQ(daemon_.count("Send 9"), 0u);
  EXPECT_EQ(daemon_.count("Send 8"), 1u);
  EXPECT_EQ(daemon_.count("Send 1"), 1u);
}

#if !defined(__SANITIZE_ADDRESS__) && !__has_feature(address_sanitizer)
// In a thread that the kernel kills at any call but read, write and its own end.
TEST_F(KYTReportingTest, SendsAMessageWithoutASystemCall) {
  ASSERT_TRUE(daemon_.start());
  const pid_t child = fork();
  if (child == 0) {
    alarm(static_cast<unsigned>(kTestDeadline.count()));
    const auto session = KYTReporting::open(options(65536));
    bool right = statesOf(*session) == "httppost qrs ";
    const Dictionary payload = {{"text", std::string(200, 'x')}, {"number", 1}};
    std::atomic<int> taken{-1};
    std::thread sender([&] {
      int sent = 0;
      if (prctl(PR_SET_SECCOMP, SECCOMP_MODE_STRICT) == 0)
        for (int i = 0; i < 1000; ++i) sent += session->sendMessage(1, 1, payload) ? 1 : 0;
      taken = sent;
      syscall(SYS_exit, 0);
    });
    right = right && eventually([&] { return taken == 1000; });
    _exit(right ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}
#endif

// The library's first session, in a program that has no descriptor left just then.
TEST_F(KYTReportingTest, WorksOnWhenThereWasNoDescriptorForItsWakeUp) {
  // Before the daemon's threads exist: a child of fork() never gets a lock that another thread holds just then, and the
  // sanitizers' allocators have such locks.
  const pid_t child = fork();
  if (child == 0) {
    alarm(static_cast<unsigned>(kTestDeadline.count()));
    rlimit before{};
    getrlimit(RLIMIT_NOFILE, &before);
    rlimit none = before;
    none.rlim_cur = 0;
    setrlimit(RLIMIT_NOFILE, &none);
    const auto session = KYTReporting::open(options());
    setrlimit(RLIMIT_NOFILE, &before);
    bool right = statesOf(*session) == "httppost qrs ";
    for (int i = 0; i < 3; ++i) {
      right = right && eventually([] { return client::Loop::current()->sleeps(); });
      right = right && statesOf(*session) == "httppost qrs ";
    }
    _exit(right ? 0 : 1);
  }
  ASSERT_TRUE(daemon_.start());
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}
#endif

}  // namespace
}  // namespace kyt
