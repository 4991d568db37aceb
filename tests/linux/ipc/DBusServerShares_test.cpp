// The server and what one user's clients may hold of it: bytes of half messages and of replies that nobody reads,
// descriptors of messages of which the rest does not come.
#include <string>
#include <vector>

#include "ServerFixture.h"
#include "tests/ipc/WireTestSupport.h"

namespace kyt {
namespace {

using test::PlainClient;
using test::Server;

Limits limitsOf(std::optional<uint64_t> bytes, std::optional<uint64_t> descriptors = std::nullopt) {
  Limits limits;
  limits.maxBytesPerUser = bytes;
  limits.maxDescriptorsPerUser = descriptors;
  return limits;
}

std::string eventOf(size_t bytes) {
  std::string call;
  MessageWriter writer(call);
  writer.beginCall(1, {.member = "UpdateSharedDataForKey", .signature = "sav", .expectsReply = false});
  writer.writeString("key");
  writer.writeOptionalValue(Value(std::string(bytes, 'x')));
  EXPECT_TRUE(writer.end());
  return call;
}

uint64_t held(Server& server, Share share) {
  return server.budget.account(::getuid())->holds(share);
}

TEST(UsersShareOfTheServer, IsGivenBackWithTheConnections) {
  Server server;
  {
    std::vector<std::unique_ptr<PlainClient>> clients;
    for (int i = 0; i < 5; ++i) {
      clients.push_back(std::make_unique<PlainClient>(server.path));
      ASSERT_TRUE(clients.back()->shakeHands());
      clients.back()->send(eventOf(100000).substr(0, 50000), {0, 0});
    }
    EXPECT_TRUE(eventually([&] {
      return held(server, Share::descriptors) == 15 &&
             held(server, Share::bytes) == 5 * (Limits::connectionBytes + 50000);
    })) << held(server, Share::bytes);
    EXPECT_EQ(held(server, Share::connections), 5u);
  }
  EXPECT_TRUE(eventually([&] { return server.budget.account(::getuid())->holdsNothing(); }));
}

TEST(UsersShareOfTheServer, EndsTheConnectionWhoseHalfMessageHasNoRoom) {
  Server server(limitsOf(3 * Limits::connectionBytes + 150000));
  PlainClient first(server.path), second(server.path);
  ASSERT_TRUE(first.shakeHands() && second.shakeHands());
  first.send(eventOf(200000).substr(0, 100000));
  EXPECT_TRUE(eventually([&] { return held(server, Share::bytes) > 2 * Limits::connectionBytes + 90000; }));
  second.send(eventOf(200000).substr(0, 100000));
  EXPECT_TRUE(second.atEnd());
  EXPECT_EQ(server.counted(Reason::userBytesExceeded), 1u);
  EXPECT_TRUE(server.sink.contains(LogLevel::normal, "its user's clients hold too many bytes"));
  first.send(eventOf(200000).substr(100000));
  EXPECT_TRUE(eventually([&] { return server.session()->notes().size() == 1; }));
}

TEST(UsersShareOfTheServer, RefusesConnectionsThatHaveNoRoom) {
  Server server(limitsOf(2 * Limits::connectionBytes + 1));
  PlainClient first(server.path), second(server.path), third(server.path);
  EXPECT_TRUE(first.shakeHands() && second.shakeHands());
  EXPECT_TRUE(third.atEnd());
  EXPECT_EQ(server.counted(Reason::userBytesExceeded), 1u);
  first.close();
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 1; }));
  PlainClient fourth(server.path);
  EXPECT_TRUE(fourth.shakeHands());
}

// One that reads nothing holds its socket's buffer too.
TEST(UsersShareOfTheServer, EndsTheClientThatReadsNothingWhenItIsUsedUp) {
  Server server(limitsOf(4 * Limits::connectionBytes + 2 * Limits::socketBytes));
  PlainClient reader(server.path), silent(server.path);
  ASSERT_TRUE(reader.shakeHands() && silent.shakeHands());
  server.session(0)->displayURLBytes = 50000;
  server.session(1)->displayURLBytes = 50000;
  for (int i = 0; i < 50; ++i) silent.call("FetchDisplayURL");
  EXPECT_TRUE(eventually([&] { return server.counted(Reason::clientNotReading) == 1; }));
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 1; }));
  for (int i = 0; i < 50; ++i) {
    reader.call("FetchDisplayURL");
    ASSERT_EQ(reader.receiveText().size(), 50000u);
  }
  EXPECT_EQ(held(server, Share::bytes), Limits::connectionBytes);
}

TEST(UsersShareOfTheServer, EndsTheConnectionWhoseDescriptorsHaveNoRoom) {
  Server server(limitsOf(std::nullopt, 20));
  PlainClient first(server.path), second(server.path), third(server.path);
  ASSERT_TRUE(first.shakeHands() && second.shakeHands() && third.shakeHands());
  const std::string half = eventOf(100).substr(0, 50);
  first.send(half, std::vector<int>(16, 0));
  EXPECT_TRUE(eventually([&] { return held(server, Share::descriptors) == 19; }));
  second.send(half, {0, 0});
  EXPECT_TRUE(second.atEnd());
  EXPECT_EQ(server.counted(Reason::tooManyDescriptorsOfUser), 1u);
  third.send(half, {0});
  EXPECT_TRUE(eventually([&] { return held(server, Share::descriptors) == 19; }));
  PlainClient fourth(server.path);
  EXPECT_TRUE(fourth.shakeHands());
  PlainClient fifth(server.path);
  EXPECT_TRUE(fifth.atEnd());
  EXPECT_EQ(server.counted(Reason::tooManyDescriptorsOfUser), 2u);
}

}  // namespace
}  // namespace kyt
