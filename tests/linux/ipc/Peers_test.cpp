// The server and the general D-Bus programs and libraries as its clients: sd-bus in this process for a whole
// session with descriptors, gdbus, busctl and dbus-send as they come from the system. A program that is
// missing is skipped, visibly.
#include <fcntl.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>

#include <array>
#include <cstdio>

#include "ServerFixture.h"

namespace kyt {
namespace {

using test::Server;

constexpr const char* kPath = "/com/vantu/kytreportingd";
constexpr const char* kInterface = "com.vantu.kytreportingd.ClientSessionInterface";
constexpr const char* kName = "com.vantu.kytreportingd";

// sd-bus.

struct Bus {
  sd_bus* bus = nullptr;
  ~Bus() { sd_bus_flush_close_unref(bus); }
};

void openBus(const Server& server, bool asBusClient, Bus& out) {
  ASSERT_GE(sd_bus_new(&out.bus), 0);
  ASSERT_GE(sd_bus_set_address(out.bus, ("unix:path=" + server.path).c_str()), 0);
  ASSERT_GE(sd_bus_set_bus_client(out.bus, asBusClient ? 1 : 0), 0);
  ASSERT_GE(sd_bus_negotiate_fds(out.bus, 1), 0);
  ASSERT_GE(sd_bus_start(out.bus), 0);
}

class Call {
 public:
  Call(sd_bus* bus, const char* member) : bus_(bus) {
    EXPECT_GE(sd_bus_message_new_method_call(bus, &call_, kName, kPath, kInterface, member), 0);
  }
  ~Call() {
    sd_bus_message_unref(call_);
    sd_bus_message_unref(reply_);
    sd_bus_error_free(&error_);
  }
  Call(const Call&) = delete;
  Call& operator=(const Call&) = delete;
  sd_bus_message* message() { return call_; }
  sd_bus_message* send() {
    EXPECT_GE(sd_bus_call(bus_, call_, 0, &error_, &reply_), 0)
        << (error_.message != nullptr ? error_.message : "");
    return reply_;
  }
  const char* errorName() {
    EXPECT_LT(sd_bus_call(bus_, call_, 0, &error_, &reply_), 0);
    return error_.name;
  }

 private:
  sd_bus* bus_;
  sd_bus_message* call_ = nullptr;
  sd_bus_message* reply_ = nullptr;
  sd_bus_error error_{};
};

TEST(SdBusPeer, RunsAWholeSession) {
  for (const bool asBusClient : {false, true}) {
    Server server;
    Bus bus;
    openBus(server, asBusClient, bus);
    {
      Call call(bus.bus, "SetSessionInfo");
      ASSERT_GE(sd_bus_message_append(call.message(), "a{sv}", 2, "SessionID", "u", 1u, "ClientType", "i", 7),
                0);
      ASSERT_GE(sd_bus_message_append(call.message(), "aa{sv}", 1, 1, "ClientName", "s", "a"), 0);
      ASSERT_GE(sd_bus_message_append(call.message(), "av", 1, "as", 2, "UIKit", "AVKit"), 0);
      ASSERT_GE(sd_bus_message_append(call.message(), "b", 1), 0);
      EXPECT_STREQ(sd_bus_message_get_signature(call.send(), 1), "");
    }
    {
      Call call(bus.bus, "StartConfigWithCompletionHandler");
      sd_bus_message* reply = call.send();
      const char *first = nullptr, *second = nullptr;
      ASSERT_GT(sd_bus_message_enter_container(reply, 'a', "as"), 0);
      ASSERT_GT(sd_bus_message_enter_container(reply, 'a', "s"), 0);
      ASSERT_GT(sd_bus_message_read(reply, "s", &first), 0);
      ASSERT_GT(sd_bus_message_read(reply, "s", &second), 0);
      EXPECT_STREQ(first, "httppost");
      EXPECT_STREQ(second, "dashboard");
    }
    {
      Call call(bus.bus, "SendMessageWithDictionary");
      ASSERT_GE(sd_bus_message_append(call.message(), "a{sv}", 3, "Category", "q", 3, "Type", "q", 4,
                                      "Payload", "a{sv}", 2, "text", "s", "\xC3\xA4", "number", "d", 0.5),
                0);
      sd_bus_message* reply = call.send();
      ASSERT_GT(sd_bus_message_enter_container(reply, 'a', "v"), 0);
      ASSERT_GT(sd_bus_message_enter_container(reply, 'v', "a{sv}"), 0);
    }
    {
      Call call(bus.bus, "FlushMessagesWithCompletion");
      sd_bus_message* reply = call.send();
      int value = 0;
      const char *domain = nullptr, *text = nullptr;
      int32_t code = 0;
      ASSERT_GT(sd_bus_message_read(reply, "av", 1, "b", &value), 0);
      ASSERT_GT(sd_bus_message_read(reply, "a(sis)", 1, &domain, &code, &text), 0);
      EXPECT_EQ(value, 1);
      EXPECT_STREQ(domain, "domain");
      EXPECT_EQ(code, 7);
      EXPECT_STREQ(text, "text");
    }
    {
      Call call(bus.bus, "SetDigestKey");
      ASSERT_GE(sd_bus_message_append_array(call.message(), 'y', "secret", 6), 0);
      ASSERT_GE(sd_bus_message_append(call.message(), "i", 1), 0);
      call.send();
    }
    {
      const std::string name = server.folder + "/upload";
      const Descriptor file = ownDescriptor(::open(name.c_str(), O_CREAT | O_RDWR | O_CLOEXEC, 0600));
      ASSERT_EQ(::write(file.get(), "contents", 8), 8);
      const Descriptor folder = ownDescriptor(::open(server.folder.c_str(), O_PATH | O_CLOEXEC));
      Call call(bus.bus, "UploadFileAtPath");
      ASSERT_GE(sd_bus_message_append(call.message(), "ssah", "file:///upload", "token", 2, file.get(),
                                      folder.get()),
                0);
      int success = 0;
      ASSERT_GT(sd_bus_message_read(call.send(), "b", &success), 0);
      EXPECT_EQ(success, 1);
    }
    {
      Call call(bus.bus, "SetDigestKey");
      ASSERT_GE(sd_bus_message_append(call.message(), "s", "wrong"), 0);
      EXPECT_STREQ(call.errorName(), "org.freedesktop.DBus.Error.InvalidArgs");
    }
    const auto session = server.session();
    EXPECT_EQ(
        session->notes(),
        (std::vector<std::string>{
            "setSessionInfo {\"SessionID\":1,\"ClientType\":7} {\"ClientName\":\"a\"} [\"UIKit\",\"AVKit\"] yes",
            "startConfig",
            "sendMessage {\"Category\":3,\"Type\":4,\"Payload\":{\"text\":\"\xC3\xA4\",\"number\":0.5}} replies",
            "flush", "digest secret 1", "upload file:///upload token contents"}));
    const char* unique = nullptr;
    if (asBusClient) {
      ASSERT_GE(sd_bus_get_unique_name(bus.bus, &unique), 0);
      EXPECT_STREQ(unique, ":1.1");
    }
  }
}

int takeMessage(sd_bus_message* message, void* userdata, sd_bus_error*) {
  if (sd_bus_message_is_method_call(message, "com.vantu.kytreportingd.ClientSessionReplyInterface",
                                    "SendMessageToClient") != 1) {
    return 0;
  }
  double timestamp = 0;
  uint16_t category = 0, type = 0;
  if (sd_bus_message_skip(message, "aa{sv}") >= 0 &&
      sd_bus_message_read(message, "dqq", &timestamp, &category, &type) > 0) {
    *static_cast<std::string*>(userdata) =
        std::to_string(timestamp) + " " + std::to_string(category) + " " + std::to_string(type);
  }
  return 1;
}

TEST(SdBusPeer, IsCalledBack) {
  Server server;
  Bus bus;
  openBus(server, false, bus);
  std::string received;
  ASSERT_GE(sd_bus_add_object(bus.bus, nullptr, "/com/vantu/kytreportingd/client", takeMessage, &received),
            0);
  ASSERT_FALSE(server.session()->connection().remoteObjectProxy().sendMessageToClient(
      Dictionary{{"SessionID", 1}}, 1.5, 2, 3, Dictionary{{"a", 1}}));
  EXPECT_TRUE(eventually([&] {
    while (sd_bus_process(bus.bus, nullptr) > 0) {
    }
    return !received.empty();
  }));
  EXPECT_EQ(received, "1.500000 2 3");
}

// Programs.

struct Outcome {
  int status = -1;
  std::string text;
};

Outcome run(const std::string& command) {
  Outcome outcome;
  FILE* pipe = ::popen((command + " 2>&1 < /dev/null").c_str(), "r");
  if (pipe == nullptr) return outcome;
  std::array<char, 4096> buffer{};
  size_t count = 0;
  while ((count = std::fread(buffer.data(), 1, buffer.size(), pipe)) > 0)
    outcome.text.append(buffer.data(), count);
  const int status = ::pclose(pipe);
  outcome.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return outcome;
}

#define SKIP_WITHOUT(program) \
  if (run("command -v " program).status != 0) GTEST_SKIP() << program " is not installed"

TEST(GDBusPeer, CallsTheSession) {
  SKIP_WITHOUT("gdbus");
  Server server;
  const std::string call = "timeout 30 gdbus call --address unix:path=" + server.path + " --dest " + kName +
                           " --object-path " + kPath + " --method " + kInterface;
  // As a person would write it.
  Outcome outcome =
      run(call +
          ".SetSessionInfo \"{'SessionID': <uint32 1>, 'ClientType': <7>, 'RequireUserInfo': <true>}\""
          " \"[{'ClientName': <'a'>}]\" \"[]\" false");
  EXPECT_EQ(outcome.status, 0) << outcome.text;
  EXPECT_EQ(outcome.text, "()\n");
  EXPECT_TRUE(server.session(0)->has(
      "setSessionInfo {\"SessionID\":1,\"ClientType\":7,\"RequireUserInfo\":true} {\"ClientName\":\"a\"} (null) no"));
  outcome = run(call + ".StartConfigWithCompletionHandler");
  EXPECT_EQ(outcome.text, "([['httppost', 'dashboard']],)\n");
  outcome = run(
      call +
      ".SendMessageWithDictionary \"{'Category': <uint16 3>, 'Type': <uint16 4>, 'Payload': <{'a': <1>}>}\"");
  EXPECT_EQ(outcome.status, 0) << outcome.text;
  EXPECT_NE(outcome.text.find("'Payload': <{'a': <int64 1>}>"), std::string::npos) << outcome.text;
  outcome = run(call + ".NoSuchMethod");
  EXPECT_NE(outcome.status, 0);
  EXPECT_NE(outcome.text.find("UnknownMethod"), std::string::npos) << outcome.text;
}

TEST(GDBusPeer, Introspects) {
  SKIP_WITHOUT("gdbus");
  Server server;
  const Outcome outcome = run("timeout 30 gdbus introspect --recurse --address unix:path=" + server.path +
                              " --dest " + kName + " --object-path /");
  EXPECT_EQ(outcome.status, 0) << outcome.text;
  EXPECT_NE(outcome.text.find("SendMessageWithDictionary(in  a{sv} message,"), std::string::npos)
      << outcome.text;
}

TEST(BusctlPeer, CallsTheSession) {
  SKIP_WITHOUT("busctl");
  Server server;
  const std::string busctl = "timeout 30 busctl --address=unix:path=" + server.path;
  Outcome outcome =
      run(busctl + " call " + kName + " " + kPath + " " + kInterface + " StartConfigWithCompletionHandler");
  EXPECT_EQ(outcome.status, 0) << outcome.text;
  EXPECT_EQ(outcome.text, "aas 1 2 \"httppost\" \"dashboard\"\n");
  outcome = run(busctl + " call " + kName + " " + kPath + " " + kInterface +
                " SendMessageWithDictionary 'a{sv}' 2" + " Category q 3 Type q 4");
  EXPECT_EQ(outcome.text, "av 1 a{sv} 2 \"Category\" t 3 \"Type\" t 4\n");
}

TEST(BusctlPeer, ShowsTheTreeAndTheInterface) {
  SKIP_WITHOUT("busctl");
  Server server;
  const std::string busctl = "timeout 30 busctl --no-pager --address=unix:path=" + server.path;
  Outcome outcome = run(busctl + " tree " + kName);
  EXPECT_EQ(outcome.status, 0) << outcome.text;
  EXPECT_NE(outcome.text.find("/com/vantu/kytreportingd"), std::string::npos) << outcome.text;
  outcome = run(busctl + " introspect " + kName + " " + kPath);
  EXPECT_EQ(outcome.status, 0) << outcome.text;
  EXPECT_NE(outcome.text.find(".SetDigestKey"), std::string::npos) << outcome.text;
}

TEST(DBusSendPeer, CallsTheSession) {
  SKIP_WITHOUT("dbus-send");
  Server server;
  for (const char* how : {"--peer=", "--bus="}) {
    const std::string send = std::string("timeout 30 dbus-send --print-reply ") + how +
                             "unix:path=" + server.path + " --dest=" + kName + " " + kPath + " ";
    Outcome outcome = run(send + kInterface + ".FetchDisplayURL");
    EXPECT_EQ(outcome.status, 0) << how << outcome.text;
    EXPECT_NE(outcome.text.find("string \"uuuuuuuuuuuu\""), std::string::npos) << outcome.text;
    outcome = run(send + "org.freedesktop.DBus.Peer.GetMachineId");
    EXPECT_NE(outcome.text.find(test::kMachineId), std::string::npos) << outcome.text;
    outcome = run(send + kInterface + ".SetDigestKey string:x");
    EXPECT_NE(outcome.text.find("InvalidArgs"), std::string::npos) << outcome.text;
  }
}

}  // namespace
}  // namespace kyt
