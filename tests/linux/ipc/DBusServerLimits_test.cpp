// What one client may take of the server: queued bytes when it does not read, connections, memory.
#include <malloc.h>
#include <unistd.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ServerFixture.h"
#include "platform/ipc/BodyReader.h"

// Sanitizers bring their own allocators, whose figures say nothing.
#if defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define KYT_HAS_SANITIZER 1
#endif
#endif
#if !defined(KYT_HAS_SANITIZER)
#define KYT_HAS_SANITIZER 0
#endif

namespace kyt {
namespace {

using test::PlainClient;
using test::Server;

TEST(DBusServer, StopsReadingFromAClientThatDoesNotReadAndGoesOnWhenItDoes) {
  Limits limits;
  limits.maxQueuedBytes = 100000;
  Server server(limits);
  PlainClient slow(server.path), other(server.path);
  ASSERT_TRUE(slow.shakeHands() && other.shakeHands());
  server.session(0)->displayURLBytes = 50000;
  server.session(1)->displayURLBytes = 50000;
  constexpr int kCalls = 200;
  for (int i = 0; i < kCalls; ++i) slow.call("FetchDisplayURL");
  EXPECT_TRUE(eventually([&] { return server.counted(Reason::queuedBytesExceeded) == 1; }));
  other.call("FetchDisplayURL");
  EXPECT_EQ(other.receiveText().size(), 50000u);
  EXPECT_EQ(server.invalidations, 0);
  for (int i = 0; i < kCalls; ++i) ASSERT_EQ(slow.receiveText().size(), 50000u) << i;
}

TEST(DBusServer, EndsAClientWhoseRepliesPassTwiceTheLimit) {
  Limits limits;
  limits.maxQueuedBytes = 100000;
  Server server(limits);
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  server.session()->displayURLBytes = 1000000;
  client.call("FetchDisplayURL");
  const auto session = server.session();
  EXPECT_TRUE(eventually([&] { return session->has("invalidated"); }));
  EXPECT_EQ(server.counted(Reason::clientNotReading), 1u);
}

TEST(DBusServer, DropsMessagesToAClientThatReadsTooSlowlyAndKeepsIt) {
  Limits limits;
  limits.maxQueuedBytes = 100000;
  Server server(limits);
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  auto& proxy = server.session()->connection().remoteObjectProxy();
  const Dictionary payload{{"text", std::string(20000, 'x')}};
  int sent = 0;
  for (; sent < 1000 && server.counted(Reason::aggregatorMessageDropped) == 0; ++sent)
    ASSERT_FALSE(proxy.sendMessageToClient(std::nullopt, 0, 1, 2, payload)) << "a dropped one is no error";
  ASSERT_EQ(server.counted(Reason::aggregatorMessageDropped), 1u);
  for (int i = 0; i < sent - 1; ++i) ASSERT_TRUE(client.receive());
  EXPECT_FALSE(proxy.sendMessageToClient(std::nullopt, 7, 1, 2, payload));
  EXPECT_EQ(server.counted(Reason::aggregatorMessageDropped), 1u) << "there is room again";
  const auto next = client.receive();
  ASSERT_TRUE(next);
  BodyReader in(*next);
  std::optional<Dictionary> info;
  double timestamp = 0;
  EXPECT_TRUE(in.readOptionalDictionary(info) && in.readDouble(timestamp));
  EXPECT_EQ(timestamp, 7) << "nothing is left of the dropped one";
  EXPECT_EQ(server.invalidations, 0);
}

// Without it the client would go on waiting for messages that nobody sends any more.
TEST(DBusServer, NeverDropsTheMessageThatEndsAnAggregation) {
  Limits limits;
  limits.maxQueuedBytes = 100000;
  Server server(limits);
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  auto& proxy = server.session()->connection().remoteObjectProxy();
  // The smallest messages last, so that there is no room left for any.
  int sent = 0;
  for (const size_t bytes : {20000u, 1000u, 1u}) {
    const Dictionary payload{{"text", std::string(bytes, 'x')}};
    const uint64_t dropped = server.counted(Reason::aggregatorMessageDropped);
    for (; sent < 10000 && server.counted(Reason::aggregatorMessageDropped) == dropped; ++sent)
      ASSERT_FALSE(proxy.sendMessageToClient(std::nullopt, 5, 1, 2, payload));
    --sent;  // the dropped one
  }
  ASSERT_EQ(server.counted(Reason::aggregatorMessageDropped), 3u);
  EXPECT_FALSE(proxy.sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt));
  EXPECT_EQ(server.counted(Reason::aggregatorMessageDropped), 3u);
  for (int i = 0; i < sent; ++i) ASSERT_TRUE(client.receive()) << i;
  const auto last = client.receive();
  ASSERT_TRUE(last);
  BodyReader in(*last);
  std::optional<Dictionary> info;
  double timestamp = 1;
  uint16_t category = 1, type = 1;
  EXPECT_TRUE(in.readOptionalDictionary(info) && in.readDouble(timestamp) && in.readUInt16(category) &&
              in.readUInt16(type));
  EXPECT_EQ(timestamp, 0);
  EXPECT_EQ(category + type, 0);
  EXPECT_EQ(server.invalidations, 0);
}

TEST(DBusServer, AClientThatReadsNothingAndClosesIsEndedWithoutSpinning) {
  Limits limits;
  limits.maxQueuedBytes = 100000;
  Server server(limits);
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  server.session()->displayURLBytes = 50000;
  PlainClient other(server.path);
  ASSERT_TRUE(other.shakeHands());
  for (int i = 0; i < 100; ++i) client.call("FetchDisplayURL");
  EXPECT_TRUE(eventually([&] { return server.counted(Reason::queuedBytesExceeded) >= 1; }));
  client.halfClose();
  const uint64_t wakeUps = server.reactor->wakeUps();
  for (int i = 0; i < 100; ++i) {
    other.call("FetchDisplayURL");
    ASSERT_EQ(other.receiveText(), "uuuuuuuuuuuu");
  }
  EXPECT_LT(server.reactor->wakeUps() - wakeUps, 500u);
  client.close();
  EXPECT_TRUE(eventually([&] { return server.invalidations == 1; }));
}

TEST(DBusServer, RefusesConnectionsPastTheLimits) {
  Limits limits;
  limits.maxConnectionsPerUser = 2;
  Server server(limits);
  PlainClient first(server.path), second(server.path), third(server.path);
  EXPECT_TRUE(first.shakeHands() && second.shakeHands());
  EXPECT_TRUE(third.atEnd());
  EXPECT_EQ(server.counted(Reason::tooManyConnectionsOfUser), 1u);
  first.close();
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 1; }));
  PlainClient fourth(server.path);
  EXPECT_TRUE(fourth.shakeHands());
}

TEST(DBusServer, RefusesConnectionsPastTheLimitOfAll) {
  Limits limits;
  limits.maxConnections = 1;
  Server server(limits);
  PlainClient first(server.path);
  EXPECT_TRUE(first.shakeHands());
  PlainClient second(server.path);
  EXPECT_TRUE(second.atEnd());
  EXPECT_EQ(server.counted(Reason::tooManyConnections), 1u);
}

#if !KYT_HAS_SANITIZER
TEST(DBusServer, IdleConnectionsAreSmallAndTheirMemoryComesBack) {
  Server server;
  server.keepsNothing = true;
  constexpr size_t kConnections = 400;
  std::vector<std::unique_ptr<PlainClient>> clients;
  const auto open = [&] {
    for (size_t i = 0; i < kConnections; ++i) {
      clients.push_back(std::make_unique<PlainClient>(server.path));
      ASSERT_TRUE(clients.back()->shakeHands());
      clients.back()->call("FetchDisplayURL");
      ASSERT_TRUE(clients.back()->receive());
    }
  };
  const auto close = [&] {
    clients.clear();
    EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 0; }));
  };
  open();  // so that tables and pools have grown
  close();
  const size_t before = ::mallinfo2().uordblks;
  open();
  const size_t during = ::mallinfo2().uordblks;
  size_t ofClients = 0;
  for (const auto& client : clients) ofClients += sizeof(PlainClient) + client->received().capacity();
  EXPECT_LT((during - before - ofClients) / kConnections, 3000u)
      << "bytes of the server and the session for each";
  close();
  // Read buffers stay for the next turns, four at most, and each worker keeps a little.
  EXPECT_TRUE(eventually([&] { return ::mallinfo2().uordblks < before + 4 * ReadBuffers::kBytes + 30000; }));
}
#endif

}  // namespace
}  // namespace kyt
