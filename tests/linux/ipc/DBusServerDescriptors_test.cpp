// The server and file descriptors: those that clients pass, its own, and when there are none left.
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "ServerFixture.h"
#include "platform/linux/base/Descriptors.h"
#include "tests/ipc/WireTestSupport.h"

namespace kyt {
namespace {

using test::PlainClient;
using test::Server;

TEST(DBusServer, ClosesDescriptorsThatNobodyTakes) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  client.call("FetchDisplayURL");
  ASSERT_TRUE(client.receive());
  const size_t before = test::openDescriptors();
  const auto none = [](MessageWriter&) {};
  client.call("FetchDisplayURL", "", none, true, {0, 0, 0});  // claimed, not used
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
  std::string bytes = test::everyCall()[3];
  client.send(bytes, {0, 0});  // not claimed
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
  bytes.clear();
  MessageWriter writer(bytes);
  writer.beginCall(99, {.member = "UpdateSharedDataForKey", .signature = "sav", .unixFds = 2});
  writer.writeString("key");
  writer.writeOptionalValue(true);
  ASSERT_TRUE(writer.end());
  bytes.replace(bytes.rfind(std::string("\1b\0", 3)), 3, std::string("\1h\0", 3));
  client.send(bytes, {0, 0});
  EXPECT_EQ(client.receiveText(), "org.freedesktop.DBus.Error.InvalidArgs");
  EXPECT_TRUE(eventually([&] { return test::openDescriptors() == before; }));
}

TEST(DBusServer, TakesAnExtensionOfExactlyTwoDescriptors) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  const size_t before = test::openDescriptors();
  const auto upload = [&](std::vector<uint32_t> indexes, uint32_t count) {
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(1, {.member = "UploadFileAtPath", .signature = "ssah", .unixFds = count});
    writer.writeString("file:///x");
    writer.writeString("t");
    writer.writeDescriptorIndexes(static_cast<uint32_t>(indexes.size()));
    EXPECT_TRUE(writer.end());
    for (size_t i = 0; i < indexes.size(); ++i) {
      std::memcpy(bytes.data() + bytes.size() - 4 * (indexes.size() - i), &indexes[i], 4);
    }
    client.send(bytes, std::vector<int>(count, 0));
    return client.receiveText();
  };
  const std::string invalid = "org.freedesktop.DBus.Error.InvalidArgs";
  EXPECT_EQ(upload({}, 0), "b");
  EXPECT_EQ(upload({1, 0}, 2), "b");
  EXPECT_EQ(upload({0}, 1), invalid);
  EXPECT_EQ(upload({0, 1, 2}, 3), invalid);
  EXPECT_EQ(upload({0, 0}, 2), invalid);
  EXPECT_EQ(upload({0, 2}, 2), invalid);
  EXPECT_TRUE(eventually([&] { return test::openDescriptors() == before; }));
}

// As libraries do that send on without waiting for an answer.
TEST(DBusServer, TakesDescriptorsThatCameWithTheHandshakesLastBytes) {
  Server server;
  PlainClient client(server.path);
  char name[] = "/tmp/kyt-ipc-file-XXXXXX";
  const Descriptor file = ownDescriptor(::mkstemp(name));
  ASSERT_EQ(::unlink(name), 0);
  ASSERT_EQ(::write(file.get(), "contents", 8), 8);
  std::string bytes = ClientHandshake::opening(::getuid());
  std::string call = test::everyCall()[7];
  client.send(bytes + call, {file.get(), file.get()});
  while (client.received().find("AGREE_UNIX_FD\r\n") == std::string::npos) ASSERT_TRUE(client.fill());
  client.received().erase(0, client.received().find("AGREE_UNIX_FD\r\n") + 15);
  EXPECT_EQ(client.receiveText(), "b");
  EXPECT_TRUE(server.session()->has("upload file:///tmp/x token contents"))
      << server.session()->notes().front();
}

TEST(DBusServer, EndsAConnectionThatPassesTooManyDescriptors) {
  Server server;
  const size_t before = test::openDescriptors();
  {
    PlainClient client(server.path);
    ASSERT_TRUE(client.shakeHands());
    client.call(
        "FetchDisplayURL", "", [](MessageWriter&) {}, true, std::vector<int>(17, 0));
    EXPECT_TRUE(client.atEnd());
  }
  {
    PlainClient client(server.path);
    ASSERT_TRUE(client.shakeHands());
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(1, {.member = "FetchDisplayURL", .unixFds = 2});
    ASSERT_TRUE(writer.end());
    client.send(bytes, {0});  // one of two
    EXPECT_TRUE(client.atEnd());
  }
  {
    PlainClient client(server.path);
    ASSERT_TRUE(client.shakeHands());
    client.send("l", std::vector<int>(10, 0));
    client.send("\1", std::vector<int>(10, 0));
    EXPECT_TRUE(client.atEnd());
  }
  EXPECT_EQ(server.counted(Reason::malformedMessage), 3u);
  EXPECT_TRUE(eventually([&] { return test::openDescriptors() == before; }));
}

TEST(DBusServer, ClosesDescriptorsThatComeBeforeTheyAreAgreedOn) {
  Server server;
  PlainClient client(server.path);
  std::string opening = ClientHandshake::opening(::getuid());
  opening.resize(opening.find("NEGOTIATE_UNIX_FD"));
  client.send(opening);
  while (client.received().find("\r\n") == std::string::npos) ASSERT_TRUE(client.fill());
  client.received().clear();
  const size_t before = test::openDescriptors();
  client.send("BEGIN\r\n", {0, 0});
  client.call("FetchDisplayURL");
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
  EXPECT_EQ(test::openDescriptors(), before);
  client.call("FetchDisplayURL", "", [](MessageWriter&) {}, true, {0});
  EXPECT_TRUE(client.atEnd()) << "a message cannot carry descriptors that were not agreed on";
}

TEST(DBusServer, DescriptorsComeBackAfterThousandsOfConnections) {
  Server server;
  server.keepsNothing = true;
  {
    PlainClient warm(server.path);
    ASSERT_TRUE(warm.shakeHands());
  }
  ASSERT_TRUE(eventually([&] { return server.listener->connectionCount() == 0; }));
  const size_t before = test::openDescriptors();
  for (int i = 0; i < 2000; ++i) {
    PlainClient client(server.path);
    ASSERT_TRUE(client.connected());
    if (i % 4 == 0) client.send(ClientHandshake::opening(::getuid()));
    if (i % 4 == 1) {
      ASSERT_TRUE(client.shakeHands());
    }
    if (i % 4 == 2) client.send("nonsense");
  }
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 0; }));
  EXPECT_TRUE(eventually([&] { return test::openDescriptors() == before; }));
}

TEST(DBusServer, GoesOnServingWhenThereAreNoDescriptorsLeft) {
  Server server;
  PlainClient first(server.path);
  ASSERT_TRUE(first.shakeHands());
  rlimit old{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &old), 0);
  PlainClient waiting("/nonexistent");  // its socket exists; it is connected below
  Descriptor highest = ownDescriptor(::dup(0));
  rlimit tight = old;
  tight.rlim_cur = static_cast<rlim_t>(highest.get());
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &tight), 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, server.path.data(), server.path.size());
  ASSERT_EQ(::connect(waiting.descriptor(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  EXPECT_TRUE(eventually([&] { return server.counted(Reason::tooManyConnections) >= 2; }))
      << "it tries again";
  const uint64_t wakeUps = server.reactor->wakeUps();
  first.call("FetchDisplayURL");
  EXPECT_EQ(first.receiveText(), "uuuuuuuuuuuu");
  EXPECT_LT(server.reactor->wakeUps() - wakeUps, 1000u);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &old), 0);
  EXPECT_TRUE(waiting.shakeHands());
}

}  // namespace
}  // namespace kyt
