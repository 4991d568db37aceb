// What a session's program is told about where it stands, and how long its calls wait for a daemon.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <mutex>
#include <thread>

#include "kytreporting/KYTReporting.h"
#include "kytreporting/kytreporting.h"
#include "tests/client/AnswerOf.h"
#include "tests/client/TestDaemon.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

using State = KYTReporting::State;
using std::chrono::milliseconds;

class ClientStates : public testing::Test {
 protected:
  KYTReporting::Options options(int clientType = 7) {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = {{kKYTReportingSessionInfoSessionID, 42},
                        {kKYTReportingSessionInfoClientType, clientType}};
    made.onStateChange = [this](State state, const std::string& why) {
      const std::lock_guard lock(mutex_);
      told_.push_back(std::string(KYTReporting::nameOf(state)) + ": " + why);
    };
    return made;
  }
  std::vector<std::string> told() {
    const std::lock_guard lock(mutex_);
    return told_;
  }
  bool wasTold(const std::string& line) {
    for (const std::string& one : told())
      if (one == line) return true;
    return false;
  }
  static bool becomes(const KYTReporting& session, State state) {
    return eventually([&] { return session.state() == state; });
  }
  static std::optional<Error> errorOfFlush(KYTReporting& session) {
    std::promise<std::optional<Error>> flushed;
    session.flush([&](const Value&, std::optional<Error> error) { flushed.set_value(std::move(error)); });
    return answerOf(flushed);
  }

  // At the socket's path, and nobody listens.
  int staleSocket() const {
    const int made = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    socket_.copy(address.sun_path, sizeof address.sun_path - 1);
    EXPECT_EQ(bind(made, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    return made;
  }

  TemporaryFolder folder_;
  const std::string socket_ = folder_ / "socket";
  TestDaemon daemon_{socket_};
  std::mutex mutex_;
  std::vector<std::string> told_;
};

TEST_F(ClientStates, TellsThePathAndTheReasonWhenThereIsNoDaemon) {
  const auto session = KYTReporting::open(options());
  const std::string why = socket_ + ": No such file or directory";
  EXPECT_TRUE(eventually([&] { return wasTold("no-daemon: " + why); }));
  EXPECT_EQ(session->state(), State::noDaemon);
  EXPECT_EQ(session->stateReason(), why);

  KYTReporting::Options tooLong = options();
  tooLong.socketPath = std::string(120, 'x');
  const auto other = KYTReporting::open(std::move(tooLong));
  EXPECT_TRUE(eventually([&] {
    return wasTold("no-daemon: " + std::string(120, 'x') + ": a socket's path has at most 107 bytes");
  }));
}

TEST_F(ClientStates, TellsARefusalOnlyWhenTheDaemonEndsTheConnectionAgain) {
  daemon_.setAccepts(false);
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  ASSERT_TRUE(becomes(*session, State::refused));
  const std::string ended = socket_ + ": the connection ended";
  ASSERT_TRUE(eventually([&] { return told().size() == 2; }));
  EXPECT_EQ(told()[0].find("no-daemon: " + ended), 0U) << told()[0];
  EXPECT_EQ(told()[1].find("refused: " + ended), 0U) << told()[1];
  EXPECT_NE(told()[1].find("the daemon refuses this user and program"), std::string::npos) << told()[1];
  daemon_.setAccepts(true);
  EXPECT_TRUE(becomes(*session, State::connected));
}

TEST_F(ClientStates, GoesFromConnectedToLiveAndBackWhenTheDaemonEnds) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  ASSERT_TRUE(becomes(*session, State::connected));
  EXPECT_EQ(session->stateReason(), "startConfiguration was not called yet");
  session->startConfiguration();
  ASSERT_TRUE(becomes(*session, State::live));
  EXPECT_EQ(session->stateReason(), "httppost qrs");
  daemon_.stop();
  ASSERT_TRUE(becomes(*session, State::noDaemon));
  ASSERT_TRUE(daemon_.start());
  EXPECT_TRUE(becomes(*session, State::live));
}

TEST_F(ClientStates, NamesTheClientTypeThatHasNoStorebag) {
  daemon_.setStates(std::nullopt);
  ASSERT_TRUE(daemon_.start());
  const auto unknown = KYTReporting::open(options(3)), known = KYTReporting::open(options(20));
  unknown->startConfiguration();
  known->startConfiguration();
  ASSERT_TRUE(becomes(*unknown, State::noStorebag));
  EXPECT_EQ(unknown->stateReason(), "client type 3 has no storebag: types 5 to 23 have one");
  ASSERT_TRUE(becomes(*known, State::noStorebag));
  EXPECT_EQ(
      known->stateReason(),
      "the daemon has no storebag for client type 20, or one that names no back end: its log says why it could "
      "not be fetched or verified, or that it names none");
}

TEST_F(ClientStates, NamesWhatMayKeepEveryBackEndOff) {
  daemon_.setStates(Array());
  ASSERT_TRUE(daemon_.start());
  KYTReporting::Options promised = options(), named = options();
  promised.sessionInfo = SessionInfo{.sessionID = 1, .clientType = 20};
  named.sessionInfo = SessionInfo{.sessionID = 2, .clientType = 20};
  named.userInfo = Dictionary{{kKYTReportingUserInfoClientName, "example"}};
  const auto without = KYTReporting::open(std::move(promised)), with = KYTReporting::open(std::move(named));
  without->startConfiguration();
  with->startConfiguration();
  ASSERT_TRUE(becomes(*without, State::noLiveBackEnd));
  EXPECT_EQ(without->stateReason(), "RequireUserInfo is set, and the session has no user information");
  ASSERT_TRUE(becomes(*with, State::noLiveBackEnd));
  EXPECT_NE(with->stateReason().find("ClientName \"example\", ServiceName none"), std::string::npos);
  EXPECT_NE(with->stateReason().find("consent"), std::string::npos);
}

TEST_F(ClientStates, SaysAndCountsThatMessagesAreSentWithoutAConfiguration) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(session->sendMessage(1, 1, {}));
  EXPECT_TRUE(eventually([&] {
    return wasTold(
        "connected: messages are sent, and startConfiguration was not called: the daemon drops them");
  }));
  session->startConfiguration();
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  EXPECT_TRUE(session->finish());
  EXPECT_EQ(session->statistics().sentUnconfigured, 3U);
  EXPECT_EQ(session->state(), State::live);
}

TEST_F(ClientStates, TellsInformationThatIsWrongAsARefusal) {
  KYTReporting::Options wrong = options();
  wrong.sessionInfo.set("RequireUserinfo", true);
  const auto session = KYTReporting::open(std::move(wrong));
  EXPECT_EQ(session->state(), State::refused);
  EXPECT_NE(session->stateReason().find("\"RequireUserinfo\""), std::string::npos);
  EXPECT_TRUE(eventually([&] { return told().size() == 1; }));
}

TEST_F(ClientStates, MayCloseTheSessionFromInsideTheBlock) {
  std::promise<void> closed;
  std::unique_ptr<KYTReporting> session;
  std::promise<void> opened;
  KYTReporting::Options closing = options();
  closing.onStateChange = [&, ready = opened.get_future()](State, const std::string&) {
    ready.wait();
    session.reset();
    closed.set_value();
  };
  session = KYTReporting::open(std::move(closing));
  opened.set_value();
  answerOf(closed);
  EXPECT_EQ(session, nullptr);
}

TEST_F(ClientStates, FinishGivesUpAtOnceWhereNoDaemonEverWas) {
  const auto session = KYTReporting::open(options());
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(session->finish(std::chrono::minutes(10)));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kTestDeadline);
  EXPECT_EQ(session->statistics().lostInQueue, 1U);
  EXPECT_EQ(session->statistics().lostOnConnectionEnd, 0U) << "nothing was written";
  EXPECT_EQ(session->stateReason(), socket_ + ": No such file or directory");
}

TEST_F(ClientStates, FinishGivesUpAtOnceWhereTheDaemonRefuses) {
  daemon_.setAccepts(false);
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(session->finish(std::chrono::minutes(10)));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kTestDeadline);
  EXPECT_EQ(session->state(), State::refused);
}

TEST_F(ClientStates, FinishTriesOnceMoreBeforeItGivesUp) {
  const auto session = KYTReporting::open(options());
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  ASSERT_TRUE(eventually([&] { return !told().empty(); }));
  ASSERT_TRUE(daemon_.start());
  EXPECT_TRUE(session->finish(kTestDeadline));
  EXPECT_EQ(daemon_.count("Send"), 1U);
}

TEST_F(ClientStates, FinishWaitsForADaemonWhenItIsToldTo) {
  KYTReporting::Options patient = options();
  patient.finishWaitsForDaemon = true;
  const auto session = KYTReporting::open(std::move(patient));
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  std::thread later([&] {
    (void)eventually([&] { return !told().empty(); });
    ASSERT_TRUE(daemon_.start());
  });
  EXPECT_TRUE(session->finish(kTestDeadline));
  later.join();
  EXPECT_EQ(daemon_.count("Send"), 1U);
}

TEST_F(ClientStates, FinishWaitsForADaemonThatTookSomethingAndDied) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  ASSERT_TRUE(becomes(*session, State::connected));
  daemon_.stop();
  ASSERT_TRUE(eventually([&] { return wasTold("no-daemon: " + socket_ + ": No such file or directory"); }));
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  std::promise<bool> finished;
  std::atomic<bool> over{false};
  std::thread finishing([&] {
    const bool taken = session->finish(kTestDeadline);
    over = true;
    finished.set_value(taken);
  });
  // From the goodbye on nothing is taken.
  uint64_t taken = 1;
  EXPECT_TRUE(eventually([&] { return !session->sendMessage(1, 1, {}) || (++taken, over.load()); }));
  // Another reason shows that it goes on trying.
  const int stale = staleSocket();
  EXPECT_TRUE(eventually([&] { return wasTold("no-daemon: " + socket_ + ": Connection refused") || over; }));
  EXPECT_FALSE(over) << "it gave up";
  close(stale);
  unlink(socket_.c_str());
  ASSERT_TRUE(daemon_.start());
  EXPECT_TRUE(answerOf(finished));
  finishing.join();
  // What was taken while the goodbye was said stands behind it.
  EXPECT_EQ(session->statistics().accepted, taken);
  EXPECT_EQ(daemon_.count("Send"), session->statistics().sent);
}

TEST_F(ClientStates, FailsCompletionsThatWaitForADaemonThatNeverComes) {
  KYTReporting::Options hurried = options();
  hurried.callDeadline = milliseconds(20);
  const auto session = KYTReporting::open(std::move(hurried));
  // The reason is that of an attempt, and a busy machine lets the deadline pass before the first.
  ASSERT_TRUE(eventually([&] { return session->stateReason().find("No such file") != std::string::npos; }));
  const std::optional<Error> error = errorOfFlush(*session);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, kKYTReportingClientErrorDomain);
  EXPECT_EQ(error->code, static_cast<int32_t>(ClientError::timedOut));
  EXPECT_EQ(error->localizedDescription,
            "no daemon within 0.02 s: " + socket_ + ": No such file or directory");
  EXPECT_EQ(session->statistics().waitedTooLong, 1U);
}

TEST_F(ClientStates, TellsADaemonThatComesTooLateWhatTheSessionIsAndNotWhatNobodyWaitsForAnyMore) {
  KYTReporting::Options hurried = options();
  hurried.callDeadline = milliseconds(20);
  const auto session = KYTReporting::open(std::move(hurried));
  std::promise<std::optional<Error>> configured;
  session->startConfiguration(
      [&](auto, std::optional<Error> error) { configured.set_value(std::move(error)); });
  session->updateSharedData("x", 1);
  EXPECT_TRUE(session->sendMessage(1, 1, {}));
  std::promise<std::optional<Error>> posted;
  session->sendMessage(2, 2, {}, 0,
                       [&](const Value&, std::optional<Error> error) { posted.set_value(std::move(error)); });
  EXPECT_TRUE(answerOf(configured));
  EXPECT_TRUE(answerOf(posted));
  ASSERT_TRUE(daemon_.start());
  ASSERT_TRUE(becomes(*session, State::live));
  EXPECT_TRUE(session->finish());
  EXPECT_EQ(daemon_.calls(), (std::vector<std::string>{"SetSessionInfo 42", "StartConfig", "SharedData x=1",
                                                       "Send 1 1 -", "Finish"}));
}

TEST_F(ClientStates, RefusesACategoryOrTypeThatDoesNotFit) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  EXPECT_FALSE(session->sendMessage(70000, 1, {}));
  EXPECT_FALSE(session->sendMessage(1, 65536, {}));
  EXPECT_TRUE(session->sendMessage(65535, 65535, {}));
  std::promise<std::optional<Error>> posted, single;
  session->sendMessage(70000, 1, {}, 0,
                       [&](const Value&, std::optional<Error> error) { posted.set_value(std::move(error)); });
  const auto error = answerOf(posted);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, static_cast<int32_t>(ClientError::invalid));
  EXPECT_EQ(error->localizedDescription, "category 70000, type 1: both are whole numbers from 0 to 65535");
  KYTReporting::sendSingleMessage(options(), 70000, 1, std::nullopt, [&](auto, std::optional<Error> wrong) {
    single.set_value(std::move(wrong));
  });
  EXPECT_TRUE(answerOf(single));
  EXPECT_TRUE(session->finish());
  EXPECT_EQ(session->statistics().droppedInvalid, 3U);
  EXPECT_EQ(daemon_.calls(), (std::vector<std::string>{"SetSessionInfo 42", "Send 65535 65535 -", "Finish"}));
}

TEST_F(ClientStates, ASingleMessageSaysWhyThereIsNoDaemon) {
  std::promise<std::string> sent;
  KYTReporting::sendSingleMessage(options(), 5, 6, std::nullopt, [&](auto, std::optional<Error> error) {
    sent.set_value(error ? error->localizedDescription : "sent");
  });
  EXPECT_EQ(answerOf(sent), socket_ + ": No such file or directory");
}

TEST_F(ClientStates, ASingleMessageIsSentAgainToADaemonThatWasJustEnding) {
  daemon_.setRefusals(1);
  ASSERT_TRUE(daemon_.start());
  std::promise<std::string> sent;
  KYTReporting::sendSingleMessage(options(), 5, 6, std::nullopt,
                                  [&](std::string text, std::optional<Error> error) {
                                    sent.set_value(error ? error->localizedDescription : std::move(text));
                                  });
  EXPECT_EQ(answerOf(sent), "finished");
}

TEST_F(ClientStates, AreNeverRefusedByADaemonThatSaysThatItEnds) {
  daemon_.setEndings(3);
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  ASSERT_TRUE(becomes(*session, State::connected));
  for (const std::string& line : told()) EXPECT_NE(line.substr(0, 8), "refused:") << line;
  EXPECT_TRUE(wasTold("no-daemon: " + socket_ + ": the daemon is ending"));
  daemon_.setEndings(1);
  std::promise<std::string> sent;
  KYTReporting::sendSingleMessage(options(), 5, 6, std::nullopt,
                                  [&](std::string text, std::optional<Error> error) {
                                    sent.set_value(error ? error->localizedDescription : std::move(text));
                                  });
  EXPECT_EQ(answerOf(sent), "finished");
}

TEST_F(ClientStates, ASingleMessageSaysThatTheDaemonRefuses) {
  daemon_.setAccepts(false);
  ASSERT_TRUE(daemon_.start());
  std::promise<std::string> sent;
  KYTReporting::sendSingleMessage(options(), 5, 6, std::nullopt, [&](auto, std::optional<Error> error) {
    sent.set_value(error ? error->localizedDescription : "sent");
  });
  EXPECT_NE(answerOf(sent).find("the daemon refuses this user and program"), std::string::npos);
}

TEST_F(ClientStates, AreTheSameInC) {
  daemon_.setStates(Array());
  ASSERT_TRUE(daemon_.start());
  std::promise<std::string> told;
  struct Context {
    std::promise<std::string>* told;
  } context{&told};
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket_.c_str();
  options.on_state_change = [](kyt_state state, const char* why, void* given) {
    if (state == KYT_STATE_NO_LIVE_BACK_END)
      static_cast<Context*>(given)->told->set_value(std::string(kyt_state_name(state)) + ": " + why);
  };
  options.state_context = &context;
  kyt_session* session = kyt_session_open(&options);
  kyt_session_configure(session, nullptr, nullptr);
  const std::string line = answerOf(told);
  EXPECT_EQ(line.find("no-live-back-end: no entry of the storebag is switched on"), 0U) << line;
  EXPECT_EQ(kyt_session_state(session), KYT_STATE_NO_LIVE_BACK_END);
  char reason[16];
  kyt_session_state_reason(session, reason, sizeof reason);
  EXPECT_STREQ(reason, "no entry of the");
  EXPECT_EQ(kyt_session_send(session, 70000, 1, nullptr, 0), 0);
  EXPECT_EQ(kyt_session_finish(session, 20000), 1);
  kyt_statistics figures{};
  kyt_session_statistics(session, &figures);
  EXPECT_EQ(figures.dropped_invalid, 1U);
  kyt_session_close(session);
  EXPECT_EQ(kyt_session_state(nullptr), KYT_STATE_NO_DAEMON);
}

TEST_F(ClientStates, FinishWaitsForADaemonInCToo) {
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket_.c_str();
  options.finish_waits_for_daemon = 1;
  kyt_session* session = kyt_session_open(&options);
  EXPECT_EQ(kyt_session_send(session, 1, 1, nullptr, 0), 1);
  std::atomic<bool> over{false};
  std::promise<bool> finished;
  std::thread finishing([&] {
    const bool taken = kyt_session_finish(session, 60000) == 1;
    over = true;
    finished.set_value(taken);
  });
  const auto says = [&](const char* text) {
    char reason[256];
    kyt_session_state_reason(session, reason, sizeof reason);
    return std::string(reason).ends_with(text);
  };
  uint64_t taken = 1;
  const auto saidGoodbye = [&] {
    return kyt_session_send(session, 1, 1, nullptr, 0) == 0 || (++taken, false);
  };
  EXPECT_TRUE(eventually([&] { return (saidGoodbye() && says(": No such file or directory")) || over; }));
  const int stale = staleSocket();
  EXPECT_TRUE(eventually([&] { return says(": Connection refused") || over; }));
  EXPECT_FALSE(over) << "it gave up";
  close(stale);
  unlink(socket_.c_str());
  ASSERT_TRUE(daemon_.start());
  EXPECT_TRUE(answerOf(finished));
  finishing.join();
  kyt_statistics figures{};
  kyt_session_statistics(session, &figures);
  kyt_session_close(session);
  EXPECT_EQ(figures.accepted, taken);
  EXPECT_EQ(daemon_.count("Send"), figures.sent);
}

TEST_F(ClientStates, FailCallbacksOfCAtTheirDeadlineToo) {
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket_.c_str();
  options.call_deadline_milliseconds = 20;
  kyt_session* session = kyt_session_open(&options);
  ASSERT_TRUE(eventually([&] {  // as above
    char reason[256];
    kyt_session_state_reason(session, reason, sizeof reason);
    return std::string(reason).find("No such file") != std::string::npos;
  }));
  std::promise<std::string> flushed;
  kyt_session_flush(
      session,
      [](const char*, const char* error, void* given) {
        static_cast<std::promise<std::string>*>(given)->set_value(error != nullptr ? error : "");
      },
      &flushed);
  EXPECT_EQ(answerOf(flushed), "no daemon within 0.02 s: " + socket_ + ": No such file or directory");
  EXPECT_EQ(kyt_session_finish(session, 600000), 0);
  kyt_session_close(session);
}

}  // namespace
}  // namespace kyt
