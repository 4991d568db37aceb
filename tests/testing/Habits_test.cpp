// What sessions do by themselves, and what programs measure, against the daemon of tests.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <thread>
#include <vector>

#include "kytreporting/FakeDaemon.h"
#include "kytreporting/Measuring.h"
#include "kytreporting/kytreporting.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

using testing::Event;
using testing::FakeDaemon;
using testing::Kind;

class Habits : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(daemon_.start(), std::nullopt); }
  [[nodiscard]] static KYTReporting::Options optionsFor(const std::string& socket) {
    KYTReporting::Options options;
    options.socketPath = socket;
    options.sessionInfo = SessionInfo{.clientType = 20};
    return options;
  }
  [[nodiscard]] std::unique_ptr<KYTReporting> open(const KYTReporting::Behaviour& behaviour = {}) const {
    return KYTReporting::open(optionsFor(daemon_.socketPath()), behaviour);
  }
  [[nodiscard]] Event message(size_t number) const {
    EXPECT_TRUE(daemon_.waitFor(Kind::message, number + 1));
    return daemon_.events(Kind::message).at(number);
  }
  FakeDaemon daemon_;
};

TEST_F(Habits, ASessionFlushesAnIntervalAfterTheFirstMessage) {
  const auto session = open({.flushInterval = std::chrono::milliseconds(10)});
  session->sendMessage(1, 1, {});
  ASSERT_TRUE(daemon_.waitFor(Kind::flush, 1));
  session->sendMessage(1, 2, {});
  ASSERT_TRUE(daemon_.waitFor(Kind::flush, 2));
  EXPECT_TRUE(session->finish(std::chrono::seconds(30)));
  ASSERT_TRUE(daemon_.waitFor(Kind::end, 1));
  EXPECT_EQ(daemon_.events(Kind::flush).size(), 2U) << "without a message there is no flush";
}

TEST_F(Habits, AFlushOfTheProgramsOwnTakesThePlaceOfTheNext) {
  const auto session = open({.flushInterval = std::chrono::hours(1)});
  session->sendMessage(1, 1, {});
  session->flush();
  EXPECT_TRUE(session->finish(std::chrono::seconds(30)));
  ASSERT_TRUE(daemon_.waitFor(Kind::end, 1));
  EXPECT_EQ(daemon_.events(Kind::flush).size(), 1U);
}

TEST_F(Habits, DestructionFinishesWhereItIsTo) {
  open({.finishOnDestruction = std::chrono::seconds(30)})->sendMessage(1, 1, {});
  EXPECT_EQ(daemon_.events(Kind::message).size(), 1U);
  EXPECT_TRUE(daemon_.waitFor(Kind::finish, 1));
}

TEST_F(Habits, ASessionThatDoesNotWaitForADaemonEndsWithoutOne) {
  const std::string nowhere = daemon_.socketPath() + ".none";
  const auto session = KYTReporting::open(optionsFor(nowhere), {.waitForDaemon = false});
  session->sendMessage(1, 1, {});
  std::optional<Error> why;
  ASSERT_TRUE(eventually([&] {
    why = session->trySendMessage(1, 1, {});
    return why.has_value();
  }));
  EXPECT_EQ(why->code, static_cast<int>(ClientError::notConnected));
  EXPECT_NE(why->localizedDescription.find(nowhere), std::string::npos);
  // The thread that gave up counts what waited a moment after it says so.
  EXPECT_TRUE(eventually([&] {
    const auto figures = session->statistics();
    return figures.accepted == figures.lostInQueue && figures.droppedClosed >= 1;
  }));
}

TEST_F(Habits, ASessionThatDoesNotWaitForADaemonWaitsForTheNextOnceOneTookIt) {
  const auto session = open({.waitForDaemon = false});
  session->sendMessage(1, 1, {});
  ASSERT_TRUE(daemon_.waitFor(Kind::message, 1));
  daemon_.stop();
  ASSERT_TRUE(eventually([&] { return session->state() == KYTReporting::State::noDaemon; }));
  EXPECT_TRUE(session->sendMessage(1, 2, {}));
  ASSERT_EQ(daemon_.start(), std::nullopt);
  EXPECT_EQ(message(1).type, 2);
}

TEST_F(Habits, OptionsOfTheCInterfaceSayTheSame) {
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = daemon_.socketPath().c_str();
  options.flush_interval_milliseconds = 10;
  options.finish_on_close_milliseconds = 30000;
  kyt_session* session = kyt_session_open(&options);
  EXPECT_EQ(kyt_session_send(session, 1, 1, nullptr, 0), 1);
  EXPECT_TRUE(daemon_.waitFor(Kind::flush, 1));
  kyt_session_close(session);
  EXPECT_TRUE(daemon_.waitFor(Kind::finish, 1));
  options.socket_path = "/nonexistent";
  options.ends_without_daemon = 1;
  session = kyt_session_open(&options);
  EXPECT_TRUE(eventually([&] { return kyt_session_send(session, 1, 1, nullptr, 0) == 0; }));
  kyt_session_close(session);
}

TEST_F(Habits, ATimerSendsSecondsUnlessItIsCancelled) {
  const auto session = open();
  {
    Timer timer(*session, 20, 1, {{"step", "index"}});
    timer.set("rows", 3);
    Timer cancelled(*session, 20, 2);
    cancelled.cancel();
  }
  EXPECT_TRUE(session->finish(std::chrono::seconds(30)));
  const Event sent = message(0);
  EXPECT_EQ(sent.type, 1);
  EXPECT_EQ(*sent.payload.string("step"), "index");
  EXPECT_EQ(sent.payload.integer("rows"), 3);
  EXPECT_GE(sent.payload.find("duration")->doubleValue(), 0);
  EXPECT_LT(sent.payload.find("duration")->doubleValue(), 60);
  EXPECT_EQ(daemon_.events(Kind::message).size(), 1U);
}

TEST_F(Habits, SumsThatFindNoRoomGoAlongWithTheNext) {
  daemon_.stop();
  KYTReporting::Options options = optionsFor(daemon_.socketPath());
  options.maxQueuedMessages = 64;
  const auto session = KYTReporting::open(std::move(options), {});
  Counter counter(*session, 21, 1, std::chrono::milliseconds(0));
  for (int i = 0; i < 70; ++i) counter.add(5);
  EXPECT_EQ(session->statistics().queued, 64U);
  EXPECT_FALSE(daemon_.start());
  EXPECT_TRUE(eventually([&] { return session->statistics().queued == 0; }));
  counter.add(1);
  EXPECT_TRUE(session->finish(std::chrono::seconds(30)));
  const std::vector<Event> sent = daemon_.events(Kind::message);
  ASSERT_EQ(sent.size(), 65U);
  EXPECT_EQ(sent[63].payload.integer("count"), 5);
  EXPECT_EQ(sent[64].payload.integer("count"), 31);
}

TEST_F(Habits, SumsOfManyThreadsAreWholeWhoeverSendsThem) {
  const auto session = open();
  const auto begun = std::chrono::steady_clock::now();
  {
    Counter counter(*session, 21, 1, std::chrono::milliseconds(1));
    std::vector<std::jthread> threads;
    for (int i = 0; i < 4; ++i)
      threads.emplace_back([&counter] {
        for (int n = 0; n < 100000; ++n) counter.add();
      });
  }
  const double passed = std::chrono::duration<double>(std::chrono::steady_clock::now() - begun).count();
  EXPECT_TRUE(session->finish(std::chrono::seconds(30)));
  int64_t count = 0;
  double seconds = 0;
  for (const Event& event : daemon_.events(Kind::message)) {
    count += event.payload.integer("count");
    seconds += event.payload.find("seconds")->doubleValue();
  }
  EXPECT_EQ(count, 400000);
  EXPECT_LE(seconds, passed);
}

TEST_F(Habits, ACounterSendsSumsOfItsInterval) {
  const auto session = open();
  {
    Counter each(*session, 21, 1, std::chrono::milliseconds(0), {{"kind", "request"}});
    each.add(3);
    Counter rest(*session, 21, 2);
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i)
      threads.emplace_back([&rest] {
        for (int n = 0; n < 1000; ++n) rest.add();
      });
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(session->statistics().accepted, 1U);
  }
  EXPECT_TRUE(session->finish(std::chrono::seconds(30)));
  EXPECT_EQ(message(0).payload.integer("count"), 3);
  EXPECT_EQ(*message(0).payload.string("kind"), "request");
  EXPECT_EQ(message(1).payload.integer("count"), 4000);
  EXPECT_EQ(daemon_.events(Kind::message).size(), 2U) << "a sum of nothing does not leave";
}

TEST_F(Habits, ValuesComeFromChronoAndOptional) {
  using namespace std::chrono_literals;
  EXPECT_EQ(asValue(1500ms), Value(1.5));
  EXPECT_EQ(asValue(std::chrono::system_clock::time_point(90s)), Value(Date{90}));
  EXPECT_EQ(asValue(std::optional<int>()), Value());
  EXPECT_EQ(asValue(std::optional(250ms)), Value(0.25));
  EXPECT_EQ(asValue("text"), Value("text"));
  const auto session = open();
  session->sendMessage(1, 1, {{"none", asValue(std::optional<int>())}, {"one", asValue(std::optional(1))}});
  EXPECT_EQ(message(0).payload, (Dictionary{{"one", 1}}));
}

const kyt_last_word* lastWord = nullptr;

TEST_F(Habits, ALastWordOfACrashingProgramArrives) {
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_int(info, "ClientType", 20);
  kyt_dictionary_set_uint(info, "SessionID", 7);
  kyt_dictionary* payload = kyt_dictionary_new();
  kyt_dictionary_set_string(payload, "version", "1.2");
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = daemon_.socketPath().c_str();
  options.session_info = info;
  kyt_last_word* word = kyt_last_word_new(&options, 99, 11, payload);
  ASSERT_NE(word, nullptr);
  lastWord = word;
  const pid_t child = ::fork();
  if (child == 0) {
    struct sigaction action {};
    action.sa_handler = [](int) { ::_exit(kyt_last_word_send(lastWord, 20000) == 1 ? 42 : 1); };
    ::sigaction(SIGSEGV, &action, nullptr);
    ::raise(SIGSEGV);
    ::_exit(2);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 42);
  const Event sent = message(0);
  EXPECT_TRUE(sent.single);
  EXPECT_EQ(sent.category, 99);
  EXPECT_EQ(*sent.payload.string("version"), "1.2");
  EXPECT_EQ(kyt_last_word_send(word, 20000), 1) << "any number of times";
  daemon_.stop();
  errno = 7;
  EXPECT_EQ(kyt_last_word_send(word, 20000), 0) << "nobody listens";
  EXPECT_EQ(errno, 7);
  kyt_last_word_free(word);
  EXPECT_EQ(kyt_last_word_new(&options, 70000, 1, nullptr), nullptr);
  kyt_dictionary_set_string(info, "Misspelt", "x");
  EXPECT_EQ(kyt_last_word_new(&options, 1, 1, nullptr), nullptr);
  EXPECT_EQ(kyt_last_word_new(nullptr, 1, 1, nullptr), nullptr);
  EXPECT_EQ(kyt_last_word_send(nullptr, 1), 0);
  kyt_last_word_free(nullptr);
  kyt_dictionary_free(payload);
  kyt_dictionary_free(info);
}

}  // namespace
}  // namespace kyt
