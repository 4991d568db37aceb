// Completions that run while a session ends, and waits that are meant to have no end.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstddef>
#include <future>
#include <thread>

#include "kytreporting/KYTReporting.h"
#include "kytreporting/kytreporting.h"
#include "tests/client/AnswerOf.h"
#include "tests/client/TestDaemon.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

using std::chrono::milliseconds;

// Listens and takes connections, and never says a word: a daemon that hangs while it starts.
class SilentDaemon {
 public:
  explicit SilentDaemon(const std::string& path)
      : listener_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    EXPECT_EQ(bind(listener_, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    EXPECT_EQ(listen(listener_, 4), 0);
  }
  ~SilentDaemon() {
    close(listener_);
    if (connection_ >= 0) close(connection_);
  }
  SilentDaemon(const SilentDaemon&) = delete;
  SilentDaemon& operator=(const SilentDaemon&) = delete;

  // Whether a client has connected by now.
  bool hasClient() {
    if (connection_ < 0) connection_ = accept(listener_, nullptr, nullptr);
    return connection_ >= 0;
  }
  // Whether the first connection is ended by its client.
  bool clientEnds() {
    return eventually([this] { return hasClient(); }) && eventually([this] {
             char bytes[512];
             return recv(connection_, bytes, sizeof bytes, MSG_DONTWAIT) == 0;
           });
  }

 private:
  int listener_, connection_ = -1;
};

class ClientEnds : public testing::Test {
 protected:
  KYTReporting::Options options() const {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = SessionInfo{.sessionID = 42, .clientType = 7};
    return made;
  }
  // The first of two flushes closes the session; whether the second's completion had run when that was done.
  struct Closing {
    std::unique_ptr<KYTReporting> session;
    std::atomic<bool> secondRan{false};
    std::promise<bool> ranBefore;
    void flushTwice() {
      session->flush([this](const Value&, const std::optional<Error>&) {
        session.reset();
        ranBefore.set_value(secondRan);
      });
      session->flush([this](const Value&, const std::optional<Error>&) { secondRan = true; });
    }
  };

  TemporaryFolder folder_;
  const std::string socket_ = folder_ / "socket";
  TestDaemon daemon_{socket_};
};

TEST_F(ClientEnds, NoCompletionRunsAfterAnotherHasClosedTheSessionAtTheirDeadline) {
  Closing closing;
  KYTReporting::Options hurried = options();
  hurried.callDeadline = milliseconds(20);
  closing.session = KYTReporting::open(std::move(hurried));
  closing.flushTwice();
  EXPECT_TRUE(answerOf(closing.ranBefore));
}

TEST_F(ClientEnds, NoCompletionRunsAfterAnotherHasClosedTheSessionThatFinishedWithoutADaemon) {
  Closing closing;
  std::promise<void> flushing;
  KYTReporting::Options finishing = options();
  finishing.onStateChange = [&closing, ready = flushing.get_future()](auto, const std::string&) {
    ready.wait();
    EXPECT_FALSE(closing.session->finish());
  };
  closing.session = KYTReporting::open(std::move(finishing));
  closing.flushTwice();
  flushing.set_value();
  EXPECT_TRUE(answerOf(closing.ranBefore));
}

TEST_F(ClientEnds, ASingleMessageThatWaitedTooLongLeavesNoConnectionBehind) {
  SilentDaemon silent(socket_);
  // Again where its time was over before it had connected.
  EXPECT_TRUE(eventually([&] {
    KYTReporting::Options hurried = options();
    hurried.callDeadline = milliseconds(20);
    std::promise<int32_t> sent;
    KYTReporting::sendSingleMessage(
        std::move(hurried), 5, 6, std::nullopt,
        [&](auto, const std::optional<Error>& error) { sent.set_value(error ? error->code : 0); });
    EXPECT_EQ(answerOf(sent), static_cast<int32_t>(ClientError::timedOut));
    return silent.hasClient();
  }));
  EXPECT_TRUE(silent.clientEnds());
}

TEST_F(ClientEnds, TheLongestTimesThatThereAreDoNotEndAtOnce) {
  KYTReporting::Options patient = options();
  patient.callDeadline = milliseconds::max();
  patient.finishWaitsForDaemon = true;
  std::promise<void> tried;
  patient.onStateChange = [&tried, told = false](auto, const std::string&) mutable {
    if (!std::exchange(told, true)) tried.set_value();
  };
  const auto session = KYTReporting::open(std::move(patient));
  std::promise<std::string> flushed;
  session->flush([&](const Value&, const std::optional<Error>& error) {
    flushed.set_value(error ? error->localizedDescription : "");
  });
  answerOf(tried);
  std::promise<bool> finished;
  std::thread finishing([&] { finished.set_value(session->finish(milliseconds::max())); });
  ASSERT_TRUE(daemon_.start());
  EXPECT_EQ(answerOf(flushed), "Nothing to flush");
  EXPECT_TRUE(answerOf(finished));
  finishing.join();
}

TEST_F(ClientEnds, OptionsOfASizeThatCutsAFieldAreReadWithoutIt) {
  ASSERT_TRUE(daemon_.start());
  kyt_options options{};
  options.socket_path = socket_.c_str();
  options.on_state_change = [](kyt_state, const char*, void*) { ADD_FAILURE() << "not within the size"; };
  for (const size_t cut : {size_t{1}, size_t{4}, size_t{7}}) {
    options.size = offsetof(kyt_options, on_state_change) + cut;
    kyt_session* session = kyt_session_open(&options);
    EXPECT_EQ(kyt_session_finish(session, 20000), 1);
    kyt_session_close(session);
  }
}

}  // namespace
}  // namespace kyt
