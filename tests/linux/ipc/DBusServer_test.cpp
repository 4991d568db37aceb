// The server over real sockets: sessions, hostile clients, broken streams, limits.
#include "platform/ipc/DBusServer.h"

#include <fcntl.h>
#include <malloc.h>
#include <sys/resource.h>

#include <thread>

#include "ServerFixture.h"
#include "platform/ipc/BodyReader.h"
#include "tests/ipc/WireTestSupport.h"
#include "tests/support/ChildProcess.h"

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

TEST(DBusServer, ServesEveryOperation) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  const int file = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
  const Descriptor owned = ownDescriptor(file);
  uint32_t expected = 0;
  const char* const signatures[] = {"",  "aas",     "aas", "s", "av", "ava(sis)", "",
                                    "b", "ba(sis)", "s",   "",  "",   ""};
  for (const std::string& call : test::everyCall()) {
    const bool upload = call.find("UploadFileAtPath") != std::string::npos;
    client.send(call, upload ? std::vector<int>{file, file} : std::vector<int>{});
    const auto reply = client.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->type, wire::MessageType::methodReturn);
    EXPECT_EQ(reply->signature, signatures[expected]);
    EXPECT_EQ(reply->replySerial, ++expected);
  }
  const auto notes = server.session()->notes();
  ASSERT_EQ(notes.size(), 13u);
  EXPECT_EQ(notes[0].substr(0, 15), "setSessionInfo ");
  EXPECT_EQ(notes[7], "upload file:///tmp/x token ");
  EXPECT_EQ(notes[12], "digest secret -1");
}

TEST(DBusServer, AnswersCallsInTheOtherByteOrder) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  client.send(test::ByteOrderSwapper::swapped(test::everyCall()[3]));
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
}

TEST(DBusServer, CallsWithoutAnInterfaceWorkAndAnyDestinationIsTaken) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(1, {.interface = "", .member = "FetchDisplayURL", .destination = "any.where"});
  ASSERT_TRUE(writer.end());
  client.send(bytes);
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
}

TEST(DBusServer, SpeaksTheStandardInterfaces) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  uint32_t serial = 0;
  const auto ask = [&](std::string_view path, std::string_view interface, std::string_view member,
                       const char* argument = nullptr) {
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(++serial, {.path = path,
                                .interface = interface,
                                .member = member,
                                .signature = argument != nullptr ? "s" : ""});
    if (argument != nullptr) writer.writeString(argument);
    EXPECT_TRUE(writer.end());
    client.send(bytes);
    return client.receiveText();
  };
  EXPECT_EQ(ask("/org/freedesktop/DBus", "org.freedesktop.DBus", "Hello"), ":1.1");
  EXPECT_EQ(ask("/", "org.freedesktop.DBus.Peer", "Ping"), "");
  EXPECT_EQ(ask("/any/path", "org.freedesktop.DBus.Peer", "GetMachineId"), test::kMachineId);
  EXPECT_NE(ask("/", "org.freedesktop.DBus.Introspectable", "Introspect").find("<node name=\"com\"/>"),
            std::string::npos);
  EXPECT_NE(ask("/com", "org.freedesktop.DBus.Introspectable", "Introspect").find("<node name=\"vantu\"/>"),
            std::string::npos);
  EXPECT_NE(ask("/com/vantu", "org.freedesktop.DBus.Introspectable", "Introspect")
                .find("<node name=\"kytreportingd\"/>"),
            std::string::npos);
  const std::string description =
      ask("/com/vantu/kytreportingd", "org.freedesktop.DBus.Introspectable", "Introspect");
  EXPECT_NE(description.find("<arg name=\"displayURL\" type=\"s\" direction=\"out\"/>"), std::string::npos);
  EXPECT_EQ(description.find("ClientSessionReplyInterface"), std::string::npos);
  EXPECT_EQ(description.find("<!--"), std::string::npos);
  EXPECT_EQ(ask("/com/vantu/kytreportingd", "org.freedesktop.DBus.Properties", "GetAll",
                "com.vantu.kytreportingd.ClientSessionInterface"),
            "a{sv}");
  const std::string error = "org.freedesktop.DBus.Error.";
  EXPECT_EQ(ask("/com/vantu/kytreportingd", "org.freedesktop.DBus.Properties", "GetAll"),
            error + "InvalidArgs");
  EXPECT_EQ(ask("/com/vantu/kytreportingd", "org.freedesktop.DBus.Properties", "GetAll", "no.such"),
            error + "UnknownInterface");
  EXPECT_EQ(ask("/", "org.freedesktop.DBus.Peer", "Ping", "x"), error + "InvalidArgs");
  EXPECT_EQ(ask("/com/vantu/kytreportingd", "com.vantu.kytreportingd.ClientSessionInterface", "Nothing"),
            error + "UnknownMethod");
  EXPECT_EQ(ask("/com/vantu/kytreportingd", "", "Nothing"), error + "UnknownMethod");
  EXPECT_EQ(ask("/com/vantu/kytreportingd", "no.such", "FetchDisplayURL"), error + "UnknownInterface");
  EXPECT_EQ(ask("/com/vantu", "com.vantu.kytreportingd.ClientSessionInterface", "FetchDisplayURL"),
            error + "UnknownInterface");
  EXPECT_EQ(ask("/no/such", "com.vantu.kytreportingd.ClientSessionInterface", "FetchDisplayURL"),
            error + "UnknownObject");
  EXPECT_EQ(ask("/org/freedesktop/DBus", "org.freedesktop.DBus", "ListNames"), error + "UnknownMethod");
  EXPECT_EQ(ask("/com/vantu/kytreportingd", "com.vantu.kytreportingd.ClientSessionInterface",
                "FetchDisplayURL", "x"),
            error + "InvalidArgs");
  EXPECT_EQ(
      ask("/com/vantu/kytreportingd", "com.vantu.kytreportingd.ClientSessionInterface", "FetchDisplayURL"),
      "uuuuuuuuuuuu")
      << "the connection lives";
}

TEST(DBusServer, AnswersNothingToOneWayCallsAndGivesNoReplyFunction) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  for (const bool replies : {false, true}) {
    client.call(
        "SendMessageWithDictionary", "a{sv}",
        [](MessageWriter& w) {
          w.writeDictionary({{"Type", 1}});
        },
        replies);
  }
  client.call("FinishSessionGracefully", false);
  client.call("NoSuchMethod", false);
  const uint32_t last = client.call("FetchDisplayURL");
  EXPECT_EQ(client.receive()->replySerial, 2u);
  EXPECT_EQ(client.receive()->replySerial, last);
  EXPECT_TRUE(server.session()->has("sendMessage {\"Type\":1}"));
  EXPECT_TRUE(server.session()->has("sendMessage {\"Type\":1} replies"));
}

TEST(DBusServer, AnswersFailedWhenASessionDropsAReply) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  server.session()->dropsReplies = true;
  client.call("SendMessageWithDictionary", "a{sv}", [](MessageWriter& w) { w.writeEmptyDictionary(); });
  EXPECT_EQ(client.receiveText(), "org.freedesktop.DBus.Error.Failed");
}

TEST(DBusServer, CallsItsClientOneWay) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  auto& proxy = server.session()->connection().remoteObjectProxy();
  EXPECT_EQ(proxy.sendMessageToClient(Dictionary{{"SessionID", 1}}, 1.5, 2, 3, std::nullopt), std::nullopt);
  const auto message = client.receive();
  ASSERT_TRUE(message);
  EXPECT_EQ(message->type, wire::MessageType::methodCall);
  EXPECT_FALSE(message->expectsReply());
  EXPECT_EQ(message->path, "/com/vantu/kytreportingd/client");
  EXPECT_EQ(message->interface, "com.vantu.kytreportingd.ClientSessionReplyInterface");
  EXPECT_EQ(message->member, "SendMessageToClient");
  EXPECT_EQ(message->signature, "aa{sv}dqqaa{sv}");
}

TEST(DBusServer, RefusesAClientWithoutTheEntitlementBeforeTellingItAnything) {
  Server server;
  server.entitlements.entitled = false;
  PlainClient client(server.path);
  client.send(ClientHandshake::opening(::getuid()));
  EXPECT_TRUE(client.atEnd());
  EXPECT_TRUE(client.received().empty());
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 0; }));
  EXPECT_EQ(server.counted(Reason::unentitledConnection), 1u);
}

TEST(DBusServer, DescribesARefusedConnectionWithTheCommandThatTellsWhy) {
  Server server;
  {
    PlainClient client(server.path);
    ASSERT_TRUE(client.shakeHands());
  }
  server.entitlements.entitled = false;
  PlainClient client(server.path);
  EXPECT_TRUE(client.atEnd());
  const std::string pid = std::to_string(::getpid());
  const std::string see = ", see \"kytctl entitlements check --pid " + pid + "\",";
  EXPECT_EQ(server.sink.count(LogLevel::debug, "of process " + pid + ", user " + std::to_string(::getuid())),
            2U);
  EXPECT_EQ(server.sink.count(LogLevel::debug, see), 1U);
}

TEST(DBusServer, AnOrderlyEndInvalidatesWithoutInterruption) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  client.call("FinishSessionGracefully");
  client.halfClose();
  ASSERT_TRUE(client.receive());
  EXPECT_TRUE(client.atEnd());
  const auto session = server.session();
  EXPECT_TRUE(eventually([&] { return session->has("invalidated"); }));
  EXPECT_EQ(session->notes(), (std::vector<std::string>{"finish", "invalidated"}));
}

TEST(DBusServer, AStreamBrokenInTheMiddleOfAMessageInterruptsFirst) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  client.send(test::everyCall()[0].substr(0, 50));
  client.close();
  const auto session = server.session();
  EXPECT_TRUE(eventually([&] { return session->has("invalidated"); }));
  EXPECT_EQ(session->notes(), (std::vector<std::string>{"interrupted", "invalidated"}));
}

TEST(DBusServer, AMalformedMessageEndsThatConnectionAloneAfterWhatCameBefore) {
  Server server;
  PlainClient good(server.path), bad(server.path);
  ASSERT_TRUE(good.shakeHands() && bad.shakeHands());
  std::string bytes = test::everyCall()[6];
  std::string second = test::everyCall()[12];
  second[second.size() - 5] = 1;  // padding before the last argument
  bad.send(bytes + second + bytes);
  EXPECT_TRUE(bad.receive());
  EXPECT_TRUE(bad.atEnd());
  EXPECT_TRUE(eventually([&] { return server.invalidations == 1; }));
  EXPECT_EQ(server.counted(Reason::malformedMessage), 1u);
  EXPECT_EQ(server.sink.count("padding is not zero"), 1u);
  good.call("FetchDisplayURL");
  EXPECT_EQ(good.receiveText(), "uuuuuuuuuuuu");
}

TEST(DBusServer, RefusesAMessageOverTheLimitAtOnce) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  std::string start = test::everyCall()[0].substr(0, 16);
  const uint32_t length = 100u << 20;
  std::memcpy(start.data() + 4, &length, 4);
  client.send(start);
  EXPECT_TRUE(client.atEnd());
  EXPECT_EQ(server.counted(Reason::messageTooLong), 1u);
}

TEST(DBusServer, TakesMessagesLargerThanItsBufferAndOneByteAtATime) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  const std::string large(700000, 'x');
  client.call("UpdateSharedDataForKey", "sav", [&](MessageWriter& w) {
    w.writeString("key");
    w.writeOptionalValue(large);
  });
  ASSERT_TRUE(client.receive());
  EXPECT_TRUE(server.session()->has("sharedKey key " + large));
  for (const char byte : test::everyCall()[3] + test::everyCall()[3]) client.send({&byte, 1});
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
}

TEST(DBusServer, TakesAHandshakeOneByteAtATime) {
  Server server;
  PlainClient client(server.path);
  for (const char byte : ClientHandshake::opening(::getuid()) + test::everyCall()[3]) client.send({&byte, 1});
  while (client.received().find("AGREE_UNIX_FD\r\n") == std::string::npos) ASSERT_TRUE(client.fill());
  client.received().erase(0, client.received().find("AGREE_UNIX_FD\r\n") + 15);
  EXPECT_EQ(client.receiveText(), "uuuuuuuuuuuu");
}

TEST(DBusServer, AFailedHandshakeEndsTheConnection) {
  Server server;
  PlainClient client(server.path);
  client.send("GET / HTTP/1.1\r\n");
  EXPECT_TRUE(client.atEnd());
  EXPECT_EQ(server.counted(Reason::handshakeFailed), 1u);
}

TEST(DBusServer, ManyPipelinedCallsAreAnsweredInOrder) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  std::string bytes;
  MessageWriter writer(bytes);
  constexpr uint32_t kCalls = 5000;
  for (uint32_t i = 1; i <= kCalls; ++i) {
    writer.beginCall(i, {.member = "SendMessageWithDictionary", .signature = "a{sv}"});
    writer.writeDictionary({{"i", i}});
    ASSERT_TRUE(writer.end());
  }
  std::thread sender([&] { client.send(bytes); });
  for (uint32_t i = 1; i <= kCalls; ++i) {
    const auto reply = client.receive();
    ASSERT_TRUE(reply);
    ASSERT_EQ(reply->replySerial, i);
  }
  sender.join();
  EXPECT_EQ(server.session()->events, static_cast<int>(kCalls));
}

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

TEST(DBusServer, FinishRunsTheHandlerAndWritesWhatIsQueued) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  const auto session = server.session();
  session->displayURLBytes = 1500000;
  client.call("FetchDisplayURL");
  EXPECT_TRUE(eventually([&] { return session->has("fetchDisplayURL"); }));
  session->connection().finish();
  EXPECT_TRUE(eventually([&] { return session->has("invalidated"); }));
  EXPECT_EQ(server.listener->connectionCount(), 1u) << "the client has not read it yet";
  EXPECT_EQ(client.receiveText().size(), 1500000u);
  EXPECT_TRUE(client.atEnd());
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 0; }));
}

TEST(DBusServer, InvalidateEndsTheConnectionOnce) {
  Server server;
  PlainClient client(server.path);
  ASSERT_TRUE(client.shakeHands());
  const auto session = server.session();
  session->connection().invalidate();
  session->connection().invalidate();
  EXPECT_TRUE(client.atEnd());
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 0; }));
  EXPECT_EQ(session->notes(), std::vector<std::string>{"invalidated"});
  EXPECT_TRUE(
      session->connection().remoteObjectProxy().sendMessageToClient(std::nullopt, 0, 1, 2, std::nullopt));
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

// Descriptors.

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

// The socket's file.

TEST(UnixSocketAcceptor, TakesThePlaceOfAStaleSocketButNotOfALiveOneOrAFile) {
  Server server;
  auto live = UnixSocketAcceptor::bindAt(server.path);
  ASSERT_TRUE(std::holds_alternative<Error>(live));
  EXPECT_NE(std::get<Error>(live).localizedDescription.find("Another process listens"), std::string::npos);

  const std::string stale = server.folder + "/stale";
  {
    const Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, stale.data(), stale.size());
    ASSERT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  }
  {
    auto bound = UnixSocketAcceptor::bindAt(stale);
    ASSERT_TRUE(std::holds_alternative<std::unique_ptr<UnixSocketAcceptor>>(bound));
    PlainClient client(stale);
    EXPECT_TRUE(client.connected());
  }
  EXPECT_FALSE(std::filesystem::exists(stale)) << "it removes what it made";

  const std::string file = server.folder + "/file";
  const Descriptor made = ownDescriptor(::open(file.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600));
  EXPECT_TRUE(std::holds_alternative<Error>(UnixSocketAcceptor::bindAt(file)));
  EXPECT_TRUE(std::filesystem::exists(file));
}

TEST(UnixSocketAcceptor, RefusesAPathOver107Bytes) {
  auto bound = UnixSocketAcceptor::bindAt("/tmp/" + std::string(103, 'x'));
  ASSERT_TRUE(std::holds_alternative<Error>(bound));
  EXPECT_NE(std::get<Error>(bound).localizedDescription.find("longer than 107 bytes"), std::string::npos);
  auto fits = UnixSocketAcceptor::bindAt("/tmp/" + std::string(90, 'k') + std::to_string(::getpid()));
  EXPECT_TRUE(std::holds_alternative<std::unique_ptr<UnixSocketAcceptor>>(fits));
}

TEST(UnixSocketAcceptor, AdoptsOnlyAListeningUnixSocket) {
  int pair[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
  const Descriptor other = ownDescriptor(pair[1]);
  EXPECT_TRUE(std::holds_alternative<Error>(UnixSocketAcceptor::adopt(ownDescriptor(pair[0]))));

  const std::string path = "/tmp/kyt-ipc-adopt-" + std::to_string(::getpid());
  auto bound = UnixSocketAcceptor::bindAt(path);
  auto& listening = std::get<std::unique_ptr<UnixSocketAcceptor>>(bound);
  auto adopted = UnixSocketAcceptor::adopt(ownDescriptor(::dup(listening->descriptor())));
  ASSERT_TRUE(std::holds_alternative<std::unique_ptr<UnixSocketAcceptor>>(adopted));
  EXPECT_TRUE(std::get<0>(adopted)->activated());
  PlainClient client(path);
  std::unique_ptr<Stream> stream;
  EXPECT_EQ(std::get<0>(adopted)->accept(stream), AcceptStatus::accepted);
  const PeerCredentials peer = stream->peer();
  EXPECT_EQ(peer.pid, ::getpid());
  EXPECT_EQ(peer.uid, ::getuid());
  std::vector<gid_t> groups(static_cast<size_t>(::getgroups(0, nullptr)));
  ASSERT_GE(::getgroups(static_cast<int>(groups.size()), groups.data()), 0);
  EXPECT_EQ(peer.groups, groups);
}

// What a service manager does before it starts the daemon: socket 3, and the variables that say so.
std::string adoptInChild(int socket, const std::string& count, bool ours) {
  return inChildProcess([&]() -> std::string {
    if (::dup2(socket, 3) != 3) return "dup2 failed";
    ::setenv("LISTEN_FDS", count.c_str(), 1);
    ::setenv("LISTEN_PID", std::to_string(ours ? ::getpid() : 1).c_str(), 1);
    auto adopted = UnixSocketAcceptor::adoptActivated();
    if (const Error* error = std::get_if<Error>(&adopted)) return error->localizedDescription;
    if (std::get<0>(adopted) == nullptr) return "none";
    if (::getenv("LISTEN_FDS") != nullptr) return "the variables are still there";
    if ((::fcntl(3, F_GETFD) & FD_CLOEXEC) == 0) return "not closed on exec";
    return (::fcntl(3, F_GETFL) & O_NONBLOCK) != 0 ? "adopted" : "it blocks";
  });
}

TEST(UnixSocketAcceptor, AdoptsTheSocketOfTheServiceManager) {
  const std::string path = "/tmp/kyt-ipc-activated-" + std::to_string(::getpid());
  auto bound = UnixSocketAcceptor::bindAt(path);
  const int socket = std::get<std::unique_ptr<UnixSocketAcceptor>>(bound)->descriptor();
  EXPECT_EQ(adoptInChild(socket, "1", true), "adopted");
  EXPECT_EQ(adoptInChild(socket, "1", false), "none") << "meant for another process";
  EXPECT_NE(adoptInChild(socket, "2", true).find("passed 2 sockets"), std::string::npos);
  EXPECT_NE(adoptInChild(2, "1", true).find("no listening Unix stream socket"), std::string::npos);
}

}  // namespace
}  // namespace kyt
