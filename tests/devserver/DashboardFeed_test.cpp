// The dashboard feed and log data: what is decoded, acknowledged, kept and answered.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>

#include "tests/devserver/ServerProcess.h"

namespace kyt::devserver::test {
namespace {

// A datagram by hand: session 1, version 3, method 2, response code 3, at 5.120 s.
std::string datagram(uint16_t event, const std::string& text, uint16_t flags = 1) {
  const auto number = [](uint32_t value, int width) {
    std::string out;
    while (width-- > 0) out += static_cast<char>(value >> (8 * width));
    return out;
  };
  std::string out = std::string("\x08\x06\x01\x1e", 4) + number(5, 4) + number(~1U, 4) + number(0xFFFC, 2);
  out += number(0xFFFF - 64 - static_cast<uint32_t>(text.size()), 2) + number(2, 2) + number(3, 2);
  return out + "device" + std::string(34, '\0') + number(event, 2) + number(flags, 2) + text;
}

class Client {
 public:
  explicit Client(uint16_t port) : socket_(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(port);
    EXPECT_EQ(connect(socket_, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    const timeval patience{30, 0};
    setsockopt(socket_, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  }
  ~Client() { close(socket_); }
  void send(const std::string& bytes) const {
    EXPECT_EQ(::send(socket_, bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
  }
  std::string receive() const {
    char buffer[2048];
    const ssize_t got = recv(socket_, buffer, sizeof buffer, 0);
    return got < 0 ? "nothing" : std::string(buffer, static_cast<size_t>(got));
  }
  // The event number of the next acknowledgement.
  int acknowledged() const {
    const std::string bytes = receive();
    if (bytes.size() < 62) return -static_cast<int>(bytes.size());
    return static_cast<uint8_t>(bytes[60]) << 8 | static_cast<uint8_t>(bytes[61]);
  }

 private:
  int socket_;
};

class DashboardFeedTest : public testing::Test {
 protected:
  DashboardFeedTest()
      : server_(state_.path(), {"--udp-port", "0", "--http-events"}), client_(server_.udpPort()) {}
  void SetUp() override {
    ASSERT_TRUE(server_.isReady()) << server_.errors();
    ASSERT_NE(server_.udpPort(), 0);
  }
  [[nodiscard]] Response control(const std::string& rule, const std::string& method = "PUT") const {
    Call call;
    call.method = method;
    call.body = rule;
    return server_.http("/control/acknowledgements", call);
  }
  // The newest line, once there are so many.
  [[nodiscard]] rapidjson::Document line(int count) const {
    EXPECT_TRUE(server_.get("/api/wait?timeout=30&lines=" + std::to_string(count))["reached"].GetBool());
    return server_.get("/api/lines?limit=1");
  }
  [[nodiscard]] Response postLog(const std::string& body) const {
    Call call;
    call.method = "POST";
    call.body = body;
    call.headers = {"Content-Type: application/octet-stream"};
    return server_.https("/logdata", call);
  }

  TemporaryFolder state_;
  ServerProcess server_;
  Client client_;
};

TEST_F(DashboardFeedTest, DecodesAndKeepsEveryDatagram) {
  client_.send(datagram(7, " k1=abc k2=a\\=b c\\\\d e k3=empty"));
  const rapidjson::Document answer = line(1);
  const auto& row = answer["lines"][0];
  EXPECT_TRUE(row["good"].GetBool());
  const auto& content = row["content"];
  EXPECT_EQ(content["selfVersionMajor"].GetInt(), 8);
  EXPECT_EQ(content["clientType"].GetInt(), 6);
  EXPECT_EQ(content["seconds"].GetInt(), 5);
  EXPECT_EQ(content["milliseconds"].GetInt(), 120);
  EXPECT_EQ(content["session"].GetInt(), 1);
  EXPECT_EQ(content["clientVersion"].GetInt(), 3);
  EXPECT_EQ(content["method"].GetInt(), 2);
  EXPECT_EQ(content["respCode"].GetInt(), 3);
  EXPECT_EQ(content["event"].GetInt(), 7);
  EXPECT_EQ(content["flags"].GetInt(), 1);
  EXPECT_STREQ(content["device"].GetString(), "device");
  EXPECT_STREQ(content["acknowledged"].GetString(), "yes");
  const auto& pairs = content["pairs"];
  ASSERT_EQ(pairs.Size(), 3u);
  EXPECT_STREQ(pairs[0][0].GetString(), "k1");
  EXPECT_STREQ(pairs[0][1].GetString(), "abc");
  EXPECT_STREQ(pairs[1][0].GetString(), "k2");
  EXPECT_STREQ(pairs[1][1].GetString(), "a=b c\\d e");
  EXPECT_STREQ(pairs[2][0].GetString(), "k3");
  EXPECT_STREQ(pairs[2][1].GetString(), "empty");
  EXPECT_EQ(server_.get("/api/totals")["lines"].GetInt(), 1);
}

TEST_F(DashboardFeedTest, AcknowledgesWithTheEventNumber) {
  client_.send(datagram(0x1234, " k=v"));
  const std::string answer = client_.receive();
  EXPECT_EQ(answer, datagram(0x1234, " k=v").substr(0, 64));
}

TEST_F(DashboardFeedTest, AcknowledgesOnlyWhoAsksForIt) {
  client_.send(datagram(1, " k=v", 2));
  client_.send(datagram(2, " k=v", 3));
  EXPECT_EQ(client_.acknowledged(), 2);
  static_cast<void>(line(2));  // it acknowledges first
  const rapidjson::Document answer = server_.get("/api/lines");
  EXPECT_STREQ(answer["lines"][1]["content"]["acknowledged"].GetString(), "not asked for");
}

TEST_F(DashboardFeedTest, KeepsWhatIsMalformedWithItsReason) {
  auto reason = [this, count = 0](const std::string& bytes) mutable {
    client_.send(bytes);
    const rapidjson::Document answer = line(++count);
    const auto& row = answer["lines"][0];
    return row["good"].GetBool() ? std::string("good") : std::string(row["content"]["reason"].GetString());
  };
  EXPECT_EQ(reason("short"), "it has 5 bytes, fewer than a header");
  std::string headless = datagram(1, "").substr(0, 63);
  headless[15] = static_cast<char>(0xFF - 63);  // what it says of its length is right
  EXPECT_EQ(reason(headless), "it has 63 bytes, fewer than a header");
  EXPECT_EQ(reason(datagram(1, "") + "x"), "its length field says 64, it has 65 bytes");
  EXPECT_EQ(reason(datagram(1, std::string(1024, 'x'))), "it has 1088 bytes, more than are sent");
  std::string wrong = datagram(1, "");
  wrong[2] = 2;
  EXPECT_EQ(reason(wrong), "its third byte is not 1");
  wrong = datagram(1, "");
  wrong[3] = static_cast<char>(250);
  EXPECT_EQ(reason(wrong), "its fraction of a second is over 249");
  EXPECT_EQ(reason(datagram(1, std::string(1023, 'x'))), "good");
}

TEST_F(DashboardFeedTest, LosesAcknowledgementsWhenTold) {
  EXPECT_EQ(control(R"({"action":"lose","times":2})").status, 200);
  for (uint16_t event = 1; event <= 3; ++event) client_.send(datagram(event, ""));
  EXPECT_EQ(client_.acknowledged(), 3);
  EXPECT_EQ(server_.get("/control/acknowledgements")["rules"].Size(), 0u);
  const rapidjson::Document answer = server_.get("/api/lines?since=0");
  EXPECT_STREQ(answer["lines"][0]["content"]["acknowledged"].GetString(), "lose");
}

TEST_F(DashboardFeedTest, DelaysRepeatsCorruptsAndShortensAcknowledgements) {
  EXPECT_EQ(control(R"({"action":"delay","delayMs":300})").status, 200);
  EXPECT_EQ(control(R"({"action":"repeat","copies":3})").status, 200);
  EXPECT_EQ(control(R"({"action":"corrupt"})").status, 200);
  EXPECT_EQ(control(R"({"action":"shorten"})").status, 200);
  const auto begin = std::chrono::steady_clock::now();
  for (uint16_t event = 1; event <= 4; ++event) client_.send(datagram(event, ""));
  for (int i = 0; i < 3; ++i) EXPECT_EQ(client_.acknowledged(), 2);
  EXPECT_EQ(client_.acknowledged(), 0xFFFC);
  EXPECT_EQ(client_.acknowledged(), -61);
  EXPECT_EQ(client_.acknowledged(), 1);
  EXPECT_GE(std::chrono::steady_clock::now() - begin, std::chrono::milliseconds(300));
}

TEST_F(DashboardFeedTest, ForgetsWhatItWasTold) {
  EXPECT_EQ(control(R"({"action":"lose","times":0})").status, 200);
  for (int count = 1; count <= 3; ++count) {  // until it is taken back
    client_.send(datagram(1, ""));
    EXPECT_STREQ(line(count)["lines"][0]["content"]["acknowledged"].GetString(), "lose");
  }
  EXPECT_EQ(control("", "DELETE").status, 200);
  client_.send(datagram(2, ""));
  EXPECT_EQ(client_.acknowledged(), 2);
  EXPECT_EQ(control(R"({"action":"lose","times":0})").status, 200);
  EXPECT_EQ(server_.http("/control/reset").status, 200);
  client_.send(datagram(3, ""));
  EXPECT_EQ(client_.acknowledged(), 3);
}

TEST_F(DashboardFeedTest, RefusesRulesThatMakeNoSense) {
  EXPECT_EQ(control("[]").body, "the rule is no JSON object\n");
  EXPECT_EQ(control("{}").body, "\"action\" is missing\n");
  EXPECT_EQ(control(R"({"action":"eat"})").body, "\"action\" is unknown or has a value that does not fit\n");
  EXPECT_EQ(control(R"({"action":"lose","x":1})").status, 400);
  EXPECT_EQ(control(R"({"action":"repeat","copies":101})").status, 400);
  EXPECT_EQ(control("", "POST").status, 405);
}

TEST_F(DashboardFeedTest, ForgetsLinesAndLogsWithEverythingElse) {
  client_.send(datagram(1, "", 0));
  EXPECT_EQ(postLog("\x80").status, 200);
  EXPECT_TRUE(server_.get("/api/wait?timeout=30&lines=1&logs=1")["reached"].GetBool());
  Call call;
  call.method = "PUT";
  EXPECT_EQ(server_.http("/control/clear", call).status, 200);
  EXPECT_EQ(server_.get("/api/totals")["lines"].GetInt(), 0);
  EXPECT_EQ(server_.get("/api/totals")["logs"].GetInt(), 0);
  EXPECT_EQ(server_.get("/api/lines")["lines"].Size(), 0u);
}

TEST_F(DashboardFeedTest, AnswersLogDataWithItsLocation) {
  // ["a", {"t": date 0, "d": bytes 1 2}]
  const std::string archive("\x82\x61\x61\xa2\x61t\xc1\x00\x61\x64\x42\x01\x02", 13);
  const Response answer = postLog(archive);
  EXPECT_EQ(answer.status, 200);
  EXPECT_EQ(answer.header("content-type"), "text/plain; charset=utf-8");
  const std::string start = "https://localhost:" + std::to_string(server_.httpsPort()) + "/logdata/";
  EXPECT_EQ(answer.body.size(), start.size() + 16) << answer.body;
  EXPECT_TRUE(answer.body.starts_with(start)) << answer.body;
  EXPECT_EQ(postLog(archive).body, answer.body);  // named after its content
  const rapidjson::Document logs = server_.get("/api/logs?since=0");
  ASSERT_EQ(logs["logs"].Size(), 2u);
  const auto& content = logs["logs"][0]["content"];
  EXPECT_TRUE(logs["logs"][0]["good"].GetBool());
  EXPECT_EQ(content["entries"].GetInt(), 2);
  EXPECT_EQ(content["location"].GetString(), answer.body);
  EXPECT_STREQ(content["data"][0].GetString(), "a");
  EXPECT_STREQ(content["data"][1]["t"].GetString(), "1970-01-01 00:00:00 +0000");
  EXPECT_STREQ(content["data"][1]["d"]["base64"].GetString(), "AQI=");
}

TEST_F(DashboardFeedTest, RefusesLogDataThatIsNone) {
  EXPECT_EQ(postLog("\xff").body,
            "the archive is malformed at byte 0: a length that is not given, or a reserved one\n");
  EXPECT_EQ(postLog("\x01").body, "the archive holds no array\n");
  EXPECT_EQ(postLog("").status, 400);
  const rapidjson::Document logs = server_.get("/api/logs");
  ASSERT_EQ(logs["logs"].Size(), 3u);
  for (const auto& row : logs["logs"].GetArray()) EXPECT_FALSE(row["good"].GetBool());
}

TEST_F(DashboardFeedTest, AnswersLogDataAsItIsTold) {
  Call rule;
  rule.method = "PUT";
  rule.body = R"({"path":"/logdata","status":503})";
  EXPECT_EQ(server_.http("/control/reply", rule).status, 200);
  EXPECT_EQ(postLog("\x80").status, 503);
  EXPECT_EQ(postLog("\x80").status, 200);
}

TEST(DashboardFeedOptions, WithoutAPortThereIsNoFeed) {
  const TemporaryFolder state;
  const ServerProcess server(state.path());
  EXPECT_TRUE(server.isReady());
  EXPECT_EQ(server.udpPort(), 0);
}

TEST(DashboardFeedOptions, APortThatIsTakenEndsTheServer) {
  const TemporaryFolder first, second;
  const ServerProcess server(first.path(), {"--udp-port", "0"});
  ASSERT_NE(server.udpPort(), 0);
  const std::string command = std::string(KYT_DEVSERVER) + " --state " + second.path().string() +
                              " --https-port 0 --http-port 0 --udp-port " + std::to_string(server.udpPort()) +
                              " 2>&1";
  FILE* output = popen(command.c_str(), "r");
  char text[200] = {};
  EXPECT_NE(std::fgets(text, sizeof text, output), nullptr);
  EXPECT_NE(pclose(output), 0);
  EXPECT_EQ(std::string(text), "kytdevserver: can't listen on UDP port " + std::to_string(server.udpPort()) +
                                   ": Address already in use\n");
}

}  // namespace
}  // namespace kyt::devserver::test
