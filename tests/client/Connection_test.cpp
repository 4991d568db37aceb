// A session's connection, and what it concludes of the daemon, with the test as the daemon.
#include "client/Connection.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt::client {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

constexpr SteadyTime kNow{seconds(1000)};
constexpr std::string_view kTaken = "OK 0123456789abcdef0123456789abcdef\r\nAGREE_UNIX_FD\r\n";

class ClientConnection : public testing::Test {
 protected:
  void TearDown() override {
    hangUp();
    if (listener_ >= 0) close(listener_);
  }
  void listen() {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path_.copy(address.sun_path, sizeof address.sun_path - 1);
    listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    ASSERT_EQ(bind(listener_, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listener_, 4), 0);
  }
  void connect() {
    std::string problem;
    ASSERT_TRUE(connection_.open(kNow, problem)) << problem;
    peer_ = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
    ASSERT_GE(peer_, 0);
  }
  void say(std::string_view bytes) {
    ASSERT_EQ(write(peer_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
  }
  void hangUp() {
    if (peer_ >= 0) close(std::exchange(peer_, -1));
  }
  void connectAndTake() {
    connect();
    say(kTaken);
    ASSERT_TRUE(connection_.read());
    ASSERT_EQ(connection_.shakeHands(), nullptr);
    ASSERT_TRUE(connection_.isTaken());
  }
  // A connection that ends before the daemon's first byte.
  Connection::End silentEnd() {
    connect();
    hangUp();
    EXPECT_FALSE(connection_.read());
    EXPECT_EQ(connection_.shakeHands(), nullptr);
    std::string reason = "ended";
    return connection_.end(kNow, reason);
  }
  static std::string reply(uint32_t replySerial) {
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginReply(1, replySerial, "");
    EXPECT_TRUE(writer.end());
    return bytes;
  }

  TemporaryFolder folder_;
  const std::string path_ = folder_ / "socket";
  Connection connection_{path_};
  int listener_ = -1, peer_ = -1;
};

TEST_F(ClientConnection, TriesAgainLaterEachTimeAndAtTheLatestAfterFiveSeconds) {
  std::vector<long> waits;
  for (int i = 0; i < 8; ++i) {
    std::string problem;
    EXPECT_FALSE(connection_.open(kNow, problem));
    EXPECT_EQ(problem, path_ + ": No such file or directory");
    EXPECT_TRUE(connection_.foundNobody());
    waits.push_back(std::chrono::duration_cast<milliseconds>(connection_.nextAttempt() - kNow).count());
  }
  EXPECT_EQ(waits, (std::vector<long>{100, 200, 400, 800, 1600, 3200, 5000, 5000}));
  listen();
  connectAndTake();
  std::string reason = "ended";
  (void)connection_.end(kNow, reason);
  EXPECT_EQ(connection_.nextAttempt(), kNow + milliseconds(100)) << "a daemon was there: from the beginning";
}

TEST_F(ClientConnection, IsTakenWhenTheHandshakeIsDone) {
  listen();
  connect();
  EXPECT_TRUE(connection_.isOpen());
  EXPECT_FALSE(connection_.isTaken());
  say(kTaken.substr(0, 20));
  EXPECT_TRUE(connection_.read());
  EXPECT_EQ(connection_.shakeHands(), nullptr);
  EXPECT_FALSE(connection_.isTaken());
  connection_.forgetHandled();
  say(kTaken.substr(20));
  EXPECT_TRUE(connection_.read());
  EXPECT_EQ(connection_.shakeHands(), nullptr);
  EXPECT_TRUE(connection_.isTaken());
  EXPECT_TRUE(connection_.wasEverTaken());
  EXPECT_TRUE(connection_.passesDescriptors());
}

TEST_F(ClientConnection, ReadsWholeMessagesAsTheyCome) {
  listen();
  connectAndTake();
  const std::string two = reply(7) + reply(8);
  const size_t cut = two.size() - 3;
  say(std::string_view(two).substr(0, cut));
  EXPECT_TRUE(connection_.read());
  Message message;
  ASSERT_EQ(connection_.next(message), Connection::Next::message);
  EXPECT_EQ(message.replySerial, 7U);
  EXPECT_EQ(connection_.next(message), Connection::Next::none);
  connection_.forgetHandled();
  say(std::string_view(two).substr(cut));
  EXPECT_TRUE(connection_.read());
  ASSERT_EQ(connection_.next(message), Connection::Next::message);
  EXPECT_EQ(message.replySerial, 8U);
  EXPECT_EQ(connection_.next(message), Connection::Next::none);
}

TEST_F(ClientConnection, SaysWhatIsMalformed) {
  listen();
  connectAndTake();
  say("this is no message of the protocol");
  EXPECT_TRUE(connection_.read());
  Message message;
  EXPECT_EQ(connection_.next(message), Connection::Next::malformed);
}

TEST_F(ClientConnection, BringsWhatTheDaemonSaidBeforeItEnded) {
  listen();
  connectAndTake();
  say(reply(7));
  hangUp();
  EXPECT_FALSE(connection_.read());
  Message message;
  EXPECT_EQ(connection_.next(message), Connection::Next::message);
}

TEST_F(ClientConnection, TakesOneSilentEndForTheDaemonsOwnAndASecondForARefusal) {
  listen();
  EXPECT_FALSE(silentEnd().refused);
  EXPECT_FALSE(connection_.foundNobody());
  EXPECT_TRUE(silentEnd().refused);
  EXPECT_TRUE(connection_.foundNobody());
}

TEST_F(ClientConnection, CountsSilentEndsAnewOnceADaemonHasTakenIt) {
  listen();
  EXPECT_FALSE(silentEnd().refused);
  connectAndTake();
  std::string reason = "ended";
  const Connection::End ended = connection_.end(kNow, reason);
  EXPECT_TRUE(ended.taken);
  EXPECT_FALSE(ended.refused);
  EXPECT_EQ(reason, path_ + ": ended");
  EXPECT_FALSE(connection_.isOpen());
  EXPECT_FALSE(connection_.isTaken());
  EXPECT_FALSE(silentEnd().refused);
}

TEST_F(ClientConnection, IsNotRefusedByADaemonThatSaysThatItEnds) {
  listen();
  EXPECT_FALSE(silentEnd().refused);
  connect();
  say(kServerEnds);
  EXPECT_TRUE(connection_.read());
  EXPECT_NE(connection_.shakeHands(), nullptr);
  std::string reason = "it ends";
  EXPECT_FALSE(connection_.end(kNow, reason).refused);
  EXPECT_FALSE(silentEnd().refused) << "counted anew";
}

TEST_F(ClientConnection, IsRefusedAtOnceByADaemonThatSaysSo) {
  listen();
  connect();
  say("REJECTED EXTERNAL\r\n");
  EXPECT_TRUE(connection_.read());
  EXPECT_NE(connection_.shakeHands(), nullptr);
  std::string reason = "rejected";
  EXPECT_TRUE(connection_.end(kNow, reason).refused);
  EXPECT_NE(reason.find("the daemon refuses this user and program"), std::string::npos);
}

TEST_F(ClientConnection, ForgetsWhatAFormerOneBrought) {
  listen();
  connectAndTake();
  say(reply(7).substr(0, 10));
  EXPECT_TRUE(connection_.read());
  std::string reason = "ended";
  (void)connection_.end(kNow, reason);
  hangUp();
  connectAndTake();
  say(reply(8));
  EXPECT_TRUE(connection_.read());
  Message message;
  ASSERT_EQ(connection_.next(message), Connection::Next::message);
  EXPECT_EQ(message.replySerial, 8U);
}

}  // namespace
}  // namespace kyt::client
