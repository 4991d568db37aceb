// Descriptors that take for ever to close, passed to the real daemon by clients that it serves and by clients that
// it refuses: they hold nobody but their user's workers.
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <csignal>
#include <memory>
#include <string>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/support/PlainClient.h"

namespace kyt {
namespace {

using test::PlainClient;

// More than the daemon has workers that need not block.
constexpr int kMany = 48;

// A TCP socket whose last close waits an hour for data to leave that its other end does not read. What waits goes on
// when this object ends.
class LingeringSocket {
 public:
  LingeringSocket() {
    const Descriptor listening = tcp();
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    auto* const where = reinterpret_cast<sockaddr*>(&address);
    socklen_t size = sizeof address;
    const int small = 4096;
    ::setsockopt(listening.get(), SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
    EXPECT_EQ(::bind(listening.get(), where, size), 0);
    EXPECT_EQ(::listen(listening.get(), 1), 0);
    EXPECT_EQ(::getsockname(listening.get(), where, &size), 0);
    near_ = tcp();
    EXPECT_EQ(::connect(near_.get(), where, size), 0);
    far_ = ownDescriptor(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
    const linger anHour = {1, 3600};
    EXPECT_EQ(::setsockopt(near_.get(), SOL_SOCKET, SO_LINGER, &anHour, sizeof anHour), 0);
    const std::string piece(65536, 'x');
    while (::send(near_.get(), piece.data(), piece.size(), MSG_DONTWAIT | MSG_NOSIGNAL) > 0) {
    }
  }
  [[nodiscard]] int get() const { return near_.get(); }
  // Only the daemon has it from now on. It must not have closed it yet, or this waits.
  void forget() { near_ = Descriptor(); }

 private:
  static Descriptor tcp() { return ownDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)); }
  Descriptor near_, far_;
};

class SlowCloses : public ::testing::Test {
 protected:
  void TearDown() override {
    sockets_.clear();
    if (daemon_.process() == 0) return;  // a test has seen its end
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  LingeringSocket& lingering() { return *sockets_.emplace_back(std::make_unique<LingeringSocket>()); }
  void grantUser(unsigned user) {
    daemon_.root().write(
        "etc/kytreportingd/entitlements.d/test.toml",
        "[[grant]]\nuser = " + std::to_string(user) + "\n\"com.vantu.private.kytreportingd\" = true\n");
  }
  // It stands still when this returns.
  void stop() {
    daemon_.terminate(SIGSTOP);
    siginfo_t state = {};
    EXPECT_EQ(::waitid(P_PID, static_cast<id_t>(daemon_.process()), &state, WSTOPPED), 0);
  }
  // Clients that pass such a socket before the daemon looks at any of them.
  std::vector<std::unique_ptr<PlainClient>> connectUnseen(int count) {
    std::vector<std::unique_ptr<PlainClient>> clients;
    stop();
    for (int i = 0; i < count; ++i) {
      clients.push_back(std::make_unique<PlainClient>(daemon_.socketPath()));
      LingeringSocket& socket = lingering();
      EXPECT_TRUE(clients.back()->send(ClientHandshake::opening(::getuid()), {socket.get()}));
      socket.forget();
    }
    daemon_.terminate(SIGCONT);
    return clients;
  }
  void expectService() {
    PlainClient client(daemon_.socketPath());
    ASSERT_TRUE(client.shakeHands()) << daemon_.log();
    client.call("FetchDisplayURL");
    EXPECT_EQ(client.receiveText(), "URL not available");
  }

  DaemonProcess daemon_{"http://127.0.0.1:9"};
  std::vector<std::unique_ptr<LingeringSocket>> sockets_;
};

TEST_F(SlowCloses, OfWhatClientsPassedHoldUpNoOtherClient) {
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  std::vector<std::unique_ptr<PlainClient>> clients;
  for (int i = 0; i < kMany; ++i) {
    clients.push_back(std::make_unique<PlainClient>(daemon_.socketPath()));
    ASSERT_TRUE(clients.back()->shakeHands()) << i;
  }
  stop();
  for (const auto& client : clients) {
    LingeringSocket& socket = lingering();
    client->call("FetchDisplayURL", "", [](MessageWriter&) {}, true, {socket.get()});
    socket.forget();
  }
  daemon_.terminate(SIGCONT);
  expectService();
}

TEST_F(SlowCloses, OfWhatRefusedClientsPassedHoldUpNoOtherClient) {
  grantUser(4294967000);
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  const auto refused = connectUnseen(kMany);
  for (const auto& client : refused) EXPECT_TRUE(client->atEnd());
  grantUser(::geteuid());
  expectService();
}

TEST_F(SlowCloses, OfWhatClientsPastTheLimitPassedHoldUpNoOtherClient) {
  daemon_.addSettings("[limits]\nmax_connections_per_user = 1\n");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  {
    PlainClient only(daemon_.socketPath());
    ASSERT_TRUE(only.shakeHands());
    const auto refused = connectUnseen(kMany);
    for (const auto& client : refused) EXPECT_TRUE(client->atEnd());
  }
  EXPECT_TRUE(eventually([&] { return PlainClient(daemon_.socketPath()).shakeHands(); })) << daemon_.log();
}

TEST_F(SlowCloses, DoNotHoldUpTheDaemonsEnd) {
  daemon_.addSettings("shutdown_grace_seconds = 0.5\n");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  const auto clients = connectUnseen(kMany);
  expectService();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(
      daemon_.logged("<3>shutDown: Threads still work or wait for what clients passed, ending without them"));
}

}  // namespace
}  // namespace kyt
