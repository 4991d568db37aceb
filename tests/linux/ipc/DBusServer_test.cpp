// The server over real sockets: sessions, hostile clients, broken streams.
#include "platform/ipc/DBusServer.h"

#include <fcntl.h>

#include <thread>

#include "ServerFixture.h"
#include "platform/ipc/BodyReader.h"
#include "tests/ipc/WireTestSupport.h"

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

TEST(DBusServer, DoesNotTakeWhoComesAtTheEndForUnentitled) {
  Server server;
  server.ending = true;
  PlainClient client(server.path);
  client.send(ClientHandshake::opening(::getuid()));
  while (client.fill()) {
  }
  EXPECT_EQ(client.received(), kServerEnds);
  EXPECT_TRUE(eventually([&] { return server.listener->connectionCount() == 0; }));
  EXPECT_EQ(server.counted(Reason::connectionAtTheEnd), 1u);
  EXPECT_EQ(server.counted(Reason::unentitledConnection), 0u);
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

}  // namespace
}  // namespace kyt
