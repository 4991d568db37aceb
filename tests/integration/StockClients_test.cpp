// Programs and libraries of others as clients: the D-Bus tools that every system has, and sd-bus. Nothing
// here knows the daemon but by its interface.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

constexpr char kName[] = "com.vantu.kytreportingd";
constexpr char kPath[] = "/com/vantu/kytreportingd";
constexpr char kInterface[] = "com.vantu.kytreportingd.ClientSessionInterface";

class StockClients : public StageTest {
 protected:
  void SetUp() override {
    lay();
    putBag("cadmor", {entry("a"), entry("tool")});
    startDaemon();
  }
  [[nodiscard]] std::string address() const { return "unix:path=" + socket(); }
  [[nodiscard]] ProgramRun gdbus(const std::string& method, const std::vector<std::string>& arguments) const {
    std::vector<std::string> all{"call",          "--address", address(),  "--dest", kName,
                                 "--object-path", kPath,       "--method", method};
    all.insert(all.end(), arguments.begin(), arguments.end());
    return runProgram("gdbus", all);
  }
  [[nodiscard]] ProgramRun busctl(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), "--address=" + address());
    return runProgram("busctl", arguments);
  }
};

TEST_F(StockClients, GDBusSetsSessionInformation) {
  if (!isInstalled("gdbus")) GTEST_SKIP() << "gdbus is not installed";
  const ProgramRun call = gdbus(std::string(kInterface) + ".SetSessionInfo",
                                {"{'SessionID': <uint32 1>, 'ClientType': <7>, 'RequireUserInfo': <true>}",
                                 "[{'ClientName': <'a'>}]", "[]", "false"});
  EXPECT_EQ(call.status, 0) << call.text;
  EXPECT_EQ(call.text, "()\n");
  EXPECT_TRUE(logged("updateCorrelatedSessions: Session 1 has no correlated sessions")) << daemonLog();
}

TEST_F(StockClients, GDBusSendsASingleMessageAndAsksForTheAddressToDisplay) {
  if (!isInstalled("gdbus")) GTEST_SKIP() << "gdbus is not installed";
  const ProgramRun call = gdbus(std::string(kInterface) + ".SendMessageWithSessionInfo",
                                {"{'SessionID': <uint32 5>, 'ClientType': <7>, 'RequireUserInfo': <true>}",
                                 "[{'ClientName': <'a'>, 'ServiceName': <'s'>}]", "17", "3",
                                 "[{'text': <'hello'>, 'number': <int64 7>, 'half': <0.5>, 'on': <true>}]"});
  EXPECT_EQ(call.status, 0) << call.text;
  EXPECT_EQ(call.text, "('finished',)\n") << daemonLog();
  EXPECT_TRUE(arrive("client=a&service=s&method=17&status=3", 1)) << daemonLog();
  const ProgramRun url = gdbus(std::string(kInterface) + ".FetchDisplayURL", {});
  EXPECT_EQ(url.status, 0) << url.text;
  EXPECT_EQ(url.text, "('URL not available',)\n");
}

TEST_F(StockClients, GDBusIsToldWhatIsWrong) {
  if (!isInstalled("gdbus")) GTEST_SKIP() << "gdbus is not installed";
  const ProgramRun call = gdbus(std::string(kInterface) + ".NoSuchMethod", {});
  EXPECT_NE(call.status, 0);
  EXPECT_NE(call.text.find("org.freedesktop.DBus.Error.UnknownMethod"), std::string::npos) << call.text;
}

TEST_F(StockClients, GDBusIntrospects) {
  if (!isInstalled("gdbus")) GTEST_SKIP() << "gdbus is not installed";
  const ProgramRun tree = runProgram(
      "gdbus", {"introspect", "--address", address(), "--dest", kName, "--object-path", "/", "--recurse"});
  EXPECT_EQ(tree.status, 0) << tree.text;
  EXPECT_NE(tree.text.find("interface com.vantu.kytreportingd.ClientSessionInterface {"), std::string::npos)
      << tree.text;
  for (const char* method :
       {"SetSessionInfo(", "StartConfigWithCompletionHandler(", "FetchStatesWithUserInfo(",
        "FetchDisplayURL(", "SendMessageWithDictionary(", "FlushMessagesWithCompletion(",
        "FinishSessionGracefully(", "UploadFileAtPath(", "UploadLogData(", "SendMessageWithSessionInfo(",
        "UpdateSharedDataWithDictionary(", "UpdateSharedDataForKey(", "SetDigestKey("})
    EXPECT_NE(tree.text.find(method), std::string::npos) << method;
}

TEST_F(StockClients, BusctlCallsAndIntrospects) {
  if (!isInstalled("busctl")) GTEST_SKIP() << "busctl is not installed";
  const ProgramRun call = busctl({"call",
                                  kName,
                                  kPath,
                                  kInterface,
                                  "SendMessageWithSessionInfo",
                                  "a{sv}aa{sv}qqaa{sv}",
                                  "3",
                                  "SessionID",
                                  "u",
                                  "6",
                                  "ClientType",
                                  "i",
                                  "7",
                                  "RequireUserInfo",
                                  "b",
                                  "true",
                                  "1",
                                  "1",
                                  "ClientName",
                                  "s",
                                  "tool",
                                  "18",
                                  "4",
                                  "1",
                                  "1",
                                  "text",
                                  "s",
                                  "hello"});
  EXPECT_EQ(call.status, 0) << call.text;
  EXPECT_EQ(call.text, "s \"finished\"\n") << daemonLog();
  EXPECT_TRUE(arrive("client=tool&method=18&status=4", 1));
  const ProgramRun url = busctl({"call", kName, kPath, kInterface, "FetchDisplayURL"});
  EXPECT_EQ(url.status, 0) << url.text;
  EXPECT_EQ(url.text, "s \"URL not available\"\n");

  const ProgramRun description = busctl({"introspect", kName, kPath});
  EXPECT_EQ(description.status, 0) << description.text;
  EXPECT_NE(description.text.find(".SendMessageWithDictionary"), std::string::npos) << description.text;
  EXPECT_NE(description.text.find(".SetDigestKey"), std::string::npos) << description.text;
  const ProgramRun tree = busctl({"tree", kName});
  EXPECT_EQ(tree.status, 0) << tree.text;
  EXPECT_NE(tree.text.find("/com/vantu/kytreportingd"), std::string::npos) << tree.text;
  const ProgramRun wrong = busctl({"call", kName, kPath, kInterface, "FetchDisplayURL", "s", "surplus"});
  EXPECT_NE(wrong.status, 0) << wrong.text;
}

TEST_F(StockClients, DBusSendCallsAsAPeerAndAsOnABus) {
  if (!isInstalled("dbus-send")) GTEST_SKIP() << "dbus-send is not installed";
  for (const char* how : {"--peer=", "--bus="}) {
    const ProgramRun call = runProgram(
        "dbus-send", {how + address(), "--print-reply", "--type=method_call", "--dest=" + std::string(kName),
                      kPath, std::string(kInterface) + ".FetchDisplayURL"});
    EXPECT_EQ(call.status, 0) << how << call.text;
    EXPECT_NE(call.text.find("string \"URL not available\""), std::string::npos) << how << call.text;
  }
  const ProgramRun ping =
      runProgram("dbus-send", {"--peer=" + address(), "--print-reply", "--type=method_call", kPath,
                               "org.freedesktop.DBus.Peer.Ping"});
  EXPECT_EQ(ping.status, 0) << ping.text;
}

struct FreeBus {
  void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct FreeMessage {
  void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
using Message = std::unique_ptr<sd_bus_message, FreeMessage>;

class SDBusClient {
 public:
  explicit SDBusClient(const std::string& address) {
    sd_bus* bus = nullptr;
    if (sd_bus_new(&bus) < 0) return;
    bus_.reset(bus);
    ready_ = sd_bus_set_address(bus, address.c_str()) >= 0 && sd_bus_negotiate_fds(bus, 1) >= 0 &&
             sd_bus_start(bus) >= 0;
  }
  [[nodiscard]] bool isReady() const { return ready_; }
  [[nodiscard]] bool passesDescriptors() const {
    return sd_bus_can_send(bus_.get(), SD_BUS_TYPE_UNIX_FD) > 0;
  }
  Message newCall(const char* member) {
    sd_bus_message* message = nullptr;
    EXPECT_GE(sd_bus_message_new_method_call(bus_.get(), &message, nullptr, kPath, kInterface, member), 0);
    return Message(message);
  }
  // The reply; its error's name and text end the test otherwise.
  Message call(const Message& message) {
    sd_bus_error error = {};
    sd_bus_message* reply = nullptr;
    EXPECT_GE(sd_bus_call(bus_.get(), message.get(), 30u * 1000 * 1000, &error, &reply), 0)
        << (error.name != nullptr ? error.name : "") << " "
        << (error.message != nullptr ? error.message : "");
    sd_bus_error_free(&error);
    return Message(reply);
  }
  template <typename... Arguments>
  Message call(const char* member, const char* types, Arguments... arguments) {
    Message message = newCall(member);
    EXPECT_GE(sd_bus_message_append(message.get(), types, arguments...), 0);
    return call(message);
  }
  // The strings of an "aas" that holds one list; "none" when it holds none.
  static std::string states(const Message& reply) {
    if (!reply || sd_bus_message_enter_container(reply.get(), 'a', "as") < 0) return "no reply";
    char** list = nullptr;
    if (sd_bus_message_read_strv(reply.get(), &list) <= 0) return "none";
    std::string text;
    for (char** item = list; item != nullptr && *item != nullptr; ++item) {
      text += (text.empty() ? "" : " ") + std::string(*item);
      ::free(*item);
    }
    ::free(list);
    return text;
  }

 private:
  std::unique_ptr<sd_bus, FreeBus> bus_;
  bool ready_ = false;
};

TEST_F(StockClients, SDBusRunsAWholeSessionAndPassesDescriptors) {
  SDBusClient client(address());
  ASSERT_TRUE(client.isReady());
  EXPECT_TRUE(client.call("SetSessionInfo", "a{sv}aa{sv}avb", 4, "SessionID", "u", 4000u, "ClientType", "i",
                          20, "BatchEvent", "b", 1, "RequireUserInfo", "b", 1, 1, 1, "ClientName", "s",
                          "tool", 0, 0));
  EXPECT_TRUE(client.passesDescriptors());
  EXPECT_EQ(SDBusClient::states(client.call("StartConfigWithCompletionHandler", "")), "httppost")
      << daemonLog();
  for (int i = 0; i < 3; ++i) {
    const Message answer =
        client.call("SendMessageWithDictionary", "a{sv}", 3, "Category", "q", 30u, "Type", "q", 1u, "Payload",
                    "a{sv}", 2, "step", "i", i, "text", "s", "from sd-bus");
    ASSERT_TRUE(answer);
    EXPECT_STREQ(sd_bus_message_get_signature(answer.get(), 1), "av");
  }
  const Message flushed = client.call("FlushMessagesWithCompletion", "");
  ASSERT_TRUE(flushed);
  EXPECT_STREQ(sd_bus_message_get_signature(flushed.get(), 1), "ava(sis)");
  EXPECT_TRUE(arrive("client=tool&method=30", 3)) << daemonLog();
  EXPECT_EQ(
      SDBusClient::states(client.call("FetchStatesWithUserInfo", "aa{sv}", 1, 1, "ClientName", "s", "tool")),
      "httppost");
  const Message url = client.call("FetchDisplayURL", "");
  const char* text = nullptr;
  ASSERT_GE(sd_bus_message_read(url.get(), "s", &text), 0);
  EXPECT_STREQ(text, "https://display.example.org/");

  const TemporaryFolder folder;
  const std::string path = folder.write("log", "lines");
  const Descriptor file = ownDescriptor(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  const Descriptor parent = ownDescriptor(::open(folder.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  const Message uploaded = client.call("UploadFileAtPath", "ssah", ("file://" + path).c_str(), "token", 2,
                                       file.get(), parent.get());
  int success = 1;
  ASSERT_GE(sd_bus_message_read(uploaded.get(), "b", &success), 0);
  EXPECT_EQ(success, 0) << "no back end of this bag takes files";
  EXPECT_TRUE(logged("uploadFileWithURL: File upload failed for " + path)) << daemonLog();
  EXPECT_TRUE(std::filesystem::exists(path));

  EXPECT_TRUE(client.call("FinishSessionGracefully", ""));
  client = SDBusClient(address());  // the first connection ends
  EXPECT_TRUE(arrive("client=tool&method=0&status=1", 1)) << daemonLog();
  EXPECT_EQ(arrived("client=tool"), 5);
}

}  // namespace
}  // namespace kyt
