// The system's datagram sockets on loopback.
#include "platform/linux/base/LinuxUDPSocket.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <array>
#include <cerrno>
#include <string>

#include "platform/base/InternetAddress.h"
#include "platform/base/Semaphore.h"
#include "platform/linux/base/EpollReactor.h"
#include "tests/support/Eventually.h"
#include "tests/support/UDPPeer.h"

namespace kyt {
namespace {

std::span<const std::byte> bytesOf(std::string_view text) {
  return std::as_bytes(std::span(text));
}

class LinuxUDPSocketTest : public ::testing::Test {
 protected:
  std::unique_ptr<UDPSocket> open() {
    auto opened = factory_.open();
    EXPECT_TRUE(std::holds_alternative<std::unique_ptr<UDPSocket>>(opened));
    return std::get<std::unique_ptr<UDPSocket>>(std::move(opened));
  }
  static constexpr uint32_t kLoopback = 0x7F000001;
  LinuxUDPSocketFactory factory_;
  UDPPeer server_;
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
  const UDPPeer stranger;
  stranger.sendTo(port, "from a stranger");
  server_.sendTo(port, "from the server");
  std::array<std::byte, 100> buffer{};
  int64_t got = 0;
  ASSERT_TRUE(eventually([&] { return (got = socket->receive(buffer)) != -EAGAIN; }));
  EXPECT_EQ(std::string(reinterpret_cast<char*>(buffer.data()), static_cast<size_t>(got)), "from the server");
}

TEST_F(LinuxUDPSocketTest, CannotConnectToAnAddressThatIsNone) {
  const auto socket = open();
  const int error = socket->connect(ipv4Address("dashboard.example.org"), 4000);
  EXPECT_TRUE(error == EACCES || error == ENETUNREACH) << error;  // the latter on a machine without a network
}

TEST_F(LinuxUDPSocketTest, AServerThatIsGoneIsAnErrorOfASend) {
  const auto socket = open();
  socket->suppressBrokenPipeSignal();
  uint16_t port = 0;
  {
    const UDPPeer gone;
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
  ASSERT_GE(descriptor, 0);
  EXPECT_EQ(::fcntl(descriptor, F_GETFD), FD_CLOEXEC);
  EXPECT_NE(::fcntl(descriptor, F_GETFL) & O_NONBLOCK, 0);
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
