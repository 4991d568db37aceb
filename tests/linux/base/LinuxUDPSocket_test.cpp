// The system's datagram sockets on loopback.
#include "platform/linux/base/LinuxUDPSocket.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <string>

#include "platform/InternetAddress.h"
#include "platform/Semaphore.h"
#include "platform/linux/base/EpollReactor.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

std::span<const std::byte> bytesOf(std::string_view text) {
  return std::as_bytes(std::span(text));
}

// A bare socket on a free port.
class Peer {
 public:
  Peer() : descriptor_(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    EXPECT_EQ(::bind(descriptor_, reinterpret_cast<sockaddr*>(&address), size), 0);
    ::getsockname(descriptor_, reinterpret_cast<sockaddr*>(&address), &size);
    port_ = ntohs(address.sin_port);
    const timeval patience{30, 0};
    ::setsockopt(descriptor_, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  }
  ~Peer() { ::close(descriptor_); }
  [[nodiscard]] uint16_t port() const { return port_; }
  std::string receive(uint16_t* from = nullptr) const {
    char buffer[2048];
    sockaddr_in sender{};
    socklen_t size = sizeof sender;
    const ssize_t got =
        ::recvfrom(descriptor_, buffer, sizeof buffer, 0, reinterpret_cast<sockaddr*>(&sender), &size);
    if (from != nullptr) *from = ntohs(sender.sin_port);
    return got < 0 ? "nothing" : std::string(buffer, static_cast<size_t>(got));
  }
  void sendTo(uint16_t port, std::string_view text) const {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(port);
    EXPECT_EQ(::sendto(descriptor_, text.data(), text.size(), 0, reinterpret_cast<sockaddr*>(&address),
                       sizeof address),
              static_cast<ssize_t>(text.size()));
  }

 private:
  int descriptor_;
  uint16_t port_ = 0;
};

class LinuxUDPSocketTest : public ::testing::Test {
 protected:
  std::unique_ptr<UDPSocket> open() {
    auto opened = factory_.open();
    EXPECT_TRUE(std::holds_alternative<std::unique_ptr<UDPSocket>>(opened));
    return std::get<std::unique_ptr<UDPSocket>>(std::move(opened));
  }
  static constexpr uint32_t kLoopback = 0x7F000001;
  LinuxUDPSocketFactory factory_;
  Peer server_;
};

TEST_F(LinuxUDPSocketTest, SendsToItsPeerAndHearsItsAnswers) {
  const auto socket = open();
  socket->suppressBrokenPipeSignal();
  ASSERT_EQ(socket->bindToAnyPort(), 0);
  ASSERT_EQ(socket->connect(kLoopback, server_.port()), 0);
  EXPECT_EQ(socket->send(bytesOf("hello")), 5);
  uint16_t port = 0;
  EXPECT_EQ(server_.receive(&port), "hello");

  std::array<std::byte, 3> buffer{};
  EXPECT_EQ(socket->receive(buffer), -EAGAIN);  // and does not block
  server_.sendTo(port, "abcdef");
  int64_t got = 0;
  ASSERT_TRUE(eventually([&] { return (got = socket->receive(buffer)) != -EAGAIN; }));
  EXPECT_EQ(got, 3);  // the rest is lost
  EXPECT_EQ(std::string(reinterpret_cast<char*>(buffer.data()), 3), "abc");
  EXPECT_EQ(socket->receive(buffer), -EAGAIN);
}

TEST_F(LinuxUDPSocketTest, HearsNoStranger) {
  const auto socket = open();
  ASSERT_EQ(socket->bindToAnyPort(), 0);
  ASSERT_EQ(socket->connect(kLoopback, server_.port()), 0);
  ASSERT_EQ(socket->send(bytesOf("hello")), 5);
  uint16_t port = 0;
  ASSERT_EQ(server_.receive(&port), "hello");
  const Peer stranger;
  stranger.sendTo(port, "from a stranger");
  server_.sendTo(port, "from the server");
  std::array<std::byte, 100> buffer{};
  int64_t got = 0;
  ASSERT_TRUE(eventually([&] { return (got = socket->receive(buffer)) != -EAGAIN; }));
  EXPECT_EQ(std::string(reinterpret_cast<char*>(buffer.data()), static_cast<size_t>(got)), "from the server");
}

TEST_F(LinuxUDPSocketTest, CannotConnectToAnAddressThatIsNone) {
  const auto socket = open();
  EXPECT_EQ(socket->connect(ipv4Address("dashboard.example.org"), 4000), EACCES);
}

TEST_F(LinuxUDPSocketTest, AServerThatIsGoneIsAnErrorOfASend) {
  const auto socket = open();
  socket->suppressBrokenPipeSignal();
  uint16_t port = 0;
  {
    const Peer gone;
    port = gone.port();
  }
  ASSERT_EQ(socket->connect(kLoopback, port), 0);
  int64_t sent = 0;
  EXPECT_TRUE(eventually([&] { return (sent = socket->send(bytesOf("x"))) < 0; }));
  EXPECT_EQ(sent, -ECONNREFUSED);
}

TEST_F(LinuxUDPSocketTest, ADatagramThatIsTooLongIsAnError) {
  const auto socket = open();
  ASSERT_EQ(socket->connect(kLoopback, server_.port()), 0);
  EXPECT_EQ(socket->send(bytesOf(std::string(70000, 'x'))), -EMSGSIZE);
}

TEST_F(LinuxUDPSocketTest, CountsWhatIsOpenAndClosesAtItsEnd) {
  auto first = open(), second = open();
  EXPECT_EQ(factory_.openSockets(), 2u);
  const int descriptor = first->descriptor();
  EXPECT_GE(descriptor, 0);
  first.reset();
  EXPECT_EQ(factory_.openSockets(), 1u);
  EXPECT_EQ(::fcntl(descriptor, F_GETFD), -1);
}

TEST_F(LinuxUDPSocketTest, IsReportedByTheReactorOnceForEachTimeItIsArmed) {
  const auto reactor = EpollReactor::create();
  const auto socket = open();
  ASSERT_EQ(socket->bindToAnyPort(), 0);
  ASSERT_EQ(socket->connect(kLoopback, server_.port()), 0);
  ASSERT_EQ(socket->send(bytesOf("hello")), 5);
  uint16_t port = 0;
  server_.receive(&port);
  std::atomic<int> reports{0};
  Watch watch =
      reactor->watch(socket->descriptor(), ready::readable | ready::oneShot, [&](unsigned) { ++reports; });
  server_.sendTo(port, "one");
  server_.sendTo(port, "two");
  ASSERT_TRUE(eventually([&] { return reports == 1; }));
  std::array<std::byte, 100> buffer{};
  ASSERT_TRUE(eventually([&] { return socket->receive(buffer) == 3; }));
  ASSERT_TRUE(watch.rearm());  // the second one is waiting already
  EXPECT_TRUE(eventually([&] { return reports == 2; }));
}

}  // namespace
}  // namespace kyt
