#include "kytreporting/FakeDaemon.h"

#include <gtest/gtest.h>

#include <future>

#include "kytreporting/KYTReporting.h"
#include "platform/base/Mutex.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

using testing::Event;
using testing::FakeDaemon;
using testing::Kind;

std::unique_ptr<KYTReporting> sessionOn(const FakeDaemon& daemon) {
  KYTReporting::Options options;
  options.socketPath = daemon.socketPath();
  options.sessionInfo = SessionInfo{.sessionID = 5, .clientType = 20, .batchEvent = true};
  options.userInfo = Dictionary{{kKYTReportingUserInfoClientName, "x"}};
  return KYTReporting::open(std::move(options));
}

std::string flushed(KYTReporting& session) {
  std::promise<std::string> answer;
  session.flush([&answer](const Value&, std::optional<Error> error) {
    answer.set_value(error ? error->localizedDescription : "");
  });
  return answer.get_future().get();
}

std::optional<std::vector<std::string>> configured(KYTReporting& session) {
  std::promise<std::optional<std::vector<std::string>>> answer;
  session.startConfiguration([&answer](std::optional<std::vector<std::string>> states,
                                       const std::optional<Error>&) { answer.set_value(std::move(states)); });
  return answer.get_future().get();
}

TEST(FakeDaemonOfTests, KeepsWhatAProgramTellsIt) {
  FakeDaemon daemon;
  ASSERT_EQ(daemon.start(), std::nullopt);
  const auto session = sessionOn(daemon);
  EXPECT_EQ(configured(*session), std::vector<std::string>{"httppost"});
  session->updateSharedData("key", 1);
  session->setDigestKey(Data("\x01\xff"), 0);
  EXPECT_TRUE(session->sendMessage(10, 1, {{"step", 1}}, 2));
  EXPECT_EQ(flushed(*session), "");
  EXPECT_EQ(flushed(*session), "Nothing to flush");
  EXPECT_TRUE(session->finish(std::chrono::seconds(30)));
  ASSERT_TRUE(daemon.waitFor(Kind::end, 1));
  const std::vector<Kind> expected = {Kind::session,   Kind::configuration, Kind::sharedData,
                                      Kind::digestKey, Kind::message,       Kind::flush,
                                      Kind::flush,     Kind::finish,        Kind::end};
  std::vector<Kind> kinds;
  for (const Event& event : daemon.events()) {
    kinds.push_back(event.kind);
    EXPECT_EQ(event.connection, 1U);
  }
  EXPECT_EQ(kinds, expected);
  EXPECT_EQ(daemon.events(Kind::session)[0].sessionInfo.unsignedInteger("SessionID"), 5U);
  EXPECT_EQ(daemon.events(Kind::digestKey)[0].text, "01ff");
  const Event message = daemon.events(Kind::message)[0];
  EXPECT_EQ(message.payload, (Dictionary{{"step", 1}}));
  EXPECT_EQ(description(message.dictionary()),
            R"({"event":"message","connection":1,"category":10,"type":1,"flag":2,"payload":{"step":1}})");
}

TEST(FakeDaemonOfTests, DropsASingleMessageWithoutIdentifiersAsTheDaemonDoes) {
  FakeDaemon daemon;
  ASSERT_EQ(daemon.start(), std::nullopt);
  for (const Dictionary& incomplete : {Dictionary{{"SessionID", 5U}}, Dictionary{{"ClientType", 20}}}) {
    KYTReporting::Options options;
    options.socketPath = daemon.socketPath();
    options.sessionInfo = incomplete;
    std::promise<std::string> answer;
    KYTReporting::sendSingleMessage(
        std::move(options), 1, 2, std::nullopt,
        [&answer](std::string text, const std::optional<Error>&) { answer.set_value(std::move(text)); });
    EXPECT_EQ(answer.get_future().get(), "Could not retrieve identifiers from sessionInfo");
  }
  EXPECT_TRUE(daemon.events(Kind::message).empty());
}

TEST(FakeDaemonOfTests, TakesSingleMessagesAndUploads) {
  FakeDaemon daemon({.socketPath = {}, .live = {"httppost", "uploadserver"}, .onEvent = nullptr});
  ASSERT_EQ(daemon.start(), std::nullopt);
  KYTReporting::Options options;
  options.socketPath = daemon.socketPath();
  options.sessionInfo = SessionInfo{.clientType = 20};
  std::promise<std::string> said;
  KYTReporting::sendSingleMessage(
      std::move(options), 3, 4, Dictionary{{"a", 1}},
      [&said](std::string text, const std::optional<Error>&) { said.set_value(std::move(text)); });
  EXPECT_EQ(said.get_future().get(), "finished");
  EXPECT_TRUE(daemon.events(Kind::message)[0].single);
  const TemporaryFolder folder;
  const auto session = sessionOn(daemon);
  EXPECT_EQ(configured(*session), (std::vector<std::string>{"httppost", "uploadserver"}));
  std::promise<bool> taken;
  session->uploadFile(folder.write("report.log", "x"),
                      [&taken](bool success, const std::optional<Error>&) { taken.set_value(success); });
  EXPECT_TRUE(taken.get_future().get());
  EXPECT_TRUE(daemon.events(Kind::file)[0].text.ends_with("/report.log"));
}

TEST(FakeDaemonOfTests, HasNoStorebagWhereItIsToldSo) {
  FakeDaemon::Options options;
  options.storebag = false;
  FakeDaemon daemon(std::move(options));
  ASSERT_EQ(daemon.start(), std::nullopt);
  const auto session = sessionOn(daemon);
  EXPECT_EQ(configured(*session), std::nullopt);
}

TEST(FakeDaemonOfTests, RefusesWhereItIsToldSo) {
  FakeDaemon::Options options;
  options.refuse = true;
  FakeDaemon daemon(std::move(options));
  ASSERT_EQ(daemon.start(), std::nullopt);
  const auto session = sessionOn(daemon);
  EXPECT_TRUE(eventually([&] { return session->state() == KYTReporting::State::refused; }));
  EXPECT_TRUE(daemon.events().empty());
}

TEST(FakeDaemonOfTests, DiesAfterSoManyMessagesAndLivesAgain) {
  FakeDaemon::Options options;
  options.dieAfter = 2;
  FakeDaemon daemon(std::move(options));
  ASSERT_EQ(daemon.start(), std::nullopt);
  const auto session = sessionOn(daemon);
  std::promise<int> code;
  for (int i = 0; i < 3; ++i) session->sendMessage(1, static_cast<uint32_t>(i), {});
  session->flush(
      [&code](const Value&, const std::optional<Error>& error) { code.set_value(error ? error->code : 0); });
  EXPECT_EQ(code.get_future().get(), static_cast<int>(ClientError::notConnected))
      << "no answer of a dead one";
  EXPECT_FALSE(daemon.isRunning());
  EXPECT_EQ(daemon.events(Kind::message).size(), 2U);
  ASSERT_EQ(daemon.start(), std::nullopt);
  ASSERT_TRUE(daemon.waitFor(Kind::session, 2));
  session->sendMessage(1, 9, {});
  ASSERT_TRUE(daemon.waitFor(Kind::message, 3));
  EXPECT_EQ(daemon.events(Kind::message)[2].type, 9);
}

TEST(FakeDaemonOfTests, TellsEachEventAsItComes) {
  std::promise<uint16_t> told;
  FakeDaemon::Options options;
  options.onEvent = [&told](const Event& event) {
    if (event.kind == Kind::message) told.set_value(event.type);
  };
  FakeDaemon daemon(std::move(options));
  ASSERT_EQ(daemon.start(), std::nullopt);
  const auto session = sessionOn(daemon);
  session->sendMessage(1, 7, {});
  EXPECT_EQ(told.get_future().get(), 7);
}

TEST(FakeDaemonOfTests, GivesMessagesToTheTopMostSessionThatAggregates) {
  FakeDaemon daemon;
  ASSERT_EQ(daemon.start(), std::nullopt);
  Mutex mutex;
  std::vector<std::string> received;  // guarded by it
  const auto open = [&](const char* token, uint32_t level, bool aggregates) {
    KYTReporting::Options options;
    options.socketPath = daemon.socketPath();
    options.sessionInfo = Dictionary{{"SessionID", level},
                                     {"ClientType", 20},
                                     {"HierarchyToken", Dictionary{{"TokenID", token}, {"Level", level}}}};
    if (aggregates)
      options.aggregationBlock = [&, level](const AggregatedMessage& message) {
        MutexLock lock(mutex);
        received.push_back(std::to_string(level) + " of " +
                           std::to_string(message.sessionInfo->unsignedInteger("SessionID")) + ": " +
                           std::to_string(message.category) + " " + description(*message.payload));
      };
    auto session = KYTReporting::open(std::move(options));
    session->startConfiguration();
    return session;
  };
  const auto top = open("a", 1, true), middle = open("a", 2, true), lowest = open("a", 3, false),
             above = open("a", 0, false), stranger = open("b", 4, false);
  ASSERT_TRUE(daemon.waitFor(Kind::session, 5));
  uint32_t category = 0;
  size_t expected = 0;
  for (const auto& session : {&above, &stranger, &lowest, &middle, &top}) {
    ++category;
    EXPECT_TRUE((*session)->sendMessage(category, 1, {{"k", category}}));
    ASSERT_TRUE(daemon.waitFor(Kind::message, category));
    if (session == &lowest || session == &middle || session == &top) ++expected;
    ASSERT_TRUE(eventually([&] {
      MutexLock lock(mutex);
      return received.size() == expected;
    }));
  }
  MutexLock lock(mutex);
  EXPECT_EQ(received,
            (std::vector<std::string>{"1 of 3: 3 {\"k\":3}", "1 of 2: 4 {\"k\":4}", "1 of 1: 5 {\"k\":5}"}));
}

TEST(FakeDaemonOfTests, SaysWhyItCannotListen) {
  const TemporaryFolder folder;
  FakeDaemon::Options options;
  options.socketPath = folder / "missing/socket";
  FakeDaemon daemon(std::move(options));
  const auto problem = daemon.start();
  ASSERT_TRUE(problem);
  EXPECT_NE(problem->localizedDescription.find("missing/socket"), std::string::npos);
  FakeDaemon first;
  ASSERT_EQ(first.start(), std::nullopt);
  EXPECT_TRUE(first.start()) << "it runs already";
}

TEST(FakeDaemonOfTests, WaitsNoLongerThanItIsTold) {
  FakeDaemon daemon;
  ASSERT_EQ(daemon.start(), std::nullopt);
  EXPECT_FALSE(daemon.waitFor(Kind::message, 1, std::chrono::milliseconds(5)));
  daemon.stop();
  EXPECT_FALSE(daemon.isRunning());
}

}  // namespace
}  // namespace kyt
